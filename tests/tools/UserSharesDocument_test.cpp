// What SECURITY says of the users' shares is what the daemon has.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

constexpr uint64_t kMiB = 1u << 20, kGiB = 1u << 30;

// The cells of each row of the table below that heading, without the blanks around them.
std::vector<std::vector<std::string>> tableBelow(const std::string& heading) {
  std::vector<std::vector<std::string>> rows;
  bool below = false;
  for (const std::string& line : linesOf(textOf("docs/SECURITY.md"))) {
    if (line.starts_with("## ")) below = line == "## " + heading;
    if (!below || !line.starts_with("| ")) continue;
    std::vector<std::string> cells;
    for (size_t at = 1; at < line.size();) {
      const size_t end = line.find('|', at);
      if (end == std::string::npos) break;
      cells.push_back(line.substr(at + 1, end - at - 2));
      at = end + 1;
    }
    rows.push_back(cells);
  }
  return rows;
}

std::string withCommas(uint64_t number) {
  std::string text = std::to_string(number);
  for (size_t at = text.size(); at > 3; at -= 3) text.insert(at - 3, ",");
  return text;
}

// With so much memory and so many descriptors that a part of them is seen to be one.
std::string mostOf(const ShareRow& row) {
  const UserShares shares = UserShares::of(Limits(), 80 * kMiB, 4000);
  const UserShares ofALargeMachine = UserShares::of(Limits(), 1024 * kGiB, 4000);
  const uint64_t most = shares[row.share], atMost = ofALargeMachine[row.share];
  const bool isBytes = row.unit == std::string("bytes");
  const auto number = [&](uint64_t value) {
    if (!isBytes) return withCommas(value);
    return value % kGiB == 0 ? std::to_string(value / kGiB) + " GiB" : std::to_string(value / kMiB) + " MiB";
  };
  if (most == atMost && most != 1000) return number(most);
  if (most == 1000) return "a quarter of the limit";
  return (most == 10 * kMiB ? "an eighth of the memory, at most " : "another part, at most ") +
         number(atMost);
}

TEST(UserSharesDocument, HasEachShareWithItsUnitItsMostAndItsSetting) {
  const auto rows = tableBelow("What one user may hold");
  ASSERT_EQ(rows.size(), kShareRows.size() + 1) << "a heading and the shares";
  for (size_t i = 0; i < kShareRows.size(); ++i) {
    const ShareRow& row = kShareRows[i];
    const std::vector<std::string>& cells = rows[i + 1];
    EXPECT_EQ(static_cast<size_t>(row.share), i) << row.name;
    ASSERT_EQ(cells.size(), 6u) << row.name;
    EXPECT_EQ(cells[0], row.name);
    EXPECT_EQ(cells[1], row.unit) << row.name;
    EXPECT_EQ(cells[2], mostOf(row)) << row.name;
    const std::string setting = row.setting;
    EXPECT_EQ(cells[3], setting.empty() ? "–" : "`" + setting + "`") << row.name;
    if (setting.empty()) continue;
    EXPECT_NE(textOf("packaging/man/kytreportingd.toml.5").find(setting), std::string::npos) << setting;
  }
}

}  // namespace
}  // namespace kyt
