#include "datastore/boot_session.h"

#include "common/debug_sink.h"

namespace kel {

namespace {

std::string formatted(const char* call, const platform::SystemReading& reading) {
  return std::string(call) + " failed with errno " + std::to_string(reading.errorNumber) + " (" +
         reading.errorText + ")";
}

}  // namespace

const std::string& boot_session_id(platform::Platform& platform) {
  // Once per process: a reading that fails later must not make a cache of this session look like another's.
  return platform.constants.bootSessionID.get([&platform] {
    const platform::SystemReading boot = platform.facts.bootTime();
    if (!boot.value) send_debug_line([&] { return formatted("sysctlbyname(\"kern.boottime\")", boot); });
    const platform::SystemReading session = platform.facts.auditSession();
    if (!session.value) send_debug_line([&] { return formatted("getaudit_addr()", session); });
    return std::to_string(boot.value.value_or(0)) + "," + std::to_string(session.value.value_or(0));
  });
}

}  // namespace kel
