#include "backend/BackEndStanding.h"

namespace kyt {

const char* stateRuleName(StateRule rule) {
  constexpr std::array kNames{"none",    "user-information",   "client",   "consent",  "country", "device",
                              "filters", "sampling-threshold", "sampling", "expedite", "parent",  "5xx"};
  return kNames.at(static_cast<size_t>(rule));
}

const char* backEndStateName(int32_t state) {
  constexpr std::array kNames{"undecided", "disabled", "enabled", "held"};
  return state >= 0 && static_cast<size_t>(state) < kNames.size() ? kNames.at(static_cast<size_t>(state))
                                                                  : "unknown";
}

uint64_t BackEndStanding::pack(const State& state) {
  return uint64_t{state.decided} << 32 | uint64_t{state.status} << 16 |
         static_cast<uint64_t>(static_cast<uint8_t>(state.rule)) << 8 | state.state;
}

BackEndStanding::State BackEndStanding::unpack(uint64_t packed) {
  return {static_cast<uint8_t>(packed), static_cast<StateRule>(static_cast<uint8_t>(packed >> 8)),
          static_cast<uint16_t>(packed >> 16), static_cast<uint32_t>(packed >> 32)};
}

void BackEndStanding::setState(const State& state) {
  const State before = this->state();
  if (before.decided != 0 && before.state == state.state && before.rule == state.rule &&
      before.status == state.status)
    return;
  state_.store(pack(state), std::memory_order_relaxed);
}

void BackEndStanding::posted(uint32_t now, int status) {
  lastPost_.store(uint64_t{now} << 32 | static_cast<uint32_t>(status), std::memory_order_relaxed);
}

std::pair<uint32_t, int> BackEndStanding::lastPost() const {
  const uint64_t packed = lastPost_.load(std::memory_order_relaxed);
  return {static_cast<uint32_t>(packed >> 32), static_cast<int>(static_cast<uint32_t>(packed))};
}

}  // namespace kyt
