#include "platform/linux/url/ConnectionGrowth.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace kyt {
namespace {

constexpr Duration kMostPatience = std::chrono::seconds(1);

}  // namespace

ConnectionGrowth::ConnectionGrowth(NetworkTools& tools, Callbacks callbacks)
    : tools_(tools),
      callbacks_(std::move(callbacks)),
      patience_(Deadline::calling<&ConnectionGrowth::patienceOver>(tools.deadlines, *this)) {}

void ConnectionGrowth::wait(URLTransfer& transfer) {
  if (std::exchange(transfer.isUnbegun, true)) return;
  unbegun_.append(transfer);
  watch();
}

void ConnectionGrowth::leave(URLTransfer& transfer) {
  if (std::exchange(transfer.isUnbegun, false)) unbegun_.remove(transfer);
}

void ConnectionGrowth::connected(Duration took) {
  lastChange_ = tools_.now;
  toConnect_ = took;
}

// libcurl, which may be calling, does not let itself be told now.
void ConnectionGrowth::noMatter() {
  if (std::exchange(matters_, false) && most_ != kMost) patience_.set(tools_.now);
}

void ConnectionGrowth::noMatterNow() {
  matters_ = false;
  patience_.cancel();
  if (std::exchange(most_, kMost) != kMost) callbacks_.allow(kMost);
}

void ConnectionGrowth::reset() {
  patience_.cancel();
  matters_ = true;
  if (std::exchange(most_, 1) != 1) callbacks_.allow(1);
}

// A busy thread takes long to make a connection, and to see an answer.
Duration ConnectionGrowth::patience() const {
  const Duration least = tools_.options.connectionPatience;
  return std::clamp(toConnect_, least, std::max(least, kMostPatience));
}

MonotonicTime ConnectionGrowth::due() const {
  return std::max(unbegun_.first()->attempt.lastProgress, lastChange_) + patience();
}

void ConnectionGrowth::watch() {
  if (patience_.isSet() || unbegun_.empty() || most_ == kMost || !matters_) return;
  patience_.set(due());
  restedBefore_ = tools_.rested;
}

// Then answers may have come that it has not seen, and making connections is more work for it.
bool ConnectionGrowth::isThreadBusy() const {
  return tools_.rested - restedBefore_ < patience() / 4 &&
         tools_.now < unbegun_.first()->attempt.lastProgress + kMostPatience;
}

void ConnectionGrowth::patienceOver() {
  if (!matters_) {
    most_ = kMost;
    callbacks_.allow(most_);
    return;
  }
  if (unbegun_.empty()) return;
  if (tools_.now < due()) {
    watch();
    return;
  }
  if (callbacks_.isConnecting() || isThreadBusy()) {
    patience_.set(tools_.now + patience());
    restedBefore_ = tools_.rested;
    return;
  }
  const long more = most_;
  most_ = std::min(2 * most_, kMost);
  lastChange_ = tools_.now;
  callbacks_.allow(most_);
  std::vector<URLTransfer*> oldest;
  for (URLTransfer* one = unbegun_.first(); one != nullptr && std::ssize(oldest) < more;
       one = one->unbegunLinks.next)
    if (one->attempt.hasBegun || one->attempt.addresses.empty())  // others make a connection themselves
      oldest.push_back(one);
  for (URLTransfer* one : oldest) callbacks_.lookAgain(*one);
  watch();
}

}  // namespace kyt
