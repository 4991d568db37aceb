// The entries of the system's journal that a source asked for, in order. One thread.
//
// Entries are found by the journal's own index: those of others are passed over unread, however many there are.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

struct sd_journal;

namespace kyt::sources {

class Journal {
 public:
  struct Options {
    std::string folder;                // of journal files; empty: those of this machine
    bool systemAlone = true;           // without the journals of single users
    std::vector<std::string> matches;  // "FIELD=value": any of one field, and one of each field
  };
  // The journal, or why it cannot be read.
  [[nodiscard]] static std::variant<std::unique_ptr<Journal>, std::string> open(const Options& options);
  ~Journal();
  Journal(const Journal&) = delete;
  Journal& operator=(const Journal&) = delete;

  // The next entry is the first one after the cursor's, which may be gone. False: this is no cursor.
  [[nodiscard]] bool goAfter(const std::string& cursor);
  // The next entry is the first one of that time, in microseconds since 1970, or later.
  void goToTime(uint64_t microseconds);
  // Goes to the next entry. False: there is none (yet).
  [[nodiscard]] bool next();
  // previous() then goes to the last entry, and on to those before it. False: there is none.
  void goToEnd();
  [[nodiscard]] bool previous();

  // Of the entry that was gone to. At most kMostBytes of a field; empty: it has none.
  static constexpr size_t kMostBytes = 1024;
  [[nodiscard]] std::string field(const char* name) const;
  [[nodiscard]] uint64_t microseconds() const;  // since 1970
  [[nodiscard]] std::string cursor() const;

  // Each value once that a field has in any entry, in no order; the matches count for nothing here.
  [[nodiscard]] std::vector<std::string> valuesOf(const char* name) const;
  // The time of the oldest entry of anyone that is still there, in microseconds since 1970.
  [[nodiscard]] std::optional<uint64_t> oldest() const;
  // Readable when something may have been written; then takeNews() before the next look.
  [[nodiscard]] int descriptor() const;
  void takeNews();

 private:
  explicit Journal(sd_journal* journal) : journal_(journal) {}
  sd_journal* const journal_;
  std::string skipped_;  // a cursor whose own entry is not to be told again
};

// What a cursor says about its entry: its number in the journal, and the numbering that this belongs to.
struct CursorPlace {
  std::string numbering;
  uint64_t number = 0, microseconds = 0;
};
[[nodiscard]] std::optional<CursorPlace> placeOf(std::string_view cursor);

}  // namespace kyt::sources
