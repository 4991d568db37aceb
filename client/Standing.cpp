#include "client/Standing.h"

#include <cstdlib>
#include <cstring>

#include "client/Figures.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/client/ClientSocket.h"

namespace kyt::client {

namespace {

bool debugWanted() {
  const char* wanted = secure_getenv("KYTREPORTING_DEBUG");
  return wanted != nullptr && *wanted != '\0' && std::strcmp(wanted, "0") != 0;
}

}  // namespace

Standing::Standing(std::string name, Block block)
    : name_(std::move(name)),
      debugs_(debugWanted()),
      why_("no connection was tried yet"),
      block_(std::move(block)) {}

std::string Standing::why() const {
  MutexLock lock(mutex_);
  return why_;
}

void Standing::note(State state, std::string why) {
  MutexLock lock(mutex_);
  state_.store(state, std::memory_order_release);
  why_ = std::move(why);
}

void Standing::become(State state, std::string why) {
  note(state, why);
  std::string told = std::string(KYTReporting::nameOf(state)) + ": " + why;
  if (told == told_) return;
  told_ = std::move(told);
  say(told_);
  if (block_.isReady()) changes_.emplace_back(state, std::move(why));
}

void Standing::announce() {
  while (block_.isReady() && !changes_.empty()) {
    const auto [state, why] = std::move(changes_.front());
    changes_.pop_front();
    block_.run(state, why);
  }
}

void Standing::say(const std::string& text) const {
  if (debugs_) linux_client::writeLineToStandardError("libkytreporting: " + name_ + ": " + escapedText(text));
}

void Standing::sayDrops(const KYTReporting::Statistics& figures) {
  if (!debugs_) return;
  for (const NamedFigure& loss : kLosses) {
    const uint64_t now = figures.*loss.figure;
    uint64_t& before = said_.*loss.figure;
    if (now > before)
      say("dropped " + std::to_string(now - before) + ": " + loss.reason + " (" + std::to_string(now) +
          " in all)");
    before = now;
  }
}

}  // namespace kyt::client
