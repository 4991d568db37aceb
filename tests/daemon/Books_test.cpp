// Do the books close? Random sessions, storebags and faults on a network in memory: each event of which a request is made
// carries a number, so the test knows by itself, for each program and back end, what was taken, what a server answered to
// it, and what is still out. A run is told by its seed; KYT_BOOKS_RUNS says how many there are, KYT_BOOKS_SEED the first.
#include <gtest/gtest.h>

#include <cstdlib>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <variant>
#include <vector>

#include "backends/BackendTable.h"
#include "config/StorebagFetcher.h"
#include "daemon/ReportingdAgent.h"
#include "platform/base/Books.h"
#include "platform/fake/FakeProcessTransaction.h"
#include "platform/ipc/fake/FakeListener.h"
#include "platform/objects/Keys.h"
#include "session/ReportingdSession.h"
#include "session/ReportingdSessionClass.h"
#include "tests/support/RandomRuns.h"
#include "tests/support/RecordingMessageLog.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

constexpr int kWithQDX = 7, kWithoutQDX = 20, kWithoutStorebag = 2;

// Of one program and back end, as the test knows it.
struct Expected {
  uint64_t taken = 0, delivered = 0, open = 0;
  std::map<Reason, uint64_t> lost;  // by what became of requests
};
struct Place {
  ReportingProgram program;
  std::string backEnd;
  friend auto operator<=>(const Place&, const Place&) = default;
};

class RandomRun {
 public:
  explicit RandomRun(unsigned seed) : random_(seed) {
    test_.log.setLevel(LogLevel::error);
    test_.deflate.faults.noStream = true;  // bodies are read here
    test_.clientBundle.setResource("publicKey", "der", testPublicKey());
    test_.consent.setAllowed(chance(80));
    test_.deviceProperties.setCountryCode("US");
    test_.pluginBundles.present = chance(50);
    if (chance(20)) test_.limits.maxBatchBytes = 3000;
    if (chance(20)) test_.budget.shares()[Share::bytes] = 60000;
    if (chance(20)) test_.budget.shares()[Share::requestBytes] = 30000;
    serve();
    listener_.setDelegate(agent_);
    listener_.resume();
  }

  ~RandomRun() {
    for (Client& client : clients_) client.connection->invalidateNow();
    test_.executor.runAll();
  }

  void go() {
    const int steps = number(20, 90);
    for (int i = 0; i < steps; ++i) {
      step();
      if (chance(30)) check();
      if (::testing::Test::HasFailure()) return;
    }
    chance(50) ? endDaemon() : endQuietly();
    check();
    for (const BookRow& row : test_.books.snapshot()) EXPECT_EQ(row.pending(), 0U) << describeRow(row);
  }

 private:
  struct Client {
    std::shared_ptr<FakeConnection> connection;
    std::shared_ptr<ReportingdSession> session;
    ReportingProgram program;
    bool requiresInfo = false;
  };
  struct Answer {
    FakeURLSessionFactory::Reply reply;
    std::optional<Reason> lost;
  };

  bool chance(int percent) { return number(1, 100) <= percent; }
  int number(int from, int to) { return std::uniform_int_distribution<int>(from, to)(random_); }

  Dictionary entry(const char* host) {
    const std::string address = std::string("https://") + host + ".example.org/events";
    Dictionary entry{{"event_threshold", number(0, 6)}};
    if (chance(90)) entry.set("post_url", address);
    if (chance(50)) entry.set("realtime_post_url", address + "/now");
    if (chance(90)) entry.set("sampling_threshold", chance(80) ? 1.0 : 0.5);
    if (chance(95)) entry.set("filters", Array{});
    if (chance(95)) entry.set("locale_whitelist", Array{chance(95) ? "US" : "FR"});
    if (chance(30)) entry.set("override_dnu", 1);
    if (chance(20)) entry.set("expedite", number(0, 1));
    if (chance(30)) entry.set("event_whitelist", Array{0, 1, 2, 3});
    if (chance(30)) entry.set("event_blacklist", Array{2});
    if (chance(30)) entry.set("client", "a");
    return entry;
  }
  Dictionary clientsOf(const char* host) { return {{"clients", Array{entry(host)}}}; }

  void serve() {
    Dictionary table;
    if (chance(90)) table.set("httppost", clientsOf("httppost"));
    if (chance(50)) table.set("httppost2", clientsOf("httppost2"));
    if (chance(20)) table.set("qrs", clientsOf("qrs"));
    if (chance(20)) table.set("uploadserver", Dictionary{{"post_url", "https://files.example.org"}});
    if (chance(20)) table.set("ampyx", Dictionary());
    if (chance(20)) table.set("qdx", Dictionary());
    if (chance(20)) table.set("dashboard", Dictionary{{"ip", "127.0.0.1"}, {"port", 9}});
    FakeURLSessionFactory::Reply bag;
    if (chance(90)) {
      for (const auto& entry : table) table_.push_back(entry.key.str());
      bag.body = signedBag(releaseBag(table), test_.propertyLists);
    } else {
      table_ = {"qdx"};  // the one that is built in
      bag.error = Error{kKYTURLErrorDomain, 6, "no such host"};
    }
    test_.urlSessions.setResponder(
        [bag](const URLRequest& request) -> std::optional<FakeURLSessionFactory::Reply> {
          if (request.method == "GET") return bag;
          return std::nullopt;
        });
  }

