// The URL session port in memory, for tests. Every request is recorded; a test answers it by its number, in
// the order in which requests were started, or installs a responder that answers at once.
//
// Without an executor a completion runs on the thread that answers, before the call returns (with a
// responder: inside start(), so that code that starts a request and then waits for it needs no second
// thread). With an executor it runs on the session's own serial delegate queue. Any thread. The factory may
// be destroyed before or after its sessions; requests still open then are dropped without a completion.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/URLSession.h"
#include "platform/queues/Executor.h"

namespace kyt {

class FakeURLSessionFactory final : public URLSessionFactory {
 public:
  using Headers = std::vector<std::pair<std::string, std::string>>;
  // An answer: an error, or a status with headers and body.
  struct Reply {
    int status = 200;
    Headers headers = {};
    std::string body = {};
    std::optional<Error> error = {};
  };
  // No value: the request stays open and the test answers it later.
  using Responder = std::function<std::optional<Reply>(const URLRequest&)>;

  explicit FakeURLSessionFactory(Executor* executor = nullptr);
  ~FakeURLSessionFactory() override;

  [[nodiscard]] std::unique_ptr<URLSession> create(URLSessionConfiguration configuration) override;
  void cancelAwaited() override;
  void cancelAll() override;
  [[nodiscard]] URLFigures figures() const override;
  [[nodiscard]] size_t outstanding() const override;
  void watchConnectivity(std::shared_ptr<Function<void()>> changed) override;
  void changeConnectivity();  // tells who watches
  [[nodiscard]] bool isWatched() const;

  void setResponder(Responder responder);

  [[nodiscard]] size_t requestCount() const;
  // Preconditions of all that take an index: index < requestCount().
  [[nodiscard]] URLRequest request(size_t index) const;
  [[nodiscard]] URLRequest lastRequest() const;
  // Of the session that started it.
  [[nodiscard]] URLSessionConfiguration configurationOf(size_t index) const;
  [[nodiscard]] size_t sessionOf(size_t index) const;  // numbered in the order of create()
  [[nodiscard]] bool isOpen(size_t index) const;       // neither answered nor cancelled
  // The value of a header of a request, compared with case; no value when it has none of that name.
  [[nodiscard]] std::optional<std::string> requestHeader(size_t index, std::string_view name) const;
  // Whether that many requests were started within `timeout` of real time.
  [[nodiscard]] bool waitForRequests(size_t count, Duration timeout = std::chrono::seconds(10)) const;

  [[nodiscard]] size_t sessionsCreated() const;
  [[nodiscard]] size_t sessionsInvalidated() const;

  // Answer an open request; false when it was not open any more (its completion does not run twice).
  bool complete(size_t index, int status, Headers headers = {}, std::string_view body = {});
  bool fail(size_t index, Error error);
  bool answer(size_t index, Reply reply);
  // An open request begins to wait for connectivity, or goes on.
  void setWaiting(size_t index, bool waits);

  class State;

 private:
  std::shared_ptr<State> state_;
};

}  // namespace kyt
