// The manual page says what the program has: reasons, metrics, settings.
#include <gtest/gtest.h>

#include <fstream>
#include <iterator>
#include <regex>
#include <set>
#include <string>

#include "platform/fake/FakePostStore.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/MemoryLogSink.h"
#include "receiver/Metrics.h"
#include "tests/receiver/FakeLog.h"

namespace kyt::receiver {
namespace {

using Names = std::set<std::string>;

std::string textOf(const std::string& file) {
  std::ifstream in(KYT_SOURCE_DIR "/" + file);
  return {std::istreambuf_iterator<char>(in), {}};
}

Names matchesIn(const std::string& text, const std::string& expression) {
  const std::regex pattern(expression);
  Names found;
  for (std::sregex_iterator match(text.begin(), text.end(), pattern), end; match != end; ++match)
    found.insert((*match)[1]);
  return found;
}

// The items of a section of the page.
std::string itemsOf(const std::string& section) {
  const std::string page = textOf("packaging/man/kytreceiver.8");
  const size_t begin = page.find("\n.Sh " + section + "\n");
  const std::string text = page.substr(begin, page.find("\n.Sh ", begin + 1) - begin);
  std::string items;
  for (const std::string& line : matchesIn(text, "(\\.It [^\n]*)")) items += line + "\n";
  return items;
}

TEST(ManualOfTheReceiver, NamesEachReason) {
  Names reasons;
  for (size_t i = 0; i < static_cast<size_t>(Refusal::numberOfRefusals); ++i)
    reasons.insert(refusalName(static_cast<Refusal>(i)));
  EXPECT_EQ(reasons.size(), static_cast<size_t>(Refusal::numberOfRefusals));
  EXPECT_EQ(matchesIn(itemsOf("REASONS"), " ([a-z]+(?:-[a-z]+)*)"), reasons);
}

TEST(ManualOfTheReceiver, NamesEachMetric) {
  ManualClock clock;
  Figures figures;
  MemoryLogSink sink;
  Log lines(sink);
  FakeLog log;
  FakePostStore store(std::make_shared<FakePostStore::Disk>());
  Spool spool(store, 1000, clock, figures, lines);
  Delivery delivery(log, spool, clock, figures, lines, std::chrono::seconds(2));
  const std::string text = metricsText({figures, delivery, spool});
  const Names metrics = matchesIn(text, "# TYPE ([a-z_]+) ");
  EXPECT_GE(metrics.size(), 15U);
  EXPECT_EQ(matchesIn(itemsOf("METRICS"), "(kyt_[a-z_]+)"), metrics);
  EXPECT_TRUE(text.ends_with("# EOF\n"));
}

TEST(ManualOfTheReceiver, NamesEachSetting) {
  // As Settings.cpp asks for them.
  const Names keys =
      matchesIn(textOf("receiver/Settings.cpp"),
                "(?:text|path|count|word|seconds|find|address)\\((?:top, |section, )?\"([a-z_]+)\"");
  Names named;
  for (const std::string& name : matchesIn(itemsOf("SETTINGS"), "Ic ([a-z_.]+)"))
    named.insert(name.substr(name.find('.') + 1));
  Names expected = keys;
  for (const char* section : {"log", "spool", "limits"}) expected.erase(section);
  EXPECT_GE(expected.size(), 15U);
  EXPECT_EQ(named, expected);
}

}  // namespace
}  // namespace kyt::receiver
