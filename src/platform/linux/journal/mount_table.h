#pragma once

#include <string>
#include <vector>

#include "platform/linux/files/owned_descriptor.h"

namespace kel::platform {

/// What is mounted on the way to some directories and below them. A mount hides what was there, and no watch
/// tells of it. Not locked.
class MountTable {
 public:
  explicit MountTable(std::vector<std::string> paths);

  /// Reports EPOLLPRI after changes of the table; -1 when there is none.
  int descriptor() const { return table_.get(); }

  /// True when something changed for the paths since the last call, or that cannot be told.
  bool hasChanged();

 private:
  std::vector<std::string> relevantMounts() const;

  const std::vector<std::string> paths_;
  OwnedDescriptor table_;
  std::vector<std::string> mounts_;
};

}  // namespace kel::platform
