// The C interface: thin over the C++ one. Nothing thrown leaves it.
#include "kytreporting/kytreporting.h"

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "client/CObjects.h"
#include "client/LastWord.h"
#include "kytreporting/KYTReporting.h"

struct kyt_last_word {
  kyt::linux_client::LastSocket socket;
};

struct kyt_session {
  std::unique_ptr<kyt::KYTReporting> reporting;
};

namespace {

using kyt::Dictionary;
using kyt::KYTReporting;
using kyt::Value;

std::optional<Dictionary> optional(const kyt_dictionary* dictionary) {
  if (dictionary == nullptr) return std::nullopt;
  return dictionary->value;
}

kyt_statistics inC(const KYTReporting::Statistics& figures) {
  return {figures.sent,
          figures.droppedQueueFull,
          figures.lostOnConnectionEnd,
          figures.droppedClosed,
          figures.droppedInvalid,
          figures.connections,
          figures.queued,
          figures.waitedTooLong,
          figures.replayFailed,
          figures.sentUnconfigured,
          figures.accepted,
          figures.lostInQueue,
          figures.droppedUnsendable,
          figures.droppedTooLate};
}

// What kyt_statistics held when programs did not say its size: never more is written for them.
constexpr size_t kFirstFigures = 14 * sizeof(uint64_t);
static_assert(offsetof(kyt_statistics, dropped_too_late) + sizeof(uint64_t) == kFirstFigures);

void copyFigures(const KYTReporting::Statistics& figures, kyt_statistics* out, size_t size) {
  if (out == nullptr) return;
  const kyt_statistics known = inC(figures);
  std::memset(out, 0, size);
  std::memcpy(out, &known, std::min(size, sizeof known));
}

// What the caller's library knew; the rest is 0.
kyt_options knownOf(const kyt_options& given) {
  kyt_options known{};
  // Whole fields alone: half a pointer points nowhere.
  const size_t size = given.size / alignof(kyt_options) * alignof(kyt_options);
  std::memcpy(&known, &given, std::min(size, sizeof known));
  return known;
}

KYTReporting::Options optionsOf(const kyt_options& given) {
  const kyt_options known = knownOf(given);
  KYTReporting::Options options;
  if (known.socket_path != nullptr) options.socketPath = known.socket_path;
  if (known.session_info != nullptr) options.sessionInfo = known.session_info->value;
  options.userInfo = optional(known.user_info);
  if (known.max_queued_messages != 0) options.maxQueuedMessages = known.max_queued_messages;
  if (known.max_queued_bytes != 0) options.maxQueuedBytes = known.max_queued_bytes;
  if (known.on_state_change != nullptr)
    options.onStateChange = [callback = known.on_state_change, context = known.state_context](
                                KYTReporting::State state, const std::string& why) {
      callback(static_cast<kyt_state>(state), why.c_str(), context);
    };
  if (known.call_deadline_milliseconds != 0)
    options.callDeadline = std::chrono::milliseconds(known.call_deadline_milliseconds);
  options.finishWaitsForDaemon = known.finish_waits_for_daemon != 0;
  if (known.aggregation != nullptr) {
    options.aggregationBlock = [callback = known.aggregation,
                                context = known.aggregation_context](const kyt::AggregatedMessage& message) {
      kyt_dictionary info, payload;
      if (message.sessionInfo) info.value = *message.sessionInfo;
      if (message.payload) payload.value = *message.payload;
      callback(message.sessionInfo ? &info : nullptr, message.timestamp, message.category, message.type,
               message.payload ? &payload : nullptr, context);
    };
  }
  return options;
}

thread_local kyt_error callbackError = KYT_ERROR_NONE;

kyt_error numberOf(const std::optional<kyt::Error>& error) {
  if (!error) return KYT_ERROR_NONE;
  return error->domain == kyt::kKYTReportingClientErrorDomain ? static_cast<kyt_error>(error->code)
                                                              : KYT_ERROR_BACK_END;
}

// Stands where a callback of the program runs: what kyt_callback_error() says there.
class CallbackError {
 public:
  explicit CallbackError(const std::optional<kyt::Error>& error)
      : before_(std::exchange(callbackError, numberOf(error))) {}
  ~CallbackError() { callbackError = before_; }
  CallbackError(const CallbackError&) = delete;
  CallbackError& operator=(const CallbackError&) = delete;

