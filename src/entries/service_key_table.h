#pragma once

#include <array>
#include <string>

#include "common/service_keys.h"
#include "property_lists/unicode.h"

namespace kel {

/// What validation asks of the value under a key: nothing, a string, an array of strings, a dictionary of
/// strings, or one context dictionary or several.
enum class ServiceKeyRule { None, String, StringArray, Localizable, Context };

/// A key that bundles may declare for a service.
struct ServiceKey {
  platform::PropertyListString published;
  ServiceKeyRule rule;
  bool (*isCarriedOver)(const platform::PropertyListValue&);
  std::string declared = platform::lowerCase(published);
};

namespace service_keys {
using enum ServiceKeyRule;

// Which declared values a public dictionary takes as they are.
inline bool never(const platform::PropertyListValue&) { return false; }
inline bool always(const platform::PropertyListValue&) { return true; }
inline bool ifString(const platform::PropertyListValue& value) { return value.asString() != nullptr; }
inline bool ifArray(const platform::PropertyListValue& value) { return value.asArray() != nullptr; }

/// Every key that the system knows. What is never carried over, normalisation makes from what is declared.
inline const std::array<ServiceKey, 19> table{{
    {QVSpellChecker, String, always},
    {QVFilter, String, always},
    {QVSupportsFileTranslation, None, always},
    {QVSupportsDataTranslation, None, always},
    {QVMessage, String, never},
    {"QVPortName", String, ifString},
    {"QVInputMechanism", String, always},
    {"QVHost", String, ifString},
    {"QVRequiredContext", Context, always},
    {"QVForbiddenContext", Context, always},
    {"QVUserData", String, ifString},
    {"QVTimeout", String, always},
    {QVSendTypes, StringArray, ifArray},
    {QVLanguages, StringArray, ifArray},
    {"QVSendFileTypes", StringArray, always},
    {"QVReturnTypes", StringArray, ifArray},
    {QVMenuItem, Localizable, never},
    {QVKeyEquivalent, Localizable, never},
    {QVRestricted, None, never},
}};
}  // namespace service_keys

}  // namespace kel
