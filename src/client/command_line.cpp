#include "client/command_line.h"

#include <ostream>
#include <set>

#include "common/common.h"
#include "platform/option_parser.h"
#include "property_lists/unicode.h"
#include "restrictions/whitelist_generator.h"

namespace kel {

using platform::ParsedOption;
using platform::PropertyListDictionary;
using platform::PropertyListValue;

namespace {

constexpr const char* usageLine =
    "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...";

enum OptionValue : int {
  Help = 1,
  Dump = 2,
  DumpCache = 3,
  Update = 4,
  Flush = 5,
  Debug = 6,
  MockRegistryChange = 7,
  GenerateWhitelist = 8,
};

std::vector<platform::LongOption> optionTable() {
  return {{"help", Help},
          {"update", Update},
          {"dump", Dump},
          {"dump_pboard", Dump},
          {"dump_cache", DumpCache},
          {"flush", Flush},
          {"debug", Debug},
          {"mockar", MockRegistryChange},
          {"generate_whitelist", GenerateWhitelist}};
}

struct Invocation {
  std::set<int> options;
  std::vector<std::string> localizations;

  bool has(OptionValue option) const { return options.contains(option); }
  bool asksForNothing() const {
    const bool onlyDebug = options.empty() || (options.size() == 1 && has(Debug));
    return onlyDebug && localizations.empty();
  }
};

/// Either what to do, or the status to exit with after the usage line.
std::variant<Invocation, int> parse(const std::vector<std::string>& arguments) {
  Invocation invocation;
  platform::OptionParser parser(arguments, optionTable());
  for (ParsedOption option = parser.next(); option.outcome != ParsedOption::Outcome::End;
       option = parser.next()) {
    if (option.outcome == ParsedOption::Outcome::Bad) return 1;
    if (option.value == Help) return 0;
    invocation.options.insert(option.value);
  }
  for (const std::string& argument : parser.remaining()) {
    // Behind "--": what looks like an option was meant as one and is no language.
    if (argument.starts_with('-')) return 1;
    if (platform::isValidUTF8(argument)) invocation.localizations.push_back(argument);
  }
  if (invocation.asksForNothing()) return 1;
  return invocation;
}

void dumpCache(platform::Platform& platform, std::ostream& output) {
  const std::optional<std::string> path = cache_file_path(platform.directories);
  const platform::DictionaryReading cache =
      path
          ? platform::readDictionaryFile(platform.files, *path, platform::largestOwnFile, platform::ownLimits)
          : platform::DictionaryReading();
  if (cache.dictionary) {
    output << platform::describe(*cache.dictionary) << "\n";
  } else {
    output << "Couldn't read " << path.value_or("(null)") << "\n";
  }
}

void requestLocalizations(const std::vector<std::string>& localizations, bool debug,
                          platform::Platform& platform, const ReplyPrinter& printer) {
  platform::PropertyListDictionaryBuilder request;
  request.set(protocol::localizations,
              platform::PropertyListArray(localizations.begin(), localizations.end()));
  if (debug) request.set(protocol::debug, true);
  send_kel_payload(platform, request.build(), printer);
}

void run(const Invocation& invocation, platform::Platform& platform, std::ostream& output) {
  const bool debug = invocation.has(Debug);
  const auto printingAll = [&](const platform::ConduitReply& reply) {
    print_reply(reply, PrintedData::Yes, output);
  };
  const auto printingDebug = [&](const platform::ConduitReply& reply) {
    print_reply(reply, PrintedData::No, output);
  };

  if (invocation.has(Dump)) send_kel_command(platform, protocol::getServicesPlist, debug, printingAll);
  if (invocation.has(Update))
    send_kel_command(platform, protocol::getAndUpdateServicesPlist, debug, printingDebug);
  if (invocation.has(Flush)) send_kel_command(platform, protocol::flush, debug, printingDebug);
  // The post reaches the server through the same notification as a real change.
  if (invocation.has(MockRegistryChange)) {
    platform.seeds.post(platform::databaseChangeNotification);
    output << "Mocking complete\n";
  }
  if (invocation.has(DumpCache)) dumpCache(platform, output);
  if (invocation.has(GenerateWhitelist)) generate_whitelist(platform, output);
  if (!invocation.localizations.empty()) {
    requestLocalizations(invocation.localizations, debug, platform, printingAll);
  }
}

}  // namespace

int parse_arguments(const std::vector<std::string>& arguments, platform::Platform& platform,
                    std::ostream& output) {
  const std::variant<Invocation, int> parsed = parse(arguments);
  if (const int* status = std::get_if<int>(&parsed)) {
    output << usageLine << "\n";
    return *status;
  }
  run(std::get<Invocation>(parsed), platform, output);
  return 0;
}

void print_reply(const platform::ConduitReply& reply, PrintedData printedData, std::ostream& output) {
  if (const auto* error = std::get_if<platform::ConduitError>(&reply)) {
    output << "Conduit message error: " << error->description << "\n";
    return;
  }
  const PropertyListValue& contents = std::get<PropertyListValue>(reply);
  const PropertyListDictionary* dictionary = contents.asDictionary();
  if (!dictionary) {
    output << unknown_message_type("print_reply", "reply", contents) << "\n";
    return;
  }
  if (const std::string* lines = string_value(*dictionary, protocol::debugOutput)) output << *lines << "\n";
  const auto* data = typed_value<&PropertyListValue::asData>(*dictionary, protocol::data);
  if (printedData == PrintedData::No || !data) return;
  const platform::PropertyListReading list = platform::readPropertyList(**data, platform::ownLimits);
  if (list.value) {
    output << platform::describe(*list.value) << "\n";
  } else {
    output << "Error decoding property list: " << list.error << "\n";
  }
}

}  // namespace kel
