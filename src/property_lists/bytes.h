#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <vector>

namespace kel::platform {

using Bytes = std::vector<std::uint8_t>;
using BytesView = std::span<const std::uint8_t>;
using SharedBytes = std::shared_ptr<const Bytes>;

/// A part of a shared, immutable buffer.
struct SharedSlice {
  SharedBytes bytes;
  std::size_t offset = 0;
  std::size_t length = 0;

  BytesView view() const { return BytesView(*bytes).subspan(offset, length); }
};

}  // namespace kel::platform
