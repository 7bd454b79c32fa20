#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "property_lists/bytes.h"
#include "property_lists/property_list.h"

namespace kel::platform {

// What cannot be had may be had in a moment: an input error, no descriptor or memory left, a stale handle.
// Such a failure is transient and no answer: whoever knew something goes on knowing it and looks again soon.
// "Not there", "no directory" and "not permitted" are answers.

/// Bytes, or one line that says why there are none.
struct FileReading {
  std::optional<Bytes> bytes;
  std::string error;
  bool isTransient = false;
};

/// Names, or one line that says why there are none.
struct DirectoryReading {
  std::optional<std::vector<std::string>> names;
  std::string error;
  bool isTransient = false;
};

/// Files and directories. Any thread. Operations that can fail return the reason as one line.
class FileSystem {
 public:
  virtual ~FileSystem() = default;

  /// The names of all entries directly inside `directory`, hidden ones included, without "." and "..". A name
  /// that is no UTF-8 is left out, with a line in the system log.
  virtual DirectoryReading listDirectory(const std::string& directory) = 0;

  virtual bool exists(const std::string& path) = 0;

  /// The contents of a regular file of at most `largest` bytes; a FIFO or a device is refused, never waited
  /// for.
  virtual FileReading read(const std::string& path, std::size_t largest) = 0;

  /// Writes a temporary file beside `path` and lets it take the place of the file there; a missing parent
  /// directory is made. A reader sees the old contents or the new. Returns the error, or absent.
  virtual std::optional<std::string> writeAtomically(const std::string& path, BytesView bytes) = 0;

  /// Writes the file in place, never through a symbolic link. Returns the error, or absent.
  virtual std::optional<std::string> writePlainly(const std::string& path, BytesView bytes) = 0;

  /// Deletes a file; false when it was not there or cannot be deleted.
  virtual bool remove(const std::string& path) = 0;
};

inline constexpr std::size_t largestForeignFile = 16 * 1024 * 1024;
inline constexpr std::size_t largestOwnFile = std::size_t{1} << 30;

/// The limits for what bundles ship: nesting stays so far below what a reader accepts that the lists made
/// from it can be written and read.
inline constexpr PropertyListLimits bundleFileLimits{256, 64 * 1024 * 1024};

/// Reads a property-list file of any encoding whose top level must be a dictionary; otherwise absent with
/// `error` saying why.
struct DictionaryReading {
  std::optional<PropertyListDictionary> dictionary;
  std::string error;
  bool isTransient = false;
};
DictionaryReading readDictionaryFile(FileSystem& files, const std::string& path, std::size_t largest,
                                     const PropertyListLimits& limits = {});

/// `base` and `name` with exactly one "/" between them.
std::string joinPath(std::string_view base, std::string_view name);

}  // namespace kel::platform
