// What the sources share that read the journal: it follows the entries that a program asked for, sums them up, and hands
// the sum over once a period. One thread.
//
// What is read and not delivered is read again after a restart, from the state's position on, so nothing is lost; what
// was delivered is not told again. A report that the daemon was given and did not take whole is tried again as it is, under
// its number, over a restart too; what is found meanwhile is the next one's. After a hard end (a power cut, a kill) between
// the handing over and the word of it in the state file a report comes once more, with the same number and at least the
// same contents.
#pragma once

#include <chrono>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "sources/Delivery.h"
#include "sources/Journal.h"
#include "sources/State.h"
#include "sources/Summary.h"

namespace kyt::sources {

// One thing found in an entry, told apart from others by its fields.
struct Finding {
  uint32_t type = 0;
  Dictionary fields;
};
using FieldReader = std::function<std::string(const char* name)>;
using Finder = std::function<std::optional<Finding>(const FieldReader& field)>;
using Deliver = std::function<Handover(const std::vector<SourceEvent>&)>;

class Follower {
 public:
  struct Options {
    std::string stateFile;
    uint32_t category = 0;
    // Processor time of one look. What it leaves is read at the next one.
    std::chrono::microseconds lookBudget = std::chrono::milliseconds(25);
    // A look that is behind by more goes on at the present, and counts what it passed over.
    std::chrono::seconds mostBehind = std::chrono::minutes(15);
  };
  // `now` is in microseconds since 1970. Without a state file it begins at the present.
  Follower(Journal& journal, Options options, Finder finder, Deliver deliver, std::function<uint64_t()> now);

  void look();
  // Whether the last look left entries unread.
  [[nodiscard]] bool isBehind() const { return behind_; }
  [[nodiscard]] bool hasFindings() const { return begun_ || !summary_.empty(); }
  // Whether all was taken. What was not waits, and grows by no more than the summary's bounds.
  [[nodiscard]] bool report();
  // What was found in the place of a state; empty: nothing, or one.
  [[nodiscard]] const std::string& startProblem() const { return startProblem_; }
  // Why the state could not be written, last; empty: it could.
  [[nodiscard]] const std::string& stateProblem() const { return stateProblem_; }

 private:
  // A report of which the daemon was given something: the events that it has not said to have taken.
  struct Begun {
    std::vector<SourceEvent> events;
    std::string until;  // the position that its taking reaches
  };
  void begin();
  [[nodiscard]] bool goToPosition();
  void take();
  void goToThePresent();
  // Whether what is read was read before, for a report that an earlier run began.
  [[nodiscard]] bool isReadingAgain() const { return !state_.until.empty() && !begun_; }
  [[nodiscard]] bool isPastWhatWasBegun() const;
  void closeWhatWasBegun();
  [[nodiscard]] bool reportBegun();
  [[nodiscard]] bool settle(const std::vector<bool>& taken);
  void writeDown();

  Journal& journal_;
  const Options options_;
  const Finder finder_;
  const Deliver deliver_;
  const std::function<uint64_t()> now_;
  Summary summary_;
  std::optional<Begun> begun_;
  State state_;       // as in the file
  std::string read_;  // the position that was read to
  std::string startProblem_, stateProblem_;
  std::optional<CursorPlace> unreadFrom_;  // entries from here to the next one that is read count as unread
  bool behind_ = false;
};

}  // namespace kyt::sources
