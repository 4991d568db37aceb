// What the servers of the log answer.
#include <algorithm>
#include <charconv>
#include <utility>

#include "platform/base/TextEscape.h"
#include "receiver/nats/NatsLog.h"

namespace kyt::receiver {
namespace {

// The library frees each message in a thread of its own, which it wakes if that is idle: once for so many.
constexpr size_t kKeptMessages = 256;

// What stands behind a key of the stream's short answers, up to the comma or brace that ends it; empty: nothing. Only for
// texts for people.
std::string_view memberOf(std::string_view json, std::string_view key) {
  const size_t at = json.find(key);
  if (at == std::string_view::npos) return {};
  json.remove_prefix(at + key.size());
  json.remove_prefix(std::min(json.find_first_not_of(' '), json.size()));
  if (!json.empty() && json.front() == '"') {
    json.remove_prefix(1);
    return json.substr(0, json.find('"'));
  }
  return json.substr(0, json.find_first_of(",}"));
}

// The stream, or what its servers or its account may have on their disks, is full.
bool isFull(std::string_view code, std::string_view text) {
  constexpr std::string_view kAccount = "10002", kServers = "10023", kMemory = "10028", kDisk = "10047",
                             kStream = "10077";
  if (code == kStream) return text.find("maximum") != text.npos || text.find("no space") != text.npos;
  return code == kAccount || code == kServers || code == kMemory || code == kDisk;
}

std::string_view dataOf(natsMsg* message) {
  return {natsMsg_GetData(message), static_cast<size_t>(natsMsg_GetDataLength(message))};
}

}  // namespace

void NatsLog::takeStreamNames(std::string_view json) {
  // A stream of that name, or several, each for some partitions, whose names begin with it.
  if (json.find("[\"" + settings_.stream) != std::string_view::npos) {
    isMissingTold_ = false;
    mustAskRetention_ = true;
    hasStream_ = true;
    return setUp(true);
  }
  if (!isMissingTold_.exchange(true))
    lines_.error("log: no stream \"%s\" takes \"kyt.events.0\"; kytreceiver --make-streams makes it",
                 settings_.stream.c_str());
}

// One that was made by hand, by other settings or by an earlier version: what differs of it is told, and stays.
void NatsLog::takeStreamInfo(std::string_view json) {
  const std::string_view age = memberOf(json, "\"max_age\":"), name = memberOf(json, "\"name\":");
  int64_t nanoseconds = -1;
  if (std::from_chars(age.data(), age.data() + age.size(), nanoseconds).ec != std::errc()) return;
  const int64_t seconds = nanoseconds / 1'000'000'000;
  if (seconds == settings_.maxAge.count() || isRetentionTold_.exchange(true)) return;
  lines_.error(
      "log: the stream \"%s\" keeps posts for %lld seconds (0: for ever, until it takes no more), by "
      "log.max_age_seconds %lld; kytreceiver --update-streams changes that",
      escapedText(name).c_str(), static_cast<long long>(seconds),
      static_cast<long long>(settings_.maxAge.count()));
}

void NatsLog::takeAnswers() {
  for (size_t i = 0; i < subscriptions_.size(); ++i) {
    uint64_t waiting = 0, untaken = 0;
    while (natsSubscription_QueuedMsgs(subscriptions_[i].get(), &waiting) == NATS_OK && waiting != 0)
      for (; waiting != 0; --waiting) untaken += takeNext(i) ? 0 : 1;
    if (untaken != 0) tellNobodyTakes(i, untaken);
  }
}

// False: no stream takes the subject of a message.
bool NatsLog::takeNext(size_t subscription) {
  natsMsg* message = nullptr;
  const natsStatus status = natsSubscription_NextMsg(&message, subscriptions_[subscription].get(), 0);
  if (status == NATS_NO_RESPONDERS) return false;
  if (status != NATS_OK) return true;
  read_.emplace_back(message);
  take(subscription, message);
  if (read_.size() == kKeptMessages) read_.clear();
  return true;
}

void NatsLog::take(size_t subscription, natsMsg* message) {
  std::string_view name = natsMsg_GetSubject(message);
  name.remove_prefix(std::min(name.rfind('.') + 1, name.size()));
  if (subscription == groups())
    return endDeadLetter(dataOf(message).find("\"error\"") == std::string_view::npos);
  if (name == "names") return takeStreamNames(dataOf(message));
  if (name == "info") return takeStreamInfo(dataOf(message));
  uint64_t token = 0;
  const auto [end, error] = std::from_chars(name.data(), name.data() + name.size(), token);
  if (error == std::errc() && end == name.data() + name.size()) takeAcknowledgement(token, message);
}

// Once for many messages: whoever is told looks through all that are on their way.
void NatsLog::tellNobodyTakes(size_t subscription, uint64_t messages) {
  if (subscription == groups())
    for (; messages != 0; --messages) endDeadLetter(false);
  if (subscription >= groups()) return;  // what was asked is asked again soon
  for (auto partition = static_cast<uint32_t>(subscription); partition < settings_.partitions;
       partition += groups())
    listener_->partitionRefused(partition, "no stream takes the message");
}

void NatsLog::takeAcknowledgement(uint64_t token, natsMsg* message) {
  const std::string_view json = dataOf(message);
  if (json.find("\"error\"") != std::string_view::npos) {
    const std::string_view code = memberOf(json, "\"err_code\":");
    const std::string_view text = memberOf(json, "\"description\":");
    constexpr std::string_view kTooLarge = "10054";
    const LogVerdict verdict = code == kTooLarge    ? LogVerdict::refusedForGood
                               : isFull(code, text) ? LogVerdict::full
                                                    : LogVerdict::refused;
    return listener_->logAnswered(token, {verdict, escapedText(text) + " (" + escapedText(code) + ")"});
  }
  if (!memberOf(json, "\"stream\":").starts_with(settings_.stream))
    return listener_->logAnswered(token, {LogVerdict::refused, "another stream took the message"});
  const bool isDuplicate = memberOf(json, "\"duplicate\":") == "true";
  listener_->logAnswered(token, {isDuplicate ? LogVerdict::duplicate : LogVerdict::stored, {}});
}

void NatsLog::endDeadLetter(bool isStored) {
  uint64_t inFlight = deadInFlight_;
  while (inFlight != 0 && !deadInFlight_.compare_exchange_weak(inFlight, inFlight - 1)) {
  }
  if (inFlight != 0)
    listener_->deadLetterAnswered(isStored);  // else it was given up when the connection ended
}

}  // namespace kyt::receiver
