#include "platform/URLSession.h"

#include <algorithm>
#include <cctype>
#include <iterator>
#include <utility>

#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/base/UserBudget.h"

namespace kyt {

std::optional<std::string> URLResponse::header(std::string_view name) const {
  const auto sameLetter = [](char a, char b) {
    return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
  };
  std::optional<std::string> all;
  for (const auto& [key, value] : headers) {
    if (!std::equal(key.begin(), key.end(), name.begin(), name.end(), sameLetter)) continue;
    all = all ? *all + ", " + value : value;
  }
  return all;
}

bool mayHaveLeft(const std::optional<URLResponse>& response, const std::optional<Error>& error) {
  // libcurl's: no such address, no resolver, nobody listens, no common TLS, a certificate or a list of them that is wrong.
  constexpr int32_t kBeforeTheBody[] = {1,  3,  4,  5,  6,  7,  35, 53, 58, 59,
                                        60, 66, 77, 80, 82, 83, 90, 91, 96, 98};
  if (response || !error) return true;
  if (error->code == kURLErrorWaitingTooMuch || error->code == kURLErrorOutstandingTooMuch) return false;
  return std::find(std::begin(kBeforeTheBody), std::end(kBeforeTheBody), error->code) ==
         std::end(kBeforeTheBody);
}

URLReply startAndWait(URLRequest request, Function<void(URLRequest, URLCompletion)> start) {
  Semaphore done;
  URLReply reply;
  request.isAwaited = true;
  start(std::move(request),
        [&](std::optional<Data> data, std::optional<URLResponse> response, std::optional<Error> error) {
          reply = URLReply{std::move(data), std::move(response), std::move(error)};
          done.signal();
        });
  done.wait();
  return reply;
}

size_t OutstandingBytes::of(const URLRequest& request) {
  constexpr size_t kRequestCost = 12288;  // measured: what libcurl keeps, however small the request is
  size_t bytes = kRequestCost + request.url.size() + request.body.size();
  for (const auto& [name, value] : request.headers) bytes += name.size() + value.size();
  return std::min(bytes, Limits::maxOutstandingBytes / 2);
}

OutstandingBytes::~OutstandingBytes() {
  for (User* user = first_.load(); user != nullptr;) delete std::exchange(user, user->next_);
}

OutstandingBytes::User& OutstandingBytes::user(const std::shared_ptr<UserAccount>& account) {
  User* first = first_.load(std::memory_order_acquire);
  std::unique_ptr<User> made;
  for (;;) {
    for (User* user = first; user != nullptr; user = user->next_)
      if (user->account_ == account) return *user;
    if (!made) made = std::make_unique<User>(account);
    made->next_ = first;
    if (first_.compare_exchange_weak(first, made.get(), std::memory_order_acq_rel)) return *made.release();
  }
}

size_t OutstandingBytes::User::most() const {
  return account_ ? account_->most(Share::requestBytes) : Limits::maxOutstandingBytes;
}

size_t OutstandingBytes::User::mostWaiting() const {
  return account_ ? account_->most(Share::waitingBytes) : Limits::maxWaitingBytes;
}

uint64_t OutstandingBytes::User::owner() const {
  return account_ ? uint64_t{account_->user()} + 1 : 0;
}

bool OutstandingBytes::User::take(size_t bytes) {
  size_t before = bytes_.load(std::memory_order_relaxed);
  do {
    if (before + bytes > most()) return false;
  } while (!bytes_.compare_exchange_weak(before, before + bytes, std::memory_order_relaxed));
  if (!account_ || account_->take(Share::bytes, bytes, 2 * kLeftForMessages)) return true;
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  return false;
}

bool OutstandingBytes::User::takeReply(size_t bytes) {
  return !account_ || account_->take(Share::bytes, bytes, 2 * kLeftForMessages);
}

void OutstandingBytes::User::giveReplyBack(size_t bytes) {
  if (account_) account_->giveBack(Share::bytes, bytes);
}

void OutstandingBytes::User::giveBack(size_t bytes) {
  bytes_.fetch_sub(bytes, std::memory_order_relaxed);
  if (account_) account_->giveBack(Share::bytes, bytes);
}

}  // namespace kyt