  void step() {
    const int what = number(1, 100);
    if (clients_.empty() || what <= 8) return connect();
    Client& client = clients_[static_cast<size_t>(number(0, static_cast<int>(clients_.size()) - 1))];
    if (what <= 50) return send(client);
    if (what <= 56) return changeNames(client);
    if (what <= 62)
      return client.connection->call([](auto& s) { s.flushMessagesWithCompletion(nullptr); }), void();
    if (what <= 66) return configure(client);
    if (what <= 72) return sendSingle(client);
    if (what <= 76) return kill(client);
    if (what <= 78) return test_.consent.setAllowed(chance(50));
    if (what <= 84) return wait();
    if (what <= 90) return void(test_.executor.runOne());
    answerOne();
  }

  void connect() {
    test_.random.setDraw(static_cast<uint32_t>(number(0, 100)));
    Client client;
    client.program.user = chance(70) ? 1000 : 1001;
    client.connection =
        std::make_shared<FakeConnection>(SerialQueue::create("client", test_.executor), client.program.user);
    client.connection->setEntitlement(kEntitlement, true);
    if (chance(50)) client.connection->setUserAccount(test_.budget.account(client.program.user));
    if (!listener_.connect(client.connection)) return;
    client.session = std::static_pointer_cast<ReportingdSession>(client.connection->exportedObject());
    clients_.push_back(std::move(client));
    if (chance(90)) identify(clients_.back());
    if (chance(85)) configure(clients_.back());
  }
  Dictionary names(ReportingProgram& program) {
    program.clientName = chance(70) ? "a" : "b";
    program.service = chance(70) ? "s" : "t";
    return {{kKYTReportingUserInfoClientName, program.clientName},
            {kKYTReportingUserInfoServiceName, program.service}};
  }
  void identify(Client& client) {
    client.program.clientType = chance(5) ? kWithoutStorebag : chance(60) ? kWithQDX : kWithoutQDX;
    client.requiresInfo = chance(50);
    Dictionary info{{kKYTReportingSessionInfoSessionID, 1U},
                    {kKYTReportingSessionInfoClientType, client.program.clientType},
                    {kKYTReportingSessionInfoBatchEvent, chance(70)},
                    {kKYTReportingSessionInfoRequireUserInfo, client.requiresInfo}};
    std::optional<Dictionary> userInfo;
    if (chance(50)) userInfo = names(client.program);
    client.connection->call([&](auto& s) { s.setSessionInfo(info, userInfo, nullptr, false); });
  }
  void configure(Client& client) {
    client.connection->call([](auto& s) { s.startConfigWithCompletionHandler(nullptr); });
  }
  void changeNames(Client& client) {
    const Dictionary info = names(client.program);
    client.connection->call([&](auto& s) { s.fetchStatesWithUserInfo(info, nullptr); });
  }

  void expectTaken(const ReportingProgram& program, const std::vector<std::string>& backEnds) {
    for (const std::string& name : backEnds) ++expected_[{program, name}].taken;
    if (backEnds.empty()) ++expected_[{program, std::string(kNoBackEnd)}].taken;
  }
  Dictionary payload(const ReportingProgram& program) {
    programs_.push_back(program);
    return {{"number", static_cast<unsigned>(programs_.size() - 1)}, {"text", std::string(40, 'x')}};
  }

  void send(Client& client) {
    for (int left = number(1, 8); left > 0; --left) {
      Dictionary message{{kKYTReportingMessageParametersPayload, payload(client.program)},
                         {kKYTReportingMessageParametersFlag, chance(70) ? 0 : number(0, 3)}};
      const bool complete = chance(97);
      message.set(kKYTReportingMessageParametersCategory, number(0, 4));
      if (complete) message.set(kKYTReportingMessageParametersType, number(0, 2));
      std::vector<std::string> backEnds;
      for (const std::string& name : table_)
        if (complete && client.session->backendForKey(name) != nullptr) backEnds.push_back(name);
      expectTaken(client.program, backEnds);
      client.connection->call([&](auto& s) { s.sendMessageWithDictionary(message, nullptr); });
    }
  }

