#include "bench/Rows.h"

#include <algorithm>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>

namespace kyt::bench {

namespace {

std::vector<RowName> makeRows() {
  std::vector<RowName> made;
  for (const Posting& posting : postingRows()) {
    made.push_back({"posting", "processor time: " + posting.name()});
    made.push_back({"posting", "rate, memory: " + posting.name()});
  }
  for (const size_t fields : fieldRows()) made.push_back({"fields", nameOfFields(fields)});
  for (const Posting& posting : quietRows()) made.push_back({"quiet", "5,000 a second: " + posting.name()});
  for (const Crowd& crowd : tlsRows()) made.push_back({"tls", crowd.name()});
  for (const char* what : {rows::kBusy, rows::kBusyEach}) made.push_back({"busy", what});
  for (const char* what : {rows::kBatched, rows::kBatchedMemory}) made.push_back({"batching", what});
  for (const char* what : {rows::kSend, rows::kClient}) made.push_back({"client", what});
  for (const char* what : {rows::kWakeUps, rows::kIdleAnonymous, rows::kIdleResident, rows::kAfterFirst,
                           rows::kIdleSession, rows::kCrowd})
    made.push_back({"idle", what});
  made.push_back({"end", rows::kEnd});
  for (const char* what : {rows::kOutboxOn, rows::kDeafWatcher}) made.push_back({"beside", what});
  return made;
}

}  // namespace

std::string Posting::name() const {
  return text("%s, consent %s, %zu client%s, batches of %d", ordinary ? "ordinary events" : "random digits",
              consent ? "given" : "off", clients, clients == 1 ? "" : "s", batch);
}

std::string Crowd::name() const {
  return text("TLS, %zu sessions, batches of %d", sessions, batch);
}

std::string nameOfFields(size_t fields) {
  return text("%zu field%s, consent off, 1 client, batches of 1000", fields, fields == 1 ? "" : "s");
}

std::vector<Posting> postingRows() {
  std::vector<Posting> made;
  for (const bool ordinary : {false, true})
    for (const bool consent : {false, true})
      for (const size_t clients : {1u, 4u})
        made.push_back({ordinary, consent, ordinary ? 1000 : 50, clients});
  return made;
}

std::vector<Posting> quietRows() {
  return {{false, false, 50, 4}, {true, false, 1000, 4}, {true, true, 1000, 4}};
}

std::vector<Crowd> tlsRows() {
  return {{64, 50}, {64, 1000}, {1000, 50}, {1000, 1000}};
}

std::vector<size_t> fieldRows() {
  return {1, 10, 50, 200};
}

const std::vector<RowName>& allRows() {
  static const std::vector<RowName> kRows = makeRows();
  return kRows;
}

void printRow(const std::string& what, const std::string& figure, const std::string& reference,
              const std::string& goal, std::optional<bool> reached) {
  const auto& all = allRows();
  if (std::none_of(all.begin(), all.end(), [&what](const RowName& row) { return row.what == what; }))
    std::abort();
  std::printf("%-72s | %-32s | %-44s | %-18s | %s\n", what.c_str(), figure.c_str(), reference.c_str(),
              goal.c_str(),
              !reached   ? ""
              : *reached ? "reached"
                         : "MISSED");
  std::fflush(stdout);
}

std::string text(const char* format, ...) {
  char buffer[256];
  va_list arguments;
  va_start(arguments, format);
  std::vsnprintf(buffer, sizeof buffer, format, arguments);
  va_end(arguments);
  return buffer;
}

}  // namespace kyt::bench
