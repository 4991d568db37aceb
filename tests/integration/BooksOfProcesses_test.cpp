// Do the books of daemon and client library close, and do they join, between real processes? Each run has a daemon, a
// server and some client processes of its own, and faults: refused, reset and hanging posts, servers and networks that are
// not there, killed clients, full limits, a consent that is withdrawn, the daemon's end at any moment. A run is told by its
// seed; KYT_PROCESS_BOOKS_RUNS says how many there are, KYT_PROCESS_BOOKS_SEED the first.
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <map>
#include <optional>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "platform/base/Counters.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"
#include "tests/support/RandomRuns.h"
#include "tests/support/Sanitizers.h"
#include "tools/demo/ChildProcess.h"

#ifndef KYT_NO_FORK_TEST

namespace kyt {
namespace {

using std::chrono::milliseconds;

constexpr int kWithStorebag = 20, kWithoutStorebag = 2;

class Draw {
 public:
  explicit Draw(unsigned seed) : random_(seed) {}
  int number(int from, int to) { return std::uniform_int_distribution<int>(from, to)(random_); }
  bool chance(int percent) { return number(1, 100) <= percent; }
  void pause(int most) {
    for (int left = number(0, most); left > 0; left -= 5) tools::briefPause();
  }

 private:
  std::mt19937 random_;
};

// One client process: some sessions one after another, or at once.
class ClientProgram {
 public:
  ClientProgram(unsigned seed, std::string socket, std::string name)
      : draw_(seed), socket_(std::move(socket)), name_(std::move(name)) {}

  KYTReporting::Statistics run() {
    for (int sessions = draw_.number(1, 3); sessions > 0; --sessions) {
      auto session = KYTReporting::open(options());
      if (draw_.chance(90)) session->startConfiguration();
      for (int bursts = draw_.number(1, 12); bursts > 0; --bursts) burst(*session);
      // Most say goodbye. Where the daemon has ended for good it waits for the time.
      if (draw_.chance(85)) static_cast<void>(session->finish(milliseconds(draw_.number(0, 1500))));
    }
    // Single messages end by themselves.
    static_cast<void>(eventually([] { return KYTReporting::totalStatistics().queued == 0; }));
    return KYTReporting::totalStatistics();
  }

 private:
  KYTReporting::Options options() {
    KYTReporting::Options made;
    made.socketPath = socket_;
    made.sessionInfo = {
        {kKYTReportingSessionInfoSessionID, draw_.number(1, 1 << 30)},
        {kKYTReportingSessionInfoClientType, draw_.chance(95) ? kWithStorebag : kWithoutStorebag},
        {kKYTReportingSessionInfoBatchEvent, draw_.chance(80)},
        {kKYTReportingSessionInfoRequireUserInfo, draw_.chance(80)}};
    made.userInfo = Dictionary{{kKYTReportingUserInfoClientName, std::string_view(name_)},
                               {kKYTReportingUserInfoServiceName, "test"}};
    if (draw_.chance(20)) made.maxQueuedMessages = 64;
    made.callDeadline = milliseconds(500);
    return made;
  }
  void burst(KYTReporting& session) {
    for (int left = draw_.number(1, draw_.chance(10) ? 500 : 30); left > 0; --left) {
      const auto category = static_cast<uint32_t>(draw_.number(1, 4));
      Dictionary event{{"text", std::string(static_cast<size_t>(draw_.number(0, 200)), 'x')}};
      const uint32_t flag = draw_.chance(95) ? 0 : static_cast<uint32_t>(draw_.number(1, 3));
      if (draw_.chance(97))
        static_cast<void>(session.sendMessage(category, 1, std::move(event), flag));
      else if (draw_.chance(50))
        session.sendMessage(category, 1, std::move(event), flag, [](const Value&, const auto&) {});
      else
        KYTReporting::sendSingleMessage(options(), category, 1, std::move(event),
                                        [](const auto&, const auto&) {});
    }
    if (draw_.chance(20)) session.flush();
    draw_.pause(60);
  }

  Draw draw_;
  const std::string socket_, name_;
};

// A row of the daemon's books, as it logs it.
struct LoggedRow {
  std::string client, backEnd;
  bool isInternal = false;
  std::map<std::string, uint64_t> figures;
  uint64_t at(const std::string& figure) const {
    const auto found = figures.find(figure);
    return found != figures.end() ? found->second : 0;
  }
};

class BooksOfProcesses : public StageTest {
 protected:
  // What the runs were worth.
  void printSums(unsigned runs, unsigned first) const {
    std::printf("%u runs from seed %u", runs, first);
    for (const auto& [what, events] : sums_)
      if (events != 0) std::printf("; %s %llu", what.c_str(), static_cast<unsigned long long>(events));
    std::printf("\n");
  }

  struct Client {
    pid_t process = -1;
    int report = -1;
    std::string name;
    bool isKilled = false;
    std::optional<KYTReporting::Statistics> told;
  };

