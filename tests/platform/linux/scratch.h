#pragma once

#include <filesystem>
#include <fstream>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <set>

#include "platform/linux/files/files.h"
#include "platform/linux/files/linux_file_system.h"
#include "platform/linux/process/unix_address.h"
#include "support/in_memory_services.h"
#include "support/print.h"

namespace kel::platform {

/// A directory that is removed, with all in it, at the end of the test.
class Scratch {
 public:
  Scratch() {
    std::string name = std::filesystem::temp_directory_path() / "kel-test-XXXXXX";
    if (!mkdtemp(name.data())) throw std::runtime_error("cannot make a scratch directory");
    path_ = name;
  }
  Scratch(const Scratch&) = delete;
  Scratch& operator=(const Scratch&) = delete;
  ~Scratch() { std::filesystem::remove_all(path_); }

  const std::string& path() const { return path_; }
  std::string operator/(std::string_view name) const { return path_ + "/" + std::string(name); }

  std::string makeDirectory(std::string_view name) const {
    std::filesystem::create_directories(*this / name);
    return *this / name;
  }

  /// Makes the file and its parent directories; returns its path.
  std::string write(std::string_view name, std::string_view text = "") const {
    const std::string file = *this / name;
    std::filesystem::create_directories(std::filesystem::path(file).parent_path());
    std::ofstream(file, std::ios::binary) << text;
    return file;
  }

  std::string read(std::string_view name) const {
    std::ifstream file(*this / name, std::ios::binary);
    return {std::istreambuf_iterator<char>(file), {}};
  }

  /// The names in the directory `name`.
  std::set<std::string> names(std::string_view name = ".") const {
    std::set<std::string> result;
    for (const auto& entry : std::filesystem::directory_iterator(*this / name)) {
      result.insert(entry.path().filename());
    }
    return result;
  }

  unsigned mode(std::string_view name) const {
    struct stat status {};
    return lstat((*this / name).c_str(), &status) == 0 ? status.st_mode & 07777u : 0;
  }

 private:
  std::string path_;
};

class ScratchTest : public testing::Test {
 protected:
  Scratch scratch;
  test::RecordingLog log;
  LinuxFileSystem files{log};
};

}  // namespace kel::platform
