#include "tools/explain/Rehearsal.h"

#include <zlib.h>

#include <algorithm>
#include <array>
#include <utility>
#include <variant>

#include "backend/BackendFactory.h"
#include "backends/BackendTable.h"
#include "backends/https/HTTPSPostBackend.h"
#include "backends/https/RuleWitness.h"
#include "config/DeviceIdentity.h"
#include "config/StorebagFetcher.h"
#include "daemon/ReportingdAgent.h"
#include "platform/JSON.h"
#include "platform/Platform.h"
#include "platform/base/Books.h"
#include "platform/base/Mutex.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/FakeFileExtensions.h"
#include "platform/fake/FakePluginBundles.h"
#include "platform/fake/FakePowerLog.h"
#include "platform/fake/FakeProcessTransaction.h"
#include "platform/fake/FakeUDPSocket.h"
#include "platform/fake/FixedRandom.h"
#include "platform/fake/ManualClock.h"
#include "platform/fake/ManualExecutor.h"
#include "platform/fake/ManualTimers.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/fake/MemoryStream.h"
#include "platform/ipc/fake/FakeListener.h"
#include "platform/objects/Keys.h"
#include "platform/queues/LargeWork.h"
#include "session/MessageLog.h"
#include "session/ReportingdSession.h"
#include "session/ReportingdSessionClass.h"
#include "tools/explain/ScratchUserDefaults.h"

namespace kyt::tools {

namespace {

constexpr size_t kReasons = static_cast<size_t>(Reason::numberOfReasons);

class NoMessageLog final : public MessageLog {
 public:
  bool takesLine(uint32_t, size_t) override { return false; }
  void writeToLogFile(uint32_t, const char*, std::initializer_list<Value>) override {}
};

class Rows final : public RuleWitness {
 public:
  Rows(std::string backend, std::vector<JudgedRule>& rules) : backend_(std::move(backend)), rules_(rules) {}
  void judged(const char* rule, bool passes, const Value& value, const Value& wanted) override {
    rules_.push_back({backend_, rule, passes, value, wanted});
  }

