#pragma once

#include <array>
#include <fcntl.h>
#include <map>
#include <random>
#include <sstream>
#include <stdio.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/journal/entry_look.h"
#include "platform/linux/scratch.h"

namespace kel::platform {

namespace fs = std::filesystem;

/// What was found in each bundle, by path.
using FoundBundles = std::map<std::string, std::string>;

/// Random operations on a directory of bundles, on what links in them lead to, and on what is above them.
class Disk {
 public:
  Disk(const Scratch& scratch, unsigned seed, bool mounts)
      : root(scratch / "home/Services/"),
        home_(scratch / "home"),
        outside_(scratch / "outside/"),
        random_(seed),
        mounts_(mounts) {
    for (unsigned index = 0; index < 4; ++index) {
      makeBundle(root + bundleName(index));
      makeBundle(outside_ + "target" + std::to_string(index));
      makeBundle(outside_ + "spare" + std::to_string(index));
    }
    link(outside_ + "target0", root + "linked.service");
    fs::remove(root + bundleName(0) + "/Info.plist");
    link(outside_ + "target1/Info.plist", root + bundleName(0) + "/Info.plist");
    if (below(4) == 0) fs::rename(home_, outside_ + "late");
  }
  ~Disk() {
    close(kept_);
    unmountAll();
  }

  /// Every bundle with what a loader would find in it, links followed.
  FoundBundles snapshot() const {
    FoundBundles result;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(root, ignored)) {
      const int file = open((entry.path() / "Info.plist").c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
      std::array<char, 64> text;
      const ssize_t length = read(file, text.data(), text.size());
      struct stat status {};
      fstat(file, &status);
      result[entry.path()] = length < 0 ? "none"
                                        : std::to_string(status.st_mode) +
                                              std::string(text.data(), static_cast<std::size_t>(length));
      close(file);
    }
    return result;
  }

  void operate() {
    using Operation = void (Disk::*)();
    static constexpr Operation operations[] = {
        &Disk::write,         &Disk::write,           &Disk::truncate,
        &Disk::writeBeside,   &Disk::moveFileOut,     &Disk::moveFileIn,
        &Disk::replace,       &Disk::removeFile,      &Disk::changeMode,
        &Disk::retarget,      &Disk::writeBehindLink, &Disk::swapDirectories,
        &Disk::setOldTimes,   &Disk::addBundle,       &Disk::removeBundle,
        &Disk::moveBundleOut, &Disk::moveBundleIn,    &Disk::makeFolder,
        &Disk::renameBundle,  &Disk::linkHard,        &Disk::writeHard,
        &Disk::keepOpen,      &Disk::writeKept,       &Disk::writeMapped,
        &Disk::replaceRoot,   &Disk::swapHome,        &Disk::bind,
        &Disk::unbind};
    (this->*operations[below(std::size(operations))])();
    // The times of files follow the kernel's clock, whose ticks an operation may share with a look.
    if (below(40) == 0) waitForAnotherTick();
  }

  /// Another home, with bundles of its own; or, the second time, the first one as it was.
  void swapHome() {
    const std::string late = outside_ + "late";
    if (!fs::exists(late)) makeBundle(late + "/Services/" + bundleName(1));
    touchAll();
    if (!fs::exists(home_)) return move(late, home_);
    renameat2(AT_FDCWD, home_.c_str(), AT_FDCWD, late.c_str(), RENAME_EXCHANGE);
    touchAll();
  }

  unsigned below(std::size_t bound) { return static_cast<unsigned>(random_() % bound); }

  const std::string root;
  std::set<std::string> touched;  ///< bundles that an operation was about since this was cleared

 private:
  static std::string bundleName(unsigned index) { return "b" + std::to_string(index) + ".service"; }
  static void put(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
  }
  static void link(const std::string& target, const std::string& path) {
    std::error_code ignored;
    fs::create_symlink(target, path, ignored);
  }

  void makeBundle(const std::string& path) {
    std::error_code ignored;
    fs::create_directories(path + "/Resources/German", ignored);
    put(path + "/Info.plist", text());
  }

  /// Eight letters: so most writes leave the size as it was.
  std::string text() {
    std::string result(8, 'a');
    for (char& letter : result) letter = static_cast<char>('a' + below(26));
    return result;
  }

  std::string any(const std::string& directory) {
    std::vector<std::string> names;
    std::error_code ignored;
    for (const auto& entry : fs::directory_iterator(directory, ignored)) names.push_back(entry.path());
    std::sort(names.begin(), names.end());
    return names.empty() ? directory + "none" : names[below(names.size())];
  }
  std::string anyBundle() {
    std::string bundle = any(root);
    touched.insert(bundle);
    return bundle;
  }
  std::string anyFile() { return anyBundle() + "/Info.plist"; }
  /// For what is reached by several names: any of them may lead there.
  void touchAll() {
    for (const auto& [bundle, state] : snapshot()) touched.insert(bundle);
  }
  void move(const std::string& from, const std::string& to) { ::rename(from.c_str(), to.c_str()); }

