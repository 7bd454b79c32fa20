#include <sstream>

#include "client/command_line.h"
#include "support/in_memory_platform.h"
#include "support/property_lists.h"

namespace kel::test {
namespace {

using namespace platform;

TEST(ClassificationTest, TellsKindsApartByNameAndElseAndOnlyABooleanTrueAsksForDebugOutput) {
  using enum KELCommand;
  const Array names{"de", "fr"};
  for (const auto& [entries, kind] : std::vector<std::pair<Entries, KELCommand>>{
           {{{"command", "get_services_plist"}}, KELCommandGetServicesPlist},
           {{{"command", "get_and_update_services_plist"}}, KELCommandGetAndUpdateServicesPlist},
           {{{"command", "flush"}, {"localizations", names}}, KELCommandFlush},
           {{{"command", "Flush"}}, KELCommandInvalid},
           {{{"command", "x"}, {"localizations", names}}, KELCommandLocalizations},
           {{{"command", 1}, {"localizations", names}}, KELCommandLocalizations},
           {{{"localizations", Array{}}}, KELCommandLocalizations},
           {{{"localizations", Array{"de", 1}}}, KELCommandInvalid},
           {{{"localizations", "de"}}, KELCommandInvalid},
           {{}, KELCommandInvalid}}) {
    EXPECT_EQ(classify_request(dictionary(entries)), kind) << testing::PrintToString(entries);
  }
  for (const Value& value : Array{true, false, 1, "true"})
    EXPECT_EQ(wants_debug(dictionary({{"debug", value}})), value == Value(true));
}

struct CommandLineTest : testing::Test {
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
  std::string run(Names arguments) {
    arguments.insert(arguments.begin(), "kel");
    std::ostringstream output;
    status = parse_arguments(arguments, system.platform, output);
    return output.str();
  }

  static Value command(const char* name) { return dictionary({{"command", name}}); }

  const std::string usage =
      "Usage: kel [-debug] [-dump] [-dump_cache] [-update] [-flush] language1 language2...\n";
  InMemoryPlatform system;
  SerialQueue serverQueue{"server"};
  ConduitListening listening;
  std::vector<Value> requests;
  std::optional<Value> reply = dictionary({});
  int status = -1;
};

TEST_F(CommandLineTest, WrongUsagePrintsTheUsageLineAndSendsNothing) {
  serve();
  using Case = std::pair<Names, int>;
  for (const auto& [arguments, expected] :
       {Case{{}, 1}, Case{{"-debug"}, 1}, Case{{"-dump", "-help"}, 0}, Case{{"-bogus", "-help"}, 1},
        Case{{"-help", "-bogus"}, 0}, Case{{"-dum"}, 1}, Case{{"-d"}, 1}, Case{{"-f"}, 1},
        Case{{"--", "-fr"}, 1}, Case{{"-flush", "-"}, 1}, Case{{"\xff"}, 1}}) {
    EXPECT_TRUE(run(arguments) == usage && status == expected) << testing::PrintToString(arguments);
  }
  EXPECT_THAT(requests, IsEmpty());
}

TEST_F(CommandLineTest, ActionsRunInTheirFixedOrderEachOnAConnectionOfItsOwn) {
  serve();
  EXPECT_EQ(
      run({"en", "-gen", "-dump_c", "-mockar", "-fl", "--update", "fr", "-dump_p", "-dump"}),
      "Mocking complete\nCouldn't read " + cachePath +
          "\nNo services (com.orvex.ServicesMenu.Services missing or empty in QVServices preferences)\n");
  EXPECT_EQ(status, 0);
  EXPECT_THAT(requests,
              ElementsAre(command("get_services_plist"), command("get_and_update_services_plist"),
                          command("flush"), Value(dictionary({{"localizations", Array{"en", "fr"}}}))));
  EXPECT_EQ(system.conduit.connections, 4);
  EXPECT_EQ(system.seeds.postsOf("com.orvex.AppRegistry.DatabaseChange"), 1U);
}

TEST_F(CommandLineTest, DebugIsAskedOfEveryRequestAndPrintedBeforeTheData) {
  serve();
  reply = dictionary(
      {{"debug_output", "line 1\nline 2"}, {"data", *platform::writeBinaryPropertyList(Array{"x"}).bytes}});
  EXPECT_EQ(run({"-dump", "-update", "-debug", "en"}),
            "line 1\nline 2\n(\n    x\n)\n"
            "line 1\nline 2\n"
            "line 1\nline 2\n(\n    x\n)\n");
  for (const Value& request : requests)
    EXPECT_EQ(*request.asDictionary()->find("debug"), true) << testing::PrintToString(request);
}

TEST_F(CommandLineTest, OddRepliesArePrintedAndChangeNoStatus) {
  serve();
  reply = dictionary({{"data", platform::Bytes{'<', 'x'}}});
  EXPECT_THAT(run({"-dump"}), MatchesRegex("Error decoding property list: [^\n]+\n"));
  reply = "text";
  EXPECT_THAT(run({"-flush"}),
              MatchesRegex("print_reply: unknown Conduit message type 0x[0-9a-f]+ for reply: text\n"));
  EXPECT_EQ(status, 0);
}

TEST_F(CommandLineTest, WhatBreaksAConnectionIsPrintedAndLogged) {
  EXPECT_EQ(run({"-dump"}), "Conduit message error: Connection invalid\n");
  EXPECT_THAT(system.log.take(), ElementsAre("send_kel_payload: kel message error: Connection invalid"));
  serve();
  run({"-dump"});
  EXPECT_THAT(system.log.take(), IsEmpty());
  reply.reset();
  EXPECT_EQ(run({"-update", "-flush"}),
            "Conduit message error: Connection interrupted\nConduit message error: Connection interrupted\n");
  EXPECT_EQ(status, 0);
  const std::string line = "send_kel_payload: kel message error: Connection interrupted";
  EXPECT_THAT(system.log.take(), ElementsAre(line, line));
}

}  // namespace
}  // namespace kel::test
