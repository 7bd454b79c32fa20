#pragma once

#include <optional>
#include <string>

namespace kel::platform {

/// The directory for what lives as long as the user's session (sockets, seeds), without a "/" at its end; or
/// one line that says why there is none.
struct RuntimeDirectory {
  std::optional<std::string> path;
  std::string error;
};

/// Makes `$XDG_RUNTIME_DIR/kel`, or `/tmp/kel-UID` without that variable (or when it is no absolute path),
/// and checks it as below. Any thread.
RuntimeDirectory resolveRuntimeDirectory();

/// Makes `path` with mode 0700, unless it is there. Refused: anything but a directory (a symbolic link too),
/// one that someone else owns, one that group or others may write to. Any thread.
RuntimeDirectory makePrivateDirectory(const std::string& path);

}  // namespace kel::platform