  void write() { overwrite(anyFile()), touchAll(); }
  void overwrite(const std::string& file) {
    const int descriptor = open(file.c_str(), O_WRONLY | O_NONBLOCK | O_CLOEXEC);
    if (descriptor >= 0 && pwrite(descriptor, text().data(), 8, 0) < 0) perror("pwrite");
    close(descriptor);
  }
  void truncate() {
    if (::truncate(anyFile().c_str(), below(9)) == 0) touchAll();
  }
  void writeBeside() {
    const std::string bundle = any(root);
    put(bundle + "/file" + std::to_string(below(3)), text());
    put(bundle + "/Resources/German/ServicesMenu.strings", text());
  }
  void moveFileOut() { move(anyFile(), outside_ + "kept"); }
  void moveFileIn() { move(outside_ + "kept", anyBundle() + "/Info.plist"); }
  void replace() {
    put(outside_ + "new", text());
    move(outside_ + "new", anyFile());
  }
  void removeFile() { unlink(anyFile().c_str()); }
  void changeMode() { chmod(anyFile().c_str(), below(2) ? 0600 : 0644), touchAll(); }
  void retarget() {
    const std::string path = root + "linked.service";
    touched.insert(path);
    std::error_code ignored;
    fs::remove_all(path, ignored);
    link(outside_ + "target" + std::to_string(below(4)), path);
  }
  void writeBehindLink() {
    touchAll();
    overwrite(outside_ + "target" + std::to_string(below(3)) + "/Info.plist");
  }
  void swapDirectories() {
    const std::string one = anyBundle(), other = anyBundle();
    renameat2(AT_FDCWD, one.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
  }
  void setOldTimes() {
    const timespec times[2] = {{1'000'000'000, 0}, {1'000'000'000, 0}};
    utimensat(AT_FDCWD, anyFile().c_str(), times, 0), touchAll();
  }
  void addBundle() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    if (fs::exists(root)) makeBundle(bundle);
  }
  void removeBundle() {
    std::error_code ignored;
    fs::remove_all(anyBundle(), ignored);
  }
  void moveBundleOut() { move(anyBundle(), outside_ + "gone" + std::to_string(below(3))); }
  void moveBundleIn() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    move(any(outside_), bundle);
  }
  void renameBundle() {
    const std::string bundle = root + bundleName(below(6));
    touched.insert(bundle);
    move(anyBundle(), bundle);
  }
  void makeFolder() {
    std::error_code ignored;
    fs::create_directories(any(root) + "/Resources/French/deep", ignored);
  }
  void linkHard() {
    std::error_code ignored;
    fs::remove(outside_ + "hard", ignored);
    fs::create_hard_link(anyFile(), outside_ + "hard", ignored), touchAll();
  }
  void writeHard() { overwrite(outside_ + "hard"), touchAll(); }
  void keepOpen() {
    close(kept_);
    linkHard();
    kept_ = open((outside_ + "hard").c_str(), O_RDWR | O_CLOEXEC);
    unlink((outside_ + "hard").c_str());
  }
  void writeKept() {
    touchAll();
    if (kept_ >= 0 && pwrite(kept_, text().data(), 8, 0) < 0) perror("pwrite");
  }
  void writeMapped() {
    const int file = open(anyFile().c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
    if (file >= 0 && ftruncate(file, 8) == 0) {
      void* const mapped = mmap(nullptr, 8, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
      close(file);
      if (mapped == MAP_FAILED) return;
      text().copy(static_cast<char*>(mapped), 8);
      munmap(mapped, 8), touchAll();
    }
  }
  void replaceRoot() {
    const std::string other = outside_ + "other";
    makeBundle(other + "/" + bundleName(0));
    touchAll();
    renameat2(AT_FDCWD, root.substr(0, root.size() - 1).c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE);
    touchAll();
    std::error_code ignored;
    fs::remove_all(other, ignored);
  }
  void bind() {
    const std::string over = below(2) ? anyFile() : anyBundle();
    const std::string under = outside_ + "spare" + std::to_string(below(4));
    const bool isFile = over.ends_with(".plist");
    if (!mounts_ || !fs::exists(over) || fs::is_directory(over) == isFile) return;
    const std::string from = isFile ? under + "/Info.plist" : under;
    touchAll();
    mount(from.c_str(), over.c_str(), nullptr, MS_BIND, nullptr);
    overwrite(over), overwrite(from), touchAll();
  }
  void unbind() { touchAll(), unmountAll(), touchAll(); }

  /// By the kernel's table: what is mounted on moves with the directories above it.
  void unmountAll() {
    std::vector<std::string> points;
    std::ifstream table("/proc/self/mountinfo");
    for (std::string line; std::getline(table, line);) {
      std::istringstream fields(line);
      std::string field, point;
      for (int count = 0; count < 4; ++count) fields >> field;
      fields >> point;
      if (point.starts_with(fs::path(home_).parent_path().string() + "/")) points.push_back(point);
    }
    while (!points.empty()) umount2(points.back().c_str(), MNT_DETACH), points.pop_back();
  }

  static void waitForAnotherTick() {
    const std::int64_t start = timeStampNow();
    while (timeStampNow() < start + 25'000'000) std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }

  const std::string home_;
  const std::string outside_;
  std::mt19937 random_;
  const bool mounts_;
  int kept_ = -1;
};

}  // namespace kel::platform
