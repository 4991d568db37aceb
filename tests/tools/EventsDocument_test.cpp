#include "tools/events/Document.h"

#include <gtest/gtest.h>

#include <string>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/tools/EventsText.h"
#include "tests/tools/ManualText.h"

namespace kyt::tools {
namespace {

TEST(EventsDocument, SaysFirstWhatIsAboutAPerson) {
  EXPECT_EQ(
      documentEvents(eventsOf(
          "client = \"shop\"\nservice = \"orders\"\n"
          "[[event]]\nevent = \"page_opened\"\ncategory = 10\ntype = 1\ndescription = \"Somebody opened a page.\"\n"
          "fields.page = { type = \"string\", personal = false, description = \"Its name.\" }\n"
          "fields.account = { type = \"string\", personal = true, optional = true, description = \"Whose.\" }\n"
          "[[event]]\nevent = \"ended\"\ncategory = 10\ntype = 2\ndescription = \"It ended.\"\n")),
      R"(# What shop reports

2 events with 2 fields. About a person: `account` of `page_opened`.

It names itself `shop` (client), `orders` (service).

What of it leaves a device is decided by its owner's consent and by the storebag. Made by `kytctl events document` from `e.toml`.

## page_opened

Somebody opened a page.

Category 10, type 1.

| field | what it is | about a person | meaning |
|---|---|---|---|
| `page` | text | no | Its name. |
| `account` | text, may be missing | **yes** | Whose. |

## ended

It ended.

Category 10, type 2. It has no fields.
)");
}

TEST(EventsDocument, SaysThatNothingIsAboutAPerson) {
  const std::string page = documentEvents(eventsOf(eventText("a", 1, 1, fieldText("b", "date"))));
  EXPECT_EQ(page.find("# What e.toml reports\n\n1 event with 1 field. No field is about a person.\n"), 0U)
      << page;
}

TEST(EventsDocument, HasNoMarkOfItsTexts) {
  EXPECT_EQ(markdownText("a_b _a_ *c* `d` <script>e</script> [f](g) h|i # j &amp; ~k~ \\"),
            R"(a_b \_a\_ \*c\* \`d\` \<script\>e\</script\> \[f\](g) h\|i \# j \&amp; \~k\~ \\)");
  EXPECT_EQ(markdownText("- a"), "\\- a");
  EXPECT_EQ(markdownText("12. a"), "12\\. a");
  EXPECT_EQ(markdownText("===\nb"), "\\=== b");
  EXPECT_EQ(markdownText("12"), "12");
  EXPECT_EQ(markdownText("\n one\n two\n\n\n\t- three"), "one two\n\n\\- three");
}

TEST(EventsDocument, KeepsItsTableWhateverStandsInIt) {
  const std::string page = documentEvents(eventsOf(
      "[[event]]\nevent = \"`a|b` <i>\"\ncategory = 1\ntype = 1\ndescription = \"x\"\n"
      "fields.\"c|`d\" = { type = \"string\", personal = true, description = \"one | \\n\\n| two |\\nthree\" }\n"));
  EXPECT_NE(page.find("| c\\|\\`d | text | **yes** | one \\|<br>\\| two \\| three |\n"), std::string::npos)
      << page;
  EXPECT_NE(page.find("## \\`a\\|b\\` \\<i\\>\n"), std::string::npos) << page;
}

TEST(EventsDocument, IsPrintedOrWrittenToAFile) {
  const TemporaryFolder folder;
  const std::string file = folder.write("events.toml", eventText("a", 0, 1));
  const ProgramRun printed = runProgram(KYT_PROGRAMS "/kytctl", {"events", "document", file});
  EXPECT_EQ(printed.status, 0);
  EXPECT_EQ(runProgram(KYT_PROGRAMS "/kytctl", {"events", "document", file, "-o", folder / "page.md"}).status,
            0);
  EXPECT_EQ(folder.read("page.md"), printed.text);
  EXPECT_EQ(printed.text.find("# What events.toml reports\n"), 0U);
  EXPECT_EQ(runProgram(KYT_PROGRAMS "/kytctl", {"events", "document", folder / "nowhere.toml"}).status, 1);
}

// What is kept beside the ready-made sources is what is made of their files.
class MadeOfEventsOfSource : public ::testing::TestWithParam<const char*> {
 protected:
  [[nodiscard]] static std::string made(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "events");
    arguments.insert(arguments.begin() + 2,
                     std::string(KYT_SOURCE_DIR "/sources/") + GetParam() + "/events.toml");
    return runProgram(KYT_PROGRAMS "/kytctl", arguments).text;
  }
  [[nodiscard]] static std::string kept(const std::string& name) {
    return textOf(std::string("sources/") + GetParam() + "/" + name);
  }
};

TEST_P(MadeOfEventsOfSource, IsThePageForPeople) {
  EXPECT_EQ(kept("events.md"), made({"document"}));
}

TEST_P(MadeOfEventsOfSource, IsTheHeaderThatTheSourceUses) {
  const std::string header = kept("Events.h");
  if (GetParam() != std::string("boots")) {
    EXPECT_EQ(header, "") << "it has none";
  } else {
    EXPECT_EQ(header, made({"generate", "--lang", "c++"}));
  }
}

// "processorMin" is one of the figures "processor".
std::string figureOf(std::string field) {
  for (const std::string end : {"Min", "Mean", "Max"})
    if (field.ends_with(end)) return field.substr(0, field.size() - end.size());
  return field;
}

TEST_P(MadeOfEventsOfSource, StandsInTheGuide) {
  const auto read = readEvents(std::string(KYT_SOURCE_DIR "/sources/") + GetParam() + "/events.toml");
  ASSERT_TRUE(std::holds_alternative<EventsFile>(read));
  const std::string guide = textOf("docs/SOURCES.md"),
                    title = std::string("\n## kytsource-") + GetParam() + "\n";
  const size_t at = guide.find(title);
  ASSERT_NE(at, std::string::npos);
  const std::string section = guide.substr(at, guide.find("\n## ", at + 1) - at);
  Names declared;
  for (const DeclaredEvent& event : std::get<EventsFile>(read).events) {
    EXPECT_TRUE(
        std::regex_search(guide, std::regex(std::string("\n\\| `kytsource-") + GetParam() + "` \\|.*\\| " +
                                            std::to_string(event.category) + " \\|\n")));
    for (const EventField& field : event.fields)
      EXPECT_NE(guide.find("`" + figureOf(field.name) + "`"), std::string::npos) << field.name;
    // What every report may end with stands in a section of its own.
    if (event.type != 9) declared.insert(std::to_string(event.type) + " | `" + event.name + "`");
  }
  EXPECT_EQ(matchesIn(section, "\n\\| ([0-9]+ \\| `[a-z_]+`) \\|"), declared);
}

INSTANTIATE_TEST_SUITE_P(Sources, MadeOfEventsOfSource,
                         ::testing::Values("units", "boots", "crashes", "resources"),
                         [](const auto& test) { return std::string(test.param); });

}  // namespace
}  // namespace kyt::tools
