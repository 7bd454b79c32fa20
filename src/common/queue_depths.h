#pragma once

/// How deep the server's queues lie: each may wait for the ones below it in this list, none for one above it.
/// Every other queue waits for none.
namespace kel::queue_depths {

inline constexpr int conduit = 0;
inline constexpr int datastore = 1;
inline constexpr int datastoreWrites = 2;

}  // namespace kel::queue_depths
