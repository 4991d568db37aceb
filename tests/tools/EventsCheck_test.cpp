#include "tools/events/EventsCheck.h"

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <vector>

#include "tests/tools/EventsText.h"

namespace kyt::tools {
namespace {

using Texts = std::vector<std::string>;

Dictionary client(const Dictionary& further = {}) {
  Dictionary entry{{"client", "shop"}, {"filters", Array{}}};
  entry.merge(further);
  return entry;
}

Dictionary bagOf(const Array& clients, const char* section = "release", const char* backend = "httppost") {
  return Dictionary{{"version", "1"}, {section, Dictionary{{backend, Dictionary{{"clients", clients}}}}}};
}

Dictionary filter(const char* key, const char* action, const Dictionary& further = {}) {
  Dictionary dictionary{{"key", key}, {"action", action}};
  dictionary.merge(further);
  return dictionary;
}

// "LINE KIND: TEXT" each.
Texts findings(const std::string& events, const Dictionary& bag) {
  Texts texts;
  for (const EventFinding& finding : checkEvents(eventsOf(events), bag).findings)
    texts.push_back(std::to_string(finding.line) + " " + finding.kind + ": " + finding.text);
  return texts;
}

const std::string kPlain = eventText("login", 10, 1, fieldText("step", "integer"));
const std::string kPersonal = eventText("login", 10, 1, fieldText("email", "string", true));
const std::string kUnfiltered =
    "6 personal-unfiltered: \"email\" of \"login\" is personal, and no filter removes or hashes it: ";
const std::string kShop = "release, httppost, client \"shop\"";

TEST(EventsCheck, FindsNothingWhereAllIsWell) {
  EXPECT_EQ(findings(kPlain, bagOf({client()})), Texts{});
  const EventsVerdict verdict = checkEvents(eventsOf(kPlain), bagOf({client()}));
  EXPECT_EQ(verdict.further, 0U);
}

TEST(EventsCheck, FindsAPersonalFieldThatNoFilterGuards) {
  EXPECT_EQ(findings(kPersonal, bagOf({client()})), Texts{kUnfiltered + kShop});
  Dictionary without = client();
  without.remove("filters");
  EXPECT_EQ(findings(kPersonal, bagOf({without})), Texts{kUnfiltered + kShop});
  for (const char* action : {"remove", "sha256"})
    EXPECT_EQ(findings(kPersonal, bagOf({client({{"filters", Array{filter("EMAIL", action)}}})})), Texts{})
        << action;
  for (const char* action : {"Remove", "keep", ""})
    EXPECT_EQ(findings(kPersonal, bagOf({client({{"filters", Array{filter("email", action)}}})})),
              Texts{kUnfiltered + kShop})
        << action;
}

TEST(EventsCheck, TakesTheFirstFilterThatMatchesAsTheDaemonDoes) {
  const auto of = [](const Array& filters) {
    return findings(kPersonal, bagOf({client({{"filters", filters}})}));
  };
  EXPECT_EQ(of({filter("email", "keep"), filter("email", "remove")}), Texts{kUnfiltered + kShop});
  EXPECT_EQ(of({filter("email", "remove", {{"method", 10}, {"status", 1}})}), Texts{});
  EXPECT_EQ(of({filter("email", "remove", {{"method", 11}})}), Texts{kUnfiltered + kShop});
  EXPECT_EQ(of({filter("email", "remove", {{"status", 2}})}), Texts{kUnfiltered + kShop});
  EXPECT_EQ(of({filter("mail", "remove")}), Texts{kUnfiltered + kShop});
}

TEST(EventsCheck, FindsCategoriesThatTheListsRefuse) {
  const std::string refused = "1 category-refused: category 10 of \"login\" is refused: " + kShop;
  EXPECT_EQ(findings(kPlain, bagOf({client({{"event_whitelist", Array{11}}})})),
            Texts{refused + ", event_whitelist"});
  EXPECT_EQ(findings(kPlain, bagOf({client({{"event_whitelist", Array{}}})})),
            Texts{refused + ", event_whitelist"});
  EXPECT_EQ(findings(kPlain, bagOf({client({{"event_blacklist", Array{9, 10}}})})),
            Texts{refused + ", event_blacklist"});
  EXPECT_EQ(findings(kPlain, bagOf({client({{"event_whitelist", Array{10}}, {"event_blacklist", Array{}}})})),
            Texts{});
}

TEST(EventsCheck, JudgesNoFieldWhereTheEventIsRefused) {
  EXPECT_EQ(findings(kPersonal, bagOf({client({{"event_blacklist", Array{10}}})})).size(), 1U);
}

TEST(EventsCheck, FindsCategoryZero) {
  EXPECT_EQ(
      findings(eventText("login", 0, 1), bagOf({client()})),
      Texts{"1 category-0: \"login\" has category 0, which is the daemon's own: type 0 is a session's start, "
            "type 1 its end"});
}

TEST(EventsCheck, FindsValuesThatCannotBePosted) {
  const std::string text =
      eventText("login", 10, 1,
                fieldText("bytes", "data") + fieldText("list", "array") + fieldText("map", "dictionary") +
                    fieldText("when", "date") + fieldText("on", "boolean") + fieldText("n", "unsigned"));
  Texts found;
  for (const EventFinding& finding : checkEvents(eventsOf(text), bagOf({client()})).findings)
    found.push_back(finding.kind + " " + finding.field);
  EXPECT_EQ(found, (Texts{"not-posted bytes", "not-posted list", "not-posted map"}));
  EXPECT_EQ(
      findings(eventText("login", 10, 1, fieldText("list", "array")), bagOf({client()})),
      Texts{
          "6 not-posted: \"list\" of \"login\" is of the type array, which is not posted: the record leaves "
          "without it, with a line in the log: " +
          kShop});
}

TEST(EventsCheck, TakesWhatAFilterRemovesOrHashesForSettled) {
  const std::string text =
      eventText("login", 10, 1, fieldText("bytes", "data", true) + fieldText("list", "array", true));
  EXPECT_EQ(
      findings(text,
               bagOf({client({{"filters", Array{filter("bytes", "sha256"), filter("list", "sha256")}}})})),
      Texts{})
      << "data is hashed by its digits, an array is removed where it should be hashed";
}

TEST(EventsCheck, FindsFieldsThatTheRecordReplaces) {
  const std::string text = eventText("login", 10, 1,
                                     fieldText("_method", "integer") + fieldText("eventTime", "date") +
                                         fieldText("ClientName", "string") + fieldText("_mine", "string") +
                                         fieldText("clientname", "string"));
  EXPECT_EQ(
      findings(text, bagOf({client()})),
      (Texts{
          "6 replaced: \"_method\" of \"login\" is a key of every record: the record's own value takes its place",
          "7 replaced: \"eventTime\" of \"login\" is a key of every record: the record's own value takes its "
          "place",
          "8 replaced: \"ClientName\" of \"login\" is a key of the user information, which takes its place"}));
}

TEST(EventsCheck, LooksAtTheProgramsOwnEntriesAlone) {
  const Dictionary bag = bagOf({client({{"client", "other"}}), client({{"event_whitelist", Array{11}}}),
                                client({{"filters", Array{filter("email", "remove")}}})});
  const std::string others = kUnfiltered + "release, httppost, client \"other\"";
  EXPECT_EQ(findings(kPersonal, bag), Texts{others}) << "any of them may be its entry";
  EXPECT_EQ(findings("client = \"SHOP\"\n" + kPersonal, bag).size(), 1U);
  EXPECT_EQ(findings("client = \"SHOP\"\n" + kPersonal, bag).at(0),
            "2 category-refused: category 10 of \"login\" is refused: " + kShop + ", event_whitelist")
      << "the first entry that fits governs, those behind it do not";
}

TEST(EventsCheck, LooksBehindAnEntryThatNeedNotBeChosen) {
  const std::string text = "client = \"shop\"\n" + kPersonal;
  const std::string last =
      "7 personal-unfiltered: \"email\" of \"login\" is personal, and no filter removes or hashes it: ";
  const Dictionary guarded = client({{"filters", Array{filter("email", "remove")}}});
  Dictionary newer = guarded, ofService = guarded;
  newer.set("enabledSince", "9.0");
  ofService.set("service", "orders");
  EXPECT_EQ(findings(text, bagOf({newer, client()})), Texts{last + kShop});
  EXPECT_EQ(findings(text, bagOf({ofService, client()})), Texts{last + kShop});
  EXPECT_EQ(findings("service = \"the orders\"\n" + text, bagOf({ofService, client()})), Texts{});
}

TEST(EventsCheck, FindsAProgramThatNoEntryIsFor) {
  const std::string text = "client = \"stranger\"\n" + kPlain;
  EXPECT_EQ(
      findings(text, bagOf({client()})),
      Texts{"1 client-not-listed: no entry of release is for client \"stranger\": no event leaves there"});
  EXPECT_EQ(
      findings("client = \"shop\"\nservice = \"a\"\n" + kPlain, bagOf({client({{"service", "b"}})})),
      Texts{"1 client-not-listed: no entry of release is for client \"shop\", service \"a\": no event leaves "
            "there"});
  const Texts none{"0 client-not-listed: the bag has no client entry of posts: no event leaves by it"};
  EXPECT_EQ(findings(kPlain, Dictionary{{"version", "1"}}), none);
  EXPECT_EQ(findings(kPlain, bagOf({client()}, "release", "dashboard")), none);
}

TEST(EventsCheck, LooksAtEachSectionAndBackEndOfPosts) {
  for (const char* backend : {"httppost", "httppost2", "qrs"})
    for (const char* section : {"development", "vantu_internal", "seed", "release"})
      EXPECT_EQ(findings(kPersonal, bagOf({client()}, section, backend)),
                Texts{kUnfiltered + section + ", " + backend + ", client \"shop\""});
  Dictionary both = bagOf({client({{"event_whitelist", Array{10}}})});
  Dictionary release = *both.dictionary("release");
  release.set("httppost2", Dictionary{{"clients", Array{client({{"event_whitelist", Array{11}}})}}});
  both.set("release", release);
  EXPECT_EQ(findings(kPlain, both), Texts{}) << "one back end takes it";
}

TEST(EventsCheck, BearsABagOfAnyShape) {
  for (const Value& clients :
       {Value(), Value(3), Value(Array{3, "x", Array{}}), Value(Dictionary{{"a", 1}})}) {
    const Dictionary bag{{"release", Dictionary{{"httppost", Dictionary{{"clients", clients}}}}}};
    EXPECT_EQ(findings(kPlain, bag).size(), 1U);
  }
  EXPECT_EQ(findings(kPersonal, bagOf({client({{"filters", Array{3, "x", Dictionary{}}},
                                               {"event_whitelist", Array{"10"}},
                                               {"event_blacklist", 10}})}))
                .size(),
            1U);
}

TEST(EventsCheck, TellsAThousandFindingsOfTenThousandEventsAndHowManyMore) {
  std::string text;
  for (int i = 0; i < 10'000; ++i)
    text += eventText("e" + std::to_string(i), i + 1, 1, fieldText("email", "string", true));
  const EventsVerdict verdict = checkEvents(eventsOf(text), bagOf({client()}));
  EXPECT_EQ(verdict.findings.size(), kMostFindings);
  EXPECT_EQ(verdict.further, 9'000U);
}

}  // namespace
}  // namespace kyt::tools
