#include <gmock/gmock.h>
#include <sstream>

#include "client/command_line.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel {
namespace {

using platform::ConduitConnection;
using platform::ConduitError;
using platform::ConduitEvent;
using platform::ConduitMessage;
using platform::PropertyListArray;
using platform::PropertyListDictionary;
using platform::PropertyListValue;
using test::dictionary;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

TEST(ClassificationTest, TellsKindsApartByNameAndElse) {
  using enum KELCommand;
  const PropertyListArray names{"de", "fr"};
  struct Case {
    const char* name;
    PropertyListDictionary request;
    KELCommand kind;
  };
  for (const Case& c : {
           Case{"flush", dictionary({{"command", "flush"}}), KELCommandFlush},
           Case{"get", dictionary({{"command", "get_services_plist"}}), KELCommandGetServicesPlist},
           Case{"update", dictionary({{"command", "get_and_update_services_plist"}}),
                KELCommandGetAndUpdateServicesPlist},
           Case{"a command wins", dictionary({{"command", "flush"}, {"localizations", names}}),
                KELCommandFlush},
           Case{"other case", dictionary({{"command", "Flush"}}), KELCommandInvalid},
           Case{"a name's beginning", dictionary({{"command", "get_services_plist "}}), KELCommandInvalid},
           Case{"unknown with names", dictionary({{"command", "x"}, {"localizations", names}}),
                KELCommandLocalizations},
           Case{"no string with names", dictionary({{"command", 1}, {"localizations", names}}),
                KELCommandLocalizations},
           Case{"no names at all", dictionary({{"localizations", PropertyListArray{}}}),
                KELCommandLocalizations},
           Case{"one that is no string", dictionary({{"localizations", PropertyListArray{"de", 1}}}),
                KELCommandInvalid},
           Case{"names that are no array", dictionary({{"localizations", "de"}}), KELCommandInvalid},
           Case{"nothing", dictionary({}), KELCommandInvalid},
       }) {
    EXPECT_EQ(classify_request(c.request), c.kind) << c.name;
  }
}

TEST(ClassificationTest, OnlyABooleanTrueAsksForDebugOutput) {
  EXPECT_TRUE(wants_debug(dictionary({{"debug", true}})));
  for (const PropertyListValue& value :
       {PropertyListValue(false), PropertyListValue(1), PropertyListValue("true")}) {
    EXPECT_FALSE(wants_debug(dictionary({{"debug", value}})));
  }
  EXPECT_FALSE(wants_debug(dictionary({})));
}

class CommandLineTest : public testing::Test {
 protected:
  /// Answers every request with `reply` and keeps it.
  void serve() {
    listening = system.conduit.listen(endpointName, serverQueue, [this](const ConduitEvent& event) {
      const auto connection = std::get<std::shared_ptr<ConduitConnection>>(event);
      connection->setEventHandler([this](const ConduitEvent& received) {
        if (const auto* message = std::get_if<std::shared_ptr<ConduitMessage>>(&received)) {
          requests.push_back((*message)->contents());
          if (reply) (*message)->reply(*reply);
        }
      });
      connection->start();
    });
  }

  /// Runs the client; leaves the exit status in `status`.
  std::string run(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "kel");
    std::ostringstream output;
    status = parse_arguments(arguments, system.platform, output);
    return output.str();
  }

  static PropertyListValue command(const char* name) { return dictionary({{"command", name}}); }

  const std::string usage =
      "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n";
  test::InMemoryPlatform system;
  platform::SerialQueue serverQueue{"server"};
  platform::ConduitListening listening;
  std::vector<PropertyListValue> requests;
  std::optional<PropertyListValue> reply = dictionary({});
  int status = -1;
};

