#pragma once

#include <string>
#include <string_view>
#include <sys/types.h>

namespace kel::platform {

/// True unless the process `pid`, held by the process descriptor `pidDescriptor`, surely runs outside every
/// sandbox: any error, any doubt, and a process that has ended meanwhile count as sandboxed. Any thread;
/// reads a few files.
bool isSandboxed(pid_t pid, int pidDescriptor);

/// True when a control group listing (/proc/PID/cgroup) names the scope of a sandboxed application.
bool namesSandboxScope(std::string_view controlGroups);

/// True when a security label confines more than this process's own, `ownLabel`, does.
bool isConfiningLabel(std::string_view label, std::string_view ownLabel);

}  // namespace kel::platform
