#include "entries/app_entry_validation.h"

#include <algorithm>
#include <array>

#include "common/common.h"
#include "entries/app_entry.h"
#include "entries/service_key_table.h"
#include "property_lists/unicode.h"

namespace kel {

namespace {

namespace information_keys = platform::information_keys;
using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListValue;

std::vector<std::string_view> keysWith(ServiceKeyRule rule) {
  return map_array(service_keys::table, [rule](const ServiceKey& key) {
    return key.rule == rule ? std::optional<std::string_view>(key.declared) : std::nullopt;
  });
}

const auto string_service_keys = keysWith(ServiceKeyRule::String);
const auto string_array_service_keys = keysWith(ServiceKeyRule::StringArray);
const auto localizable_service_keys = keysWith(ServiceKeyRule::Localizable);
const auto context_service_keys = keysWith(ServiceKeyRule::Context);
constexpr std::array<std::string_view, 4> context_string_keys{"qvapplicationidentifier", "qvtextscript",
                                                              "qvtextlanguage", "qvtextcontent"};
constexpr std::array<std::string_view, 1> context_number_keys{"qvwordlimit"};

bool isOfType(const PropertyListValue& value, ServiceValueType type) {
  switch (type) {
    case ServiceValueType::String:
      return value.asString() != nullptr;
    case ServiceValueType::Array:
      return value.asArray() != nullptr;
    case ServiceValueType::Dictionary:
      return value.asDictionary() != nullptr;
    case ServiceValueType::Number:
      return value.isNumber();
  }
  return false;
}

std::string nameOf(ServiceValueType type) {
  switch (type) {
    case ServiceValueType::String:
      return "QVString";
    case ServiceValueType::Array:
      return "QVArray";
    case ServiceValueType::Dictionary:
      return "QVDictionary";
    case ServiceValueType::Number:
      return "QVNumber";
  }
  return {};
}

std::string typeNameOf(const PropertyListValue& value) {
  for (const ServiceValueType type : {ServiceValueType::String, ServiceValueType::Array,
                                      ServiceValueType::Dictionary, ServiceValueType::Number}) {
    if (isOfType(value, type)) return nameOf(type);
  }
  return value.asData() ? "QVData" : "QVDate";
}

bool validateLocalizable(std::string_view key, const PropertyListValue& value, ValidationErrors* errors) {
  if (!validate_value_type(key, &value, ServiceValueType::Dictionary, false, errors)) return false;
  const PropertyListDictionary& titles = *value.asDictionary();
  return std::all_of(titles.begin(), titles.end(), [&](const PropertyListDictionary::Entry& title) {
    return validate_value_type(key, &title.second, ServiceValueType::String, true, errors);
  });
}

bool validateContextKey(std::string_view key, const PropertyListValue& value, ValidationErrors* errors) {
  if (key_in_list(key, context_string_keys)) {
    return value.asArray() ? validate_string_array(key, &value, errors)
                           : validate_string(key, &value, errors);
  }
  if (key_in_list(key, context_number_keys)) {
    return validate_value_type(key, &value, ServiceValueType::Number, false, errors);
  }
  return true;
}

bool validateServiceKey(std::string_view key, const PropertyListValue& value, ValidationErrors* errors) {
  if (key_in_list(key, string_service_keys)) return validate_string(key, &value, errors);
  if (key_in_list(key, string_array_service_keys)) return validate_string_array(key, &value, errors);
  if (key_in_list(key, localizable_service_keys)) return validateLocalizable(key, value, errors);
  if (key_in_list(key, context_service_keys)) return validate_context(key, &value, false, errors);
  return true;
}

}  // namespace

std::string ValidationErrors::report(std::string heading) const {
  for (const std::string& message : messages_) heading.append("\n\t").append(message);
  if (notKept_ > 0) heading.append("\n\tand ").append(std::to_string(notKept_)).append(" more");
  return heading;
}

bool key_in_list(std::string_view key, ServiceKeyTable table) {
  // No character of more than three bytes has an ASCII letter for its lower case, so a key much longer than
  // the table's need not be converted to be told apart.
  const bool mayMatch = std::any_of(table.begin(), table.end(), [&](std::string_view known) {
    return key.size() >= known.size() && key.size() <= 3 * known.size();
  });
  return mayMatch && std::find(table.begin(), table.end(), platform::lowerCase(key)) != table.end();
}

bool validate_value_type(std::string_view key, const PropertyListValue* value, ServiceValueType expected,
                         bool element, ValidationErrors* errors) {
  if (!value || isOfType(*value, expected)) return true;
  if (errors) {
    errors->add([&] {
      std::string message = "The value for key " + std::string(key);
      message += element ? " was supposed to contain types " : " was supposed to be of type ";
      message += nameOf(expected);
      message += element ? ", but instead it was found to contain type " : ", but instead it was of type ";
      return message += typeNameOf(*value);
    });
  }
  return false;
}

bool validate_string(std::string_view key, const PropertyListValue* value, ValidationErrors* errors) {
  return validate_value_type(key, value, ServiceValueType::String, false, errors);
}

bool validate_string_array(std::string_view key, const PropertyListValue* value, ValidationErrors* errors) {
  if (!validate_value_type(key, value, ServiceValueType::Array, false, errors)) return false;
  if (!value) return true;
  const PropertyListArray& elements = *value->asArray();
  return std::all_of(elements.begin(), elements.end(), [&](const PropertyListValue& element) {
    return validate_value_type(key, &element, ServiceValueType::String, true, errors);
  });
}

bool validate_context(std::string_view key, const PropertyListValue* value, bool nested,
                      ValidationErrors* errors) {
  if (!value) return true;
  bool valid = true;
  if (const PropertyListArray* contexts = nested ? nullptr : value->asArray()) {
    for (const PropertyListValue& context : *contexts) valid &= validate_context(key, &context, true, errors);
    return valid;
  }
  if (!validate_value_type(key, value, ServiceValueType::Dictionary, nested, errors)) return false;
  for (const auto& [contextKey, contextValue] : *value->asDictionary())
    valid &= validateContextKey(contextKey.text(), contextValue, errors);
  return valid;
}

bool validate_service_dictionary(const PropertyListDictionary& service, ValidationErrors* errors) {
  // No short cut: whoever mends a bundle wants to know of all that is wrong with it.
  bool valid = true;
  for (const auto& [key, value] : service) valid &= validateServiceKey(key.text(), value, errors);
  return valid;
}

bool KELAppEntry::validateBaseServiceKeysIntoErrors(ValidationErrors* errors) const {
  bool valid = true;
  const auto validate = [&](std::string_view key, const Value& value, ServiceValueType expected) {
    valid &= validate_value_type(key, value ? &*value : nullptr, expected, false, errors);
  };
  validate(information_keys::identifier, bundleID(), ServiceValueType::String);
  validate(information_keys::name, bundleName(), ServiceValueType::String);
  validate(information_keys::version, bundleVersion(), ServiceValueType::String);
  validate(information_keys::services, infoPlistServiceDictionaries(), ServiceValueType::Array);
  return valid;
}

bool KELAppEntry::validateEntryPlistFormatOptionallyLoggingErrors(bool log) const {
  ValidationErrors list;
  ValidationErrors* errors = log ? &list : nullptr;
  bool valid = validateBaseServiceKeysIntoErrors(errors);
  const Value services = infoPlistServiceDictionaries();
  // When they are no array there is nothing to walk; when the name is no string the bundle is lost already.
  if (valid && services) {
    for (const PropertyListValue& service : *services->asArray()) {
      valid &= validate_value_type(information_keys::services, &service, ServiceValueType::Dictionary, true,
                                   errors) &&
               validate_service_dictionary(*service.asDictionary(), errors);
    }
  }
  if (!list.empty()) {
    platform_.log.write(
        list.report("Malformed Services entries in Info.plist for Service at URL " + bundlePath()));
  }
  return valid;
}

}  // namespace kel
