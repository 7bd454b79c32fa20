#pragma once

#include "platform/property_list_value.h"

/// Keys of service dictionaries. Each is one shared string, so that storing a value under it copies a
/// reference and a list of many services holds each key once.
namespace kel::service_key {

using Key = platform::PropertyListString;

inline const Key bundleIdentifier = "QVBundleIdentifier";
inline const Key bundlePath = "QVBundlePath";
inline const Key filter = "QVFilter";
inline const Key forbiddenContext = "QVForbiddenContext";
inline const Key host = "QVHost";
inline const Key inputMechanism = "QVInputMechanism";
inline const Key keyEquivalent = "QVKeyEquivalent";
inline const Key languages = "QVLanguages";
inline const Key menuItem = "QVMenuItem";
inline const Key message = "QVMessage";
inline const Key portName = "QVPortName";
inline const Key requiredContext = "QVRequiredContext";
inline const Key restricted = "QVRestricted";
inline const Key returnTypes = "QVReturnTypes";
inline const Key sendFileTypes = "QVSendFileTypes";
inline const Key sendTypes = "QVSendTypes";
inline const Key spellChecker = "QVSpellChecker";
inline const Key supportsDataTranslation = "QVSupportsDataTranslation";
inline const Key supportsFileTranslation = "QVSupportsFileTranslation";
inline const Key timeout = "QVTimeout";
inline const Key userData = "QVUserData";
inline const Key uuid = "QVUUID";

/// In a dictionary of menu titles or key equivalents: the one that is not localized.
inline const Key defaultTitle = "default";

}  // namespace kel::service_key
