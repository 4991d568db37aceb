// Do the library's figures close? Random sessions and faults against the real server side: the test counts by itself what
// it was told of each message, and the daemon what arrived. A run is told by its seed; KYT_STATISTICS_RUNS says how many
// there are, KYT_STATISTICS_SEED the first.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <future>
#include <map>
#include <memory>
#include <mutex>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "client/Figures.h"
#include "kytreporting/KYTReporting.h"
#include "kytreporting/kytreporting.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/RandomRuns.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

using Statistics = KYTReporting::Statistics;
using std::chrono::milliseconds;

uint64_t lostAfterAcceptance(const Statistics& figures) {
  return figures.lostOnConnectionEnd + figures.lostInQueue + figures.droppedUnsendable +
         figures.droppedTooLate;
}
uint64_t refused(const Statistics& figures) {
  return figures.droppedQueueFull + figures.droppedClosed + figures.droppedInvalid;
}
bool closes(const Statistics& figures) {
  return figures.accepted == figures.sent + figures.queued + lostAfterAcceptance(figures);
}
std::string describe(const Statistics& figures) {
  return "accepted " + std::to_string(figures.accepted) + " sent " + std::to_string(figures.sent) +
         " queued " + std::to_string(figures.queued) + " connection-ended " +
         std::to_string(figures.lostOnConnectionEnd) + " session-ended " +
         std::to_string(figures.lostInQueue) + " unsendable " + std::to_string(figures.droppedUnsendable) +
         " too-late " + std::to_string(figures.droppedTooLate) + " refused " +
         std::to_string(refused(figures));
}
// Of the process, since `before`.
Statistics totalSince(const Statistics& before) {
  Statistics since = KYTReporting::totalStatistics();
  for (const client::NamedFigure& loss : client::kLosses) since.*loss.figure -= before.*loss.figure;
  for (const auto figure : client::kOtherFigures) since.*figure -= before.*figure;
  return since;
}

// What the test itself saw: of one session, or of all.
struct Seen {
  uint64_t accepted = 0, refused = 0, tooLarge = 0;
  std::atomic<uint64_t> lateAnswers{0}, completions{0};
  uint64_t asked = 0;  // completions that must run
};

class RandomRun {
 public:
  explicit RandomRun(unsigned seed) : random_(seed) {}

  void go() {
    for (int steps = number(20, 120); steps > 0; --steps) step();
    for (Client& client : clients_) checkAtRest(client);
    while (!clients_.empty()) end(clients_.front());
    daemon_.stop();
    checkTotals();
  }

 private:
  struct Client {
    std::unique_ptr<KYTReporting> session;
    std::shared_ptr<Seen> seen;
    bool mayExpire = false;
  };

  bool chance(int percent) { return number(1, 100) <= percent; }
  int number(int from, int to) { return std::uniform_int_distribution<int>(from, to)(random_); }

  void step() {
    const int what = number(1, 100);
    if (what <= 8) return toggleDaemon();
    if (what <= 12) return chance(50) ? daemon_.setRefusals(number(1, 3)) : daemon_.setEndings(number(1, 3));
    if (what <= 15) return sendSingle();
    if (clients_.empty() || what <= 25) return open();
    Client& client = clients_[static_cast<size_t>(number(0, static_cast<int>(clients_.size()) - 1))];
    if (what <= 65) return send(client, chance(20) ? number(100, 400) : number(1, 20));
    if (what <= 75) return sendWithReply(client);
    if (what <= 80) return client.session->startConfiguration();
    if (what <= 84) return client.session->flush();
    if (what <= 88) return void(client.session->finish(milliseconds(number(0, 20))));
    if (what <= 92) return end(client);
    if (what <= 96) return checkAtRest(client);
    // Few: on a busy machine each lasts as long as everybody else's turn.
    for (int turns = number(1, 10); turns > 0; --turns) std::this_thread::yield();
  }

  void toggleDaemon() {
    if (runs_)
      daemon_.stop();
    else
      ASSERT_TRUE(daemon_.start());
    runs_ = !runs_;
  }

