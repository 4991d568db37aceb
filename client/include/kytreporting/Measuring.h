// What programs measure, as messages: durations (Timer) and sums (Counter), and values from std::chrono and std::optional.
// Inline, over KYTReporting.h; a session outlives what is made with it.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <optional>
#include <type_traits>
#include <utility>

#include "kytreporting/KYTReporting.h"

namespace kyt {

// A duration is a number, its seconds; a moment is a date; an optional is what it holds, or null, and a payload's null
// entry is left out. Everything else is what Value makes of it.
template <typename T>
requires std::is_constructible_v<Value, const T&>
[[nodiscard]] Value asValue(const T& given) {
  return Value(given);
}
template <typename Rep, typename Period>
[[nodiscard]] Value asValue(std::chrono::duration<Rep, Period> duration) {
  return std::chrono::duration<double>(duration).count();
}
template <typename Duration>
[[nodiscard]] Value asValue(std::chrono::time_point<std::chrono::system_clock, Duration> moment) {
  return Date{std::chrono::duration<double>(moment.time_since_epoch()).count()};
}
template <typename T>
[[nodiscard]] Value asValue(const std::optional<T>& given) {
  return given ? asValue(*given) : Value();
}

// Sends one message with "duration", in seconds, when it is destroyed. One thread.
class Timer {
 public:
  Timer(KYTReporting& session, uint32_t category, uint32_t type, Dictionary payload = {})
      : session_(session), category_(category), type_(type), payload_(std::move(payload)) {}
  ~Timer() {
    if (cancelled_) return;
    payload_.set("duration", asValue(std::chrono::steady_clock::now() - begun_));
    session_.sendMessage(category_, type_, std::move(payload_));
  }
  Timer(const Timer&) = delete;
  Timer& operator=(const Timer&) = delete;

  void set(String key, Value value) { payload_.set(std::move(key), std::move(value)); }  // goes along
  void cancel() { cancelled_ = true; }                                                   // sends nothing

 private:
  KYTReporting& session_;
  const uint32_t category_, type_;
  Dictionary payload_;
  bool cancelled_ = false;
  const std::chrono::steady_clock::time_point begun_ = std::chrono::steady_clock::now();
};

// Sums up what happens too often for a message each. The sum leaves as one message with "count", and "seconds" since the
// last, when add() finds that the interval is over, and when the counter is destroyed; a sum of nothing never leaves. What
// the session's queue has no room for goes along with the next sum.
// add() and send() may be called from any thread, and take no lock; while one thread sends, others go on.
class Counter {
 public:
  Counter(KYTReporting& session, uint32_t category, uint32_t type,
          std::chrono::milliseconds interval = std::chrono::minutes(1), Dictionary payload = {})
      : session_(session),
        category_(category),
        type_(type),
        interval_(interval),
        payload_(std::move(payload)) {}
  ~Counter() { send(); }
  Counter(const Counter&) = delete;
  Counter& operator=(const Counter&) = delete;

  void add(uint64_t count = 1) {
    count_.fetch_add(count, std::memory_order_relaxed);
    if (Clock::now().time_since_epoch() - tried_.load(std::memory_order_relaxed) >= interval_) send();
  }
  void send() {
    if (sending_.exchange(true, std::memory_order_acquire)) return;
    const Clock::duration now = Clock::now().time_since_epoch();
    tried_.store(now, std::memory_order_relaxed);
    const uint64_t count = count_.exchange(0, std::memory_order_relaxed);
    if (count == 0 || sends(count, now - begun_))
      begun_ = now;
    else
      count_.fetch_add(count, std::memory_order_relaxed);
    sending_.store(false, std::memory_order_release);
  }

 private:
  using Clock = std::chrono::steady_clock;
  bool sends(uint64_t count, Clock::duration seconds) {
    Dictionary payload = payload_;
    payload.set("count", count);
    payload.set("seconds", asValue(seconds));
    return session_.sendMessage(category_, type_, std::move(payload));
  }
  KYTReporting& session_;
  const uint32_t category_, type_;
  const std::chrono::milliseconds interval_;
  const Dictionary payload_;
  std::atomic<uint64_t> count_{0};
  std::atomic<bool> sending_{false};
  Clock::duration begun_ = Clock::now().time_since_epoch();  // of the sum; whoever sends
  std::atomic<Clock::duration> tried_{begun_};
};

}  // namespace kyt
