#include "platform/linux/conduit/conduit_server_message.h"

#include "property_lists/property_list.h"

namespace kel::platform {

ConduitServerMessage::~ConduitServerMessage() {
  if (answered_) return;
  const auto connection = connection_.lock();
  if (!connection) return;
  // Without a tag nobody waits, but the request still has to be taken off those in flight.
  connection->settle(tag_ == 0 ? std::vector<SharedSlice>{} : makeFrame(FrameKind::Dropped, tag_, {}));
}

void ConduitServerMessage::reply(const PropertyListValue& contents) {
  if (tag_ == 0 || answered_.exchange(true)) return;
  const auto connection = connection_.lock();
  if (!connection) return;
  // Coded on the caller's thread, which may be any: the loop has other peers to serve.
  PropertyListPieces pieces = writeBinaryPropertyListPieces(contents);
  if (pieces.error.empty() && pieces.size > largestReply) pieces.error = "it is too large";
  if (!pieces.error.empty()) {
    connection->log("a reply cannot be sent: " + pieces.error);
    connection->settle(makeFrame(FrameKind::Dropped, tag_, {}));
    return;
  }
  connection->settle(makeFrame(FrameKind::Reply, tag_, std::move(pieces)));
}

}  // namespace kel::platform
