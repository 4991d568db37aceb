#include "tools/kytctl/SessionScript.h"

#include <charconv>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <thread>

#include "platform/base/TextEscape.h"

namespace kyt::tools {

namespace {

// Messages that a script lets wait, well below what a session's queue holds.
constexpr uint64_t kQueued = 1024;
constexpr int64_t kLastFlag = 3, kLast16 = 65535, kLast31 = 2147483647, kLast32 = 4294967295;

KeyRule number(std::string_view name, int64_t most, bool required = false) {
  return {name, KeyKind::number, required, 0, most};
}

std::optional<Dictionary> dictionaryAt(const Dictionary& step, const char* key) {
  const Dictionary* value = step.dictionary(key);
  return value != nullptr ? std::optional(*value) : std::nullopt;
}

std::optional<std::string> bytesOfHex(const std::string& digits) {
  std::string bytes;
  for (size_t i = 0; i < digits.size(); i += 2) {
    unsigned byte = 0;
    const char* const first = digits.data() + i;
    const char* const end = first + std::min<size_t>(2, digits.size() - i);
    const auto read = std::from_chars(first, end, byte, 16);
    if (read.ec != std::errc() || read.ptr != first + 2) return std::nullopt;
    bytes += static_cast<char>(byte);
  }
  return bytes;
}

}  // namespace

// The messages that an aggregating session gets, printed as they come, each a line of JSON. Shared: they come
// on the library's thread, and the last may come while the session closes.
class SessionScript::Aggregated {
 public:
  void print(const AggregatedMessage& message) {
    Dictionary line{{"timestamp", message.timestamp},
                    {"category", static_cast<unsigned>(message.category)},
                    {"type", static_cast<unsigned>(message.type)}};
    if (message.sessionInfo) line.set("sessionInfo", *message.sessionInfo);
    if (message.payload) line.set("payload", *message.payload);
    const std::string text = escapedJSON(description(Dictionary{{"aggregated", std::move(line)}}));
    std::printf("%s\n", text.c_str());
    std::fflush(stdout);
    const std::lock_guard lock(mutex_);
    ++count_;
    changed_.notify_all();
  }
  [[nodiscard]] bool waitFor(uint64_t count, double seconds) {
    std::unique_lock lock(mutex_);
    return changed_.wait_for(lock, std::chrono::duration<double>(seconds), [&] { return count_ >= count; });
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  uint64_t count_ = 0;
};

std::map<std::string, SessionScript::Step> SessionScript::allSteps() {
  using Script = SessionScript;
  return {{"open",
           {&Script::open,
            {{"sessionInfo", KeyKind::object, true},
             {"userInfo", KeyKind::object},
             {"aggregate", KeyKind::boolean}}}},
          {"configure", {&Script::configure, {}}},
          {"states", {&Script::states, {{"userInfo", KeyKind::object}}}},
          {"send",
           {&Script::send,
            {number("category", kLast16, true),
             number("type", kLast16, true),
             {"payload", KeyKind::object},
             number("flag", kLastFlag),
             number("repeat", kLast32),
             {"reply", KeyKind::boolean}}}},
          {"flush", {&Script::flush, {}}},
          {"displayURL", {&Script::displayURL, {}}},
          {"sharedData", {&Script::sharedData, {{"entries", KeyKind::object, true}}}},
          {"digestKey", {&Script::digestKey, {{"hex", KeyKind::text, true}, number("algorithm", kLast31)}}},
          {"wait", {&Script::wait, {number("messages", kLast32)}}},
          {"finish", {&Script::finish, {}}}};
}

SessionScript::SessionScript(const ConnectionOptions& connection)
    : connection_(connection), steps_(allSteps()), aggregated_(std::make_shared<Aggregated>()) {}

int SessionScript::run(const Dictionary& step) {
  const Value* what = step.find("do");
  if (what == nullptr || !what->isString()) return failed("a step needs \"do\"");
  const std::string name = what->string()->str();
  const auto found = steps_.find(name);
  if (found == steps_.end()) return failed("unknown step \"" + name + "\"");
  if (name != "open" && !session_) return failed("the first step is {\"do\":\"open\"}");
  Dictionary keys = step;
  keys.remove("do");
  if (const auto problem = problemIn(keys, found->second.keys)) return failed(name + ": " + *problem);
  return (this->*found->second.run)(step);
}

void SessionScript::end() const {
  if (unfinished_)
    std::fprintf(stderr,
                 "kytctl: session: the script ends without \"finish\": what was sent last may be lost\n");
}

int SessionScript::open(const Dictionary& step) {
  KYTReporting::Options options;
  options.socketPath = socketPath(connection_);
  options.sessionInfo = dictionaryAt(step, "sessionInfo").value_or(Dictionary());
  if (const auto problem = KYTReporting::checkSessionInfo(options.sessionInfo))
    return failed("open: " + problem->localizedDescription);
  if (!options.sessionInfo.contains(kKYTReportingSessionInfoClientType))
    return failed("open: session information: \"ClientType\" is missing");
  options.userInfo = dictionaryAt(step, "userInfo");
  if (step.boolean("aggregate"))
    options.aggregationBlock = [aggregated = aggregated_](const AggregatedMessage& message) {
      aggregated->print(message);
    };
  options.callDeadline = std::chrono::milliseconds(0);  // --timeout counts
  refusal_ = std::make_shared<Refusal>();
  options.onStateChange = [refusal = refusal_](KYTReporting::State state, const std::string& why) {
    refusal->become(state, why);
  };
  session_ = KYTReporting::open(std::move(options));
  configured_ = false;
  return 0;
}

int SessionScript::reportCall(const std::shared_ptr<Answer>& answer, const std::string& what) {
  refusal_->answers(answer);
  const int status = report(answer, connection_, what);
  if (status == 0) unfinished_ = false;  // the daemon has taken what came before
  return status;
}

int SessionScript::wait(const Dictionary& step) {
  if (aggregated_->waitFor(step.unsignedInteger("messages", 1), connection_.timeoutSeconds)) return 0;
  return failed("wait: not so many messages in time");
}

int SessionScript::configure(const Dictionary&) {
  configured_ = true;
  auto answer = std::make_shared<Answer>();
  session_->startConfiguration([answer](auto states, std::optional<Error> error) {
    answer->set(statesText(states), std::move(error));
  });
  return reportCall(answer, "configure");
}

int SessionScript::states(const Dictionary& step) {
  auto answer = std::make_shared<Answer>();
  session_->fetchStates(dictionaryAt(step, "userInfo"), [answer](auto states, std::optional<Error> error) {
    answer->set(statesText(states), std::move(error));
  });
  return reportCall(answer, "states");
}

int SessionScript::send(const Dictionary& step) {
  if (!configured_)
    return failed(
        "send: the daemon drops what comes before the session is configured: {\"do\":\"configure\"}");
  const auto category = static_cast<uint16_t>(step.unsignedInteger("category"));
  const auto type = static_cast<uint16_t>(step.unsignedInteger("type"));
  const uint32_t flag = step.unsignedInteger("flag");
  const Dictionary payload = dictionaryAt(step, "payload").value_or(Dictionary());
  const bool reply = step.boolean("reply");
  for (uint32_t i = step.unsignedInteger("repeat", 1); i > 0; --i) {
    if (reply) {
      if (const int status = sendWithReply(category, type, payload, flag); status != 0) return status;
      continue;
    }
    if (!waitForRoom())
      return failedCall(connection_, "send", refusal_->why().value_or("the queue stays full"));
    if (!session_->sendMessage(category, type, payload, flag))
      return failed("send: the message does not fit into the queue");
    unfinished_ = true;
  }
  return 0;
}

int SessionScript::sendWithReply(uint16_t category, uint16_t type, const Dictionary& payload, uint32_t flag) {
  auto answer = std::make_shared<Answer>();
  session_->sendMessage(category, type, payload, flag,
                        [answer](const Value& value, std::optional<Error> error) {
                          answer->set(value.isNull() ? "" : description(value), std::move(error));
                        });
  return reportCall(answer, "send");
}

// A script that repeats a message more often than the session's queue holds goes on at the daemon's pace.
bool SessionScript::waitForRoom() {
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::duration<double>(connection_.timeoutSeconds);
  while (session_->statistics().queued >= kQueued) {
    if (refusal_->why() || std::chrono::steady_clock::now() >= deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

int SessionScript::flush(const Dictionary&) {
  auto answer = std::make_shared<Answer>();
  session_->flush([answer](const Value& value, std::optional<Error> error) {
    answer->set(value.isNull() ? "flushed" : description(value), std::move(error));
  });
  return reportCall(answer, "flush");
}

int SessionScript::displayURL(const Dictionary&) {
  auto answer = std::make_shared<Answer>();
  session_->fetchDisplayURL([answer](std::string url, std::optional<Error> error) {
    answer->set(std::move(url), std::move(error));
  });
  return reportCall(answer, "displayURL");
}

int SessionScript::sharedData(const Dictionary& step) {
  const Dictionary entries = dictionaryAt(step, "entries").value_or(Dictionary());
  for (const DictionaryEntry& entry : entries) session_->updateSharedData(entry.key, entry.value);
  return 0;
}

int SessionScript::digestKey(const Dictionary& step) {
  const auto bytes = bytesOfHex(step.find("hex")->string()->str());
  if (!bytes) return failed("digestKey: \"hex\" is no hex");
  session_->setDigestKey(Data(std::string_view(*bytes)),
                         static_cast<int32_t>(step.unsignedInteger("algorithm")));
  return 0;
}

int SessionScript::finish(const Dictionary&) {
  const auto timeout = std::chrono::milliseconds(static_cast<int64_t>(connection_.timeoutSeconds * 1000));
  const bool done = session_->finish(timeout);
  unfinished_ = false;
  const KYTReporting::Statistics figures = session_->statistics();
  const uint64_t lost = figures.lostOnConnectionEnd + figures.lostInQueue;
  const uint64_t dropped =
      figures.droppedQueueFull + figures.droppedInvalid + figures.droppedUnsendable + figures.droppedTooLate;
  missing_ = lost + dropped;
  std::printf("sent %llu, lost %llu, dropped %llu\n", static_cast<unsigned long long>(figures.sent),
              static_cast<unsigned long long>(lost), static_cast<unsigned long long>(dropped));
  const char* const late = "the daemon did not take everything in time";
  return done ? 0 : failedCall(connection_, "finish", refusal_->why().value_or(late));
}

}  // namespace kyt::tools
