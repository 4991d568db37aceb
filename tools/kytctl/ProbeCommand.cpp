// Asks a server for a storebag as the daemon does, three times: as a device that has none, as one that has this, and as one
// that has a later one; and tells what devices would feel.
#include <cstdio>
#include <ctime>
#include <memory>
#include <utility>
#include <variant>

#include "config/StorebagFetcher.h"
#include "platform/Bundle.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/objects/Keys.h"
#include "tools/kytctl/DevicePorts.h"
#include "tools/kytctl/StorebagServices.h"

namespace kyt::tools {

namespace {

constexpr char kHTTPDate[] = "%a, %d %b %Y %H:%M:%S GMT";

std::optional<int64_t> secondsOf(const std::string& date) {
  tm parts{};
  const char* end = strptime(date.c_str(), kHTTPDate, &parts);
  return end != nullptr && *end == '\0' ? std::optional<int64_t>(timegm(&parts)) : std::nullopt;
}

std::string dateOf(int64_t seconds) {
  const time_t time = seconds;
  tm parts{};
  gmtime_r(&time, &parts);
  char text[64];
  return {text, std::strftime(text, sizeof text, kHTTPDate, &parts)};
}

class Probe {
 public:
  Probe(const std::string& root, const ProbeOptions& options) : ports_(root, false), options_(options) {
    CurlURLSessionOptions network;
    if (ports_.settings()) network.certificateFile = ports_.settings()->caFile;
    if (!options.caFile.empty()) network.certificateFile = options.caFile;
    factory_ = std::make_unique<CurlURLSessionFactory>(network, log_, counters_);
    URLSessionConfiguration configuration;
    configuration.sourceApplication = kSourceApplication;
    session_ = factory_->create(std::move(configuration));
  }

  int run() {
    Bundle& bundle = ports_.device(true).clientBundle;
    url_ = options_.url + "?version=" + bundle.version().value_or("8.0").str();
    std::printf("%s\n", escapedText(url_).c_str());
    const URLReply first = ask({});
    if (failedToAnswer(first)) return 1;
    tellReply(first);
    tellBag(first, bundle);
    if (const auto date = first.response->header("Last-Modified")) {
      tellRepeat(*date);
      tellLater(*date);
    } else {
      warn("there is no Last-Modified: each refresh carries the whole bag");
    }
    std::printf("%s\n", faults_ != 0 ? "devices do not get what they should" : "devices get this bag");
    return faults_ != 0 ? 1 : 0;
  }

 private:
  URLReply ask(const std::string& since) {
    URLRequest request;
    request.url = url_;
    request.timeout = kStorebagRequestTimeout;
    request.maxRedirects = kMaxStorebagRedirects;
    if (!since.empty()) request.headers.emplace_back("If-Modified-Since", since);
    return startAndWait(std::move(request), [this](URLRequest sent, URLCompletion completion) {
      session_->start(std::move(sent), std::move(completion));
    });
  }

  static void tell(const std::string& text) { std::printf("  %s\n", escapedText(text).c_str()); }
  static void warn(const std::string& text) { tell("warning: " + text); }
  void fault(const std::string& text) {
    tell("FAULT: " + text);
    ++faults_;
  }

  bool failedToAnswer(const URLReply& reply) {
    if (!reply.error && reply.response) return false;
    fault("no answer: " + (reply.error ? reply.error->localizedDescription : std::string("none")));
    return true;
  }

  void tellReply(const URLReply& reply) {
    tell("status " + std::to_string(reply.response->status) + ", " +
         std::to_string(reply.data ? reply.data->size() : 0) + " bytes, of at most " +
         std::to_string(Limits::maxHTTPReplyBytes));
    if (reply.response->status != 200)
      warn("the daemon does not look at the status: what came counts if it verifies");
    tell("Last-Modified: " + reply.response->header("Last-Modified").value_or("none"));
    const std::optional<std::string> control = reply.response->header("Cache-Control");
    const int32_t lifetime = maxAgeFromCacheControl(control);
    tell("Cache-Control: " + control.value_or("none") + " (asked again after " + std::to_string(lifetime) +
         " seconds)");
    if (control && lifetime == kMaxStorebagAge && control->find("max-age=") != std::string::npos &&
        control->find("max-age=86400") == std::string::npos)
      warn("its max-age is not read, since another word touches it: a blank has to stand before it");
    if (const auto age = reply.response->header("Age"))
      warn("a cache sent this (Age: " + *age +
           "), which is not counted: it may be used for up to twice its lifetime");
  }

