#include "entries/app_entry_validation.h"

#include "entries/entry_fixture.h"

namespace kel::test {
namespace {

using platform::Bytes;
using platform::PropertyListDate;
using platform::PropertyListDictionary;
using testing::ElementsAre;
using testing::EndsWith;
using testing::IsEmpty;
using testing::SizeIs;

class ValidationTest : public EntryTest {
 protected:
  /// The messages about an entry with these fields, each on a line; the verdict must agree with them, with
  /// and without logging.
  std::string problems(std::vector<PropertyListDictionary::Entry> fields) {
    const auto entry = cached(std::move(fields));
    const bool valid = entry->validateEntryPlistFormatOptionallyLoggingErrors(false);
    EXPECT_THAT(system.log.messages(), IsEmpty());
    EXPECT_EQ(entry->validateEntryPlistFormatOptionallyLoggingErrors(true), valid);
    const std::vector<std::string> messages = system.log.take();
    EXPECT_EQ(messages.empty(), valid);
    if (messages.empty()) return {};
    EXPECT_THAT(messages, SizeIs(1));
    const std::string heading = "Malformed Services entries in Info.plist for Service at URL " + path;
    EXPECT_THAT(messages[0], testing::StartsWith(heading + "\n\t"));
    return messages[0].substr(heading.size());
  }

  std::string problemsOfService(std::vector<PropertyListDictionary::Entry> service) {
    return problems({{"service_dicts", Array{dictionary(std::move(service))}}});
  }

  static std::string itself(const std::string& key, const std::string& expected, const std::string& found) {
    return "\n\tThe value for key " + key + " was supposed to be of type " + expected +
           ", but instead it was of type " + found;
  }
  static std::string element(const std::string& key, const std::string& expected, const std::string& found) {
    return "\n\tThe value for key " + key + " was supposed to contain types " + expected +
           ", but instead it was found to contain type " + found;
  }
};

TEST_F(ValidationTest, BaseValuesAreAllTestedAndHideTheServices) {
  EXPECT_EQ(problems({}), "");
  EXPECT_EQ(
      problems({{"bundle_id", true}, {"name", Bytes{1}}, {"vers", 1.0}, {"service_dicts", "x"}}),
      itself("KTBundleIdentifier", "QVString", "QVNumber") + itself("KTBundleName", "QVString", "QVData") +
          itself("KTBundleVersion", "QVString", "QVNumber") + itself("QVServices", "QVArray", "QVString"));
  EXPECT_EQ(problems({{"vers", PropertyListDate{}}, {"service_dicts", Array{1}}}),
            itself("KTBundleVersion", "QVString", "QVDate"));
  EXPECT_EQ(problems({{"service_dicts", dictionary({})}}), itself("QVServices", "QVArray", "QVDictionary"));
}

TEST_F(ValidationTest, EveryServiceIsExaminedAroundAnElementThatIsNone) {
  EXPECT_EQ(problems({{"service_dicts",
                       Array{dictionary({{"QVHost", 1}}), "stray", dictionary({{"QVFilter", Array{}}})}}}),
            itself("QVHost", "QVString", "QVNumber") + element("QVServices", "QVDictionary", "QVString") +
                itself("QVFilter", "QVString", "QVArray"));
}

TEST_F(ValidationTest, EveryKnownKeyOfAServiceHasItsKind) {
  for (const char* key : {"QVMessage", "QVHost", "QVUserData", "QVTimeout", "QVFilter", "QVSpellChecker",
                          "QVInputMechanism", "QVPortName"}) {
    EXPECT_EQ(problemsOfService({{key, "text"}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, 1}}), itself(key, "QVString", "QVNumber"));
  }
  for (const char* key : {"QVSendTypes", "QVReturnTypes", "QVSendFileTypes", "QVLanguages"}) {
    EXPECT_EQ(problemsOfService({{key, Array{}}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "text"}}), itself(key, "QVArray", "QVString"));
    EXPECT_EQ(problemsOfService({{key, Array{"text", 1, Array{}}}}), element(key, "QVString", "QVNumber"));
  }
  for (const char* key : {"QVMenuItem", "QVKeyEquivalent"}) {
    EXPECT_EQ(problemsOfService({{key, dictionary({{"default", "x"}})}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "x"}}), itself(key, "QVDictionary", "QVString"));
    EXPECT_EQ(problemsOfService({{key, dictionary({{"a", Array{}}, {"b", 1}})}}),
              element(key, "QVString", "QVArray"));
  }
}

TEST_F(ValidationTest, ContextsAreDictionariesOrArraysOfThem) {
  const auto badLimit = dictionary({{"QVWordLimit", "many"}});
  for (const char* key : {"QVRequiredContext", "QVForbiddenContext"}) {
    EXPECT_EQ(problemsOfService({{key, Array{}}}), "") << key;
    EXPECT_EQ(problemsOfService({{key, "x"}}), itself(key, "QVDictionary", "QVString"));
    EXPECT_EQ(problemsOfService({{key, Array{badLimit, Array{}, badLimit}}}),
              itself("QVWordLimit", "QVNumber", "QVString") + element(key, "QVDictionary", "QVArray") +
                  itself("QVWordLimit", "QVNumber", "QVString"));
  }
  for (const char* key : {"QVApplicationIdentifier", "QVTextScript", "QVTextLanguage", "QVTextContent"}) {
    const auto context = [&](Value value) {
      return problemsOfService({{"QVRequiredContext", dictionary({{key, std::move(value)}})}});
    };
    EXPECT_EQ(context("x") + context(Array{"x", "y"}), "") << key;
    EXPECT_EQ(context(1), itself(key, "QVString", "QVNumber"));
    EXPECT_EQ(context(Array{"x", 1, 2}), element(key, "QVString", "QVNumber"));
  }
  EXPECT_EQ(problemsOfService({{"QVRequiredContext", dictionary({{"QVWordLimit", true}, {"Other", 1}})}}),
            "");
}

TEST_F(ValidationTest, KeysAreComparedWholeAndWithoutRegardToLetterCase) {
  for (const char* key : {"qvmessage", "QVMESSAGE", "qVsPeLlChEcKeR", "QVSpellChec\u212Aer"}) {
    EXPECT_EQ(problemsOfService({{key, 1}}), itself(key, "QVString", "QVNumber"));
  }
  const std::string longestWithKelvin = "QV\u212AeyEquivalent";
  EXPECT_EQ(problemsOfService({{longestWithKelvin, 1}}),
            itself(longestWithKelvin, "QVDictionary", "QVNumber"));
  EXPECT_EQ(problemsOfService({{"QV Message", 1},
                               {"QVMessage\t", 1},
                               {"QVMessages", 1},
                               {"QVMessag", 1},
                               {"", 1},
                               {"Icon", Array{1}},
                               {std::string(1 << 20, 'Q'), 1}}),
            "");
}

TEST_F(ValidationTest, ReportStaysBoundedWhateverTheNumberOfProblems) {
  const std::string report = problems({{"service_dicts", Array(1000, Array{})}});
  EXPECT_EQ(std::count(report.begin(), report.end(), '\n'), 201);
  EXPECT_THAT(report, EndsWith("\n\tand 800 more"));
}

}  // namespace
}  // namespace kel::test
