#include "receiver/nats/NatsStreams.h"

#include <algorithm>
#include <memory>
#include <utility>

namespace kyt::receiver {
namespace {

constexpr int64_t kDeadBytes = int64_t{1} << 30;
constexpr int64_t kNanoseconds = 1'000'000'000;
// For how long the names of messages are known at most.
constexpr int64_t kDuplicateWindow = 600 * kNanoseconds;

struct Free {
  void operator()(jsStreamInfo* info) const { jsStreamInfo_Destroy(info); }
};

// What the settings say of a stream.
struct Wanted {
  const char* name;
  const char* subject;
  int64_t maxBytes;
  jsDiscardPolicy discard;
  int64_t maxAge, window;  // nanoseconds; no age: 0
  int64_t replicas;
};

// Its names are no older than its messages: the server takes no other.
Wanted wantedOf(const LogSettings& settings, const char* name, const char* subject, int64_t maxBytes,
                jsDiscardPolicy discard) {
  const int64_t age = settings.maxAge.count() * kNanoseconds;
  return {name,
          subject,
          maxBytes,
          discard,
          age,
          age == 0 ? kDuplicateWindow : std::min(age, kDuplicateWindow),
          settings.replicas};
}

void apply(const Wanted& wanted, jsStreamConfig& config) {
  config.Replicas = wanted.replicas;
  config.MaxBytes = wanted.maxBytes;
  config.MaxAge = wanted.maxAge;
  config.Discard = wanted.discard;
  config.Duplicates = wanted.window;
}

std::string secondsText(int64_t nanoseconds) {
  return nanoseconds == 0 ? "for ever" : "for " + std::to_string(nanoseconds / kNanoseconds) + " seconds";
}

std::string bytesText(int64_t bytes) {
  return bytes < 0 ? "any number of bytes" : std::to_string(bytes) + " bytes";
}

void compare(const Wanted& wanted, const jsStreamConfig& is, std::vector<std::string>& differences) {
  const auto differs = [&](const char* what, const std::string& has, const std::string& should) {
    differences.push_back("The stream \"" + std::string(wanted.name) + "\" " + what + " " + has +
                          "; by the settings " + should + ".");
  };
  if (is.MaxAge != wanted.maxAge) differs("keeps posts", secondsText(is.MaxAge), secondsText(wanted.maxAge));
  if (is.MaxBytes != wanted.maxBytes) differs("takes", bytesText(is.MaxBytes), bytesText(wanted.maxBytes));
  if (is.Replicas != wanted.replicas)
    differs("has copies:", std::to_string(is.Replicas), std::to_string(wanted.replicas));
  if (is.Duplicates != wanted.window)
    differs("knows repeats", secondsText(is.Duplicates), secondsText(wanted.window));
  if (is.Discard != wanted.discard) {
    const char *refuses = "new posts", *forgets = "its oldest";
    differs("without room gives up", is.Discard == js_DiscardNew ? refuses : forgets,
            wanted.discard == js_DiscardNew ? refuses : forgets);
  }
}

natsStatus makeOne(jsCtx* context, const Wanted& wanted, bool updates, StreamsMade& made) {
  jsStreamInfo* info = nullptr;
  const natsStatus found = js_GetStreamInfo(&info, context, wanted.name, nullptr, nullptr);
  const std::unique_ptr<jsStreamInfo, Free> owned(info);
  if (found == NATS_NOT_FOUND) {
    const char* subject = wanted.subject;
    jsStreamConfig config;
    jsStreamConfig_Init(&config);
    config.Name = wanted.name;
    config.Subjects = &subject;
    config.SubjectsLen = 1;
    apply(wanted, config);
    return js_AddStream(nullptr, context, &config, nullptr, nullptr);
  }
  if (found != NATS_OK) return found;
  std::vector<std::string> differences;
  compare(wanted, *info->Config, differences);
  if (!updates || differences.empty()) {
    made.differences.insert(made.differences.end(), differences.begin(), differences.end());
    return NATS_OK;
  }
  apply(wanted, *info->Config);
  return js_UpdateStream(nullptr, context, info->Config, nullptr, nullptr);
}

}  // namespace

StreamsMade makeStreams(jsCtx* context, const LogSettings& settings, bool updates) {
  StreamsMade made;
  for (const Wanted& wanted :
       {wantedOf(settings, settings.stream.c_str(), "kyt.events.*", settings.maxBytes, js_DiscardNew),
        wantedOf(settings, kDeadStream, kDeadSubject, kDeadBytes, js_DiscardOld)}) {
    const natsStatus status = makeOne(context, wanted, updates, made);
    if (status == NATS_OK) continue;
    made.problem = std::string(wanted.name) + ": " + natsStatus_GetText(status);
    if (const char* last = nats_GetLastError(nullptr); last != nullptr && *last != '\0')
      *made.problem += std::string(": ") + last;
    break;
  }
  return made;
}

}  // namespace kyt::receiver