  void run(unsigned seed) {
    Draw draw(seed);
    tools::Stage::Options options;
    options.consent = draw.chance(80);
    options.logLevel = "debug";  // the books are among the last lines
    isCalm_ = draw.chance(35);
    options.extraSettings = settings(draw);
    lay(std::move(options));
    ASSERT_FALSE(HasFatalFailure());
    putBags(draw);
    startDaemon();
    ASSERT_FALSE(HasFatalFailure());
    std::vector<Client> clients = startClients(draw);
    const bool endsMeanwhile = !isCalm_ && draw.chance(60);
    for (int faults = draw.number(2, 25); faults > 0; --faults) {
      fault(draw, clients);
      draw.pause(80);
    }
    if (endsMeanwhile) endDaemon();
    for (Client& client : clients) collect(client);
    if (!endsMeanwhile) endDaemon();
    check(clients);
    stage_.reset();
  }

 private:
  std::string settings(Draw& draw) const {
    const int grace = isCalm_ ? 25 : draw.number(1, 3);
    std::string text = "[service]\nshutdown_grace_seconds = " + std::to_string(grace) + "\n";
    std::string limits;
    if (draw.chance(20)) limits += "max_batch_bytes = " + std::to_string(draw.number(2, 20) * 1024) + "\n";
    if (draw.chance(20)) limits += "max_bytes_per_user = 1048576\n";
    return limits.empty() ? text : text + "[limits]\n" + limits;
  }

  Dictionary anyEntry(Draw& draw, const std::string& name) {
    Dictionary made = entry(name);
    made.set("event_threshold", draw.number(1, 60));
    if (draw.chance(10)) made.remove("post_url");
    if (draw.chance(10)) made.set("sampling_threshold", 0.3);
    if (draw.chance(5)) made.set("locale_whitelist", Array{"FR"});
    if (draw.chance(15)) made.set("override_dnu", 1);
    if (draw.chance(15)) made.set("expedite", 1);
    if (draw.chance(15)) made.set("event_whitelist", Array{0, 1, 2, 3});
    if (draw.chance(15)) made.set("event_blacklist", Array{2});
    if (draw.chance(10)) made.set("post_url", "https://127.0.0.1:1/nobody");
    if (draw.chance(10) && !isCalm_) made.set("post_url", "https://[2001:db8::1]/no-network");
    return made;
  }
  void putBags(Draw& draw) {
    if (draw.chance(5)) return;  // … and there is none
    Array entries;
    for (int i = 0; i < 8; ++i)
      if (draw.chance(90)) entries.append(anyEntry(draw, "program" + std::to_string(i)));
    putBag("cadmor", entries);
  }

  std::vector<Client> startClients(Draw& draw) {
    std::vector<Client> clients(static_cast<size_t>(draw.number(1, 5)));
    int number = 0;
    for (Client& client : clients) {
      client.name = "program" + std::to_string(number++);
      const auto seed = static_cast<unsigned>(draw.number(0, 1 << 30));
      int ends[2];
      EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
      client.process = fork();
      if (client.process == 0) {
        alarm(static_cast<unsigned>(4 * kTestDeadline.count()));
        const KYTReporting::Statistics told = ClientProgram(seed, socket(), client.name).run();
        _exit(write(ends[1], &told, sizeof told) == sizeof told ? 0 : 1);
      }
      close(ends[1]);
      client.report = ends[0];
    }
    return clients;
  }
  static void collect(Client& client) {
    KYTReporting::Statistics told;
    if (read(client.report, &told, sizeof told) == sizeof told) client.told = told;
    close(client.report);
    int status = 0;
    waitpid(client.process, &status, 0);
    if (!client.isKilled) {
      EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << client.name << ": " << status;
    }
  }

  void fault(Draw& draw, std::vector<Client>& clients) {
    const char* replies[] = {
        R"({"path":"/events","status":503,"times":1})",  R"({"path":"/events","status":404,"times":3})",
        R"({"path":"/events","status":302,"times":1})",  R"({"path":"/events","close":true,"times":2})",
        R"({"path":"/events","delayMs":200,"times":5})", R"({"path":"/bags","close":true,"times":1})",
        R"({"path":"/events","hang":true,"times":1})"};
    const int what = draw.number(1, 100);
    if (what <= 60) return void(stage_->control("/control/reply", replies[draw.number(0, isCalm_ ? 5 : 6)]));
    if (what <= 75) return void(kytctl({"consent", draw.chance(50) ? "withdraw" : "grant"}));
    if (what <= 80) {
      Client& client = clients[static_cast<size_t>(draw.number(0, static_cast<int>(clients.size()) - 1))];
      client.isKilled = true;
      ::kill(client.process, SIGKILL);
    }
  }

