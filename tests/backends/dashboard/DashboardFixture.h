// What the tests of the dashboard back end share: a fake socket, manual time, and the numbers that a server
// would read out of a datagram.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/objects/Keys.h"
#include "tests/support/TestPlatform.h"

namespace kyt {

inline constexpr char kTestDevice[] = "0123456789abcdefghijklmnopqrstuvwxyzABCD";

// Answers at once as it is told.
class AnsweringPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) override {
    requests.push_back(std::move(request));
    URLResponse response;
    response.status = status;
    if (error)
      completion(std::nullopt, std::nullopt, error);
    else
      completion(data, response, std::nullopt);
  }
  std::vector<URLRequest> requests;
  std::optional<Data> data = Data(std::string_view("https://logs.example.org/4711"));
  std::optional<Error> error;
  int status = 200;
};

class DashboardFixture : public ::testing::Test {
 protected:
  DashboardFixture() {
    facts_.sessionID = 1;
    facts_.compType = 6;
    facts_.clientVersion = 3;
    facts_.setSelfVersion("8.0");
    facts_.udid = String(kTestDevice);
    facts_.productFamily = String("Phone");
  }
  ~DashboardFixture() override {
    backend_.reset();
    platform_.executor.runAll();
    EXPECT_EQ(platform_.udpSockets.openSockets(), 0u);
  }

  static Dictionary profile(const Dictionary& more = {}) {
    Dictionary out{{"ip", "192.0.2.7"}, {"port", 4000}};
    out.merge(more);
    return out;
  }
  static Dictionary reliable() { return profile({{"reliable", 500}}); }
  DashboardBackend* make(const std::optional<Dictionary>& profile) {
    backend_ = DashboardBackend::initWithName(platform_.platform, kKYTReportingBackendDashboard, profile,
                                              std::make_shared<SessionFacts>(facts_));
    return backend_.get();
  }
  DashboardBackend* makeWithoutProfile(const std::optional<String>& ip, uint16_t port) {
    backend_ = DashboardBackend::initWithName(platform_.platform, kKYTReportingBackendDashboard, ip, port,
                                              std::make_shared<SessionFacts>(facts_));
    return backend_.get();
  }

  // Sends and runs the network queue; the local log line.
  std::string send(uint16_t eventID, const Dictionary& message = {}, TimeValue time = {5, 123456},
                   uint16_t method = 2, uint16_t respCode = 3) {
    const Value line = backend_->sendMessage(message, time, method, respCode, EventID{eventID});
    platform_.executor.runAll();
    const String* text = line.string();
    return text != nullptr ? text->str() : "null";
  }
  // The text of the datagram that the message makes.
  std::string textOf(const Dictionary& message) {
    send(1, message);
    return socket().sent.back().substr(64);
  }
  FakeUDPSockets::Record& socket() { return platform_.udpSockets.last(); }
  // An acknowledgement arrives.
  bool acknowledge(uint16_t eventID, size_t length = 64) {
    std::string datagram(length, '\0');
    if (length > 60) datagram[60] = static_cast<char>(eventID >> 8);
    if (length > 61) datagram[61] = static_cast<char>(eventID);
    return arrive(datagram);
  }
  bool arrive(const std::string& datagram) {
    socket().arriving.push_back(datagram);
    return report();
  }
  bool report() {
    const bool watched = platform_.reactor.report(socket().descriptor, ready::readable);
    platform_.executor.runAll();
    return watched;
  }
  void tick(int times = 1, std::chrono::milliseconds period = std::chrono::milliseconds(500)) {
    for (int i = 0; i < times; ++i) platform_.timers.advance(period, [this] { platform_.executor.runAll(); });
  }
  std::vector<uint16_t> queued() const {
    std::vector<uint16_t> numbers;
    for (const auto& packet : backend_->messageQueue()) numbers.push_back(packet->eventNumber());
    return numbers;
  }
  [[nodiscard]] size_t errors(std::string_view line) const {
    return platform_.sink.count(LogLevel::error, line);
  }

  TestPlatform platform_;
  SessionFacts facts_;
  std::shared_ptr<DashboardBackend> backend_;
};

}  // namespace kyt
