#include "tools/events/EventsFile.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/base/TextEscape.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/tools/EventsText.h"

namespace kyt::tools {
namespace {

using Texts = std::vector<std::string>;

const std::string kEvent = eventText("login", 10, 1);

TEST(EventsFile, HasWhatIsWrittenInItsOrder) {
  const EventsFile file = eventsOf(
      "client = \"shop\"\nservice = \"orders\"\n" + kEvent +
      "fields.zone = { type = \"string\", personal = false, description = \"Where.\" }\n"
      "fields.account = { type = \"integer\", personal = true, optional = true, description = \"Whose.\" }\n" +
      eventText("logout", 10, 2));
  EXPECT_EQ(file.name, "e.toml");
  EXPECT_EQ(file.client, "shop");
  EXPECT_EQ(file.service, "orders");
  EXPECT_EQ(file.clientLine, 1U);
  ASSERT_EQ(file.events.size(), 2U);
  const DeclaredEvent& login = file.events[0];
  EXPECT_EQ(login.name, "login");
  EXPECT_EQ(login.category, 10);
  EXPECT_EQ(login.type, 1);
  EXPECT_EQ(login.description, "Something.");
  EXPECT_EQ(login.line, 3U);
  ASSERT_EQ(login.fields.size(), 2U);
  EXPECT_EQ(login.fields[0].name, "zone");
  EXPECT_FALSE(login.fields[0].personal);
  EXPECT_FALSE(login.fields[0].optional);
  EXPECT_EQ(login.fields[1].name, "account");
  EXPECT_EQ(login.fields[1].type, FieldType::integer);
  EXPECT_TRUE(login.fields[1].personal);
  EXPECT_TRUE(login.fields[1].optional);
  EXPECT_EQ(login.fields[1].description, "Whose.");
  EXPECT_EQ(login.fields[1].line, 9U);
  EXPECT_EQ(file.events[1].name, "logout");
  EXPECT_TRUE(file.events[1].fields.empty());
}

TEST(EventsFile, KnowsEachType) {
  std::string fields;
  for (const std::string& type : eventKeys().types) fields += fieldText("of_" + type, type);
  const EventsFile file = eventsOf(kEvent + fields);
  ASSERT_EQ(file.events.size(), 1U);
  ASSERT_EQ(file.events[0].fields.size(), 9U);
  for (const EventField& field : file.events[0].fields)
    EXPECT_EQ("of_" + fieldTypeName(field.type), field.name);
}

TEST(EventsFile, NamesTheNearestKeyOfOneThatThereIsNot) {
  EXPECT_EQ(problemsOf("clinet = \"a\"\n" + kEvent),
            Texts{"e.toml:1: unknown key \"clinet\"; the nearest known one is \"client\""});
  EXPECT_EQ(problemsOf(kEvent + "catgory = 3\n"),
            Texts{"e.toml:6: unknown key \"catgory\"; the nearest known one is \"category\""});
  EXPECT_EQ(
      problemsOf(kEvent + "fields.a = { type = \"string\", personel = true, personal = true, "
                          "description = \"What.\" }\n"),
      Texts{"e.toml:6: unknown key \"fields.a.personel\"; the nearest known one is \"fields.a.personal\""});
  EXPECT_EQ(
      problemsOf(kEvent + fieldText("a", "sting")),
      Texts{"e.toml:6: \"fields.a.type\" must be one of string, integer, unsigned, number, boolean, date, "
            "data, array, dictionary; the nearest one is \"string\""});
  EXPECT_EQ(problemsOf(kEvent + "quite_another = 3\n"), Texts{"e.toml:6: unknown key \"quite_another\""});
}

TEST(EventsFile, NamesAllThatIsMissing) {
  EXPECT_EQ(problemsOf("\n[[event]]\n"),
            (Texts{"e.toml:2: \"event\", the event's name, is missing", "e.toml:2: \"category\" is missing",
                   "e.toml:2: \"type\" is missing", "e.toml:2: \"description\" is missing"}));
  EXPECT_EQ(problemsOf(kEvent + "fields.a = {}\n"),
            (Texts{"e.toml:6: \"fields.a.type\" is missing", "e.toml:6: \"fields.a.personal\" is missing",
                   "e.toml:6: \"fields.a.description\" is missing"}));
  EXPECT_EQ(problemsOf(""), Texts{"e.toml: there is no [[event]]"});
}

TEST(EventsFile, RefusesValuesOfAnotherKind) {
  EXPECT_EQ(problemsOf("event = 3\n"), Texts{"e.toml:1: \"event\" must be written as [[event]]"});
  EXPECT_EQ(problemsOf("event = [3]\n"), Texts{"e.toml:1: \"event\" must be written as [[event]]"});
  EXPECT_EQ(problemsOf("event = []\n"), Texts{"e.toml:1: \"event\" must be written as [[event]]"});
  EXPECT_EQ(problemsOf("client = 3\n" + kEvent), Texts{"e.toml:1: \"client\" must be text"});
  EXPECT_EQ(problemsOf(eventText("a", 65536, 1)),
            Texts{"e.toml:3: \"category\" must be a whole number from 0 to 65535"});
  EXPECT_EQ(problemsOf(eventText("a", 1, -1)),
            Texts{"e.toml:4: \"type\" must be a whole number from 0 to 65535"});
  EXPECT_EQ(problemsOf(kEvent + "fields = 3\n"), Texts{"e.toml:6: \"fields\" must be a table, a field each"});
  EXPECT_EQ(
      problemsOf(kEvent + "fields.a = { type = 1, personal = \"yes\", optional = 0, description = [] }\n"),
      (Texts{"e.toml:6: \"fields.a.type\" must be text",
             "e.toml:6: \"fields.a.personal\" must be true or false",
             "e.toml:6: \"fields.a.optional\" must be true or false",
             "e.toml:6: \"fields.a.description\" must be text"}));
  EXPECT_EQ(
      problemsOf(kEvent + "fields.a = 1\n"),
      Texts{"e.toml:6: \"fields.a\" must be a table: { type = \"string\", personal = false, description = "
            "\"…\" }"});
}

TEST(EventsFile, RefusesNamesAndNumbersThatAreThereAlready) {
  EXPECT_EQ(problemsOf(kEvent + eventText("login", 10, 2)),
            Texts{"e.toml:6: the event of line 1 has the name \"login\" already"});
  EXPECT_EQ(problemsOf(kEvent + eventText("logout", 10, 1)),
            Texts{"e.toml:6: the event of line 1 has category 10 and type 1 already"});
  EXPECT_EQ(problemsOf(kEvent + eventText("Login", 10, 2)), Texts{}) << "case counts";
  EXPECT_EQ(problemsOf(kEvent + fieldText("a", "string") + fieldText("a", "string")).size(), 1U);
}

TEST(EventsFile, RefusesNamesThatWouldSteerATerminal) {
  const std::string plain = " must be plain text, without control characters and marks that reorder it";
  EXPECT_EQ(problemsOf(eventText("a\\nb", 1, 1)), Texts{"e.toml:2: \"event\"" + plain});
  EXPECT_EQ(problemsOf(eventText("a\\u202Eb", 1, 1)), Texts{"e.toml:2: \"event\"" + plain});
  EXPECT_EQ(problemsOf(eventText("", 1, 1)), Texts{"e.toml:2: \"event\" must not be empty"});
  EXPECT_EQ(problemsOf(kEvent + "fields.\"a\\u0000\" = {}\n"), Texts{"e.toml:6: a field's name" + plain});
  EXPECT_EQ(problemsOf(kEvent + "fields.\"\" = {}\n"), Texts{"e.toml:6: a field's name must not be empty"});
  EXPECT_EQ(problemsOf("client = \"\\u001B[2J\"\n" + kEvent), Texts{"e.toml:1: \"client\"" + plain});
  EXPECT_EQ(eventsOf(eventText("\\\"*/ \\\\ ünï ''' 日本", 1, 1)).events.at(0).name, "\"*/ \\ ünï ''' 日本");
}

TEST(EventsFile, TakesDescriptionsWithLineBreaksAndNothingWorse) {
  const auto described = [](const std::string& text) {
    return "[[event]]\nevent = \"a\"\ncategory = 1\ntype = 1\ndescription = " + text + "\n";
  };
  EXPECT_EQ(eventsOf(described("\"\"\"\none\r\n\ttwo */\"\"\"")).events.at(0).description, "one\n\ttwo */");
  EXPECT_EQ(problemsOf(described("\" \\n\\t\"")), Texts{"e.toml:5: \"description\" must not be empty"});
  for (const char* worse : {"\"a\\rb\"", "\"a\\u0000\"", "\"\\u009B\"", "\"\\u2028\"", "\"\\u2066\""})
    EXPECT_EQ(problemsOf(described(worse)).size(), 1U) << worse;
}

TEST(EventsFile, HasBounds) {
  const std::string longest(kLongestEventName, 'n');
  EXPECT_EQ(problemsOf(eventText(longest, 1, 1) + fieldText(longest, "string")), Texts{});
  EXPECT_EQ(problemsOf(eventText(longest + "n", 1, 1)),
            Texts{"e.toml:2: \"event\" must have at most 128 bytes"});
  EXPECT_EQ(problemsOf(kEvent + fieldText(longest + "n", "string")),
            Texts{"e.toml:6: a field's name must have at most 128 bytes"});
  EXPECT_EQ(problemsOf("[[event]]\nevent = \"a\"\ncategory = 1\ntype = 1\ndescription = \"" +
                       std::string(kLongestDescription + 1, 'd') + "\"\n"),
            Texts{"e.toml:5: \"description\" must have at most 4096 bytes"});
  std::string fields;
  for (size_t i = 0; i < kMostFields; ++i) fields += fieldText("f" + std::to_string(i), "string");
  EXPECT_EQ(problemsOf(kEvent + fields), Texts{});
  EXPECT_EQ(problemsOf(kEvent + fields + fieldText("g", "string")),
            Texts{"e.toml:6: there are more than 256 fields"});
}

TEST(EventsFile, TakesTenThousandEventsAndNoMore) {
  std::string text;
  for (size_t i = 0; i < kMostEvents; ++i)
    text += eventText("event_" + std::to_string(i), static_cast<int>(i), 1) + fieldText("a", "string");
  EXPECT_EQ(eventsOf(text).events.size(), 10'000U);
  EXPECT_EQ(problemsOf(text + eventText("further", 10'000, 2)),
            Texts{"e.toml:60001: there are more than 10000 events"});
}

TEST(EventsFile, TellsTheFirstHundredProblemsAndHowManyMore) {
  std::string text;
  for (int i = 0; i < 150; ++i) text += eventText("e" + std::to_string(i), i, 70'000);
  const Texts problems = problemsOf(text);
  ASSERT_EQ(problems.size(), 101U);
  EXPECT_EQ(problems.back(), "e.toml: and 50 more problems");
}

TEST(EventsFile, HasProblemsOfPlainTextWhateverStandsInIt) {
  for (const std::string& problem : problemsOf(kEvent + "\"\\u001B[2J\\n\" = 1\nfields.\"\\u202E\" = 1\n"))
    EXPECT_TRUE(isPlainText(problem)) << problem;
  EXPECT_EQ(problemsOf("a = \n").size(), 1U);
}

TEST(EventsFile, SaysWhyItCannotBeRead) {
  const TemporaryFolder folder;
  const auto read = readEvents(folder / "nowhere.toml");
  ASSERT_TRUE(std::holds_alternative<EventsProblems>(read));
  EXPECT_NE(std::get<EventsProblems>(read).at(0).text.find("nowhere.toml: No such file or directory"),
            std::string::npos);
  EXPECT_TRUE(std::holds_alternative<EventsFile>(readEvents(folder.write("events.toml", kEvent))));
}

}  // namespace
}  // namespace kyt::tools
