#pragma once

#include <cstddef>
#include <deque>
#include <vector>

#include "property_lists/bytes.h"

namespace kel::platform {

/// Bytes on their way into a socket, sent from the shared buffers where they stand. For one thread.
class OutgoingBytes {
 public:
  enum class Result { Sent, WouldBlock, Broken };

  void add(std::vector<SharedSlice> slices);
  void clear();
  std::size_t size() const { return size_; }
  bool empty() const { return size_ == 0; }

  /// Hands the kernel as much as it takes in one call, and no signal when the peer is gone. Waits only when
  /// `socket` is a blocking one. Not to be called when empty.
  Result sendSome(int socket);

 private:
  void consume(std::size_t count);

  std::deque<SharedSlice> slices_;  // none of them empty
  std::size_t size_ = 0;
};

}  // namespace kel::platform
