#include "platform/base/BookRows.h"

#include <algorithm>
#include <map>
#include <set>
#include <string>
#include <utility>

namespace kyt {

void addFigures(BookRow& sum, const BookRow& row) {
  for (uint64_t BookRow::*figure : {&BookRow::taken, &BookRow::queued, &BookRow::batched, &BookRow::inFlight,
                                    &BookRow::waiting, &BookRow::outbox, &BookRow::delivered})
    sum.*figure += row.*figure;
  for (size_t i = 0; i < sum.dropped.size(); ++i) sum.dropped[i] += row.dropped[i];
}

std::vector<BookRow> withFewerRows(std::vector<BookRow> rows, size_t mostOfUser) {
  std::map<uint32_t, size_t> counts;
  for (const BookRow& row : rows) ++counts[row.program.user];
  const bool isEnough =
      std::all_of(counts.begin(), counts.end(), [&](const auto& user) { return user.second <= mostOfUser; });
  if (isEnough) return rows;
  std::vector<BookRow> fewer;
  std::map<std::pair<uint32_t, bool>, size_t> sums;  // where each is in `fewer`
  std::map<std::pair<uint32_t, bool>, std::set<ReportingProgram>> programs;
  for (BookRow& row : rows) {
    if (counts[row.program.user] <= mostOfUser) {
      fewer.push_back(std::move(row));
      continue;
    }
    const std::pair whose(mostOfUser == 0 ? kAllUsers : row.program.user, row.isInternal);
    const auto [place, isFirst] = sums.try_emplace(whose, fewer.size());
    if (isFirst) {
      BookRow& sum = fewer.emplace_back();
      sum.program = {whose.first, 0, std::string(kOtherPrograms), ""};
      sum.backEnd = kOtherPrograms;
      sum.isInternal = row.isInternal;
    }
    BookRow& sum = fewer[place->second];
    addFigures(sum, row);
    if (row.programsMerged != 0)
      sum.programsMerged += row.programsMerged;
    else if (programs[whose].insert(row.program).second)
      ++sum.programsMerged;
  }
  return fewer;
}

}  // namespace kyt
