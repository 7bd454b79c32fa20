#include "protocol/request_protocol.h"

#include <algorithm>
#include <span>
#include <sstream>
#include <utility>

#include "common/common.h"
#include "property_lists/property_list.h"

namespace kel {

using platform::ConduitError;
using platform::ConduitEvent;
using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListDictionaryBuilder;
using platform::PropertyListValue;

KELCommand classify_request(const PropertyListDictionary& request) {
  if (const std::string* name = string_value(request, protocol::command)) {
    if (*name == protocol::flush) return KELCommand::KELCommandFlush;
    if (*name == protocol::getServicesPlist) return KELCommand::KELCommandGetServicesPlist;
    if (*name == protocol::getAndUpdateServicesPlist) return KELCommand::KELCommandGetAndUpdateServicesPlist;
  }
  // A command that is unknown or no string is passed over: the request may still name localizations.
  const PropertyListArray* names = array_value(request, protocol::localizations);
  const auto isString = [](const PropertyListValue& value) { return value.asString() != nullptr; };
  return names && std::all_of(names->begin(), names->end(), isString) ? KELCommand::KELCommandLocalizations
                                                                      : KELCommand::KELCommandInvalid;
}

bool refused_to_sandboxed(KELCommand command) {
  return command == KELCommand::KELCommandFlush || command == KELCommand::KELCommandGetAndUpdateServicesPlist;
}

bool wants_debug(const PropertyListDictionary& request) {
  return typed_value<&PropertyListValue::asBoolean>(request, protocol::debug).value_or(false);
}

std::vector<std::string> requested_localizations(const PropertyListDictionary& request) {
  const PropertyListArray* names = array_value(request, protocol::localizations);
  if (!names) return {};
  return map_array(*names, [](const PropertyListValue& name) {
    const std::string* text = name.asString();
    return text && platform::canNameLocalization(*text) ? text : nullptr;
  });
}

bool names_too_many_localizations(const PropertyListDictionary& request) {
  const PropertyListArray* names = array_value(request, protocol::localizations);
  return names && names->size() > mostRequestedLocalizations;
}

void send_kel_command(platform::Platform& platform, std::string_view command, bool debug,
                      const ReplyPrinter& printer) {
  PropertyListDictionaryBuilder request;
  request.set(protocol::command, command);
  if (debug) request.set(protocol::debug, true);
  send_kel_payload(platform, request.build(), printer);
}

void send_kel_payload(platform::Platform& platform, const PropertyListDictionary& request,
                      const ReplyPrinter& printer) {
  constexpr const char* routine = "send_kel_payload";
  // The queue comes first: it outlives the connection, whose errors arrive on it while this thread waits.
  platform::SerialQueue queue("kel contact queue");
  const std::shared_ptr<platform::ConduitConnection> connection =
      platform.conduit.connect(endpointName, queue);
  connection->setEventHandler([&log = platform.log](const ConduitEvent& event) {
    if (const auto* error = std::get_if<ConduitError>(&event)) {
      log.write(std::string(routine) + ": kel message error: " + error->description);
    } else {
      log.write(unknown_message_type(routine, "connection handler", event) + "\n");
    }
  });
  connection->start();
  const platform::ConduitReply reply = connection->sendAndWait(request);
  if (printer) printer(reply);
}

namespace {

std::string unknownType(std::string_view routine, std::string_view subject, const void* type,
                        std::string_view description) {
  std::ostringstream line;
  line << routine << ": unknown Conduit message type " << type << " for " << subject << ": " << description;
  return line.str();
}

}  // namespace

std::string unknown_message_type(std::string_view routine, std::string_view subject,
                                 const ConduitEvent& event) {
  if (const auto* message = std::get_if<std::shared_ptr<platform::ConduitMessage>>(&event)) {
    return unknown_message_type(routine, subject, (*message)->contents());
  }
  // Addresses that stand for the kinds that are no values, as `typeAddress` does for those that are.
  static constexpr char connectionType = 0;
  static constexpr char errorType = 0;
  if (const auto* error = std::get_if<ConduitError>(&event)) {
    return unknownType(routine, subject, &errorType, error->description);
  }
  return unknownType(routine, subject, &connectionType, "a connection");
}

std::string unknown_message_type(std::string_view routine, std::string_view subject,
                                 const PropertyListValue& value) {
  return unknownType(routine, subject, value.typeAddress(), platform::describeBriefly(value));
}

}  // namespace kel
