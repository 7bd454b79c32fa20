#pragma once

#include <cstdint>

#include "property_lists/bytes.h"

namespace kel::platform {

/// A hash of `bytes` under a key that is drawn at random once per process, so that foreign input cannot be
/// made to collide. Differs from process to process. Any thread.
std::uint64_t keyedHash(BytesView bytes);

}  // namespace kel::platform
