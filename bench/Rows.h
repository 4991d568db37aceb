// The rows that kyt_bench_daemon prints: what was measured, the figure, what it stands beside, the goal. The list of all
// rows is made before anything is measured, so that `--list` and the tests know them.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace kyt::bench {

struct RowName {
  std::string group;  // what --only takes
  std::string what;
};
// Every row, in the order in which they are printed.
[[nodiscard]] const std::vector<RowName>& allRows();

// Ends the program when the row is none of the list. `reached` is none where there is no goal.
void printRow(const std::string& what, const std::string& figure, const std::string& reference,
              const std::string& goal, std::optional<bool> reached);
[[nodiscard]] std::string text(const char* format, ...) __attribute__((format(printf, 1, 2)));

// What is posted in one row of the whole daemon.
struct Posting {
  bool ordinary = true;  // the corpus of ordinary events, or that of random digits
  bool consent = false;  // the owner's: readable texts go to the message log
  int batch = 1000;      // events of a post
  size_t clients = 1;
  [[nodiscard]] std::string name() const;
};
[[nodiscard]] std::vector<Posting> postingRows();
[[nodiscard]] std::vector<Posting> quietRows();

struct Crowd {
  size_t sessions = 64;
  int batch = 50;
  [[nodiscard]] std::string name() const;
};
[[nodiscard]] std::vector<Crowd> tlsRows();
[[nodiscard]] std::vector<size_t> fieldRows();
[[nodiscard]] std::string nameOfFields(size_t fields);

namespace rows {
inline constexpr char kBusy[] = "1000 busy sessions, batches of 50";
inline constexpr char kBusyEach[] = "a busy session, growth over 1000";
inline constexpr char kBatched[] = "one batched event, socket to batch, system calls included";
inline constexpr char kBatchedMemory[] = "memory of one batched event";
inline constexpr char kSend[] = "a client's sendMessage with a ready dictionary";
inline constexpr char kClient[] = "a client's processor time, its library's thread included";
inline constexpr char kWakeUps[] = "idle daemon: wake-ups in 5 s";
inline constexpr char kIdleAnonymous[] = "idle daemon: anonymous memory";
inline constexpr char kIdleResident[] = "idle daemon: resident before the first session";
inline constexpr char kAfterFirst[] = "resident after the first session";
inline constexpr char kIdleSession[] = "an idle configured session, growth";
inline constexpr char kEnd[] = "the daemon's end, with half as many sessions again as in the idle rows";
inline constexpr char kOutboxOn[] = "the outbox on, with a server that answers";
inline constexpr char kDeafWatcher[] = "a watcher that reads nothing";
inline constexpr char kCrowd[] = "many sessions of which 10 speak";
}  // namespace rows

}  // namespace kyt::bench
