// The URL session's port with the outbox behind it: a decorator of the real one, made where the settings ask for it. Neither
// sessions nor back ends know it.
//
// A POST of events that ends without an answer, or with one that says that another time may do better, is given to the
// outbox. Once it is on disk its completion runs without data, response or error: for its session it counts as taken. Where
// the outbox cannot keep it the completion gets what it would have got without one. Such a post does not wait for
// connectivity: it fails at once, so that it is on disk where it would be in memory alone. All other requests pass.
//
// Threads as in platform/URLSession.h; completions of kept posts run on a queue for each session, on the executor that is
// given. Sessions may outlive the factory, not what it was given.
#pragma once

#include <atomic>
#include <memory>

#include "outbox/Outbox.h"
#include "platform/URLSession.h"
#include "platform/queues/Executor.h"

namespace kyt {

class OutboxURLSessionFactory final : public URLSessionFactory {
 public:
  OutboxURLSessionFactory(URLSessionFactory& network, std::shared_ptr<Outbox> outbox, Executor& completions);

  [[nodiscard]] std::unique_ptr<URLSession> create(URLSessionConfiguration configuration) override;
  void cancelAwaited() override;
  void cancelAll() override;
  [[nodiscard]] URLFigures figures() const override;
  // Requests of sessions, until their completions have run; nothing that the outbox sends again.
  [[nodiscard]] size_t outstanding() const override;
  void watchConnectivity(std::shared_ptr<Function<void()>> changed) override;

  struct Shared;

 private:
  const std::shared_ptr<Shared> shared_;
};

}  // namespace kyt
