#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <utility>
#include <vector>

#include "common/common.h"
#include "platform/file_system.h"
#include "platform/standard_directories.h"
#include "property_lists/property_list_value.h"
#include "restrictions/restriction_list_entry.h"

namespace kel {

/// The two restriction lists, with rows of any kind. Having none is not the same as having two empty ones.
template <typename Row>
struct RestrictionListsOf {
  std::vector<Row> unrestricted;  ///< vendor services that stay unrestricted
  std::vector<Row> restricted;    ///< services that are restricted whoever provides them
};

/// Restriction lists in memory. Shared as `std::shared_ptr<const KELRestrictionLists>`, null for none;
/// replaced whole, never edited.
using KELRestrictionLists = RestrictionListsOf<KELRestrictionListEntry>;

/// A service dictionary to look into, finished or under construction. Borrows it.
class ServiceView {
 public:
  ServiceView(const platform::PropertyListDictionary& service) : finished_(&service) {}
  ServiceView(const platform::PropertyListDictionaryBuilder& service) : building_(&service) {}

  /// The value under `key`, or null.
  const platform::PropertyListValue* find(std::string_view key) const {
    return finished_ ? finished_->find(key) : building_->find(key);
  }

 private:
  const platform::PropertyListDictionary* finished_ = nullptr;
  const platform::PropertyListDictionaryBuilder* building_ = nullptr;
};

/// What the restrictions file is called, where it holds and where it is generated.
inline constexpr const char* restrictionsFileName = "com.orvex.QVServicesRestrictions.plist";

/// Reads the restrictions file, in "CoreAgents" of the system's library directory, anew. None when there is
/// no such file or it is no property list with a dictionary at its top; a line in the system log says what is
/// wrong with one that is there.
platform::DictionaryReading load_restrictions_file(platform::Platform& platform);

/// Both lists mapped by `transform`, which gives an optional row; rows that are none drop out.
template <typename Row, typename Transform>
auto transform_restriction_lists(const RestrictionListsOf<Row>& lists, Transform&& transform) {
  auto unrestricted = map_array(lists.unrestricted, transform);
  auto restricted = map_array(lists.restricted, transform);
  using Result = typename decltype(unrestricted)::value_type;
  return RestrictionListsOf<Result>{std::move(unrestricted), std::move(restricted)};
}

/// The lists of a storable form, null for none. What is missing or of another kind than expected gives no
/// rows: the form may come from a damaged file.
std::shared_ptr<const KELRestrictionLists> restriction_lists_from_plist(
    const std::optional<platform::PropertyListDictionary>& plist);

/// The storable form: "QVUnrestricted" and "QVRestricted", always both. None for null.
std::optional<platform::PropertyListDictionary> restriction_lists_to_plist(const KELRestrictionLists* lists);

/// Sets "QVRestricted" to true in every service that declares no value of its own and either is named by the
/// restricted list or is the vendor's and not named by the unrestricted one. `lists` may be null.
void apply_restriction_lists(std::vector<platform::PropertyListDictionaryBuilder>& services,
                             const KELRestrictionLists* lists);

/// True when the service's bundle identifier begins with "com.orvex.".
bool is_vendor_service(const ServiceView& service);

/// The row that would name `service`: its bundle identifier and its default, else its English menu title.
/// None when either is missing.
std::optional<KELRestrictionListEntry> restriction_entry_for_service(const ServiceView& service);

}  // namespace kel
