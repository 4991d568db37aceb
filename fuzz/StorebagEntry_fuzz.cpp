// The section of a storebag for the back end that posts events. It is signed, but who signs it may be wrong:
// whatever it holds, the back end decides on one of its states, and what it posts is one JSON message with
// honest headers, over https on devices of users; each flush is answered once.
//
// The first byte sets up the session and says how to read the rest: as a property list's text, or as a recipe
// for a section made of the keys that the back end reads, each with any kind of object. Either way the back
// end is given what the property list reader made of it.
#include <strings.h>
#include <zlib.h>

#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/objects/Keys.h"
#include "platform/queues/SerialQueue.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

void require(bool condition) {
  if (!condition) std::abort();
}

constexpr const char* kEntryKeys[] = {"client",
                                      "service",
                                      "enabledSince",
                                      "expedite",
                                      "override_dnu",
                                      "locale_whitelist",
                                      "device_whitelist",
                                      "device_blacklist",
                                      "filters",
                                      "sampling_threshold",
                                      "per_country_sampling_thresholds",
                                      "override_sampling",
                                      "event_threshold",
                                      "extras_on_internal",
                                      "custom_clientId",
                                      "post_url",
                                      "realtime_post_url",
                                      "event_whitelist",
                                      "event_blacklist",
                                      "use_wifi_only",
                                      "key",
                                      "action",
                                      "method",
                                      "status",
                                      "country",
                                      "threshold"};
constexpr const char* kTexts[] = {
    "",           "a",   "a,b",   "US",     "Phone", "remove", "sha256", "email",          "_method",
    "_sessionID", "9.0", "0.5 x", "-1e400", "nan",   "5",      ",",      "http://h/x://y", "https://h",
    "://",        "h/x"};

class Recipe {
 public:
  explicit Recipe(std::string_view bytes) : bytes_(bytes) {}
  unsigned byte() {
    if (bytes_.empty()) return 0;
    const auto value = static_cast<unsigned char>(bytes_.front());
    bytes_.remove_prefix(1);
    return value;
  }
  bool isEmpty() const { return bytes_.empty(); }
  Value object(int depth) {
    switch (byte() % (depth > 0 ? 8 : 6)) {
      case 0:
        return Value(byte() % 2 != 0);
      case 1:
        return Value(static_cast<int>(byte()) - 3);
      case 2:
        return Value((static_cast<double>(byte()) - 20) / 100);
      case 3:
        return Value(Date{static_cast<double>(byte()) * 1e9});
      case 4:
        return Value(Data(std::string_view("x")));
      case 5:
        return Value(kTexts[byte() % std::size(kTexts)]);
      case 6: {
        Array array;
        for (unsigned left = byte() % 4; left > 0; --left) array.append(object(depth - 1));
        return Value(std::move(array));
      }
      default:
        return Value(dictionary(byte() % 4, depth - 1));
    }
  }
  Dictionary dictionary(unsigned count, int depth) {
    Dictionary dictionary;
    for (; count > 0; --count) {
      const char* key = kEntryKeys[byte() % std::size(kEntryKeys)];
      dictionary.set(key, object(depth));
    }
    return dictionary;
  }

 private:
  std::string_view bytes_;
};

// Entries that enable the back end, but for what the recipe replaces.
Dictionary sectionOf(Recipe recipe) {
  Array clients;
  do {
    Dictionary entry{{"locale_whitelist", Array{"US"}},
                     {"filters", Array{Dictionary{{"key", "email"}, {"action", "sha256"}}}},
                     {"sampling_threshold", 1.0},
                     {"event_threshold", 3},
                     {"post_url", "http://post.example.org/events"}};
    entry.merge(recipe.dictionary(recipe.byte() % 8, 3));
    clients.append(Value(std::move(entry)));
  } while (!recipe.isEmpty() && clients.size() < 4);
  return {{"clients", std::move(clients)}, {"display_url", recipe.object(1)}};
}

struct Poster final : ReportingSessionConnectivityInterface {
  void postURLRequestWithCompletionHandler(URLRequest request, URLCompletion completion) override {
    requests.push_back(std::move(request));
    completions.push_back(std::move(completion));
  }
  std::vector<URLRequest> requests;
  std::vector<URLCompletion> completions;
};

