#include "kytreporting/FakeDaemon.h"

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>
#include <thread>
#include <utility>
#include <variant>

#include "platform/Entitlements.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/ipc/DBusServer.h"
#include "platform/linux/base/EpollReactor.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/base/UnixSocket.h"
#include "platform/objects/Keys.h"
#include "platform/queues/Log.h"
#include "platform/queues/WorkerPool.h"
#include "testing/Aggregators.h"
#include "testing/FakeSession.h"
#include "testing/Records.h"

namespace kyt::testing {

namespace {

constexpr char kErrorDomain[] = "KYTTestingErrorDomain";
constexpr uint64_t kMostBytesOfAUser = uint64_t{1} << 30;
constexpr uint64_t kMostDescriptors = 65536;
constexpr std::chrono::seconds kPatience{5};

class NoSink final : public LogSink {
 public:
  void write(LogLevel /*level*/, std::string_view /*line*/) override {}
};

std::optional<Array> statesOf(const FakeDaemon::Options& options) {
  if (!options.storebag) return std::nullopt;
  Array states;
  for (const std::string& name : options.live) states.append(name);
  return states;
}

// Empty where none can be made.
std::string makeFolder() {
  std::error_code none;
  std::string pattern = (std::filesystem::temp_directory_path(none) / "kyt-fake-XXXXXX").string();
  return ::mkdtemp(pattern.data()) != nullptr ? pattern : std::string();
}

}  // namespace

class FakeDaemon::Implementation final : private ListenerDelegate, private Entitlements {
 public:
  explicit Implementation(Options options)
      : refuses_(options.refuse),
        mayDie_(options.dieAfter > 0),
        states_(statesOf(options)),
        folder_(options.socketPath.empty() ? makeFolder() : std::string()),
        path_(options.socketPath.empty() ? folder_ + "/socket" : options.socketPath),
        records_(std::make_shared<Records>(std::move(options.onEvent), options.dieAfter)),
        aggregators_(std::make_shared<Aggregators>()) {}
  ~Implementation() override {
    stop();
    std::error_code ignored;
    if (!folder_.empty()) std::filesystem::remove_all(folder_, ignored);
  }

  [[nodiscard]] std::optional<Error> start() EXCLUDES(life_);
  void stop() EXCLUDES(life_);
  [[nodiscard]] const std::string& path() const { return path_; }
  [[nodiscard]] const Records& records() const { return *records_; }

 private:
  [[nodiscard]] std::optional<Error> open() REQUIRES(life_);
  void takeDown() EXCLUDES(life_);
  [[nodiscard]] Value valueFor(const PeerCredentials& /*peer*/, std::string_view /*key*/) override {
    return !refuses_;
  }
  [[nodiscard]] bool listenerShouldAcceptNewConnection(
      Listener& listener, const std::shared_ptr<Connection>& connection) override;
  void noteEnd(uint64_t number) EXCLUDES(open_);

  // Constant.
  const bool refuses_, mayDie_;
  const std::optional<Array> states_;
  const std::string folder_, path_;
  const Limits limits_;
  const std::shared_ptr<Records> records_;          // with the sessions of the connections
  const std::shared_ptr<Aggregators> aggregators_;  // likewise

  // Any thread.
  UserBudget budget_{UserShares::of(limits_, kMostBytesOfAUser, kMostDescriptors)};
  Counters counters_;
  NoSink sink_;
  Log log_{sink_, LogLevel::error};
  LinuxClock clock_;
  std::atomic<uint64_t> connections_{0};
  Mutex open_;
  ConditionVariable ended_;
  size_t opened_ GUARDED_BY(open_) = 0;  // connections that have not ended

