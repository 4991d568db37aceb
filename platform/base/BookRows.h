// Rows of the books, added up for readers who have no room for all of them. No state; any thread.
#pragma once

#include <cstddef>
#include <vector>

#include "platform/base/Books.h"

namespace kyt {

// Adds the figures of a row to those of another.
void addFigures(BookRow& sum, const BookRow& row);

// The rows in their order, but of each user with more than so many rows one (and one of the daemon's own messages), named as
// the row "other" of the books, which adds up all of them; with 0 all users share one. So nothing is missing from the sums.
[[nodiscard]] std::vector<BookRow> withFewerRows(std::vector<BookRow> rows, size_t mostOfUser);

}  // namespace kyt
