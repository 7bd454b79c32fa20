#pragma once

#include <array>
#include <iosfwd>
#include <string_view>

#include "platform/platform.h"

namespace kel {

/// A vendor service that must stay restricted.
struct BlacklistRow {
  std::string_view bundleID;
  std::string_view title;
};

inline constexpr std::array<BlacklistRow, 8> default_blacklist{{
    {"com.orvex.Console", "Console/Open Console Here"},
    {"com.orvex.Console", "Console/Run Selection"},
    {"com.orvex.TaskRunner", "Tasks/Run as Task"},
    {"com.orvex.TaskRunner", "Tasks/Save as Task"},
    {"com.orvex.ImageWriter", "Images/Write to Disk"},
    {"com.orvex.FolderSharing", "Share Folder"},
    {"com.orvex.ScreenRecorder", "Record Screen"},
    {"com.orvex.AccountImporter", "Import Accounts"},
}};

/// Writes a restrictions file to the user's temporary directory whose unrestricted list names the vendor
/// services published now, without those of `default_blacklist`. Does nothing under the service launcher.
/// What it wrote, or that there was nothing to list, goes to `out`; failures go to the system log. In the
/// client, on the main thread.
void generate_whitelist(platform::Platform& platform, std::ostream& out);

}  // namespace kel
