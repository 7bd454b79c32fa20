#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/process.h"

namespace kel::platform {
namespace {

using testing::HasSubstr;

const std::vector<LongOption> table{{"help", 1},        {"update", 4},     {"dump", 2},
                                    {"dump_pboard", 2}, {"dump_cache", 3}, {"flush", 5},
                                    {"debug", 6},       {"mockar", 7},     {"generate_whitelist", 8}};

/// What a parse met, as one line: values, "bad", then the remaining arguments.
std::string parse(std::vector<std::string> arguments) {
  arguments.insert(arguments.begin(), "kel");
  OptionParser parser(std::move(arguments), table);
  std::string story;
  for (ParsedOption option = parser.next(); option.outcome != ParsedOption::Outcome::End;
       option = parser.next()) {
    story += option.outcome == ParsedOption::Outcome::Bad ? "bad " : std::to_string(option.value) + " ";
  }
  story += "|";
  for (const std::string& argument : parser.remaining()) story += " " + argument;
  return story;
}

TEST(OptionParser, OptionsAreRecognisedAsTheTableOfCasesSays) {
  const std::pair<std::vector<std::string>, std::string> rows[] = {
      {{}, "|"},
      {{"-dump", "--dump"}, "2 2 |"},
      {{"-dump_p", "--dump_pb"}, "2 2 |"},
      {{"-fl", "--f"}, "5 5 |"},
      {{"-dum"}, "bad |"},
      {{"--dump_"}, "bad |"},
      {{"-d"}, "bad |"},
      {{"-f"}, "bad |"},
      {{"-f=x"}, "bad |"},
      {{"-x", "-flush"}, "bad 5 |"},
      {{"-bogus", "-help"}, "bad 1 |"},
      {{"-flush=now"}, "bad |"},
      {{"en", "-dump", "fr", "-f", "de"}, "2 bad | en fr de"},
      {{"en", "-u", "--u"}, "bad 4 | en"},
      {{"-", "", "-update"}, "4 | - "},
      {{"-debug", "--", "-fr", "-f"}, "6 | -fr -f"},
      {{"-he", "-mo", "-g", "-ge", "-de", "-up"}, "1 7 bad 8 6 4 |"},
  };
  testing::internal::CaptureStderr();
  for (const auto& [arguments, story] : rows) {
    EXPECT_EQ(parse(arguments), story) << testing::PrintToString(arguments);
  }
  testing::internal::GetCapturedStderr();
}

TEST(OptionParser, BadOptionsAreReportedInOneFormOnTheErrorStream) {
  const std::pair<std::string, std::string> rows[] = {
      {"-f", "kel: unrecognized option '-f'\n"},
      {"-d", "kel: unrecognized option '-d'\n"},
      {"-bogus", "kel: unrecognized option '-bogus'\n"},
      {"-dum", "kel: option '-dum' is ambiguous; possibilities: '-dump' '-dump_pboard' '-dump_cache'\n"},
  };
  for (const auto& [argument, message] : rows) {
    testing::internal::CaptureStderr();
    parse({"en", argument});
    EXPECT_EQ(testing::internal::GetCapturedStderr(), message);
  }
}

}  // namespace
}  // namespace kel::platform