  KYTReporting::Options options() {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, number(1, 1000)},
                        {kKYTReportingSessionInfoClientType, 7}};
    if (chance(5)) made.sessionInfo.set("Misspelt", 1);
    if (chance(50)) made.maxQueuedMessages = 64;
    if (chance(30)) made.maxQueuedBytes = 4096;
    made.callDeadline = milliseconds(chance(50) ? 0 : number(1, 20));
    made.finishWaitsForDaemon = chance(50);
    return made;
  }
  void open() {
    KYTReporting::Options made = options();
    const bool mayExpire = made.callDeadline.count() > 0;
    clients_.push_back({KYTReporting::open(std::move(made)), std::make_shared<Seen>(), mayExpire});
  }

  // Category and type tell each message: they are its number.
  std::pair<uint32_t, uint32_t> nextNumber() {
    const uint32_t next = ++lastNumber_;
    return {1 + (next >> 16), next & 0xFFFF};
  }
  Dictionary payload(Seen& seen, bool& tooLarge) {
    tooLarge = chance(2);
    if (!tooLarge) return chance(50) ? Dictionary() : Dictionary{{"text", std::string(200, 'x')}};
    static_cast<void>(seen);
    return {{"text", kMegabyte}};
  }

  void send(Client& client, int count) {
    Seen& seen = *client.seen;
    while (count-- > 0) {
      auto [category, type] = nextNumber();
      if (chance(3)) category = 70000;
      bool tooLarge = false;
      const Dictionary event = payload(seen, tooLarge);
      const bool taken = client.session->sendMessage(category, type, event);
      ++(taken ? seen.accepted : seen.refused);
      if (taken && tooLarge) ++seen.tooLarge;
    }
  }

  // A completion that runs before the call returns, on this thread, refuses.
  auto completion(const std::shared_ptr<Seen>& seen, std::shared_ptr<std::atomic<bool>> refusedAtOnce) {
    ++seen->asked;
    return [seen, refusedAtOnce, caller = std::this_thread::get_id()](const auto&, const auto& error) {
      ++seen->completions;
      if (!error) return;
      const auto code = static_cast<ClientError>(error->code);
      if (code == ClientError::timedOut) ++seen->lateAnswers;
      if (std::this_thread::get_id() == caller && code != ClientError::notConnected) *refusedAtOnce = true;
    };
  }
  void sendWithReply(Client& client) {
    auto [category, type] = nextNumber();
    if (chance(10)) category = 70000;
    bool tooLarge = false;
    const Dictionary event = payload(*client.seen, tooLarge);
    const auto refusedAtOnce = std::make_shared<std::atomic<bool>>(false);
    client.session->sendMessage(category, type, event, 0, completion(client.seen, refusedAtOnce));
    ++(*refusedAtOnce ? client.seen->refused : client.seen->accepted);
    if (!*refusedAtOnce && tooLarge) ++client.seen->tooLarge;
  }
  void sendSingle() {
    auto [category, type] = nextNumber();
    if (chance(10)) category = 70000;
    const auto refusedAtOnce = std::make_shared<std::atomic<bool>>(false);
    KYTReporting::sendSingleMessage(options(), category, type, Dictionary(),
                                    completion(singles_, refusedAtOnce));
    ++(*refusedAtOnce ? singles_->refused : singles_->accepted);
  }

  // Nothing is in motion once the figures close: what is accepted was counted by the test when the call returned.
  void checkAtRest(Client& client) {
    Statistics figures;
    EXPECT_TRUE(eventually([&] { return closes(figures = client.session->statistics()); }))
        << describe(figures);
    EXPECT_EQ(figures.accepted, client.seen->accepted) << describe(figures);
    EXPECT_EQ(refused(figures), client.seen->refused) << describe(figures);
    EXPECT_LE(figures.droppedUnsendable, client.seen->tooLarge) << describe(figures);
    if (!client.mayExpire) {
      EXPECT_EQ(figures.droppedTooLate, 0U) << describe(figures);
    }
    EXPECT_LE(figures.droppedTooLate, figures.waitedTooLong) << describe(figures);
  }
  void end(Client& client) {
    if (chance(50)) static_cast<void>(client.session->finish(milliseconds(number(0, 200))));
    checkAtRest(client);
    all_.accepted += client.seen->accepted;
    all_.refused += client.seen->refused;
    all_.tooLarge += client.seen->tooLarge;
    client.session.reset();
    EXPECT_EQ(client.seen->completions, client.seen->asked) << "each runs once";
    all_.lateAnswers += client.seen->lateAnswers;
    clients_.erase(clients_.begin() + (&client - clients_.data()));
  }

  void checkTotals() {
    // Single messages end by themselves.
    ASSERT_TRUE(eventually([&] { return singles_->completions == singles_->asked; }));
    Statistics total;
    EXPECT_TRUE(eventually([&] {
      total = totalSince(before_);
      return total.queued == 0 && closes(total);
    })) << describe(total);
    EXPECT_EQ(total.accepted, all_.accepted + singles_->accepted) << describe(total);
    EXPECT_EQ(refused(total), all_.refused + singles_->refused) << describe(total);
    EXPECT_EQ(total.droppedTooLate, all_.lateAnswers + singles_->lateAnswers) << describe(total);
    std::multiset<std::string> arrived;
    for (const std::string& call : daemon_.calls())
      if (call.starts_with("Send ") || call.starts_with("Single ")) arrived.insert(call);
    EXPECT_EQ(std::set<std::string>(arrived.begin(), arrived.end()).size(), arrived.size())
        << "none comes twice";
    EXPECT_LE(total.sent, arrived.size()) << describe(total);
    EXPECT_GE(total.sent + total.lostOnConnectionEnd, arrived.size()) << describe(total);
  }

  const std::string kMegabyte = std::string(1 << 20, 'x');
  const Statistics before_ = KYTReporting::totalStatistics();
  std::mt19937 random_;
  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
  TestDaemon daemon_{socket_};
  bool runs_ = false;
  std::vector<Client> clients_;
  std::shared_ptr<Seen> singles_ = std::make_shared<Seen>();
  Seen all_;
  uint32_t lastNumber_ = 0;
};

