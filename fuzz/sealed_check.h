#pragma once

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <optional>
#include <string_view>

#include "platform/linux/files/sealed_bytes.h"

/// Reads `input`, as a whole file and as the payload of one of `format`, and writes what was read: that must
/// be accepted and come out as it is. `rewrite` does both; absent when the file is refused.
template <std::invocable<kel::platform::BytesView> Rewrite>
void checkRewriting(kel::platform::BytesView input, std::string_view format, Rewrite rewrite) {
  kel::platform::ByteWriter writer;
  writer.bytes(input);
  for (const kel::platform::Bytes& file :
       {kel::platform::Bytes(input.begin(), input.end()), writer.sealed(format)}) {
    const std::optional<kel::platform::Bytes> written = rewrite(file);
    if (written && rewrite(*written) != written) std::abort();
  }
}
