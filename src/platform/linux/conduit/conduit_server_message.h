#pragma once

#include <atomic>
#include <memory>
#include <utility>

#include "platform/conduit.h"
#include "platform/linux/conduit/conduit_server_connection.h"

namespace kel::platform {

/// A request that arrived on an accepted connection, in flight until it is answered or destroyed.
class ConduitServerMessage final : public ConduitMessage {
 public:
  /// `tag` is 0 when the sender wants no reply; `loop` is the connection's.
  ConduitServerMessage(std::weak_ptr<ConduitServerConnection> connection, std::shared_ptr<EventLoop> loop,
                       std::uint64_t tag, PropertyListValue contents)
      : connection_(std::move(connection)),
        keptLoop_(std::move(loop)),
        loop_(*keptLoop_),
        tag_(tag),
        contents_(std::move(contents)) {}
  ~ConduitServerMessage() override;
  ConduitServerMessage(const ConduitServerMessage&) = delete;
  ConduitServerMessage& operator=(const ConduitServerMessage&) = delete;

  const PropertyListValue& contents() const override {
    loop_.assertCurrent();
    return contents_;
  }
  void discardContents() override {
    loop_.assertCurrent();
    contents_ = PropertyListDictionary();
  }
  bool canReply() const override { return tag_ != 0 && !answered_; }
  void reply(const PropertyListValue& contents) override;

 private:
  const std::weak_ptr<ConduitServerConnection> connection_;
  const std::shared_ptr<EventLoop> keptLoop_;
  EventLoop& loop_;
  const std::uint64_t tag_;
  PropertyListValue contents_ KEL_ON(loop_);
  std::atomic<bool> answered_ = false;
};

}  // namespace kel::platform