  // The session takes the identity over.
  void sendSingle(Client& client) {
    const bool identified = chance(95);
    Dictionary info{{kKYTReportingSessionInfoSessionID, 2U},
                    {kKYTReportingSessionInfoRequireUserInfo, chance(60)}};
    if (identified) {
      client.program.clientType = chance(5) ? kWithoutStorebag : chance(50) ? kWithQDX : kWithoutQDX;
      info.set(kKYTReportingSessionInfoClientType, client.program.clientType);
    }
    Dictionary userInfo;
    if (identified) userInfo = names(client.program);
    std::vector<std::string> backEnds;
    if (identified && client.program.clientType != kWithoutStorebag)
      for (const std::string& name : table_)
        if (name != "qdx" || client.program.clientType == kWithQDX) backEnds.push_back(name);
    expectTaken(client.program, backEnds);
    const Dictionary event = payload(client.program);
    client.connection->call([&](auto& s) {
      s.sendMessageWithSessionInfo(info, userInfo, static_cast<uint16_t>(number(0, 4)), 1, event, nullptr);
    });
  }

  void kill(Client& client) {
    client.connection->invalidateNow();
    const size_t index = static_cast<size_t>(&client - clients_.data());
    clients_.erase(clients_.begin() + static_cast<std::ptrdiff_t>(index));
  }

  // The network.
  std::vector<size_t> openPosts() const {
    std::vector<size_t> open;
    for (size_t i = 0; i < test_.urlSessions.requestCount(); ++i)
      if (test_.urlSessions.isOpen(i)) open.push_back(i);
    return open;
  }
  void wait() {
    const std::vector<size_t> open = openPosts();
    if (open.empty()) return;
    const size_t index = open[static_cast<size_t>(number(0, static_cast<int>(open.size()) - 1))];
    waiting_[index] = !waiting_[index];
    test_.urlSessions.setWaiting(index, waiting_[index]);
  }
  Answer anyAnswer() {
    const auto status = [](int number, std::optional<Reason> lost) {
      FakeURLSessionFactory::Reply reply;
      reply.status = number;
      return Answer{reply, lost};
    };
    const auto error = [](int32_t code, Reason lost) {
      FakeURLSessionFactory::Reply reply;
      reply.error = Error{kKYTURLErrorDomain, code, "a fault"};
      return Answer{reply, lost};
    };
    constexpr int kReset = 56, kTimeout = 28;
    switch (number(1, 16)) {
      case 1:
        return status(404, Reason::postRefused);
      case 2:
        return status(503, Reason::postRefused);
      case 3:
        return status(302, Reason::postRedirected);
      case 4:
        return error(kReset, Reason::postFailed);
      case 5:
        return error(kTimeout, Reason::postFailed);
      case 6:
        return error(kURLErrorWaitingTooMuch, Reason::postDisplaced);
      default:
        return status(chance(80) ? 200 : 204, std::nullopt);
    }
  }
  void answerOne() {
    const std::vector<size_t> open = openPosts();
    if (open.empty()) return;
    const size_t index = open[static_cast<size_t>(number(0, static_cast<int>(open.size()) - 1))];
    Answer answer = anyAnswer();
    outcomes_[index] = answer.lost;
    test_.urlSessions.answer(index, std::move(answer.reply));
  }

  void endQuietly() {
    while (!clients_.empty()) kill(clients_.front());
    while (!openPosts().empty()) answerOne();
  }
  // As the composition root does it, the grace time over.
  void endDaemon() {
    listener_.stopAccepting();
    test_.urlSessions.cancelAwaited();
    agent_.finishAllSessions();
    test_.executor.runAll();
    for (int left = number(0, 5); left > 0; --left) answerOne();
    readRequests();  // what found no room until now was not cancelled
    cancelled_ = true;
    test_.urlSessions.cancelAll();
  }

  // What is known of the requests: read anew each time, since there are few.
  void readRequests() {
    for (auto& [place, numbers] : expected_) numbers.delivered = numbers.open = 0, numbers.lost.clear();
    internalDelivered_ = internalLost_ = internalOpen_ = 0;
    for (size_t i = 0; i < test_.urlSessions.requestCount(); ++i) {
      const URLRequest request = test_.urlSessions.request(i);
      if (request.method == "GET") continue;
      const bool open = test_.urlSessions.isOpen(i);
      std::optional<Reason> lost;
      if (const auto outcome = outcomes_.find(i); outcome != outcomes_.end()) {
        lost = outcome->second;
      } else if (!open) {
        lost = cancelled_ ? Reason::postCancelled : Reason::postWithoutRoom;
        outcomes_[i] = lost;
      }
      const std::string host = request.url.substr(8, request.url.find('.') - 8);
      const Value body = std::get<Value>(test_.json.parse(request.body.view()));
      for (const Value& record : *body.dictionary()->find("events")->array()) {
        const Value* tag = record.dictionary()->find("number");
        Expected internal;
        Expected& numbers =
            tag != nullptr ? expected_[{programs_.at(tag->unsignedIntValue()), host}] : internal;
        if (open)
          ++numbers.open;
        else if (lost)
          ++numbers.lost[*lost];
        else
          ++numbers.delivered;
        internalOpen_ += internal.open;
        internalDelivered_ += internal.delivered;
        for (const auto& [reason, events] : internal.lost) internalLost_ += events;
      }
    }
  }

