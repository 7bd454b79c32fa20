#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <variant>

#include "platform/work_queue.h"
#include "property_lists/property_list_value.h"

namespace kel::platform {

/// An error object of the IPC layer.
struct ConduitError {
  enum class Kind {
    ConnectionInvalid,      ///< the peer is not there, or has gone away for good
    ConnectionInterrupted,  ///< the connection broke, or the request was dropped, before a reply came
    Other
  };

  Kind kind = Kind::Other;
  std::string description;  ///< one line; "Connection invalid" or "Connection interrupted" for those kinds
};

/// The process at the other end of a connection, held so that a reused process id is not taken for it.
class PeerProcess {
 public:
  virtual ~PeerProcess() = default;
  virtual std::int64_t processID() const = 0;
};

/// One message that arrived on a connection. Held until it is answered; destroying it unanswered tells a
/// sender that waits for a reply that its request was dropped. Any thread.
class ConduitMessage {
 public:
  virtual ~ConduitMessage() = default;

  /// What was sent; of any kind, since the peer is not trusted.
  virtual const PropertyListValue& contents() const = 0;

  /// Forgets the contents, which are an empty dictionary from now on: a message that waits for its reply
  /// should not hold what its sender chose to send. On the connection's queue, like `contents`.
  virtual void discardContents() = 0;

  /// True when the sender waits for a reply and none was sent yet.
  virtual bool canReply() const = 0;

  /// Sends the reply on the connection the message came from. Once at most; nothing happens when the
  /// connection is gone. Never waits for the peer.
  virtual void reply(const PropertyListValue& contents) = 0;
};

class ConduitConnection;

/// What happens at a listener or a connection.
using ConduitEvent =
    std::variant<ConduitError, std::shared_ptr<ConduitConnection>, std::shared_ptr<ConduitMessage>>;
using ConduitEventHandler = std::function<void(const ConduitEvent&)>;

/// What a waiting sender gets: the reply's contents, of any kind, or an error object.
using ConduitReply = std::variant<PropertyListValue, ConduitError>;

/// One connection, at the server's or at the client's end. Its events arrive on the queue that it was made
/// with (the listener's queue for accepted ones). Letting go of a client's connection closes it; an accepted
/// one lives, started or not, until its peer goes or the listener is destroyed.
class ConduitConnection {
 public:
  virtual ~ConduitConnection() = default;

  /// The process that connected. Accepted connections only; null at the client's end.
  virtual std::shared_ptr<const PeerProcess> peer() const = 0;

  /// Set once, before `start`.
  virtual void setEventHandler(ConduitEventHandler handler) = 0;

  /// Events are delivered from now on.
  virtual void start() = 0;

  /// Sends a request and waits for its reply. Client's end only, on a thread that is not the connection's
  /// queue. Never hangs on a server that is gone; a server at work is waited for.
  virtual ConduitReply sendAndWait(const PropertyListValue& contents) = 0;
};

/// A bound endpoint; destroying it, on its queue or after the queue has ended, closes the endpoint and every
/// accepted connection.
class ConduitListener {
 public:
  virtual ~ConduitListener() = default;
};

struct ConduitListening {
  std::unique_ptr<ConduitListener> listener;  ///< null when the endpoint could not be bound
  bool servedElsewhere = false;               ///< a live server holds the endpoint
  std::string error;                          ///< one line, when there is no listener
};

/// The named IPC endpoints of the user.
class Conduit {
 public:
  virtual ~Conduit() = default;

  /// Turns on activity tracking: from here on open transactions are reported to the launcher.
  virtual void trackActivity() = 0;

  /// Binds the endpoint `name` (or takes the launcher's socket) and delivers errors and new connections to
  /// `handler` on `queue`, which outlives the listener.
  virtual ConduitListening listen(std::string_view name, SerialQueue& queue, ConduitEventHandler handler) = 0;

  /// A connection to the endpoint `name` whose events arrive on `queue`, which outlives it. Never null: what
  /// goes wrong shows in its events and replies.
  virtual std::shared_ptr<ConduitConnection> connect(std::string_view name, SerialQueue& queue) = 0;
};

}  // namespace kel::platform
