#include "platform/base/BookRows.h"

#include <gtest/gtest.h>

#include <map>
#include <string>
#include <utility>
#include <vector>

namespace kyt {
namespace {

// Five programs of user 1 at two back ends each, with messages of the daemon's own, and one of user 2.
std::vector<BookRow> rows() {
  std::vector<BookRow> all;
  uint64_t number = 0;
  const auto add = [&](uint32_t user, const std::string& name, const char* backEnd, bool isInternal) {
    BookRow& row = all.emplace_back();
    row.program = {user, 7, name, "s"};
    row.backEnd = backEnd;
    row.isInternal = isInternal;
    for (uint64_t BookRow::*figure : {&BookRow::queued, &BookRow::batched, &BookRow::inFlight,
                                      &BookRow::waiting, &BookRow::outbox, &BookRow::delivered})
      row.taken += row.*figure = ++number;
    for (uint64_t& dropped : row.dropped) row.taken += dropped = ++number;
  };
  for (const char* name : {"a", "b", "c", "d", "e"})
    for (const char* backEnd : {"httppost", "qrs"}) add(1, name, backEnd, false);
  add(1, "a", "httppost", true);
  add(2, "a", "httppost", false);
  return all;
}

// Of the programs' events and of the daemon's own messages: each figure, added up.
std::map<bool, std::vector<uint64_t>> sums(const std::vector<BookRow>& all) {
  std::map<bool, std::vector<uint64_t>> sums;
  for (const BookRow& row : all) {
    std::vector<uint64_t> figures = {row.taken,   row.queued, row.batched,  row.inFlight,
                                     row.waiting, row.outbox, row.delivered};
    figures.insert(figures.end(), row.dropped.begin(), row.dropped.end());
    auto& sum = sums[row.isInternal];
    sum.resize(figures.size());
    for (size_t i = 0; i < figures.size(); ++i) sum[i] += figures[i];
  }
  return sums;
}

TEST(WithFewerRows, NothingIsMissingFromTheSums) {
  for (size_t most = 0; most < 14; ++most) EXPECT_EQ(sums(withFewerRows(rows(), most)), sums(rows())) << most;
}

TEST(WithFewerRows, AUserWithNoMoreThanThatKeepsAll) {
  EXPECT_EQ(withFewerRows(rows(), 11).size(), rows().size());
  const std::vector<BookRow> fewer = withFewerRows(rows(), 10);
  ASSERT_EQ(fewer.size(), 3U);
  EXPECT_EQ(fewer[0].program, (ReportingProgram{1, 0, "other", ""}));
  EXPECT_EQ(fewer[0].backEnd, "other");
  EXPECT_FALSE(fewer[0].isInternal);
  EXPECT_EQ(fewer[0].programsMerged, 5U) << "each once, however many back ends it has";
  EXPECT_TRUE(fewer[1].isInternal);
  EXPECT_EQ(fewer[1].programsMerged, 1U);
  EXPECT_EQ(fewer[2].program, (ReportingProgram{2, 7, "a", "s"}));
  EXPECT_EQ(fewer[2].programsMerged, 0U);
}

TEST(WithFewerRows, AllUsersShareOneInTheEnd) {
  const std::vector<BookRow> fewer = withFewerRows(rows(), 0);
  ASSERT_EQ(fewer.size(), 2U);
  EXPECT_EQ(fewer[0].program.user, kAllUsers);
  EXPECT_EQ(fewer[0].programsMerged, 6U);
}

TEST(WithFewerRows, ProgramsThatWereMergedBeforeStayCounted) {
  std::vector<BookRow> all = rows();
  BookRow& other = all.emplace_back();
  other.program = {1, 0, "other", ""};
  other.backEnd = "other";
  other.programsMerged = 40;
  EXPECT_EQ(withFewerRows(all, 1)[0].programsMerged, 45U);
}

}  // namespace
}  // namespace kyt
