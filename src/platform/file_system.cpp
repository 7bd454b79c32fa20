#include "platform/file_system.h"

namespace kel::platform {

DictionaryReading readDictionaryFile(FileSystem& files, const std::string& path, std::size_t largest,
                                     const PropertyListLimits& limits) {
  const FileReading file = files.read(path, largest);
  if (!file.bytes) return {std::nullopt, file.error, file.isTransient};
  const PropertyListReading reading = readPropertyList(*file.bytes, limits);
  if (!reading.value) return {std::nullopt, reading.error};
  const PropertyListDictionary* dictionary = reading.value->asDictionary();
  if (!dictionary) return {std::nullopt, "the top level is not a dictionary"};
  return {*dictionary, {}};
}

std::string joinPath(std::string_view base, std::string_view name) {
  std::string path(base);
  if (!path.ends_with('/')) path += '/';
  while (name.starts_with('/')) name.remove_prefix(1);
  return path.append(name);
}

}  // namespace kel::platform
