// The filter table and the two list rules.
#include "backends/https/EventFilters.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

class EventFiltersTest : public testing::Test {
 protected:
  Dictionary filtered(const Array& table, Dictionary event) {
    filters_.createFiltersFromArray(table);
    filters_.filterEvent(event, digest_);
    return event;
  }
  static Dictionary filter(const char* key, const char* action) { return {{"key", key}, {"action", action}}; }

  EventFilters filters_;
  EventFilters::Digest digest_ = [](const String& text) { return String("#" + text.str()); };
};

TEST_F(EventFiltersTest, ReplacesAValueByItsDigestForItsMethodAlone) {
  const Array table{Dictionary{{"key", "email"}, {"action", "sha256"}, {"method", 5}}};
  EXPECT_EQ(filtered(table, {{"_method", 5}, {"EMAIL", "x"}}), (Dictionary{{"_method", 5}, {"EMAIL", "#x"}}));
  EXPECT_EQ(filtered(table, {{"_method", 6}, {"EMAIL", "x"}}), (Dictionary{{"_method", 6}, {"EMAIL", "x"}}));
}

TEST_F(EventFiltersTest, MatchesTheStatusToo) {
  const Array table{Dictionary{{"key", "k"}, {"action", "remove"}, {"status", 2}}};
  EXPECT_FALSE(filtered(table, {{"_status", 2}, {"k", 1}}).contains("k"));
  EXPECT_TRUE(filtered(table, {{"_status", 3}, {"k", 1}}).contains("k"));
}

TEST_F(EventFiltersTest, ANegativeMethodOrStatusMatchesAny) {
  const Array table{Dictionary{{"key", "k"}, {"action", "remove"}, {"method", -7}, {"status", -1}}};
  EXPECT_FALSE(filtered(table, {{"_method", 9}, {"_status", 9}, {"k", 1}}).contains("k"));
}

TEST_F(EventFiltersTest, ARecordWithoutMethodAndStatusCountsAsZero) {
  const Array table{Dictionary{{"key", "k"}, {"action", "remove"}, {"method", 0}, {"status", 0}}};
  EXPECT_FALSE(filtered(table, {{"k", 1}}).contains("k"));
  EXPECT_TRUE(filtered(table, {{"_method", 1}, {"k", 1}}).contains("k"));
  EXPECT_TRUE(filtered(table, {{"_status", 1}, {"k", 1}}).contains("k"));
}

TEST_F(EventFiltersTest, TheFirstMatchingFilterDecides) {
  EXPECT_TRUE(filtered({Dictionary{{"key", "a"}}, filter("a", "remove")}, {{"a", 1}}).contains("a"));
  EXPECT_FALSE(filtered({filter("a", "remove"), Dictionary{{"key", "a"}}}, {{"a", 1}}).contains("a"));
}

TEST_F(EventFiltersTest, AFilterForAnotherMethodDoesNotShadowALaterOne) {
  const Array table{Dictionary{{"key", "a"}, {"method", 3}}, filter("a", "remove")};
  EXPECT_FALSE(filtered(table, {{"_method", 4}, {"a", 1}}).contains("a"));
}

TEST_F(EventFiltersTest, ActionsAreComparedWithCase) {
  EXPECT_TRUE(filtered({filter("a", "Remove")}, {{"a", 1}}).contains("a"));
  EXPECT_EQ(filtered({filter("a", "SHA256")}, {{"a", "x"}}), (Dictionary{{"a", "x"}}));
}

TEST_F(EventFiltersTest, KeysOfAnyAlphabetAreComparedWithoutCase) {
  EXPECT_TRUE(filtered({filter("Größe", "remove")}, {{"GRÖßE", 1}}).empty());
  EXPECT_TRUE(filtered({filter("địa chỉ", "remove")}, {{"ĐỊA CHỈ", 1}}).empty());
  EXPECT_TRUE(filtered({filter("ĐỊA CHỈ", "remove")}, {{"địa chỉ", 1}}).empty());
}

// The Kelvin sign is a k of three bytes, the long s one of two, Ⱥ is one byte shorter than ⱥ.
TEST_F(EventFiltersTest, KeysThatTakeOtherNumbersOfBytesAreTheSameToo) {
  for (const char* key : {"to\u212Aen", "TO\u212AEN", "token", "TOKEN"})
    EXPECT_TRUE(filtered({filter("Token", "remove")}, {{key, 1}}).empty()) << key;
  for (const char* key : {"\u017Fecret", "SECRET"})
    EXPECT_TRUE(filtered({filter("secret", "remove")}, {{key, 1}}).empty()) << key;
  for (const char* key : {"di\u017Fk", "dis\u212A", "di\u017F\u212A", "DISK"})
    EXPECT_TRUE(filtered({filter("disk", "remove")}, {{key, 1}}).empty()) << key;
  for (const char* key : {"\u023A", "\u2C65"}) {
    EXPECT_TRUE(filtered({filter("\u023A", "remove")}, {{key, 1}}).empty()) << key;
    EXPECT_TRUE(filtered({filter("\u2C65", "remove")}, {{key, 1}}).empty()) << key;
  }
  EXPECT_FALSE(filtered({filter("disk", "remove")}, {{"dik", 1}}).empty());
}

