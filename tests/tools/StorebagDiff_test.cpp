#include "tools/StorebagDiff.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace kyt::tools {
namespace {

using Lines = std::vector<std::string>;

Dictionary client(const Dictionary& further = {}) {
  Dictionary entry{{"client", "a"}, {"sampling_threshold", 0.1}, {"locale_whitelist", Array{"DE", "FR"}}};
  entry.merge(further);
  return entry;
}

Dictionary bagOf(const Array& clients, const Dictionary& further = {}) {
  Dictionary bag{{"version", "1"}, {"release", Dictionary{{"httppost", Dictionary{{"clients", clients}}}}}};
  bag.merge(further);
  return bag;
}

const std::string kWhere = "release, httppost, client \"a\", ";

TEST(StorebagDiff, HasNothingToSayOfTheSameBag) {
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client()})), Lines{});
}

TEST(StorebagDiff, TellsWhatAChangedRuleMeans) {
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client({{"sampling_threshold", 0.25}})})),
            Lines{kWhere +
                  "sampling_threshold: 0.1 becomes 0.25 (about 26 of 100 sessions report, before about 11 of "
                  "100 sessions report)"});
  Dictionary silent = client();
  silent.remove("sampling_threshold");
  EXPECT_EQ(
      storebagChanges(bagOf({client()}), bagOf({silent})),
      Lines{kWhere + "sampling_threshold: is gone, it was 0.1 (sessions that require user information send "
                     "nothing)"});
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client()}, {{"refresh_cycle", 600}, {"version", "2"}})),
            (Lines{"version: \"1\" becomes \"2\"",
                   "refresh_cycle: is new, 600 (devices ask again after 600 seconds)"}));
}

TEST(StorebagDiff, TellsWhatListsGainAndLose) {
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client({{"locale_whitelist", Array{"FR", "US"}}})})),
            Lines{kWhere + "locale_whitelist: adds \"US\", takes away \"DE\""});
  const Array before{Dictionary{{"key", "email"}, {"action", "remove"}}};
  const Array after{Dictionary{{"key", "email"}, {"action", "remove"}},
                    Dictionary{{"key", "account"}, {"action", "sha256"}, {"method", 3}}};
  EXPECT_EQ(storebagChanges(bagOf({client({{"filters", before}})}), bagOf({client({{"filters", after}})})),
            Lines{kWhere + "filters: adds sha256 \"account\", method 3"});
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client({{"locale_whitelist", Array{}}})})),
            Lines{kWhere +
                  "locale_whitelist: takes away \"DE\"; \"FR\" (sessions that require user information send "
                  "nothing)"});
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client({{"locale_whitelist", Array{"FR", "DE"}}})})),
            Lines{kWhere + "locale_whitelist: the order becomes \"FR\"; \"DE\""});
}

TEST(StorebagDiff, TellsOfEntriesByWhomTheyAreForAndOfTheirOrder) {
  const Dictionary b{{"client", "b"}, {"service", "s"}, {"enabledSince", "2.0.0"}};
  EXPECT_EQ(storebagChanges(bagOf({client()}), bagOf({client(), b})),
            Lines{"release, httppost, client \"b\", service \"s\", since \"2.0.0\": is new at place 2 of 2"});
  EXPECT_EQ(
      storebagChanges(bagOf({client(), b}), bagOf({b})),
      Lines{
          "release, httppost, client \"a\": is gone (the next entry that fits governs its sessions, if there is "
          "one)"});
  EXPECT_EQ(
      storebagChanges(bagOf({client(), b}), bagOf({b, client()})),
      Lines{
          "release, httppost, the order becomes client \"b\", service \"s\", since \"2.0.0\"; client \"a\" (the "
          "first entry that fits governs a session)"});
  const Dictionary everybody{{"post_url", "https://x/1"}}, again{{"post_url", "https://x/2"}};
  EXPECT_EQ(
      storebagChanges(bagOf({everybody, everybody}), bagOf({everybody, again})),
      Lines{
          "release, httppost, client any (its entry 2), post_url: \"https://x/1\" becomes \"https://x/2\""});
}

TEST(StorebagDiff, TellsOfBackEndsAndSections) {
  const Dictionary before{{"release", Dictionary{{"qrs", Dictionary{{"clients", Array{}}}}}},
                          {"seed", Dictionary{}}};
  const Dictionary after{{"release", Dictionary{{"dashboard", Dictionary{{"ip", "10.0.0.1"}}}}}};
  EXPECT_EQ(storebagChanges(before, after),
            (Lines{"release, dashboard: the back end is new", "release, dashboard, ip: is new, \"10.0.0.1\"",
                   "release, qrs: the back end is gone", "seed: the section is gone"}));
}

TEST(StorebagDiff, TakesWhateverStandsInABag) {
  const Array odd{Value("no entry"), Value(3), Value(Dictionary{{"client", 7}})};
  EXPECT_EQ(storebagChanges(bagOf(odd), bagOf(odd)), Lines{});
  EXPECT_FALSE(storebagChanges(bagOf(odd), {{"release", "text"}}).empty());
  EXPECT_FALSE(storebagChanges({{"release", Dictionary{{"httppost", 3}}}}, bagOf(odd)).empty());
}

}  // namespace
}  // namespace kyt::tools
