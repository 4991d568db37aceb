// An outbox between a session and a network, all of it moved by hand: the clock, the queue, the answers, the disk.
#pragma once

#include <gtest/gtest.h>

#include "outbox/Outbox.h"
#include "outbox/OutboxURLSession.h"
#include "platform/fake/FakePostStore.h"
#include "tests/support/TestPlatform.h"

namespace kyt {

inline constexpr char kServer[] = "https://events.example.org";

class OutboxFixture : public testing::Test {
 protected:
  struct Outcome {
    int calls = 0;
    std::optional<URLResponse> response;
    std::optional<Error> error;
  };

  OutboxFixture() {
    test_.consent.setAllowed(true);
    test_.clock.setTimeOfDay({1767225600, 0});
    test_.random.setDraw(4999);  // ms: nobody tries again at once
  }

  // The daemon begins; or another one after it.
  void start() {
    store_ = std::make_unique<FakePostStore>(disk_);
    outbox_ = Outbox::create({test_.clock, test_.timers, test_.random, test_.executor, test_.consent,
                              test_.counters, test_.log, *books_, test_.departures, *network_, *store_},
                             settings_);
    factory_ = std::make_unique<OutboxURLSessionFactory>(*network_, outbox_, test_.executor);
    outbox_->begin();
    drain();
    URLSessionConfiguration configuration;
    configuration.sourceApplication = "com.example.test";
    configuration.waitsForConnectivity = true;
    session_ = factory_->create(configuration);
  }
  void stop() {
    outbox_->stopSending();
    drain();
    session_.reset();
    factory_.reset();
    outbox_.reset();
    drain();
    books_ = std::make_unique<Books>();
    network_ = std::make_unique<FakeURLSessionFactory>();
  }
  void restart() {
    stop();
    start();
  }
  void drain() { test_.executor.runAll(); }
  void pass(Duration time) {
    test_.timers.advance(time, [this] { drain(); });
  }

  // A post of so many events of that user, as a back end makes it.
  std::shared_ptr<Outcome> post(std::string_view body = "body", uint32_t user = 1000,
                                std::string_view url = "", size_t events = 2) {
    auto outcome = std::make_shared<Outcome>();
    const auto tally = books_->open({user, 7, "videocall", "call"}, "httppost", false);
    BookedEvents booked;
    for (size_t i = 0; i < events; ++i) {
      tally->take();
      booked.add(tally.get());
    }
    if (isShown_) {
      auto watched = std::make_shared<WatchedPost>(books_->watchers());
      watched->leaves(kServer, body);
      booked.show({books_->watchers(), "httppost", "", std::vector<EventKind>(events, {9, 1}), watched});
    }
    auto posted = std::make_shared<PostedEvents>(std::move(booked), test_.counters);
    URLRequest request;
    request.method = "POST";
    request.url = url.empty() ? std::string(kServer) + "/v1/events" : std::string(url);
    request.headers = {{"X-KYT-Client-Name", "videocall"}, {"Content-Type", "application/json"}};
    request.body = Data(body);
    request.identity = "identity";
    request.account = test_.budget.account(user);
    request.events = posted->events();
    request.isByConsent = isByConsent_;
    session_->start(std::move(request), [outcome, posted](auto, auto response, auto error) {
      ++outcome->calls;
      const int status = response ? response->status : 0;
      if (error)
        posted->dropped(Reason::postFailed);
      else if (status >= 400 && status <= 599)
        posted->dropped(Reason::postRefused);
      else
        posted->delivered();
      outcome->response = std::move(response);
      outcome->error = std::move(error);
    });
    drain();
    return outcome;
  }
  // The post fails, and is kept.
  void postAndKeep(std::string_view body = "body", uint32_t user = 1000, std::string_view url = "") {
    static_cast<void>(post(body, user, url));
    fail(last());
  }

  [[nodiscard]] size_t last() const { return network_->requestCount() - 1; }
  void answer(size_t request, int status, FakeURLSessionFactory::Headers headers = {}) {
    network_->complete(request, status, std::move(headers));
    drain();
  }
  void fail(size_t request, int32_t code = 7) {
    network_->fail(request, Error{kKYTURLErrorDomain, code, "unreachable"});
    drain();
  }
  [[nodiscard]] std::string body(size_t request) const {
    return std::string(network_->request(request).body.view());
  }
  [[nodiscard]] BookRow row(uint32_t user = 1000) const {
    for (BookRow& row : books_->snapshot())
      if (row.program.user == user) {
        EXPECT_EQ(row.taken, row.pending() + row.delivered + row.droppedInAll());
        return std::move(row);
      }
    return {};
  }

  TestPlatform test_;
  OutboxSettings settings_{.enabled = true};
  bool isByConsent_ = false, isShown_ = false;
  const std::shared_ptr<FakePostStore::Disk> disk_ = std::make_shared<FakePostStore::Disk>();
  std::unique_ptr<Books> books_ = std::make_unique<Books>();
  std::unique_ptr<FakeURLSessionFactory> network_ = std::make_unique<FakeURLSessionFactory>();
  std::unique_ptr<FakePostStore> store_;
  std::shared_ptr<Outbox> outbox_;
  std::unique_ptr<OutboxURLSessionFactory> factory_;
  std::unique_ptr<URLSession> session_;
};

}  // namespace kyt
