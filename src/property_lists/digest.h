#pragma once

#include <array>
#include <cstdint>

#include "property_lists/bytes.h"

namespace kel::platform {

using Digest = std::array<std::uint8_t, 16>;

/// The MD5 digest of `bytes`. For identities, not for security.
Digest md5(BytesView bytes);

/// HMAC with MD5 as its hash, over `message`, keyed with `key` of any length.
Digest hmacMD5(BytesView key, BytesView message);

}  // namespace kel::platform
