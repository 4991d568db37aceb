// The dashboard back end over the system's sockets, timers and threads: who is heard, and that nothing stays
// open, however it ends.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cerrno>
#include <filesystem>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/dashboard/DashboardBackend.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxUDPSocket.h"
#include "platform/objects/Keys.h"
#include "platform/queues/WorkerPool.h"
#include "tests/support/Eventually.h"
#include "tests/support/TestPlatform.h"
#include "tests/support/UDPPeer.h"

namespace kyt {
namespace {

class DashboardSockets : public ::testing::Test {
 protected:
  ~DashboardSockets() override {
    backend_.reset();
    workers_.shutDown();
    reactor_->stop();
  }
  [[nodiscard]] Dictionary profile(const Dictionary& more = {}) const {
    Dictionary out{{"ip", "127.0.0.1"}, {"port", int64_t{server_.port()}}};
    out.merge(more);
    return out;
  }
  std::shared_ptr<DashboardBackend> make(const std::optional<Dictionary>& profile) {
    return DashboardBackend::initWithName(platform_, kKYTReportingBackendDashboard, profile,
                                          std::make_shared<SessionFacts>());
  }
  void send(uint16_t number) { backend_->sendMessage({{"k", "v"}}, {5, 0}, 2, 3, EventID{number}); }
  static std::string acknowledgement(uint16_t number, size_t length = 64) {
    std::string datagram(64, '\0');
    datagram[60] = static_cast<char>(number >> 8);
    datagram[61] = static_cast<char>(number);
    return datagram.substr(0, length);
  }
  [[nodiscard]] std::vector<uint16_t> queued() const {
    return backend_->networkProcQueue().sync([this] {
      std::vector<uint16_t> numbers;
      for (const auto& packet : backend_->messageQueue()) numbers.push_back(packet->eventNumber());
      return numbers;
    });
  }
  static auto descriptors() {
    return std::distance(std::filesystem::directory_iterator("/proc/self/fd"), {});
  }

  TestPlatform fakes_;
  LinuxUDPSocketFactory sockets_;
  std::unique_ptr<EpollReactor> reactor_ = EpollReactor::create();
  WorkerPool workers_{WorkerPoolOptions{}};
  Platform platform_{
      .limits = fakes_.limits,
      .counters = fakes_.counters,
      .log = fakes_.log,
      .clock = fakes_.clock,
      .timers = *reactor_,
      .reactor = *reactor_,
      .executor = workers_,
      .largeWork = fakes_.largeWork,
      .random = fakes_.random,
      .userDefaults = fakes_.userDefaults,
      .deviceProperties = fakes_.deviceProperties,
      .consent = fakes_.consent,
      .cryptography = fakes_.cryptography,
      .propertyLists = fakes_.propertyLists,
      .json = fakes_.json,
      .deflate = fakes_.deflate,
      .memory = fakes_.memory,
      .urlSessions = fakes_.urlSessions,
      .udpSockets = sockets_,
      .clientBundle = fakes_.clientBundle,
      .daemonBundle = fakes_.daemonBundle,
      .fileExtensions = fakes_.fileExtensions,
      .pluginBundles = fakes_.pluginBundles,
      .powerLog = fakes_.powerLog,
      .budget = fakes_.budget,
      .books = fakes_.books,
      .departures = fakes_.departures,
  };
  UDPPeer server_;
  std::shared_ptr<DashboardBackend> backend_;
};

TEST_F(DashboardSockets, EveryFailureToMakeOneLeavesNoDescriptor) {
  const auto before = descriptors();
  EXPECT_EQ(make(Dictionary{{"port", 1}}), nullptr);
  EXPECT_EQ(make(Dictionary{{"ip", "127.0.0.1"}}), nullptr);
  EXPECT_EQ(make(std::nullopt), nullptr);
  for (const Dictionary& how : {Dictionary{}, Dictionary{{"reliable", 500}}}) {
    Dictionary unparsable = profile(how);
    unparsable.set("ip", "dashboard.example.org");
    EXPECT_EQ(make(unparsable), nullptr);
  }
  EXPECT_EQ(DashboardBackend::initWithName(platform_, kKYTReportingBackendDashboard,
                                           std::optional<String>("no address"), 1,
                                           std::make_shared<SessionFacts>()),
            nullptr);
  EXPECT_EQ(fakes_.sink.count(LogLevel::error, "DashboardBackend(initWithName): socket connect() failed."),
            3u);
  EXPECT_EQ(descriptors(), before);
  EXPECT_EQ(sockets_.openSockets(), 0u);
}

TEST_F(DashboardSockets, WithoutADescriptorItIsNotMadeAndSaysWhy) {
  rlimit limit{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &limit), 0);
  const rlimit none{0, limit.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
  const auto made = make(profile());
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &limit), 0);
  EXPECT_EQ(made, nullptr);
  EXPECT_EQ(fakes_.sink.count(LogLevel::error, "DashboardBackend(initWithName): socket() failed (" +
                                                   std::to_string(EMFILE) + ")"),
            1u);
}

