// What a daemon that comes back must be told again: who the session is, whether it was configured, its shared
// data and its digest key. A new value is taken over only once the call that carries it could be written, so
// that what is kept can be sent. The library's thread only.
#pragma once

#include <optional>
#include <string>

#include "client/Call.h"

namespace kyt::client {

class KeptState {
 public:
  explicit KeptState(IdentityArguments identity) : identity_(std::move(identity)) {}

  // Keeps what a call says that lasts, and nothing of others.
  void takeOver(const Call& sent);

  [[nodiscard]] const IdentityArguments& identity() const { return identity_; }
  [[nodiscard]] bool isConfigured() const { return configured_; }
  [[nodiscard]] const Dictionary& sharedData() const { return sharedData_; }
  [[nodiscard]] const std::optional<DigestKeyArguments>& digestKey() const { return digestKey_; }

  // Why a session like this has no storebag, or no live back end: as far as it can be known here.
  [[nodiscard]] std::string whyNoStorebag() const;
  [[nodiscard]] std::string whyNotLive() const;

 private:
  template <typename Other>
  void take(const Other&) {}
  void take(const UserInfoArguments& sent);
  void take(const SharedDataArguments& sent);
  void take(const SharedDataForKeyArguments& sent);
  void take(const DigestKeyArguments& sent) { digestKey_ = sent; }
  [[nodiscard]] bool promisesUserInfo() const;

  IdentityArguments identity_;
  bool configured_ = false;
  Dictionary sharedData_;
  std::optional<DigestKeyArguments> digestKey_;
};

}  // namespace kyt::client
