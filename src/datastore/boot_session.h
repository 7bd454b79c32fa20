#pragma once

#include <string>

#include "platform/platform.h"

namespace kel {

/// The identity of this boot and login session, computed once per process: "BOOT TIME,SESSION", each 0 when
/// the system does not tell it, with a line in the debug sink. Any thread.
const std::string& boot_session_id(platform::Platform& platform);

}  // namespace kel
