// Who a client is, for as long as the delegate decides whether it is served. A connection that is served forgets it: an
// idle one holds neither the client's groups nor a descriptor of its process. One thread at a time.
#pragma once

#include <string>
#include <string_view>
#include <utility>

#include "platform/Entitlements.h"
#include "platform/objects/Value.h"

namespace kyt {

class Admission {
 public:
  Admission(Entitlements& entitlements, PeerCredentials peer)
      : entitlements_(entitlements), peer_(std::move(peer)) {}

  // The value that the client holds under the key; null when it holds none, which counts as a refusal.
  [[nodiscard]] Value entitlementValue(std::string_view key);
  [[nodiscard]] bool isInGroup(uint32_t group) const;
  // Whether what was asked for last was not granted.
  [[nodiscard]] bool refused() const { return refused_; }
  // For the line about a refusal: which program it was, and what tells why. Asks the system about the client's process.
  [[nodiscard]] std::string advice() const;

  // The delegate wants the client's calls.
  void resume() { resumed_ = true; }
  [[nodiscard]] bool resumed() const { return resumed_; }

 private:
  Entitlements& entitlements_;
  const PeerCredentials peer_;
  bool refused_ = false;
  bool resumed_ = false;
};

}  // namespace kyt