  void endDaemon() {
    const std::optional<int> status = stage_->stopDaemon(std::chrono::seconds(30));
    EXPECT_EQ(status.value_or(-1), 0) << daemonLog();
  }

  // "… shutDown: books: user=1000 … back-end=httppost internal taken=5 …"
  std::vector<LoggedRow> rows() const {
    std::vector<LoggedRow> all;
    std::istringstream log(daemonLog());
    for (std::string line; std::getline(log, line);) {
      const size_t at = line.find("shutDown: books: ");
      if (at == std::string::npos) continue;
      LoggedRow row;
      std::istringstream words(line.substr(at + 17));
      for (std::string word; words >> word;) {
        const size_t equals = word.find('=');
        const std::string key = word.substr(0, equals);
        const std::string value = equals != std::string::npos ? word.substr(equals + 1) : "";
        if (key == "internal")
          row.isInternal = true;
        else if (key == "client")
          row.client = value.substr(1, value.size() - 2);
        else if (key == "back-end")
          row.backEnd = value;
        else if (key != "user" && key != "type" && key != "service")
          row.figures[key] = std::stoull(value);
      }
      all.push_back(std::move(row));
    }
    return all;
  }
  uint64_t counter(const char* reason) const {
    const std::string log = daemonLog(), line = std::string("shutDown: ") + reason + ": ";
    const size_t at = log.find(line);
    return at != std::string::npos ? std::stoull(log.substr(at + line.size())) : 0;
  }

  void check(const std::vector<Client>& clients) {
    const std::vector<LoggedRow> books = rows();
    std::map<std::string, uint64_t> taken, delivered, lostOnTheWay;
    std::map<std::string, uint64_t> fates;
    for (const LoggedRow& row : books) {
      uint64_t dropped = 0;
      for (const Reason fate : kFates) {
        dropped += row.at(reasonName(fate));
        fates[reasonName(fate)] += row.at(reasonName(fate));
      }
      SCOPED_TRACE(row.client + " " + row.backEnd + (row.isInternal ? " internal" : ""));
      EXPECT_EQ(row.at("dropped"), dropped);
      for (const char* place : {"queued", "batched", "in-flight", "waiting", "outbox"})
        EXPECT_EQ(row.at(place), 0U) << place << ": the daemon has ended";
      EXPECT_EQ(row.at("taken"), row.at("delivered") + dropped);
      if (!row.isInternal) taken[row.client] += row.at("taken");
      delivered[row.client] += row.at("delivered");
      for (const Reason fate :
           {Reason::postRefused, Reason::postFailed, Reason::postRedirected, Reason::postCancelled})
        lostOnTheWay[row.client] += row.at(reasonName(fate));
    }
    for (const auto& [reason, events] : fates) sums_["daemon: " + reason] += events;
    for (const auto& [name, events] : taken) sums_["daemon: taken"] += events;
    for (const auto& [name, events] : delivered) sums_["daemon: delivered"] += events;
    for (const auto& [reason, events] : fates) EXPECT_EQ(counter(reason.c_str()), events) << reason;
    // All was answered, or failed, before the daemon was ended.
    if (isCalm_) {
      EXPECT_EQ(fates[reasonName(Reason::postCancelled)], 0U);
    }
    for (const Client& client : clients) {
      SCOPED_TRACE(client.name);
      const auto there = static_cast<uint64_t>(arrived("client=" + client.name));
      EXPECT_LE(delivered[client.name], there);
      EXPECT_GE(delivered[client.name] + lostOnTheWay[client.name], there);
      if (!client.told) {
        ++sums_["clients killed"];
        continue;
      }
      const KYTReporting::Statistics& told = *client.told;
      EXPECT_EQ(told.queued, 0U);
      EXPECT_EQ(told.accepted, told.sent + told.lostOnConnectionEnd + told.lostInQueue +
                                   told.droppedUnsendable + told.droppedTooLate);
      for (const auto& [name, figure] :
           std::map<std::string, uint64_t>{{"accepted", told.accepted},
                                           {"sent", told.sent},
                                           {"connection-ended", told.lostOnConnectionEnd},
                                           {"session-ended", told.lostInQueue},
                                           {"too-late", told.droppedTooLate},
                                           {"queue-full", told.droppedQueueFull}})
        sums_["library: " + name] += figure;
      EXPECT_LE(told.sent, taken[client.name]);
      EXPECT_GE(told.sent + told.lostOnConnectionEnd, taken[client.name]);
    }
  }

  bool isCalm_ = false;                   // nothing hangs in this run, and the daemon ends last
  std::map<std::string, uint64_t> sums_;  // of all runs
};

TEST_F(BooksOfProcesses, CloseAndJoinWhateverHappens) {
  const RandomRuns runs("KYT_PROCESS_BOOKS", 4);
  runs.each([this](unsigned seed) { run(seed); });
  if (!HasFailure()) printSums(runs.count, runs.first);
}

}  // namespace
}  // namespace kyt
#endif