 private:
  const kyt_error before_;  // of the callback in which this one runs
};

KYTReporting::Behaviour behaviourOf(const kyt_options& given) {
  const kyt_options known = knownOf(given);
  KYTReporting::Behaviour behaviour;
  behaviour.flushInterval = std::chrono::milliseconds(known.flush_interval_milliseconds);
  behaviour.finishOnDestruction = std::chrono::milliseconds(known.finish_on_close_milliseconds);
  behaviour.waitForDaemon = known.ends_without_daemon == 0;
  return behaviour;
}

KYTReporting::StatesCompletion statesCompletion(kyt_states_callback callback, void* context) {
  if (callback == nullptr) return nullptr;
  return
      [callback, context](std::optional<std::vector<std::string>> states, std::optional<kyt::Error> error) {
        const CallbackError current(error);
        std::vector<const char*> names;
        if (states)
          for (const std::string& name : *states) names.push_back(name.c_str());
        callback(names.data(), names.size(), states ? 1 : 0,
                 error ? error->localizedDescription.c_str() : nullptr, context);
      };
}

KYTReporting::SuccessCompletion successCompletion(kyt_success_callback callback, void* context) {
  if (callback == nullptr) return nullptr;
  return [callback, context](bool success, const std::optional<kyt::Error>& error) {
    const CallbackError current(error);
    callback(success ? 1 : 0, error ? error->localizedDescription.c_str() : nullptr, context);
  };
}

kyt::Error invalid(const char* why) {
  return {kyt::kKYTReportingClientErrorDomain, static_cast<int32_t>(kyt::ClientError::invalid), why};
}

void refuse(kyt_success_callback callback, void* context, const char* why) {
  const CallbackError current(invalid(why));
  if (callback != nullptr) callback(0, why, context);
}

KYTReporting::ObjectCompletion objectCompletion(kyt_text_callback callback, void* context) {
  if (callback == nullptr) return nullptr;
  return [callback, context](const Value& result, const std::optional<kyt::Error>& error) {
    const CallbackError current(error);
    const std::string text = kyt::description(result);
    callback(result.isNull() ? nullptr : text.c_str(), error ? error->localizedDescription.c_str() : nullptr,
             context);
  };
}

// What fits, never half a character.
void copyText(std::string_view text, char* out, size_t size) {
  if (out == nullptr || size == 0) return;
  size_t length = std::min(text.size(), size - 1);
  while (length < text.size() && length > 0 && (static_cast<unsigned char>(text[length]) & 0xC0) == 0x80)
    --length;
  text.copy(out, length);
  out[length] = '\0';
}

// Read as bytes: another language may give a number that the type does not have.
bool isState(const kyt_state& state) {
  unsigned number = 0;
  static_assert(sizeof number == sizeof state);
  std::memcpy(&number, &state, sizeof number);
  return number <= KYT_STATE_LIVE;
}

}  // namespace

