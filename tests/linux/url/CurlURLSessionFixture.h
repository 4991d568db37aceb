// What the URL session tests share: a factory on the real network thread with short times, and a way to run a
// request and wait for its completion.
#pragma once

#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdio>
#include <fstream>
#include <mutex>
#include <optional>
#include <sstream>
#include <string>
#include <thread>

#include "platform/base/Counters.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/queues/Log.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {

// What a completion was given; wait() before reading.
class Outcome {
 public:
  URLCompletion completion() {
    return [state = state_](std::optional<Data> data, std::optional<URLResponse> response,
                            std::optional<Error> error) {
      std::lock_guard lock(state->mutex);
      ++state->calls;
      state->data = std::move(data);
      state->response = std::move(response);
      state->error = std::move(error);
      state->thread = std::this_thread::get_id();
      pthread_getname_np(pthread_self(), state->threadName, sizeof state->threadName);
      state->changed.notify_all();
    };
  }
  bool wait(std::chrono::milliseconds timeout = kTestDeadline) const {
    std::unique_lock lock(state_->mutex);
    return state_->changed.wait_until(lock, std::chrono::steady_clock::now() + timeout,
                                      [&] { return state_->calls > 0; });
  }
  [[nodiscard]] bool isDone() const {
    std::lock_guard lock(state_->mutex);
    return state_->calls > 0;
  }
  [[nodiscard]] int calls() const {
    std::lock_guard lock(state_->mutex);
    return state_->calls;
  }
  // 0 when there was an error.
  [[nodiscard]] int status() const { return state_->response ? state_->response->status : 0; }
  // 0 when there was none.
  [[nodiscard]] int errorCode() const { return state_->error ? state_->error->code : 0; }
  [[nodiscard]] std::string errorText() const {
    return state_->error ? state_->error->localizedDescription : std::string();
  }
  [[nodiscard]] std::string body() const { return state_->data ? std::string(state_->data->view()) : ""; }
  [[nodiscard]] std::string threadName() const { return state_->threadName; }
  [[nodiscard]] const std::optional<URLResponse>& response() const { return state_->response; }
  [[nodiscard]] const std::optional<Data>& data() const { return state_->data; }
  [[nodiscard]] const std::optional<Error>& error() const { return state_->error; }
  [[nodiscard]] std::thread::id thread() const { return state_->thread; }

 private:
  struct State {
    mutable std::mutex mutex;
    std::condition_variable changed;
    int calls = 0;
    std::optional<Data> data;
    std::optional<URLResponse> response;
    std::optional<Error> error;
    std::thread::id thread;
    char threadName[16] = {};
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

class CurlURLSessionFixture : public testing::Test {
 protected:
  CurlURLSessionFactory& factory() {
    if (!factory_) factory_ = std::make_unique<CurlURLSessionFactory>(options_, log_, counters_);
    return *factory_;
  }
  std::unique_ptr<URLSession> session(bool waits = false,
                                      std::string source = "com.vantu.system.diagnostics") {
    URLSessionConfiguration configuration;
    configuration.sourceApplication = std::move(source);
    configuration.waitsForConnectivity = waits;
    return factory().create(std::move(configuration));
  }
  static URLRequest get(std::string url) {
    URLRequest request;
    request.url = std::move(url);
    return request;
  }
  static URLRequest post(std::string url, std::string_view body) {
    URLRequest request;
    request.method = "POST";
    request.url = std::move(url);
    request.body = Data(body);
    return request;
  }
  static Outcome perform(URLSession& session, URLRequest request) {
    Outcome outcome;
    session.start(std::move(request), outcome.completion());
    EXPECT_TRUE(outcome.wait());
    return outcome;
  }

  // Whether something that was sent is not acknowledged, on the connections to that port, by the kernel's table.
  static bool hasUnacknowledged(uint16_t port) {
    char peersPort[8];
    std::snprintf(peersPort, sizeof peersPort, ":%04X", port);
    for (const char* table : {"/proc/thread-self/net/tcp", "/proc/thread-self/net/tcp6"}) {
      std::ifstream file(table);
      std::string number, local, peer, is, queues;
      for (std::string line; std::getline(file, line);) {
        std::istringstream(line) >> number >> local >> peer >> is >> queues;
        if (peer.ends_with(peersPort) && !queues.starts_with("00000000")) return true;
      }
    }
    return false;
  }

  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  Counters counters_;
  CurlURLSessionOptions options_;
  std::unique_ptr<CurlURLSessionFactory> factory_;
};

}  // namespace kyt