TEST_F(CommandLineTest, WrongUsagePrintsTheUsageLineAndSendsNothing) {
  serve();
  struct Case {
    std::vector<std::string> arguments;
    int status;
  };
  for (const Case& c :
       {Case{{}, 1}, Case{{"-debug"}, 1}, Case{{"-dump", "-help"}, 0}, Case{{"-bogus", "-help"}, 1},
        Case{{"-help", "-bogus"}, 0}, Case{{"-dum"}, 1}, Case{{"-d"}, 1}, Case{{"-f"}, 1},
        Case{{"--", "-fr"}, 1}, Case{{"-flush", "-"}, 1}, Case{{"\xff"}, 0}}) {
    const std::string output = run(c.arguments);
    if (c.arguments == std::vector<std::string>{"\xff"}) {
      EXPECT_EQ(status, 1) << "a name that is no UTF-8 does not count";
    } else {
      EXPECT_EQ(status, c.status) << testing::PrintToString(c.arguments);
    }
    EXPECT_EQ(output, usage) << testing::PrintToString(c.arguments);
  }
  EXPECT_THAT(requests, IsEmpty());
}

TEST_F(CommandLineTest, ActionsRunInTheirFixedOrderEachOnAConnectionOfItsOwn) {
  serve();
  EXPECT_EQ(run({"en", "-mockar", "-fl", "--update", "fr", "-dump_p", "-dump"}), "Mocking complete\n");
  EXPECT_EQ(status, 0);
  EXPECT_THAT(
      requests,
      ElementsAre(command("get_services_plist"), command("get_and_update_services_plist"), command("flush"),
                  PropertyListValue(dictionary({{"localizations", PropertyListArray{"en", "fr"}}}))));
  EXPECT_EQ(system.conduit.connections, 4);
  EXPECT_EQ(system.seeds.postsOf("com.orvex.AppRegistry.DatabaseChange"), 1U);
}

TEST_F(CommandLineTest, DebugIsAskedOfEveryRequestAndPrintedBeforeTheData) {
  serve();
  reply = dictionary({{"debug_output", "line 1\nline 2"},
                      {"data", *platform::writeBinaryPropertyList(PropertyListArray{"x"}).bytes}});
  EXPECT_EQ(run({"-dump", "-update", "-debug", "en"}),
            "line 1\nline 2\n(\n    x\n)\n"
            "line 1\nline 2\n"
            "line 1\nline 2\n(\n    x\n)\n");
  for (const PropertyListValue& request : requests) {
    EXPECT_EQ(*request.asDictionary()->find("debug"), true) << testing::PrintToString(request);
  }
}

TEST_F(CommandLineTest, OddRepliesArePrintedAndChangeNoStatus) {
  EXPECT_EQ(run({"-dump"}), "Conduit message error: Connection invalid\n");
  EXPECT_EQ(status, 0);
  serve();
  reply = dictionary({{"data", platform::Bytes{'<', 'x'}}});
  EXPECT_THAT(run({"-dump"}), testing::MatchesRegex("Error decoding property list: [^\n]+\n"));
  reply = "text";
  EXPECT_THAT(
      run({"-flush"}),
      testing::MatchesRegex("print_reply: unknown Conduit message type 0x[0-9a-f]+ for reply: text\n"));
  reply.reset();
  EXPECT_EQ(run({"-update", "-flush"}),
            "Conduit message error: Connection interrupted\nConduit message error: Connection interrupted\n");
  EXPECT_EQ(status, 0);
}

TEST_F(CommandLineTest, TheCacheFileIsPrintedWithoutAskingTheServer) {
  const std::string path = "/home/u/.cache/com.orvex.qvservicescache.plist";
  EXPECT_EQ(run({"-dump_cache"}), "Couldn't read " + path + "\n");
  system.files.addPropertyList(path, PropertyListArray{});
  EXPECT_EQ(run({"-dump_cache"}), "Couldn't read " + path + "\n");
  system.files.addPropertyList(path, dictionary({{"key", "value"}}));
  EXPECT_EQ(run({"-dump_cache"}), "{\n    key = value;\n}\n");
  EXPECT_EQ(status, 0);
  EXPECT_EQ(system.conduit.connections, 0);
}

}  // namespace
}  // namespace kel
