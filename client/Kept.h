// What a daemon that comes back must be told again: who the session is, whether it was configured, its shared
// data and its digest key. A new value is taken over only once the call that carries it could be encoded, so
// that what is kept can be sent. The library's thread only.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "client/Command.h"

namespace kyt::client {

struct Kept {
  Dictionary sessionInfo;
  std::optional<Dictionary> userInfo;
  Value frameworks;
  bool configured = false;
  Dictionary sharedData;
  std::optional<Data> digestKey;
  int32_t digestAlgorithm = 0;

  void takeOver(const Command& sent);
  [[nodiscard]] bool promisesUserInfo() const;

  // Why a session like this has no storebag, or no live back end: as far as it can be known here.
  [[nodiscard]] std::string whyNoStorebag() const;
  [[nodiscard]] std::string whyNotLive() const;
};

}  // namespace kyt::client
