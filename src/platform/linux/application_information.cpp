#include "platform/linux/application_information.h"

#include <cerrno>
#include <sys/stat.h>

#include "platform/application_registry.h"
#include "platform/file_system.h"

namespace kel::platform {

namespace {

constexpr std::uint64_t nanosecondsOfASecond = 1'000'000'000;

/// Wraps around in the far future, which harms no comparison for equality.
std::uint64_t nanoseconds(const timespec& time) {
  return static_cast<std::uint64_t>(time.tv_sec) * nanosecondsOfASecond +
         static_cast<std::uint64_t>(time.tv_nsec);
}

}  // namespace

InformationStatus informationStatus(const std::string& application) {
  const std::string path = informationPath(application);
  struct stat status {};
  InformationStatus result;
  bool exists = lstat(path.c_str(), &status) == 0;
  result.isLink = exists && S_ISLNK(status.st_mode);
  if (result.isLink) exists = stat(path.c_str(), &status) == 0;
  result.isKnown = exists || errno == ENOENT || errno == ENOTDIR || errno == ELOOP;
  if (!exists) return result;
  const auto size = static_cast<std::uint64_t>(status.st_size);
  result.identity = {status.st_ino, nanoseconds(status.st_ctim), nanoseconds(status.st_mtim), size};
  result.isReadable = S_ISREG(status.st_mode) && size <= largestForeignFile;
  result.changeTime = status.st_ctim;
  return result;
}

bool isRacy(const timespec& changeTime, const timespec& now) {
  constexpr std::uint64_t finest = 20'000'000;
  constexpr std::uint64_t coarsest = 2'100'000'000;
  constexpr long roundStamp = 10'000'000;
  if (changeTime.tv_sec > now.tv_sec) return true;
  if (changeTime.tv_sec < now.tv_sec - 3) return false;
  // Far less than a wrap-around apart. What lies in the future gives a huge age.
  const std::uint64_t age = nanoseconds(now) - nanoseconds(changeTime);
  return age < (changeTime.tv_nsec % roundStamp == 0 ? coarsest : finest) || age > 2 * coarsest;
}

std::uint32_t informationFlags(BytesView contents) {
  const PropertyListReading reading = readPropertyList(contents, bundleFileLimits);
  const PropertyListDictionary* dictionary = reading.value ? reading.value->asDictionary() : nullptr;
  const PropertyListValue* services = dictionary ? dictionary->find("QVServices") : nullptr;
  const PropertyListArray* array = services ? services->asArray() : nullptr;
  return array && !array->empty() ? ApplicationRegistry::providesServices : 0;
}

std::string informationPath(const std::string& application) { return joinPath(application, "Info.plist"); }

}  // namespace kel::platform
