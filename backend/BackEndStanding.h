// How a back end stands, for whoever looks from outside: published by it as it goes, in single numbers, so that a reader waits
// for nobody and nobody for a reader. A reader may see one number a moment before another that was changed with it.
//
// The back end, its posts and the session's standing share it; it says what was last when the back end is gone.
#pragma once

#include <array>
#include <atomic>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>

namespace kyt {

// What decided a back end's state.
enum class StateRule : uint8_t {
  none,             // nothing has, or the storebag lets everybody
  userInformation,  // what the session promised is missing
  client,           // no entry of the storebag is for this client
  consent,
  country,
  device,
  filters,    // the entry lacks what it must have
  threshold,  // the entry has no sampling threshold
  sampling,
  expedite,  // an urgent event freed what sampling held
  parent,    // taken over from the parent session
  server,    // it answered 5xx
};

[[nodiscard]] const char* stateRuleName(StateRule rule);    // a word with hyphens
[[nodiscard]] const char* backEndStateName(int32_t state);  // "undecided", "disabled", "enabled", "held"

class BackEndStanding {
 public:
  explicit BackEndStanding(std::string name) : name_(std::move(name)) {}
  [[nodiscard]] const std::string& name() const { return name_; }

  // Times are seconds since 1970, of 32 bits; 0: never.
  struct State {
    uint8_t state = 0;
    StateRule rule = StateRule::none;
    uint16_t status = 0;   // of the answer that decided, else 0
    uint32_t decided = 0;  // when it became so
  };
  [[nodiscard]] State state() const { return unpack(state_.load(std::memory_order_relaxed)); }
  // One thread at a time. A state that is decided again as it was keeps its time.
  void setState(const State& state);

  void setBatch(size_t events, uint64_t bytes) {
    batchedEvents_.store(events, std::memory_order_relaxed);
    batchedBytes_.store(bytes, std::memory_order_relaxed);
  }
  [[nodiscard]] uint64_t batchedEvents() const { return batchedEvents_.load(std::memory_order_relaxed); }
  [[nodiscard]] uint64_t batchedBytes() const { return batchedBytes_.load(std::memory_order_relaxed); }

  void beginPost(size_t events) { inFlight_.fetch_add(events, std::memory_order_relaxed); }
  void endPost(size_t events) { inFlight_.fetch_sub(events, std::memory_order_relaxed); }
  [[nodiscard]] uint64_t inFlight() const { return inFlight_.load(std::memory_order_relaxed); }
  // `status`: of the answer; 0: none came.
  void posted(uint32_t now, int status);
  [[nodiscard]] std::pair<uint32_t, int> lastPost() const;

 private:
  static uint64_t pack(const State& state);
  static State unpack(uint64_t packed);

  const std::string name_;
  std::atomic<uint64_t> state_{0};
  std::atomic<uint64_t> batchedEvents_{0}, batchedBytes_{0}, inFlight_{0};
  std::atomic<uint64_t> lastPost_{0};  // time and status
};

}  // namespace kyt
