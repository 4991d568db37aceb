#include "tools/kytctl/StorebagSource.h"

#include <cstdint>
#include <ctime>
#include <utility>

#include "config/Environment.h"
#include "platform/linux/url/CurlURLSession.h"
#include "platform/objects/Keys.h"
#include "tools/StorebagFile.h"
#include "tools/explain/UnsignedBag.h"
#include "tools/kytctl/StatusText.h"
#include "tools/kytctl/WindowClient.h"

namespace kyt::tools {

namespace {

CurlURLSessionOptions networkOptions(const std::optional<Settings>& settings) {
  CurlURLSessionOptions options;
  if (!settings) return options;
  options.certificateFile = settings->caFile;
  options.cellularInterfaces = settings->cellularInterfaces;
  return options;
}

URLSessionConfiguration sessionConfiguration() {
  URLSessionConfiguration configuration;
  configuration.sourceApplication = kSourceApplication;
  return configuration;
}

}  // namespace

struct StorebagSource::Network {
  explicit Network(const std::optional<Settings>& settings)
      : factory(networkOptions(settings), log, counters), session(factory.create(sessionConfiguration())) {}
  MemoryLogSink sink;
  Log log{sink};
  Counters counters;
  CurlURLSessionFactory factory;
  std::unique_ptr<URLSession> session;
};

StorebagSource::StorebagSource() = default;
StorebagSource::~StorebagSource() = default;

std::variant<std::unique_ptr<StorebagSource>, Error> StorebagSource::file(const std::string& path,
                                                                          DevicePorts& ports) {
  auto text = readFile(path);
  if (auto* error = std::get_if<Error>(&text)) return std::move(*error);
  std::unique_ptr<StorebagSource> source(new StorebagSource);
  source->from_ = path;
  FakeURLSessionFactory::Reply reply;
  reply.body = std::get<std::string>(std::move(text));
  const auto document = ports.propertyLists().parse(reply.body);
  const Value* root = std::get_if<Value>(&document);
  const Dictionary* dictionary = root != nullptr ? root->dictionary() : nullptr;
  if (dictionary == nullptr || !dictionary->contains("signature")) {
    const size_t dot = path.rfind('.');
    const StorebagFile reader(ports.propertyLists(), ports.json(), ports.cryptography());
    auto bag = reader.read(reply.body, dot == std::string::npos ? "" : path.substr(dot + 1));
    if (const auto* error = std::get_if<Error>(&bag))
      return Error{error->domain, error->code, path + ": " + error->localizedDescription};
    source->signature_ = "not checked";
    reply.body = unsignedDocument(std::get<Dictionary>(bag), ports.propertyLists());
  }
  source->reply_ = std::move(reply);
  return source;
}

// The daemon keeps the section of the environment that was in force when it fetched: whichever is in force now, a session has
// that one.
std::unique_ptr<StorebagSource> StorebagSource::daemon(const std::string& root, const std::string& name,
                                                       DevicePorts& ports) {
  auto window = WindowClient::connect(root);
  if (std::holds_alternative<Error>(window)) return nullptr;
  auto answer = std::get<WindowClient>(window).dictionary("Storebag", name);
  const auto* known = std::get_if<Dictionary>(&answer);
  const Dictionary* section = known != nullptr ? known->dictionary("section") : nullptr;
  if (section == nullptr || numberIn(*known, "expires") <= static_cast<int64_t>(std::time(nullptr)))
    return nullptr;
  Dictionary bag{{"version", textIn(*known, "version")}};
  for (uint32_t environment = 0; environment <= kEnvironmentRelease; ++environment)
    if (const auto key = environmentName(environment)) bag.set(*key, *section);
  std::unique_ptr<StorebagSource> source(new StorebagSource);
  const std::string state = textIn(*known, "state"), error = textIn(*known, "lastError");
  source->from_ = "the running daemon, which asked " + textIn(*known, "address");
  if (state != "good") source->from_ += " (" + state + ": " + error + ")";
  source->signature_ = "checked by the daemon";
  source->reply_.emplace().body = unsignedDocument(bag, ports.propertyLists());
  return source;
}

std::unique_ptr<StorebagSource> StorebagSource::server(DevicePorts& ports) {
  std::unique_ptr<StorebagSource> source(new StorebagSource);
  source->network_ = std::make_unique<Network>(ports.settings());
  return source;
}

Rehearsal::StorebagServer StorebagSource::answers() {
  return [this](const URLRequest& request) -> std::optional<FakeURLSessionFactory::Reply> {
    if (!reply_) reply_ = fetch(request);
    return reply_;
  };
}

FakeURLSessionFactory::Reply StorebagSource::fetch(const URLRequest& request) {
  from_ = request.url;
  URLReply got = startAndWait(request, [this](URLRequest sent, URLCompletion completion) {
    network_->session->start(std::move(sent), std::move(completion));
  });
  FakeURLSessionFactory::Reply reply;
  if (got.error || !got.response) {
    reply.error = got.error ? *got.error : Error{kKYTURLErrorDomain, -1, "no answer"};
    problem_ = reply.error->localizedDescription;
    return reply;
  }
  reply.status = got.response->status;
  reply.headers = got.response->headers;
  if (got.data) reply.body = std::string(got.data->view());
  return reply;
}

}  // namespace kyt::tools