extern "C" {

int kyt_session_info_check(const kyt_dictionary* session_info, char* error, size_t size) {
  const auto problem =
      KYTReporting::checkSessionInfo(session_info != nullptr ? session_info->value : Dictionary());
  copyText(problem ? problem->localizedDescription : "", error, size);
  return problem ? 0 : 1;
}
kyt_session* kyt_session_open(const kyt_options* options) {
  if (options == nullptr || options->size == 0) return nullptr;
  return new kyt_session{KYTReporting::open(optionsOf(*options), behaviourOf(*options))};
}
void kyt_session_close(kyt_session* session) {
  delete session;
}
void kyt_session_end(kyt_session* session) {
  if (session != nullptr) session->reporting->close();
}
void kyt_close_all(void) {
  KYTReporting::closeAll();
}
kyt_error kyt_callback_error(void) {
  return callbackError;
}
int kyt_session_finish(kyt_session* session, unsigned timeout_milliseconds) {
  return session != nullptr && session->reporting->finish(std::chrono::milliseconds(timeout_milliseconds))
             ? 1
             : 0;
}
const char* kyt_state_name(kyt_state state) {
  if (!isState(state)) return nullptr;
  return KYTReporting::nameOf(static_cast<KYTReporting::State>(state));
}
kyt_state kyt_session_state(const kyt_session* session) {
  return session != nullptr ? static_cast<kyt_state>(session->reporting->state()) : KYT_STATE_NO_DAEMON;
}
void kyt_session_state_reason(const kyt_session* session, char* reason, size_t size) {
  copyText(session != nullptr ? session->reporting->stateReason() : "there is no session", reason, size);
}
void kyt_session_configure(kyt_session* session, kyt_states_callback callback, void* context) {
  if (session != nullptr) session->reporting->startConfiguration(statesCompletion(callback, context));
}
void kyt_session_fetch_states(kyt_session* session, const kyt_dictionary* user_info,
                              kyt_states_callback callback, void* context) {
  if (session != nullptr)
    session->reporting->fetchStates(optional(user_info), statesCompletion(callback, context));
}
int kyt_session_send(kyt_session* session, uint32_t category, uint32_t type, const kyt_dictionary* payload,
                     uint32_t flag) {
  if (session == nullptr) return 0;
  return session->reporting->sendMessage(category, type, payload != nullptr ? payload->value : Dictionary(),
                                         flag)
             ? 1
             : 0;
}
kyt_error kyt_session_try_send(kyt_session* session, uint32_t category, uint32_t type,
                               const kyt_dictionary* payload, uint32_t flag, char* error, size_t size) {
  const std::optional<kyt::Error> problem =
      session != nullptr ? session->reporting->trySendMessage(
                               category, type, payload != nullptr ? payload->value : Dictionary(), flag)
                         : invalid("there is no session");
  copyText(problem ? problem->localizedDescription : "", error, size);
  return numberOf(problem);
}
void kyt_session_send_with_reply(kyt_session* session, uint32_t category, uint32_t type,
                                 const kyt_dictionary* payload, uint32_t flag, kyt_text_callback callback,
                                 void* context) {
  if (session != nullptr)
    session->reporting->sendMessage(category, type, payload != nullptr ? payload->value : Dictionary(), flag,
                                    objectCompletion(callback, context));
}
void kyt_session_fetch_display_url(kyt_session* session, kyt_text_callback callback, void* context) {
  if (session == nullptr || callback == nullptr) return;
  session->reporting->fetchDisplayURL([callback, context](const std::string& text,
                                                          const std::optional<kyt::Error>& error) {
    const CallbackError current(error);
    callback(error ? nullptr : text.c_str(), error ? error->localizedDescription.c_str() : nullptr, context);
  });
}
void kyt_session_flush(kyt_session* session, kyt_text_callback callback, void* context) {
  if (session != nullptr) session->reporting->flush(objectCompletion(callback, context));
}
void kyt_session_upload_file(kyt_session* session, const char* path, kyt_success_callback callback,
                             void* context) {
  if (session == nullptr) return;
  if (path == nullptr) return refuse(callback, context, "the path is null");
  session->reporting->uploadFile(path, successCompletion(callback, context));
}
void kyt_session_upload_log_data(kyt_session* session, const kyt_array* log_data,
                                 kyt_success_callback callback, void* context) {
  if (session == nullptr) return;
  if (log_data == nullptr) return refuse(callback, context, "the array is null");
  session->reporting->uploadLogData(log_data->value, successCompletion(callback, context));
}
void kyt_session_update_shared_data(kyt_session* session, const kyt_dictionary* entries) {
  if (session != nullptr && entries != nullptr) session->reporting->updateSharedData(entries->value);
}
void kyt_session_remove_shared_data(kyt_session* session, const char* key) {
  if (session != nullptr && key != nullptr) session->reporting->updateSharedData(kyt::String(key), Value());
}
void kyt_session_set_digest_key(kyt_session* session, const void* bytes, size_t length, int32_t algorithm) {
  if (session != nullptr && bytes != nullptr)
    session->reporting->setDigestKey(kyt::Data(std::string_view(static_cast<const char*>(bytes), length)),
                                     algorithm);
}
void kyt_session_read_statistics(const kyt_session* session, kyt_statistics* statistics, size_t size) {
  copyFigures(session != nullptr ? session->reporting->statistics() : KYTReporting::Statistics(), statistics,
              size);
}
void kyt_total_read_statistics(kyt_statistics* statistics, size_t size) {
  copyFigures(KYTReporting::totalStatistics(), statistics, size);
}
void kyt_session_statistics(const kyt_session* session, kyt_statistics* statistics) {
  if (session != nullptr) kyt_session_read_statistics(session, statistics, kFirstFigures);
}
void kyt_total_statistics(kyt_statistics* statistics) {
  kyt_total_read_statistics(statistics, kFirstFigures);
}
void kyt_send_single_message(const kyt_options* options, uint32_t category, uint32_t type,
                             const kyt_dictionary* payload, kyt_text_callback callback, void* context) {
  if (options == nullptr || options->size == 0) {
    const CallbackError current(invalid("the options are missing"));
    if (callback != nullptr) callback(nullptr, "the options are missing", context);
    return;
  }
  KYTReporting::sendSingleMessage(optionsOf(*options), category, type, optional(payload),
                                  [callback, context](std::string text, std::optional<kyt::Error> error) {
                                    if (callback == nullptr) return;
                                    const CallbackError current(error);
                                    callback(error ? nullptr : text.c_str(),
                                             error ? error->localizedDescription.c_str() : nullptr, context);
                                  });
}
kyt_last_word* kyt_last_word_new(const kyt_options* options, uint32_t category, uint32_t type,
                                 const kyt_dictionary* payload) {
  if (options == nullptr || options->size == 0) return nullptr;
  auto socket = kyt::client::lastWord(optionsOf(*options), category, type, optional(payload));
  return socket ? new (std::nothrow) kyt_last_word{*std::move(socket)} : nullptr;
}
void kyt_last_word_free(kyt_last_word* word) {
  delete word;
}
int kyt_last_word_send(const kyt_last_word* word, unsigned timeout_milliseconds) {
  return word != nullptr && word->socket.send(timeout_milliseconds) ? 1 : 0;
}

}  // extern "C"
