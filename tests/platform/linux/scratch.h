#pragma once

#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <stdexcept>
#include <stdlib.h>
#include <string>
#include <sys/stat.h>
#include <vector>

#include "platform/bytes.h"
#include "platform/guarded.h"
#include "platform/system_log.h"

namespace kel::platform {

inline Bytes bytesOf(std::string_view text) { return Bytes(text.begin(), text.end()); }

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

  /// Makes the file and its parent directories; returns its path.
  std::string write(std::string_view name, std::string_view text) const {
    const std::string file = *this / name;
    std::filesystem::create_directories(std::filesystem::path(file).parent_path());
    std::ofstream(file, std::ios::binary) << text;
    return file;
  }

  std::string makeDirectory(std::string_view name) const {
    std::filesystem::create_directories(*this / name);
    return *this / name;
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

/// Keeps what is logged. Any thread.
class CollectedLog final : public SystemLog {
 public:
  void write(std::string_view message) override {
    lines_.with([message](auto& lines) { lines.emplace_back(message); });
  }
  std::vector<std::string> lines() const { return lines_.copy(); }

 private:
  Guarded<std::vector<std::string>> lines_;
};

}  // namespace kel::platform
