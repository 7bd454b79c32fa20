#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "property_lists/property_list_value.h"

namespace kel::platform {

/// Keys of information dictionaries.
namespace information_keys {
inline constexpr std::string_view identifier = "KTBundleIdentifier";
inline constexpr std::string_view name = "KTBundleName";
inline constexpr std::string_view version = "KTBundleVersion";
inline constexpr std::string_view services = "QVServices";
}  // namespace information_keys

/// An information dictionary, empty when there is none that can be read; or, when there may be one and it
/// cannot be read for the moment, one line that says why.
struct InformationReading {
  PropertyListDictionary dictionary;
  std::string transientError;
};

/// An opened bundle; closed by destruction. One thread at a time.
class Bundle {
 public:
  virtual ~Bundle() = default;

  virtual InformationReading information() = 0;

  /// The bundle's identifier as declared, of whatever kind; absent when none is.
  virtual std::optional<PropertyListValue> identifier() = 0;

  /// The path of the resource `name` of `type` for `localization`; absent when there is surely no such file.
  virtual std::optional<std::string> resourcePath(std::string_view name, std::string_view type,
                                                  std::string_view localization) = 0;
};

/// Opens bundles. Any thread.
class Bundles {
 public:
  virtual ~Bundles() = default;

  /// The bundle in the directory `path`, or null when there is surely no directory.
  virtual std::unique_ptr<Bundle> open(const std::string& path) = 0;
};

/// Makes the identifier that every bundle implementation reports from an information dictionary.
std::optional<PropertyListValue> bundleIdentifier(const PropertyListDictionary& informationDictionary);

/// Longer names, in bytes, name no localization.
inline constexpr std::size_t longestLocalizationName = 128;

/// False for what can name no localization: nothing, more than `longestLocalizationName`, what begins with a
/// dot or holds a "/" or a NUL.
bool canNameLocalization(std::string_view name);

/// The path of a resource below its bundle ("Resources/LOC/NAME.TYPE"); absent for what can name no
/// localization.
std::optional<std::string> localizedResourceName(std::string_view name, std::string_view type,
                                                 std::string_view localization);

}  // namespace kel::platform
