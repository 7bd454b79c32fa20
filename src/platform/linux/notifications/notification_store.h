#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace kel::platform {

/// What is kept for one notification name.
struct NotificationRecord {
  std::uint64_t state = 0;
  std::uint64_t posts = 0;  ///< goes up by one for every post; 0: never posted
};

/// The file name for a notification name: letters, digits, "_", "-" and "." (but at the start) stand for
/// themselves, other bytes are "%" and two hexadecimal digits. Absent when that is empty or over 200 bytes.
std::optional<std::string> notificationFileName(std::string_view name);

/// The records of all names, one file each in a private directory that every process of the user shares. Any
/// thread, any process.
///
/// A writer holds a lock file for the moment of reading, changing and replacing the record, so no change is
/// lost; a reader sees the record before or after it, never a part. A damaged record counts as never set.
class NotificationStore {
 public:
  /// The directory is made, mode 0700, when it is missing; its parent must exist.
  explicit NotificationStore(std::string directory) : directory_(std::move(directory)) {}

  const std::string& directory() const { return directory_; }

  /// Absent when there is no record. `error`, when given, is set if that is for a reason other than that
  /// nothing was ever stored.
  std::optional<NotificationRecord> read(const std::string& name, std::string* error = nullptr) const;

  /// Applies `change` to the record (a fresh one where there is none) and stores it. Waits while another
  /// writer is at work. Returns the error as one line, or absent.
  std::optional<std::string> update(const std::string& name,
                                    const std::function<void(NotificationRecord&)>& change) const;

  /// Makes the directory if it is missing, and checks that it is the user's own.
  bool prepareDirectory() const;

 private:
  const std::string directory_;
};

}  // namespace kel::platform