std::string inflated(std::string_view body) {
  static std::vector<char> out(1 << 20);  // made once: filling it takes longer than all the rest
  z_stream stream{};
  require(inflateInit2(&stream, 31) == Z_OK);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  require(inflate(&stream, Z_FINISH) == Z_STREAM_END);
  std::string text(out.data(), stream.total_out);
  inflateEnd(&stream);
  return text;
}

void check(const URLRequest& request, bool internal, JSON& json) {
  require(request.method == "POST");
  const bool https = strncasecmp(request.url.c_str(), "https://", 8) == 0;
  require(internal || https || request.url.find("://") == std::string::npos);
  std::string body(request.body.view());
  for (const auto& [name, value] : request.headers) {
    if (name == "Content-Length") require(value == std::to_string(request.body.size()));
    if (name == "Content-Encoding") body = inflated(body);
  }
  const std::variant<Value, Error> parsed = json.parse(body);
  require(std::holds_alternative<Value>(parsed));
  const Dictionary* message = std::get<Value>(parsed).dictionary();
  require(message != nullptr && message->contains("postTime"));
  const Value* events = message->find("events");
  require(events != nullptr && events->array() != nullptr && !events->array()->empty());
  for (const Value& event : *events->array()) {
    require(event.isDictionary());
    for (const DictionaryEntry& entry : *event.dictionary())
      require(entry.value.isNumber() || entry.value.isString());
  }
}

// A session's life with this section: decided, sent to with every flag, flushed, answered.
void run(unsigned setup, const Dictionary& section) {
  TestPlatform platform;
  const bool internal = (setup & 1) != 0, requireUserInfo = (setup & 2) != 0;
  platform.consent.setAllowed((setup & 4) != 0);
  platform.random.setDraw((setup & 8) != 0 ? 50 : 0);
  platform.deviceProperties.setCountryCode("US");
  if (internal) platform.deviceProperties.setProperty("ReleaseType", "Internal");
  SessionFacts facts;
  facts.isInternal = internal;
  facts.requireUserInfo = requireUserInfo;
  facts.batchEvents = (setup & 16) != 0;
  facts.udid = String();
  facts.hardwareType = String("Phone9,1");
  facts.productFamily = String("Phone");
  facts.setSelfVersion("8.0");
  auto backend = HTTPSPostBackend::initWithName(platform.configuration, String(kKYTReportingBackendHTTPPost),
                                                section, std::make_shared<SessionFacts>(facts));
  if (backend == nullptr) return;
  const auto poster = std::make_shared<Poster>();
  backend->setReportingSessionConnectivityDelegate(poster);
  backend->setUserInfoDict(Dictionary{{kKYTReportingUserInfoClientName, "a"}, {"email", "x"}});

  int flushes = 0, answers = 0;
  for (uint16_t i = 0; i < 4; ++i) {
    backend->updateState();
    const int32_t state = backend->state();
    require(state >= kBackendStateUndecided && state <= kBackendStateHeld);
    const Dictionary payload{{"email", "x"}, {"date", Date{1}}, {"list", Array{1}}, {"n", i}};
    const auto send = [&](uint16_t method, int32_t flag) {
      backend->sendMessage({{kKYTReportingMessageBlobClientData, payload}}, {1000, 0}, method, 1,
                           MessageFlag{flag});
    };
    send(0, 0);
    send(5, i % 4);
    backend->setCorrelatedSessionID("12.77");
    ++flushes;
    backend->flushMessagesWithCompletion([&](const Value&, const std::optional<Error>&) { ++answers; });
  }
  static_cast<void>(backend->batchedEventsSize());
  for (const URLRequest& request : poster->requests) check(request, internal, platform.json);
  backend.reset();
  for (URLCompletion& completion : poster->completions) {
    URLResponse response;
    response.status = (setup & 32) != 0 ? 503 : 200;
    completion(Data(), response, std::nullopt);
  }
  require(answers == flushes);
  platform.executor.runAll();
}

}  // namespace
}  // namespace kyt

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const std::string_view rest(reinterpret_cast<const char*>(data) + 1, size - 1);
  kyt::PugixmlPropertyLists lists;
  const bool isText = (data[0] & 64) != 0;
  const auto read =
      lists.parse(isText ? std::string(rest) : lists.serialize(kyt::sectionOf(kyt::Recipe(rest))));
  const kyt::Value* section = std::get_if<kyt::Value>(&read);
  kyt::require(isText || section != nullptr);
  if (section != nullptr && section->isDictionary()) kyt::run(data[0] & 63, *section->dictionary());
  return 0;
}
