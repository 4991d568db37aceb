// How a test tells the dashboard feed to treat the acknowledgements of the next datagrams: to lose, delay,
// repeat, shorten or corrupt them. Any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Mutex.h"

namespace kyt::devserver {

struct AcknowledgementRule {
  enum class Action : uint8_t { lose, delay, repeat, corrupt, shorten };
  Action action = Action::lose;
  uint64_t times = 1;                     // for so many datagrams; 0: until it is taken back
  std::chrono::milliseconds delay{1000};  // of "delay"
  unsigned copies = 2;                    // of "repeat"
};

class AcknowledgementRules {
 public:
  // A rule from the JSON text that a test puts, or what is wrong with it.
  [[nodiscard]] static std::variant<AcknowledgementRule, std::string> parse(const std::string& json);

  void add(AcknowledgementRule rule) EXCLUDES(mutex_);
  void clear() EXCLUDES(mutex_);
  // The first rule, used up by one.
  [[nodiscard]] std::optional<AcknowledgementRule> take() EXCLUDES(mutex_);
  [[nodiscard]] std::string asJson() EXCLUDES(mutex_);

  [[nodiscard]] static const char* nameOf(AcknowledgementRule::Action action);

 private:
  Mutex mutex_;
  std::vector<AcknowledgementRule> rules_ GUARDED_BY(mutex_);
};

}  // namespace kyt::devserver
