#include "sources/Journal.h"

#include <systemd/sd-journal.h>

#include <charconv>
#include <cstdlib>
#include <system_error>

namespace kyt::sources {

std::variant<std::unique_ptr<Journal>, std::string> Journal::open(const Options& options) {
  sd_journal* opened = nullptr;
  const int status =
      options.folder.empty()
          ? sd_journal_open(&opened, SD_JOURNAL_LOCAL_ONLY | (options.systemAlone ? SD_JOURNAL_SYSTEM : 0))
          : sd_journal_open_directory(&opened, options.folder.c_str(), 0);
  if (status < 0) return "can't open the journal: " + std::generic_category().message(-status);
  std::unique_ptr<Journal> journal(new Journal(opened));
  for (const std::string& match : options.matches)
    if (const int error = sd_journal_add_match(opened, match.data(), match.size()); error < 0)
      return "can't look for " + match + ": " + std::generic_category().message(-error);
  sd_journal_set_data_threshold(opened, kMostBytes);
  // Asked for now, so that nothing written from here on goes unnoticed.
  if (sd_journal_get_fd(opened) < 0) return "can't watch the journal";
  return journal;
}

Journal::~Journal() {
  sd_journal_close(journal_);
}

bool Journal::goAfter(const std::string& cursor) {
  if (sd_journal_seek_cursor(journal_, cursor.c_str()) < 0) return false;
  skipped_ = cursor;
  return true;
}

void Journal::goToTime(uint64_t microseconds) {
  skipped_.clear();
  sd_journal_seek_realtime_usec(journal_, microseconds);
}

bool Journal::next() {
  if (sd_journal_next(journal_) <= 0) return false;
  if (skipped_.empty()) return true;
  const bool isThatOne = sd_journal_test_cursor(journal_, skipped_.c_str()) > 0;
  skipped_.clear();
  return !isThatOne || sd_journal_next(journal_) > 0;
}

void Journal::goToEnd() {
  skipped_.clear();
  sd_journal_seek_tail(journal_);
}

bool Journal::previous() {
  return sd_journal_previous(journal_) > 0;
}

std::vector<std::string> Journal::valuesOf(const char* name) const {
  std::vector<std::string> values;
  if (sd_journal_query_unique(journal_, name) < 0) return values;
  const void* data = nullptr;
  size_t size = 0;
  while (sd_journal_enumerate_unique(journal_, &data, &size) > 0) {
    const std::string_view text(static_cast<const char*>(data), size);
    const size_t equals = text.find('=');
    if (equals != std::string_view::npos) values.emplace_back(text.substr(equals + 1));
  }
  return values;
}

std::string Journal::field(const char* name) const {
  const void* data = nullptr;
  size_t size = 0;
  if (sd_journal_get_data(journal_, name, &data, &size) < 0) return {};
  const std::string_view text(static_cast<const char*>(data), size);
  const size_t equals = text.find('=');
  return equals == std::string_view::npos ? std::string() : std::string(text.substr(equals + 1, kMostBytes));
}

uint64_t Journal::microseconds() const {
  uint64_t time = 0;
  return sd_journal_get_realtime_usec(journal_, &time) < 0 ? 0 : time;
}

std::string Journal::cursor() const {
  char* text = nullptr;
  if (sd_journal_get_cursor(journal_, &text) < 0) return {};
  std::string cursor(text);
  std::free(text);
  return cursor;
}

std::optional<uint64_t> Journal::oldest() const {
  uint64_t from = 0;
  if (sd_journal_get_cutoff_realtime_usec(journal_, &from, nullptr) <= 0) return std::nullopt;
  return from;
}

int Journal::descriptor() const {
  return sd_journal_get_fd(journal_);
}

void Journal::takeNews() {
  sd_journal_process(journal_);
}

std::optional<CursorPlace> placeOf(std::string_view cursor) {
  CursorPlace place;
  for (std::string_view rest = cursor; !rest.empty();) {
    const std::string_view part = rest.substr(0, rest.find(';'));
    rest.remove_prefix(std::min(rest.size(), part.size() + 1));
    if (part.size() < 3 || part[1] != '=') continue;
    const std::string_view value = part.substr(2);
    if (part[0] == 's') place.numbering = value;
    uint64_t* const number =
        part[0] == 'i' ? &place.number : (part[0] == 't' ? &place.microseconds : nullptr);
    if (number == nullptr) continue;
    if (std::from_chars(value.data(), value.data() + value.size(), *number, 16).ec != std::errc())
      return std::nullopt;
  }
  if (place.numbering.empty() || place.number == 0 || place.microseconds == 0) return std::nullopt;
  return place;
}

}  // namespace kyt::sources
