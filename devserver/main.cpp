// kytdevserver: the back end for development and tests. Reads the command line, builds the objects in their
// order, says on standard output and in the ready file where it listens, and runs until SIGINT or SIGTERM.
#include <fcntl.h>
#include <pthread.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <system_error>

#include "devserver/Certificates.h"
#include "devserver/DashboardFeed.h"
#include "devserver/Files.h"
#include "devserver/JsonText.h"
#include "devserver/Options.h"
#include "devserver/Router.h"
#include "devserver/Rows.h"
#include "http/HttpServer.h"
#include "platform/linux/cli/CommandLine.h"

namespace kyt::devserver {
namespace {

using http::HttpServer;
using http::ServerOptions;
using http::Suspensions;

int fail(const std::string& what) {
  std::fprintf(stderr, "kytdevserver: %s\n", what.c_str());
  return 1;
}

int failUsage(const std::string& what) {
  fail(what);
  return kWrongUsage;
}

// "[CLIENT=]HEX"
std::optional<DigestKey> digestKeyFrom(const std::string& text) {
  const size_t sign = text.rfind('=');
  const std::string client = sign == std::string::npos ? std::string() : text.substr(0, sign);
  const auto key = bytesFromHex(sign == std::string::npos ? text : text.substr(sign + 1));
  if (!key || key->empty()) return std::nullopt;
  return DigestKey{client, *key};
}

bool isHost(const std::string& host) {
  return !host.empty() && std::all_of(host.begin(), host.end(), [](unsigned char c) {
    return std::isalnum(c) != 0 || c == '.' || c == '-' || c == ':';
  });
}

void describe(const CommandLine& commandLine, Options& options, int& requestSeconds,
              std::vector<std::string>& digestKeys) {
  commandLine.option("--state", options.state, "Folder of certificates and database; made when missing")
      .required();
  commandLine.option("--bags", options.bags, "Folder of signed storebags, NAME.plist");
  commandLine.option("--sign-key", options.signKey,
                     "Private key (PEM) that signs unsigned bags, NAME.bag.toml");
  commandLine.option("--https-port", options.httpsPort, "Port for devices; 0: any free one").showsDefault();
  commandLine.option("--http-port", options.httpPort, "Port of the page and the queries; 0: any free one")
      .showsDefault();
  commandLine.option("--udp-port", options.udpPort, "Port of the dashboard feed (UDP); 0: any free one");
  commandLine.option("--listen", options.listen, "Address to listen on").showsDefault();
  commandLine.option("--host", options.hosts, "A further name or address for the certificate (repeatable)")
      .repeatable();
  commandLine.option("--ready-file", options.readyFile,
                     "Written when the ports are open: their numbers as JSON");
  commandLine.flag("--http-events", options.httpEvents,
                   "Take event posts, log data and uploads on the plain port too");
  commandLine.option("--max-age", options.maxAge, "Seconds in a storebag's Cache-Control").showsDefault();
  commandLine.option("--digest-key", digestKeys, "[CLIENT=]HEX: posts must be signed with it (repeatable)")
      .repeatable();
  commandLine.option("--max-body", options.maxBodyBytes, "Bytes of a post, log data or an upload as sent")
      .showsDefault();
  commandLine.option("--max-inflated", options.maxInflatedBytes, "Bytes of a post's JSON or an uploaded file")
      .showsDefault();
  commandLine.option("--request-timeout", requestSeconds, "Seconds for a request to be whole")
      .between(1, 3600)
      .showsDefault();
  commandLine.option("--keep-posts", options.keepPosts, "Posts kept; the oldest go").showsDefault();
  commandLine.option("--keep-bytes", options.keepBytes, "Bytes of posts kept; the oldest go").showsDefault();
  commandLine.option("--max-connections", options.maxConnections, "Connections of each port")
      .between(4, 60000)
      .showsDefault();
}

// The folder's lock, held until the process ends, or -1 with the reason.
int lockState(const std::filesystem::path& state, std::string& error) {
  std::error_code code;
  std::filesystem::create_directories(state, code);
  const int lock = open((state / "lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  if (lock < 0) {
    error = "can't use the folder " + state.string() + ": " + std::strerror(errno);
  } else if (flock(lock, LOCK_EX | LOCK_NB) != 0) {
    error = "another server uses the folder " + state.string();
    close(lock);
    return -1;
  }
  return lock;
}

void raiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
}

std::string readyText(const Options& options, const HttpServer& https, const HttpServer& http,
                      const DashboardFeed* feed) {
  JsonText out;
  out.object().member("https", https.port()).member("http", http.port()).member("listen", options.listen);
  if (feed != nullptr) out.member("udp", feed->port());
  out.member("ca", std::filesystem::absolute(options.state / "ca.pem").string())
      .member("pid", int64_t{getpid()});
  return out.endObject().text() + "\n";
}

int serve(const Options& options, const sigset_t& signals) {
  std::string error;
  if (lockState(options.state, error) < 0) return fail(error);
  std::vector<std::string> hosts = {"localhost", "127.0.0.1", "::1"};
  hosts.insert(hosts.end(), options.hosts.begin(), options.hosts.end());
  const auto identity = serverIdentity(options.state, hosts);
  if (const auto* wrong = std::get_if<std::string>(&identity)) return fail(*wrong);

  std::optional<BagSigner> signer;
  if (!options.signKey.empty()) {
    const auto key = readFile(options.signKey, 64 * 1024);
    if (!key) return fail("can't read " + options.signKey.string());
    signer.emplace(*key);
  }

  EventStream stream;
  Suspensions suspensions([&] { stream.heartbeat(); });
  const auto committed = [&](const Commit& commit) {
    if (stream.hasListeners()) stream.publish("commit", commitAsJson(commit));
    suspensions.wake(WaitFor::data);
  };
  const std::unique_ptr<Store> store = Store::open(options.state / "devserver.sqlite",
                                                   {options.keepPosts, options.keepBytes}, committed, error);
  if (!store) return fail(error);
  const PostChecker checker(options.digestKeys, options.maxInflatedBytes);
  AcknowledgementRules acknowledgements;
  Router router(options, *store, checker, stream, suspensions, acknowledgements, signer);
  ServerOptions port = {options.listen, options.httpsPort};
  port.maxConnections = options.maxConnections;
  port.requestTime = port.idleTime = options.requestTimeout;
  const auto https = HttpServer::start(port, &std::get<Identity>(identity), router, suspensions, error);
  port.port = options.httpPort;
  const auto http = https ? HttpServer::start(port, nullptr, router, suspensions, error) : nullptr;

  std::unique_ptr<DashboardFeed> feed;
  if (http && options.udpPort)
    feed = DashboardFeed::start(options.listen, *options.udpPort, *store, acknowledgements, error);

  int status = 0;
  if (http && (feed || !options.udpPort)) {
    const std::string ready = readyText(options, *https, *http, feed.get());
    if (!options.readyFile.empty() && !replaceFile(options.readyFile, ready, 0644)) {
      status = fail("can't write " + options.readyFile.string() + ": " + std::strerror(errno));
    } else {
      std::fputs(ready.c_str(), stdout);
      std::fflush(stdout);
      int signal = 0;
      sigwait(&signals, &signal);
    }
  } else {
    status = fail(error);
  }
  // Whoever waits is answered or let go before the servers end.
  suspensions.stop();
  stream.close();
  return status;
}

}  // namespace
}  // namespace kyt::devserver

int main(int argc, char** argv) {
  using namespace kyt::devserver;
  Options options;
  std::vector<std::string> digestKeys;
  const kyt::CommandLine commandLine(
      "kytdevserver",
      "A back end for development and tests: storebags, event posts, and a page that shows them");
  auto requestSeconds = static_cast<int>(options.requestTimeout.count());
  describe(commandLine, options, requestSeconds, digestKeys);
  if (const auto status = commandLine.parse(argc, argv)) return *status;
  options.requestTimeout = std::chrono::seconds(requestSeconds);
  for (const std::string& text : digestKeys) {
    const auto key = digestKeyFrom(text);
    if (!key) return failUsage("--digest-key takes [CLIENT=]HEX");
    options.digestKeys.push_back(*key);
  }
  if (!std::all_of(options.hosts.begin(), options.hosts.end(), isHost)) {
    return failUsage("--host takes a name or an address");
  }
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  signal(SIGPIPE, SIG_IGN);
  raiseDescriptorLimit();
  return serve(options, signals);
}
