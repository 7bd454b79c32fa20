#pragma once

#include "property_lists/property_list_value.h"

/// Keys of service dictionaries that code asks for by name. Each is one shared string, so that storing a
/// value under it copies a reference and a list of many services holds each key once.
namespace kel::service_keys {

using Key = platform::PropertyListString;

inline const Key QVBundleIdentifier = "QVBundleIdentifier";
inline const Key QVBundlePath = "QVBundlePath";
inline const Key QVFilter = "QVFilter";
inline const Key QVKeyEquivalent = "QVKeyEquivalent";
inline const Key QVLanguages = "QVLanguages";
inline const Key QVMenuItem = "QVMenuItem";
inline const Key QVMessage = "QVMessage";
inline const Key QVRestricted = "QVRestricted";
inline const Key QVSendTypes = "QVSendTypes";
inline const Key QVSpellChecker = "QVSpellChecker";
inline const Key QVSupportsDataTranslation = "QVSupportsDataTranslation";
inline const Key QVSupportsFileTranslation = "QVSupportsFileTranslation";
inline const Key QVUUID = "QVUUID";

/// In a dictionary of menu titles or key equivalents: the one that is not localized.
inline const Key defaultTitle = "default";

}  // namespace kel::service_keys