TEST_F(DashboardSockets, HearsItsServerAlone) {
  backend_ = make(profile({{"reliable", 60000}}));  // no tick comes in time to send again
  ASSERT_NE(backend_, nullptr);
  uint16_t port = 0;
  for (const uint16_t number : {7, 8, 7}) {
    send(number);
    EXPECT_EQ(server_.receive(&port).substr(64), " k=v");
  }
  const UDPPeer stranger;
  stranger.sendTo(port, acknowledgement(8));
  server_.sendTo(port, acknowledgement(8, 61));
  server_.sendTo(port, acknowledgement(9));
  server_.sendTo(port, "");
  server_.sendTo(port, acknowledgement(7));
  ASSERT_TRUE(eventually([&] { return queued() == std::vector<uint16_t>{8, 7}; }));
  server_.sendTo(port, acknowledgement(8));
  server_.sendTo(port, acknowledgement(8));
  server_.sendTo(port, acknowledgement(7));
  EXPECT_TRUE(eventually([&] { return queued().empty(); }));
}

// The error that the system reports for a server that is gone fails one send at most, and ends no listening.
TEST_F(DashboardSockets, HearsAServerThatComesBack) {
  auto gone = std::make_unique<UDPPeer>();
  const uint16_t port = gone->port();
  backend_ = make(Dictionary{{"ip", "127.0.0.1"}, {"port", int64_t{port}}, {"reliable", 60000}});
  ASSERT_NE(backend_, nullptr);
  gone.reset();
  send(1);
  EXPECT_EQ(queued(), (std::vector<uint16_t>{1}));
  const UDPPeer back(port);
  send(2);
  send(3);
  uint16_t own = 0;
  std::string last;
  while (last != "nothing" && (last.size() < 62 || last[61] != 3)) last = back.receive(&own);
  ASSERT_NE(last, "nothing");
  back.sendTo(own, acknowledgement(3));
  EXPECT_TRUE(eventually([&] { return queued() == std::vector<uint16_t>{1, 2}; }));
}

TEST_F(DashboardSockets, ManyThatComeAndGoLeaveNoDescriptor) {
  const auto before = descriptors();
  std::vector<std::shared_ptr<DashboardBackend>> all;
  for (int i = 0; i < 50; ++i) {
    all.push_back(make(i % 2 == 0 ? profile() : profile({{"reliable", 10}})));
    ASSERT_NE(all.back(), nullptr);
  }
  EXPECT_EQ(descriptors(), before + 50);
  for (const auto& backend : all) {
    backend->sendMessage({}, {1, 0}, 2, 3, EventID{1});
    backend->cleanup();
  }
  all.clear();
  // The reliable ones last until they have sent five times, at the twentieth tick.
  EXPECT_TRUE(eventually([&] { return sockets_.openSockets() == 0; }));
  EXPECT_TRUE(eventually([&] { return descriptors() == before; }));
}

}  // namespace
}  // namespace kyt