TEST_F(EventFiltersTest, ChangesTheValueOfTheMethodOnlyAfterReadingIt) {
  const Array table{Dictionary{{"key", "_method"}, {"action", "remove"}},
                    Dictionary{{"key", "k"}, {"action", "remove"}, {"method", 5}}};
  EXPECT_TRUE(filtered(table, {{"_method", 5}, {"k", 1}}).empty());
}

TEST_F(EventFiltersTest, HashesTheTextOfWhatIsNoString) {
  const std::byte bytes[] = {std::byte{0x0A}, std::byte{0xFF}};
  const Dictionary event{{"a", 17},        {"b", 1.5},         {"c", true},
                         {"d", Date{2.5}}, {"e", Data(bytes)}, {"f", 18446744073709551615u}};
  Array table;
  for (const DictionaryEntry& entry : event) table.append(Value(filter(entry.key.c_str(), "sha256")));
  EXPECT_EQ(filtered(table, event), (Dictionary{{"a", "#17"},
                                                {"b", "#1.5"},
                                                {"c", "#1"},
                                                {"d", "#2.5"},
                                                {"e", "#0aff"},
                                                {"f", "#18446744073709551615"}}));
}

TEST_F(EventFiltersTest, RemovesWhatCannotBeHashed) {
  const Array table{filter("a", "sha256"), filter("b", "sha256"), filter("c", "sha256")};
  EXPECT_TRUE(filtered(table, {{"a", Array{1}}, {"b", Dictionary{{"x", 1}}}, {"c", Value()}}).empty());
}

TEST_F(EventFiltersTest, AnEmptyArrayLeavesTheEarlierTableInForce) {
  filters_.createFiltersFromArray({filter("a", "remove")});
  filters_.createFiltersFromArray({});
  EXPECT_EQ(filters_.numberOfFilters(), 1);
  Dictionary event{{"a", 1}};
  filters_.filterEvent(event, digest_);
  EXPECT_TRUE(event.empty());
}

TEST_F(EventFiltersTest, ALaterTableReplacesTheEarlierOne) {
  filters_.createFiltersFromArray({filter("a", "remove"), filter("b", "remove")});
  EXPECT_TRUE(filtered({filter("c", "remove")}, {{"a", 1}, {"c", 1}}).contains("a"));
  EXPECT_EQ(filters_.numberOfFilters(), 1);
}

TEST_F(EventFiltersTest, ElementsThatAreNoFiltersAreAboutNoKey) {
  const Array table{Value(5), Dictionary{{"action", "remove"}}, Dictionary{{"key", 7}, {"action", "remove"}}};
  EXPECT_EQ(filtered(table, {{"", 1}, {"7", 2}}), (Dictionary{{"", 1}, {"7", 2}}));
  EXPECT_EQ(filters_.numberOfFilters(), 3);
}

TEST_F(EventFiltersTest, AnEmptyKeyIsAKeyLikeAnyOther) {
  EXPECT_EQ(filtered({filter("", "remove")}, {{"", 1}, {"k", 2}}), (Dictionary{{"k", 2}}));
}

TEST_F(EventFiltersTest, FindsKeysOfEveryLength) {
  const std::string longKey(200, 'K');
  const std::string folded(200, 'k');
  EXPECT_TRUE(filtered({filter(folded.c_str(), "remove")}, {{String(longKey), 1}}).empty());
}

TEST_F(EventFiltersTest, WithoutATableNothingChanges) {
  Dictionary event{{"a", 1}};
  filters_.filterEvent(event, digest_);
  EXPECT_EQ(event.size(), 1u);
}

TEST(ListMatch, AnEmptyOrMissingListAnswersTheWhitelistArgument) {
  const String text("x");
  const Array empty;
  for (const bool whitelist : {true, false}) {
    EXPECT_EQ(matchExactStringWithList(nullptr, &text, whitelist), whitelist);
    EXPECT_EQ(matchExactStringWithList(&empty, nullptr, whitelist), whitelist);
    EXPECT_EQ(matchStringWithList(nullptr, nullptr, whitelist), whitelist);
    EXPECT_EQ(matchStringWithList(&empty, &text, whitelist), whitelist);
  }
}

TEST(ListMatch, AMissingStringFailsAWhitelistAndIsCaughtByABlacklist) {
  const Array list{"x"};
  EXPECT_FALSE(matchExactStringWithList(&list, nullptr, true));
  EXPECT_TRUE(matchExactStringWithList(&list, nullptr, false));
  EXPECT_FALSE(matchStringWithList(&list, nullptr, true));
  EXPECT_TRUE(matchStringWithList(&list, nullptr, false));
}

TEST(ListMatch, SearchesTheElementInTheString) {
  const Array list{"eu", "US"};
  const String region("us-east");
  EXPECT_TRUE(matchStringWithList(&list, &region, true));
  EXPECT_FALSE(matchExactStringWithList(&list, &region, true));
  const String country("us");
  EXPECT_TRUE(matchExactStringWithList(&list, &country, false));
  const String shorter("u");
  EXPECT_FALSE(matchStringWithList(&list, &shorter, false));
}

TEST(ListMatch, AnEmptyElementMatchesNothing) {
  const Array list{"", Value(5)};
  const String text("5");
  const String empty;
  EXPECT_FALSE(matchStringWithList(&list, &text, true));
  EXPECT_FALSE(matchExactStringWithList(&list, &empty, true));
}

}  // namespace
}  // namespace kyt
