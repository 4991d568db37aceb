// What stands behind the port of posts: checks each, sends it on its way, and answers when log or spool has it. Called on
// the server's threads, several at a time.
#pragma once

#include <atomic>
#include <memory>
#include <optional>

#include "http/Http.h"
#include "http/LaterReply.h"
#include "platform/base/Clock.h"
#include "receiver/CheckThreads.h"
#include "receiver/DeadLetters.h"
#include "receiver/Delivery.h"
#include "receiver/Figures.h"
#include "receiver/Limits.h"
#include "receiver/PostCheck.h"
#include "receiver/Settings.h"

namespace kyt::receiver {

class PostHandler final : public http::HttpHandler {
 public:
  struct Options {
    // What a post gets that can be taken now by neither log nor spool. Of 503 devices without an outbox switch off what
    // posts there: the operator's brake.
    unsigned refuseWith = 429;
    // Each post is opened, and what is not as the daemon sends it refused.
    bool opensPosts = false;
  };
  // All outlive this.
  PostHandler(const Settings& settings, Options options, Delivery& delivery, EventLog& log,
              DeadLetters& deadLetters, const Clock& clock, Figures& figures);

  [[nodiscard]] bool isRefused(const http::Request& request) const override;
  [[nodiscard]] uint64_t sampleBytes() const override { return Limits::maxDeadLetterBytes; }
  [[nodiscard]] uint64_t bodyLimit(const http::Request& request) const override;
  [[nodiscard]] http::Answer answer(http::Request& request) override;
  void ambiguous() override { figures_.refuse(Refusal::ambiguous); }
  void broken(http::Request& request) override;
  // Any thread. Posts that have come whole and are not answered.
  [[nodiscard]] uint64_t waiting() const { return waiting_.load(); }
  // From here on no post is taken any more: once waiting() is 0, log and spool are given none.
  void close() { isClosed_ = true; }

 private:
  [[nodiscard]] http::Reply reject(const http::Request& request, const Rejection& rejection) const;
  [[nodiscard]] http::Reply refuse(Refusal refusal, const char* text) const;
  [[nodiscard]] bool open(http::Request& request, bool hasDigest,
                          const std::shared_ptr<http::LaterReply>& later, uint64_t mostBytes);
  void submit(http::Request& request, bool hasDigest, const std::shared_ptr<http::LaterReply>& later);
  void deliver(http::Request& request, bool hasDigest, const std::shared_ptr<http::LaterReply>& later);
  [[nodiscard]] http::Reply replyFor(Fate fate, const LogMessage& message, bool hasDigest) const;

  const Settings& settings_;
  const Options options_;
  Delivery& delivery_;
  EventLog& log_;
  DeadLetters& deadLetters_;
  const Clock& clock_;
  Figures& figures_;
  const PostCheck check_;
  std::atomic<uint64_t> waiting_{0};
  std::atomic<bool> isClosed_{false};
  std::optional<CheckThreads> checks_;
};

}  // namespace kyt::receiver
