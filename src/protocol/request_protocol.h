#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/platform.h"

namespace kel {

/// The named endpoint that the server listens on.
inline constexpr const char* endpointName = "com.orvex.kel.fetch_services";

/// The request kinds that the server recognises.
enum class KELCommand : std::int32_t {
  KELCommandInvalid,
  KELCommandGetServicesPlist,
  KELCommandGetAndUpdateServicesPlist,
  KELCommandFlush,
  KELCommandLocalizations,
};

// Names and entries of requests and replies.
namespace protocol {
inline constexpr const char* command = "command";
inline constexpr const char* localizations = "localizations";
inline constexpr const char* debug = "debug";
inline constexpr const char* data = "data";
inline constexpr const char* debugOutput = "debug_output";
inline constexpr const char* getServicesPlist = "get_services_plist";
inline constexpr const char* getAndUpdateServicesPlist = "get_and_update_services_plist";
inline constexpr const char* flush = "flush";
}  // namespace protocol

/// What a request asks for. Only the entries that the protocol names are looked at.
KELCommand classify_request(const platform::PropertyListDictionary& request);

/// True when a process in a sandbox must not ask for this.
bool refused_to_sandboxed(KELCommand command);

/// The request's "debug" entry; anything but a boolean counts as false.
bool wants_debug(const platform::PropertyListDictionary& request);

/// How many names one request may have: each may cost a look at every bundle.
inline constexpr std::size_t mostRequestedLocalizations = 64;

/// True when a request classified as `KELCommandLocalizations` has more names than that.
bool names_too_many_localizations(const platform::PropertyListDictionary& request);

/// The "localizations" of a request classified as `KELCommandLocalizations` that can name one, in their
/// order.
std::vector<std::string> requested_localizations(const platform::PropertyListDictionary& request);

/// Takes the reply to a request, or the error object that came in its place.
using ReplyPrinter = std::function<void(const platform::ConduitReply&)>;

/// Sends the request named `command` to the server and hands its reply to `printer`.
void send_kel_command(platform::Platform& platform, std::string_view command, bool debug,
                      const ReplyPrinter& printer);

/// Sends `request` over a connection of its own and waits; then hands the reply to `printer`, if there is
/// one.
void send_kel_payload(platform::Platform& platform, const platform::PropertyListDictionary& request,
                      const ReplyPrinter& printer);

/// The log line for an event of a kind that `routine` does not know: "ROUTINE: unknown Conduit message type
/// ADDRESS for SUBJECT: DESCRIPTION".
std::string unknown_message_type(std::string_view routine, std::string_view subject,
                                 const platform::ConduitEvent& event);
std::string unknown_message_type(std::string_view routine, std::string_view subject,
                                 const platform::PropertyListValue& value);

}  // namespace kel