  Mutex life_;  // while it begins or ends
  std::unique_ptr<EpollReactor> reactor_ GUARDED_BY(life_);
  std::unique_ptr<WorkerPool> pool_ GUARDED_BY(life_);
  std::unique_ptr<DBusServer> server_ GUARDED_BY(life_);
  std::thread undertaker_;  // waits for a death, since no connection can end the server; the owner's
};

std::optional<Error> FakeDaemon::Implementation::open() {
  if (server_) return Error{kErrorDomain, EALREADY, path_ + ": it runs already"};
  auto acceptor = UnixSocketAcceptor::bindAt(path_);
  if (auto* error = std::get_if<Error>(&acceptor)) return std::move(*error);
  reactor_ = EpollReactor::create();
  if (!reactor_) return Error{kErrorDomain, EMFILE, "the system gives no descriptor to wait with"};
  pool_ = std::make_unique<WorkerPool>(WorkerPoolOptions{});
  server_ = std::make_unique<DBusServer>(
      DBusServerServices{limits_, counters_, log_, clock_, *reactor_, *pool_, *reactor_, *this, budget_,
                         "0123456789abcdef0123456789abcdef"},
      std::move(std::get<0>(acceptor)));
  records_->begin();
  server_->setDelegate(*this);
  server_->resume();
  return std::nullopt;
}

std::optional<Error> FakeDaemon::Implementation::start() {
  if (!records_->isAlive()) stop();  // what is left of one that died
  MutexLock lock(life_);
  if (auto problem = open()) return problem;
  if (mayDie_)
    undertaker_ = std::thread([this] {
      if (records_->waitForDeath()) takeDown();
    });
  return std::nullopt;
}

void FakeDaemon::Implementation::stop() {
  takeDown();
  if (undertaker_.joinable()) undertaker_.join();
}

void FakeDaemon::Implementation::takeDown() {
  MutexLock lock(life_);
  if (server_) {
    server_->stopAccepting();
    server_->invalidateConnections();
    // One that was taken in this moment may never be told of its end.
    const MonotonicTime deadline = clock_.monotonic() + kPatience;
    MutexLock held(open_);
    while (opened_ > 0 && ended_.waitUntil(open_, deadline)) {
    }
  }
  records_->end();
  server_.reset();
  records_->dropAnswers();
  if (pool_) pool_->shutDown();
  if (reactor_) reactor_->stop();
  pool_.reset();
  reactor_.reset();
}

void FakeDaemon::Implementation::noteEnd(uint64_t number) {
  Event event;
  event.connection = number;
  aggregators_->remove(number);
  records_->add(std::move(event));
  MutexLock lock(open_);
  --opened_;
  ended_.notifyAll();
}

bool FakeDaemon::Implementation::listenerShouldAcceptNewConnection(
    Listener& /*listener*/, const std::shared_ptr<Connection>& connection) {
  if (!records_->isAlive() || !connection->entitlementValue(kEntitlement).boolValue()) return false;
  const uint64_t number = ++connections_;
  connection->setExportedObject(
      std::make_shared<FakeSession>(number, connection, records_, aggregators_, states_));
  connection->setInvalidationHandler([this, number] { noteEnd(number); });
  {
    MutexLock lock(open_);
    ++opened_;
  }
  connection->resume();
  return true;
}

FakeDaemon::FakeDaemon() : FakeDaemon(Options()) {}
FakeDaemon::FakeDaemon(Options options)
    : implementation_(std::make_unique<Implementation>(std::move(options))) {}
FakeDaemon::~FakeDaemon() = default;

std::optional<Error> FakeDaemon::start() {
  return implementation_->start();
}
void FakeDaemon::stop() {
  implementation_->stop();
}
const std::string& FakeDaemon::socketPath() const {
  return implementation_->path();
}
bool FakeDaemon::isRunning() const {
  return implementation_->records().isAlive();
}
std::vector<Event> FakeDaemon::events() const {
  return implementation_->records().events(std::nullopt);
}
std::vector<Event> FakeDaemon::events(Kind kind) const {
  return implementation_->records().events(kind);
}
bool FakeDaemon::waitFor(Kind kind, size_t count, std::chrono::milliseconds timeout) const {
  return implementation_->records().waitFor(kind, count, timeout);
}

}  // namespace kyt::testing