TEST(StatisticsOfRandomSessions, CloseWhateverHappens) {
  RandomRuns("KYT_STATISTICS", 25).each([](unsigned seed) { RandomRun(seed).go(); });
}

class ClientStatistics : public testing::Test {
 protected:
  KYTReporting::Options options() const {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {{kKYTReportingSessionInfoSessionID, 42}, {kKYTReportingSessionInfoClientType, 7}};
    return made;
  }

  TemporaryFolder folder_;
  const std::string socket_ = folder_ / "socket";
};

// A daemon that takes the connection and acknowledges nothing.
class MuteDaemon {
 public:
  explicit MuteDaemon(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    listener_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    EXPECT_EQ(bind(listener_, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(listen(listener_, 4), 0);
    thread_ = std::thread([this] { serve(); });
  }
  ~MuteDaemon() { hangUp(); }
  void hangUp() {
    if (!thread_.joinable()) return;
    shutdown(listener_, SHUT_RDWR);  // where nobody came
    shutdown(peer_.load(), SHUT_RDWR);
    thread_.join();
    close(listener_);
  }

 private:
  void serve() {
    const int peer = accept4(listener_, nullptr, nullptr, SOCK_CLOEXEC);
    if (peer < 0) return;
    peer_ = peer;
    constexpr std::string_view kTaken = "OK 0123456789abcdef0123456789abcdef\r\nAGREE_UNIX_FD\r\n";
    EXPECT_EQ(write(peer, kTaken.data(), kTaken.size()), static_cast<ssize_t>(kTaken.size()));
    char buffer[65536];
    while (read(peer, buffer, sizeof buffer) > 0) {
    }
    close(peer);
  }
  int listener_ = -1;
  std::atomic<int> peer_{-1};
  std::thread thread_;
};

TEST_F(ClientStatistics, TheEndOfAConnectionLosesAtMostAWindowOfMessages) {
  MuteDaemon daemon(socket_);
  KYTReporting::Options wide = options();
  wide.maxQueuedMessages = 65536;
  wide.maxQueuedBytes = 64U << 20;
  const auto session = KYTReporting::open(std::move(wide));
  constexpr uint64_t kMore = 1000;
  for (uint64_t i = 0; i < KYTReporting::kMostUnacknowledged + kMore; ++i)
    ASSERT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_TRUE(eventually([&] { return session->statistics().queued <= kMore; }));
  EXPECT_EQ(session->statistics().sent, KYTReporting::kMostUnacknowledged);
  daemon.hangUp();
  EXPECT_TRUE(eventually([&] { return session->statistics().lostOnConnectionEnd > 0; }));
  const Statistics figures = session->statistics();
  EXPECT_EQ(figures.lostOnConnectionEnd, KYTReporting::kMostUnacknowledged);
  EXPECT_EQ(figures.sent, 0U);
  EXPECT_EQ(figures.queued, kMore);
}

TEST_F(ClientStatistics, AWindowThatIsAcknowledgedNeverStops) {
  TestDaemon daemon(socket_);
  ASSERT_TRUE(daemon.start());
  const auto session = KYTReporting::open(options());
  uint64_t taken = 0;
  while (taken < 3 * KYTReporting::kMostUnacknowledged) {
    if (session->sendMessage(1, 1, {}))
      ++taken;
    else
      std::this_thread::yield();
  }
  EXPECT_TRUE(session->finish(kTestDeadline));
  EXPECT_EQ(session->statistics().sent, taken);
  EXPECT_EQ(daemon.count("Send"), taken);
}

TEST_F(ClientStatistics, TellWrittenMessagesFromQueuedOnesWhenASessionEnds) {
  MuteDaemon daemon(socket_);
  auto session = KYTReporting::open(options());
  const Statistics before = KYTReporting::totalStatistics();
  ASSERT_TRUE(session->sendMessage(1, 1, {}));
  ASSERT_TRUE(eventually([&] { return session->statistics().sent == 1; }));
  daemon.hangUp();
  ASSERT_TRUE(eventually([&] { return session->statistics().lostOnConnectionEnd == 1; }));
  ASSERT_TRUE(session->sendMessage(1, 2, {}));
  std::atomic<int> errors{0};
  session->sendMessage(1, 3, {}, 0, [&](const Value&, const auto& error) { errors += error ? 1 : 0; });
  EXPECT_EQ(session->statistics().queued, 2U);
  session.reset();
  EXPECT_EQ(errors, 1);
  const Statistics since = totalSince(before);
  EXPECT_EQ(since.lostOnConnectionEnd, 1U);
  EXPECT_EQ(since.lostInQueue, 2U);
  EXPECT_EQ(since.accepted, 3U);
  EXPECT_EQ(since.sent, 0U);
}

TEST_F(ClientStatistics, CountAMessageWithACompletionThatIsTooLarge) {
  TestDaemon daemon(socket_);
  ASSERT_TRUE(daemon.start());
  const auto session = KYTReporting::open(options());
  std::promise<std::optional<Error>> told;
  session->sendMessage(1, 1, {{"text", std::string(1 << 20, 'x')}}, 0,
                       [&](const Value&, std::optional<Error> error) { told.set_value(std::move(error)); });
  const auto error = answerOf(told);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, static_cast<int32_t>(ClientError::invalid));
  const Statistics figures = session->statistics();
  EXPECT_EQ(figures.accepted, 1U);
  EXPECT_EQ(figures.droppedUnsendable, 1U);
  EXPECT_EQ(figures.sent, 0U);
}

TEST_F(ClientStatistics, CountNoCallsAsMessages) {
  const auto session = KYTReporting::open(options());
  session->startConfiguration();
  session->flush();
  session->updateSharedData({{"x", 1}});
  EXPECT_EQ(session->statistics().accepted, 0U);
  EXPECT_EQ(session->statistics().queued, 0U);
}

TEST_F(ClientStatistics, OfTheProcessAreToldInCToo) {
  const Statistics before = KYTReporting::totalStatistics();
  const auto session = KYTReporting::open(options());
  ASSERT_TRUE(session->sendMessage(1, 1, {}));
  EXPECT_FALSE(session->sendMessage(70000, 1, {}));
  kyt_statistics figures{};
  kyt_total_statistics(&figures);
  EXPECT_EQ(figures.accepted, before.accepted + 1);
  EXPECT_EQ(figures.queued, before.queued + 1);
  EXPECT_EQ(figures.dropped_invalid, before.droppedInvalid + 1);
  kyt_total_statistics(nullptr);
}

#ifndef KYT_NO_FORK_TEST
TEST_F(ClientStatistics, BeginAtZeroInAForkedChild) {
  auto session = KYTReporting::open(options());
  ASSERT_TRUE(session->sendMessage(1, 1, {}));
  const pid_t child = fork();
  if (child == 0) {
    alarm(static_cast<unsigned>(kTestDeadline.count()));
    const bool inert = !session->sendMessage(1, 1, {});
    session.reset();
    const Statistics own = KYTReporting::totalStatistics();
    _exit(inert && own.accepted == 0 && own.droppedClosed == 0 ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}
#endif

}  // namespace
}  // namespace kyt