  void tellBag(const URLReply& reply, Bundle& bundle) {
    std::string key;
    bool isKnown = false;
    if (!options_.publicKey.empty()) {
      auto read = readFile(options_.publicKey);
      if (auto* error = std::get_if<Error>(&read)) return fault(error->localizedDescription);
      key = std::get<std::string>(std::move(read));
      isKnown = true;
    } else if (const std::optional<Data> own = bundle.resource("publicKey", "der")) {
      key = own->view();
      isKnown = true;
    }
    const StorebagFile file(ports_.propertyLists(), ports_.json(), ports_.cryptography());
    const std::string document(reply.data ? reply.data->view() : std::string_view());
    const auto opened = file.open(document, isKnown ? std::optional<std::string_view>(key) : std::nullopt);
    if (const auto* error = std::get_if<Error>(&opened)) return fault(error->localizedDescription);
    if (isKnown)
      tell("signature: holds" + std::string(hasSecondSignature(document) ? ", over SHA-256 too" : ""));
    else
      warn("the signature was not checked: this device has no publicKey.der, and --public-key names none");
    tellContents(std::get<Dictionary>(opened));
  }

  bool hasSecondSignature(const std::string& document) {
    const auto parsed = ports_.propertyLists().parse(document);
    const Value* root = std::get_if<Value>(&parsed);
    return root != nullptr && root->dictionary() != nullptr &&
           root->dictionary()->contains(kStorebagSignature256);
  }

  void tellContents(const Dictionary& bag) {
    const auto shown = [&bag](const char* key) {
      const Value* value = bag.find(key);
      return value != nullptr ? description(*value) : std::string("none");
    };
    if (bag.string("version") == nullptr) fault("the bag has no text \"version\"");
    tell("version " + shown("version") + ", serial " + shown(kStorebagSerial) + ", refresh_cycle " +
         shown("refresh_cycle"));
    const std::optional<double> expires = storebagExpiry(bag);
    if (!expires) return;
    const std::string when = description(Value(Date{*expires}));
    if (LinuxClock().timeOfDay().asSeconds() < *expires)
      tell("expires at " + when);
    else
      warn("it expired at " + when + ": devices that refuse expired bags refuse it");
  }

  void tellRepeat(const std::string& date) {
    std::printf("asked with that time\n");
    const URLReply reply = ask(date);
    if (failedToAnswer(reply)) return;
    const bool isEmpty = !reply.data || reply.data->empty();
    tell("status " + std::to_string(reply.response->status) + (isEmpty ? ", no body" : ", a body"));
    if (!isEmpty)
      return warn("the server does not say that nothing has changed: each refresh carries the whole bag");
    if (!reply.response->header("Last-Modified"))
      fault("there is no Last-Modified: the daemon counts that as a failed fetch, and asks every 15 minutes");
  }

  // As a device to which a newer bag was handed out that has been taken back since.
  void tellLater(const std::string& date) {
    const std::optional<int64_t> seconds = secondsOf(date);
    if (!seconds) return warn("the time is written in another way than servers do");
    if (*seconds >= LinuxClock().timeOfDay().seconds - 1)
      return warn("it was published a moment ago: how the server treats older files cannot be told yet");
    std::printf("asked with a later time\n");
    const URLReply reply = ask(dateOf(*seconds + 1));
    if (failedToAnswer(reply)) return;
    const bool isEmpty = !reply.data || reply.data->empty();
    tell("status " + std::to_string(reply.response->status) + (isEmpty ? ", no body" : ", a body"));
    if (isEmpty)
      warn(
          "a bag that is put back with its old time never arrives: publish each with a newer one, as"
          " kytctl storebag publish does");
  }

  DevicePorts ports_;
  const ProbeOptions& options_;
  MemoryLogSink sink_;
  Log log_{sink_};
  Counters counters_;
  std::unique_ptr<CurlURLSessionFactory> factory_;
  std::unique_ptr<URLSession> session_;
  std::string url_;
  int faults_ = 0;
};

}  // namespace

int probeCommand(const std::string& root, const ProbeOptions& options) {
  return Probe(root, options).run();
}

}  // namespace kyt::tools