 private:
  const std::string backend_;
  std::vector<JudgedRule>& rules_;
};

// Of what this process has just compressed itself.
std::string inflated(std::string_view bytes) {
  std::string text;
  z_stream stream{};
  if (inflateInit2(&stream, 15 + 16) != Z_OK) return text;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  std::array<char, 65536> block;
  int result = Z_OK;
  while (result == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(block.data());
    stream.avail_out = block.size();
    result = inflate(&stream, Z_NO_FLUSH);
    text.append(block.data(), block.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  return text;
}

uint16_t number(const Dictionary& message, const char* key) {
  const Value* value = message.find(key);
  return static_cast<uint16_t>(value != nullptr ? value->unsignedIntValue() : 0);
}

}  // namespace

bool EventOutcome::leaves() const {
  return datagrams != 0 || std::any_of(posts.begin(), posts.end(), [](const KeptPost& post) {
           const Array* events = post.message.array("events");
           return events != nullptr && !events->empty();
         });
}

struct Rehearsal::Parts {
  Parts(const RehearsedDevice& device, StorebagServer server, RehearsedProgram theProgram, uint32_t draw)
      : program(std::move(theProgram)),
        limits(device.limits),
        budget(UserShares::of(limits, ~uint64_t{0} >> 1, ~uint64_t{0} >> 1)),
        random(draw),
        defaults(device.userDefaults),
        json(device.json),
        platform{.limits = limits,
                 .counters = counters,
                 .log = log,
                 .clock = clock,
                 .timers = timers,
                 .reactor = reactor,
                 .executor = executor,
                 .largeWork = largeWork,
                 .random = random,
                 .userDefaults = defaults,
                 .deviceProperties = device.deviceProperties,
                 .consent = device.consent,
                 .cryptography = device.cryptography,
                 .propertyLists = device.propertyLists,
                 .json = device.json,
                 .deflate = device.deflate,
                 .memory = device.memory,
                 .urlSessions = urlSessions,
                 .udpSockets = udpSockets,
                 .clientBundle = device.clientBundle,
                 .daemonBundle = device.daemonBundle,
                 .fileExtensions = fileExtensions,
                 .pluginBundles = pluginBundles,
                 .powerLog = powerLog,
                 .budget = budget,
                 .books = books,
                 .departures = departures},
        deviceIdentity(platform),
        environment(platform, deviceIdentity, device.hosts),
        configuration{platform, deviceIdentity, environment},
        factory(configuration, watchedTable()),
        fetcher(configuration, backendClassLock, device.refusals),
        sessionClass(configuration, factory, messageLog),
        agent(configuration, fetcher, sessionClass, transaction) {
    clock.setTimeOfDay(device.now);
    pluginBundles.present = true;
    urlSessions.setResponder([server = std::move(server)](const URLRequest& request) {
      return request.method == "GET" ? server(request) : std::nullopt;
    });
    listener.setDelegate(agent);
    listener.resume();
    connection = std::make_shared<FakeConnection>(SerialQueue::create("rehearsal", executor), program.user);
    connection->setEntitlement(kEntitlement, true);
    static_cast<void>(listener.connect(connection));
  }
  ~Parts() {
    made.clear();
    connection->invalidateNow();
    settle();
    executor.shutDown();
  }

  // The daemon's own table. What it makes is kept as long as it is asked about.
  std::vector<BackendCreator> watchedTable() {
    std::vector<BackendCreator> table = backendTable(configuration);
    for (BackendCreator& creator : table)
      creator.create = [this, create = creator.create](const String& name, const Dictionary& profile,
                                                       const SharedSessionFacts& facts) {
        std::shared_ptr<KYTReportingBackend> backend = create(name, profile, facts);
        if (auto* https = dynamic_cast<HTTPSPostBackend*>(backend.get())) {
          witnesses.push_back(std::make_unique<Rows>(name.str(), rules));
          https->setRuleWitness(witnesses.back().get());
        }
        if (backend != nullptr) made.push_back(backend);
        return backend;
      };
    return table;
  }

  // Until nothing is under way: every post is answered.
  void settle() {
    bool moved = true;
    while (moved) {
      moved = executor.runAll() != 0;
      for (; answered < urlSessions.requestCount(); ++answered, moved = true)
        if (urlSessions.isOpen(answered)) urlSessions.complete(answered, 200);
    }
  }

  template <typename Call>
  void call(Call&& call) {
    connection->call(std::forward<Call>(call));
    settle();
  }
  void flush() {
    call([](ClientSessionInterface& session) { session.flushMessagesWithCompletion(nullptr); });
  }

  std::array<uint64_t, kReasons> counted() const {
    std::array<uint64_t, kReasons> values{};
    for (size_t i = 0; i < kReasons; ++i) values[i] = counters.value(static_cast<Reason>(i));
    return values;
  }
  std::vector<Reason> countedSince(const std::array<uint64_t, kReasons>& before) const {
    std::vector<Reason> reasons;
    for (size_t i = 0; i < kReasons; ++i)
      if (counters.value(static_cast<Reason>(i)) != before[i]) reasons.push_back(static_cast<Reason>(i));
    return reasons;
  }
  std::vector<std::string> takeLines() {
    std::vector<std::string> lines;
    for (const MemoryLogSink::Line& line : sink.lines()) lines.push_back(line.line);
    sink.clear();
    return lines;
  }
  size_t datagramsSent() const {
    size_t sent = 0;
    for (size_t i = 0; i < udpSockets.made(); ++i) sent += udpSockets.socket(i).sent.size();
    return sent;
  }

  void keepPosts(size_t from, std::vector<KeptPost>& posts) const {
    for (size_t i = from; i < urlSessions.requestCount(); ++i) {
      KeptPost post{urlSessions.request(i), {}};
      if (post.request.method != "POST") continue;
      const bool compressed = urlSessions.requestHeader(i, "Content-Encoding").has_value();
      const std::string_view body = post.request.body.view();
      const auto parsed = json.parse(compressed ? inflated(body) : std::string(body));
      if (const Value* value = std::get_if<Value>(&parsed))
        if (const Dictionary* message = value->dictionary()) post.message = *message;
      posts.push_back(std::move(post));
    }
  }

  // As each back end that takes records makes it.
  void keepRecords(const Dictionary& message, std::vector<FilteredRecord>& records) {
    const uint16_t method = number(message, kKYTReportingMessageParametersCategory);
    const uint16_t respCode = number(message, kKYTReportingMessageParametersType);
    const Dictionary* payload = message.dictionary(kKYTReportingMessageParametersPayload);
    for (const auto& backend : made) {
      rules.push_back({backend->name().str(),
                       "event-lists",
                       backend->isWhitelistedEvent(method) && !backend->isBlacklistedEvent(method),
                       method,
                       {}});
      const auto* https = dynamic_cast<HTTPSPostBackend*>(backend.get());
      if (https == nullptr) continue;
      FilteredRecord record{https->name().str(), {}, {}};
      record.before = https->newEventDictfromPayload(payload != nullptr ? *payload : Dictionary(),
                                                     clock.timeOfDay(), method, respCode, EventID{0});
      https->mergeInformation(record.before, nullptr);
      record.after = record.before;
      https->filterEvent(record.after);
      records.push_back(std::move(record));
    }
  }

  const RehearsedProgram program;
  const Limits limits;
  UserBudget budget;
  Counters counters;
  Books books;
  NoDepartures departures;
  MemoryLogSink sink;
  Log log{sink, LogLevel::normal};
  ManualClock clock;
  ManualTimers timers{clock};
  ManualReactor reactor;
  ManualExecutor executor;
  LargeWork largeWork;
  FixedRandom random;
  ScratchUserDefaults defaults;
  FakeURLSessionFactory urlSessions;
  FakeUDPSockets udpSockets;
  FakeFileExtensions fileExtensions;
  FakePluginBundles pluginBundles;
  FakePowerLog powerLog;
  FakeProcessTransaction transaction;
  NoMessageLog messageLog;
  JSON& json;
  std::vector<JudgedRule> rules;
  std::vector<std::unique_ptr<Rows>> witnesses;
  std::vector<std::shared_ptr<KYTReportingBackend>> made;
  size_t answered = 0;  // requests

  Platform platform;
  DeviceIdentity deviceIdentity;
  Environment environment;
  Configuration configuration;
  DefaultBackendFactory factory;
  Mutex backendClassLock;
  StorebagFetcher fetcher;
  ReportingdSessionClass sessionClass;
  ReportingdAgent agent;
  FakeListener listener;
  std::shared_ptr<FakeConnection> connection;
};

Rehearsal::Rehearsal(const RehearsedDevice& device, StorebagServer server, RehearsedProgram program,
                     uint32_t draw)
    : parts_(std::make_unique<Parts>(device, std::move(server), std::move(program), draw)) {}

Rehearsal::~Rehearsal() = default;

const std::vector<JudgedRule>& Rehearsal::rules() const {
  return parts_->rules;
}

WholeSession Rehearsal::runWhole(const std::vector<Dictionary>& messages) {
  Parts& parts = *parts_;
  parts.call([&](ClientSessionInterface& session) {
    session.setSessionInfo(parts.program.sessionInfo, parts.program.userInfo, Value(), false);
    session.startConfigWithCompletionHandler(nullptr);
  });
  for (const Dictionary& message : messages) {
    if (message.empty())
      parts.flush();
    else
      parts.call(
          [&](ClientSessionInterface& session) { session.sendMessageWithDictionary(message, nullptr); });
  }
  parts.made.clear();
  parts.connection->invalidateNow();
  parts.settle();
  WholeSession whole;
  for (BookRow& row : parts.books.snapshot())
    if (!row.isInternal) whole.rows.push_back(std::move(row));
  for (size_t i = 0; i < parts.urlSessions.requestCount(); ++i) {
    const URLRequest request = parts.urlSessions.request(i);
    if (request.method != "POST") continue;
    ++whole.posts;
    whole.bytes += request.url.size() + request.body.size();
    for (const auto& [name, value] : request.headers) whole.bytes += name.size() + value.size() + 4;
  }
  return whole;
}

SessionOutcome Rehearsal::configure() {
  Parts& parts = *parts_;
  SessionOutcome outcome;
  if (parts.program.single) return outcome;
  const auto before = parts.counted();
  std::optional<Array> states;
  parts.call([&](ClientSessionInterface& session) {
    session.setSessionInfo(parts.program.sessionInfo, parts.program.userInfo, Value(), false);
    session.startConfigWithCompletionHandler(
        [&states](std::optional<Array> reply) { states = std::move(reply); });
  });
  const auto* session = dynamic_cast<ReportingdSession*>(parts.connection->exportedObject().get());
  if (session != nullptr && session->storebagVersion()) {
    outcome.hasStorebag = true;
    outcome.storebagVersion = session->storebagVersion()->str();
  }
  for (const auto& backend : parts.made) outcome.backends.push_back(backend->name().str());
  if (states)
    for (const Value& name : *states) outcome.live.push_back(name.string()->str());
  outcome.reasons = parts.countedSince(before);
  outcome.lines = parts.takeLines();
  // The session's own start message leaves first, so that what follows is the program's alone.
  parts.flush();
  static_cast<void>(parts.takeLines());
  return outcome;
}

EventOutcome Rehearsal::send(const Dictionary& message) {
  Parts& parts = *parts_;
  EventOutcome outcome;
  const auto before = parts.counted();
  const size_t firstPost = parts.urlSessions.requestCount();
  const size_t firstDatagram = parts.datagramsSent(), firstCall = parts.pluginBundles.state->calls.size();
  parts.call([&](ClientSessionInterface& session) {
    if (!parts.program.single) return session.sendMessageWithDictionary(message, nullptr);
    const Dictionary* payload = message.dictionary(kKYTReportingMessageParametersPayload);
    session.sendMessageWithSessionInfo(parts.program.sessionInfo, parts.program.userInfo,
                                       number(message, kKYTReportingMessageParametersCategory),
                                       number(message, kKYTReportingMessageParametersType),
                                       payload != nullptr ? std::optional(*payload) : std::nullopt, nullptr);
  });
  parts.keepRecords(message, outcome.records);
  parts.keepPosts(firstPost, outcome.posts);
  outcome.atOnce = !outcome.posts.empty();
  if (parts.program.single) {
    parts.made.clear();  // with them goes what they batched
    parts.settle();
  } else if (!outcome.atOnce) {
    parts.flush();
    parts.keepPosts(firstPost, outcome.posts);
  }
  for (const KeptPost& post : outcome.posts)
    if (const String* client = post.message.string("clientId"))
      outcome.isNewDevice |= parts.defaults.hasMade(client->view());
  outcome.datagrams = parts.datagramsSent() - firstDatagram;
  outcome.handedToAdaptor = parts.pluginBundles.state->calls.size() - firstCall;
  outcome.reasons = parts.countedSince(before);
  outcome.lines = parts.takeLines();
  return outcome;
}

}  // namespace kyt::tools