  void check() {
    while (test_.executor.runAll() != 0) {
    }
    readRequests();
    constexpr Reason kByAnswer[] = {Reason::postRefused,   Reason::postRedirected,  Reason::postFailed,
                                    Reason::postDisplaced, Reason::postWithoutRoom, Reason::postCancelled};
    std::array<uint64_t, kFates.size()> dropped{};
    uint64_t internalDelivered = 0, internalLost = 0, internalOpen = 0;
    std::map<Place, Expected> left = expected_;
    for (const BookRow& row : test_.books.snapshot()) {
      SCOPED_TRACE(describeRow(row));
      EXPECT_EQ(row.queued, 0U) << "nothing is in motion";
      EXPECT_EQ(row.taken, row.pending() + row.delivered + row.droppedInAll());
      EXPECT_LE(row.batched, row.taken);
      for (size_t i = 0; i < kFates.size(); ++i) dropped[i] += row.dropped[i];
      if (row.isInternal) {
        internalDelivered += row.delivered;
        internalOpen += row.inFlight + row.waiting;
        for (const Reason fate : kByAnswer) internalLost += row.droppedFor(fate);
        continue;
      }
      const auto known = left.find({row.program, row.backEnd});
      ASSERT_NE(known, left.end()) << "nobody sent it";
      const Expected& numbers = known->second;
      EXPECT_EQ(row.taken, numbers.taken);
      EXPECT_EQ(row.inFlight + row.waiting, numbers.open);
      if (row.backEnd != "qdx") {
        EXPECT_EQ(row.delivered, numbers.delivered);
      }
      for (const Reason fate : kByAnswer) {
        const auto lost = numbers.lost.find(fate);
        EXPECT_EQ(row.droppedFor(fate), lost != numbers.lost.end() ? lost->second : 0) << reasonName(fate);
      }
      left.erase(known);
    }
    for (const auto& [place, numbers] : left)
      EXPECT_EQ(numbers.taken, 0U) << place.program.clientName << " " << place.backEnd << " has no row";
    EXPECT_EQ(internalOpen, internalOpen_);
    EXPECT_EQ(internalLost, internalLost_);
    EXPECT_EQ(internalDelivered, internalDelivered_ + qdxInternal());
    for (size_t i = 0; i < kFates.size(); ++i)
      EXPECT_EQ(dropped[i], test_.counters.value(kFates[i])) << reasonName(kFates[i]);
    uint64_t waiting = 0;
    for (const BookRow& row : test_.books.snapshot()) waiting += row.waiting;
    EXPECT_EQ(waiting, eventsThatWait());
  }
  uint64_t eventsThatWait() const {
    uint64_t events = 0;
    for (const auto& [index, waits] : waiting_)
      if (waits && test_.urlSessions.isOpen(index)) events += test_.urlSessions.request(index).events->size();
    return events;
  }
  // Start and stop messages that the adaptor got. What it got is delivered.
  uint64_t qdxInternal() const {
    uint64_t all = test_.pluginBundles.state->calls.size();
    for (const BookRow& row : test_.books.snapshot())
      if (row.backEnd == "qdx" && !row.isInternal) all -= row.delivered;
    return all;
  }

  std::mt19937 random_;
  TestPlatform test_;
  DefaultBackendFactory factory_{test_.configuration, backendTable(test_.configuration)};
  RecordingMessageLog messageLog_;
  Mutex backendClassLock_;
  StorebagFetcher fetcher_{test_.configuration, backendClassLock_};
  ReportingdSessionClass class_{test_.configuration, factory_, messageLog_};
  FakeProcessTransaction transaction_;
  ReportingdAgent agent_{test_.configuration, fetcher_, class_, transaction_};
  FakeListener listener_;

  std::vector<Client> clients_;
  std::vector<std::string> table_;
  bool cancelled_ = false;
  std::vector<ReportingProgram> programs_;  // of each numbered event
  std::map<Place, Expected> expected_;
  std::map<size_t, std::optional<Reason>> outcomes_;  // of requests
  std::map<size_t, bool> waiting_;
  uint64_t internalDelivered_ = 0, internalLost_ = 0, internalOpen_ = 0;
};

TEST(BooksOfRandomSessions, CloseWhateverHappens) {
  RandomRuns("KYT_BOOKS", 150).each([](unsigned seed) { RandomRun(seed).go(); });
}

}  // namespace
}  // namespace kyt
