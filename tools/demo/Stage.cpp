#include "tools/demo/Stage.h"

#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "tools/StorebagFile.h"
#include "tools/demo/Http.h"

namespace kyt::tools {

namespace {

namespace fs = std::filesystem;
using std::chrono::seconds;

Error failure(std::string text) {
  return Error{"KYTToolsErrorDomain", -1, std::move(text)};
}

bool takesConnections(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) return false;
  std::memcpy(address.sun_path, path.data(), path.size());
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const bool taken = connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0;
  close(fd);
  return taken;
}

std::string grantFor(uid_t user) {
  return "[[grant]]\nuser = " + std::to_string(user) + "\n\"com.vantu.private.kytreportingd\" = true\n";
}

Value parsedJSON(const std::string& text) {
  RapidJSON json;
  auto parsed = json.parse(text);
  return std::holds_alternative<Value>(parsed) ? std::get<Value>(std::move(parsed)) : Value();
}

}  // namespace

std::variant<std::unique_ptr<Stage>, Error> Stage::make(Options options) {
  if (options.folder.empty()) {
    const char* temporary = std::getenv("TMPDIR");
    std::string pattern = std::string(temporary != nullptr ? temporary : "/tmp") + "/kyt-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) return failure(pattern + ": " + std::strerror(errno));
    options.folder = pattern;
  }
  std::unique_ptr<Stage> stage(new Stage(std::move(options)));
  if (auto error = stage->layOut()) return *error;
  if (auto error = stage->startServer()) return *error;
  if (auto error = stage->writeConfiguration()) return *error;
  if (auto error = stage->handOverFolders()) return *error;
  return stage;
}

Stage::~Stage() {
  daemon_.reset();
  server_.reset();
  std::error_code ignored;
  if (!options_.keepFolder) fs::remove_all(options_.folder, ignored);
}

std::optional<Error> Stage::layOut() {
  std::error_code error;
  for (const char* folder : {"/etc/kytreportingd/entitlements.d", "/var/lib/kytreportingd/defaults",
                             "/usr/share", "/run/kytreportingd", "/bags", "/server"}) {
    fs::create_directories(options_.folder + folder, error);
    if (error) return failure(options_.folder + folder + ": " + error.message());
  }
  const std::string share = options_.folder + "/usr/share/kytreporting";
  fs::copy(
      options_.share + "/kytreporting", share,
      fs::copy_options::recursive | fs::copy_options::overwrite_existing | fs::copy_options::skip_symlinks,
      error);  // an installed bundle has a link for the key, which the stage brings itself
  if (error) return failure(options_.share + "/kytreporting: " + error.message());
  auto made = makeKeyPair(2048);
  if (auto* problem = std::get_if<Error>(&made)) return *problem;
  privateKey_ = std::get<KeyPair>(made).privateKeyPEM;
  return writeFile(share + "/KYTReporting.bundle/publicKey.der", std::get<KeyPair>(made).publicKeyDER, 0644);
}

std::optional<Error> Stage::startServer() {
  const std::string ready = options_.folder + "/server.ready";
  std::vector<std::string> arguments = {"--state",      options_.folder + "/server",
                                        "--bags",       options_.folder + "/bags",
                                        "--https-port", "0",
                                        "--http-port",  "0",
                                        "--ready-file", ready,
                                        "--http-events"};
  arguments.insert(arguments.end(), options_.serverArguments.begin(), options_.serverArguments.end());
  ChildProcess::Options how;
  how.outputFile = serverLog();
  server_ = ChildProcess::start(program("kytdevserver"), arguments, how);
  if (!server_) return failure(program("kytdevserver") + ": " + std::strerror(errno));
  const bool up = waitUntil(seconds(30), [&] { return fs::exists(ready) || !server_->isRunning(); });
  auto text = readFile(ready);
  if (!up || !std::holds_alternative<std::string>(text))
    return failure("the development server did not start: " + serverLog());
  const Value ports = parsedJSON(std::get<std::string>(text));
  if (const Dictionary* numbers = ports.dictionary()) {
    if (const Value* https = numbers->find("https")) httpsPort_ = https->longLongValue();
    if (const Value* http = numbers->find("http")) httpPort_ = http->longLongValue();
    if (const Value* udp = numbers->find("udp")) udpPort_ = udp->longLongValue();
  }
  if (httpsPort_ == 0 || httpPort_ == 0) return failure("the development server's ready file names no ports");
  return std::nullopt;
}

std::optional<Error> Stage::writeConfiguration() {
  const std::string etc = options_.folder + "/etc/kytreportingd/";
  const std::string settings =
      "[storebag]\ninternal_host = \"" + httpsBase() + "\"\npublic_host = \"" + httpsBase() +
      "\"\n[tls]\nca_file = \"" + options_.folder + "/server/ca.pem\"\n" + "[log]\ntarget = \"stderr\"\n" +
      // As the packages' settings do.
      "[compression]\nlibrary = \"libdeflate\"\nlevel = 5\n" + options_.extraSettings;
  if (auto error = writeFile(etc + "kytreportingd.toml", settings, 0644)) return error;
  // Whoever started the stage may try things out on it too.
  std::string grant = grantFor(geteuid());
  if (options_.clientUser) grant += grantFor(options_.clientUser->user);
  if (auto error = writeFile(etc + "entitlements.d/stage.toml", grant, 0644)) return error;
  std::string device =
      "ProductVersion = \"12.1\"\nBuildVersion = \"12B7\"\nProductType = \"Board7,1\"\n"
      "DeviceName = \"Demo Device\"\nHWModelStr = \"B7\"\nSerialNumber = \"KYT0001\"\n"
      // Containers often have no machine identifier that it could come from.
      "UniqueDeviceID = \"00d3300d3300d3300d3300d3300d3300d3300d33\"\n";
  if (!options_.country.empty()) device += "country = \"" + options_.country + "\"\n";
  if (options_.internalBuild) device += "ReleaseType = \"Internal\"\n";
  if (auto error = writeFile(etc + "device.toml", device, 0644)) return error;
  return writeFile(options_.folder + "/var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml",
                   std::string("consent = ") + (options_.consent ? "true" : "false") + "\n", 0644);
}

// What an installation gives the daemon's user: its state, its run folder and the message logs. Everybody may look in.
std::optional<Error> Stage::handOverFolders() {
  if (!options_.daemonUser && !options_.clientUser) return std::nullopt;
  if (chmod(options_.folder.c_str(), 0755) != 0)
    return failure(options_.folder + ": " + std::strerror(errno));
  if (!options_.daemonUser) return std::nullopt;
  const std::string logs = options_.folder + "/var/mobile/Library/Logs/Faultbin/Retired";
  const std::string state = options_.folder + "/var/lib/kytreportingd/defaults";
  std::error_code error;
  fs::create_directories(logs, error);
  if (error) return failure(logs + ": " + error.message());
  // The former is made again in it.
  const std::string above = options_.folder + "/var/mobile/Library/Logs/Faultbin";
  if (chown(above.c_str(), static_cast<uid_t>(-1), options_.daemonUser->group) != 0 ||
      chmod(above.c_str(), 01775) != 0)
    return failure(above + ": " + std::strerror(errno));
  for (const std::string& own :
       {logs, state, state + "/com.vantu.diagnostics.toml", options_.folder + "/run/kytreportingd"}) {
    if (chown(own.c_str(), options_.daemonUser->user, options_.daemonUser->group) != 0)
      return failure(own + ": " + std::strerror(errno));
  }
  return std::nullopt;
}

std::optional<Error> Stage::putStorebag(const std::string& name, const Dictionary& bag) {
  PugixmlPropertyLists propertyLists;
  RapidJSON json;
  OpenSSLCryptography cryptography;
  auto document = StorebagFile(propertyLists, json, cryptography).sign(bag, privateKey_);
  if (auto* error = std::get_if<Error>(&document)) return *error;
  return writeFile(options_.folder + "/bags/" + name + ".plist", std::get<std::string>(document), 0644);
}

std::optional<Error> Stage::startDaemon(const std::string& insteadOfIt) {
  const std::string started = insteadOfIt.empty() ? program("kytreportingd") : insteadOfIt;
  ChildProcess::Options how;
  how.outputFile = daemonLog();
  how.user = options_.daemonUser;
  std::vector<std::string> arguments = {"--root", options_.folder};
  if (!options_.logLevel.empty()) arguments.insert(arguments.end(), {"--log-level", options_.logLevel});
  daemon_ = ChildProcess::start(started, arguments, how);
  if (!daemon_) return failure(started + ": " + std::strerror(errno));
  const bool up =
      waitUntil(seconds(30), [this] { return takesConnections(socketPath()) || !daemon_->isRunning(); });
  if (!up || !daemon_->isRunning()) return failure("the daemon did not start: " + daemonLog());
  return std::nullopt;
}

std::optional<int> Stage::stopDaemon(std::chrono::milliseconds timeout) {
  if (!daemon_) return std::nullopt;
  daemon_->signal(SIGTERM);
  const std::optional<int> status = daemon_->wait(timeout);
  if (status) daemon_.reset();
  return status;
}

Value Stage::query(const std::string& path) const {
  const auto answer = httpGet(httpBase() + path, 120);
  return answer && answer->status == 200 ? parsedJSON(answer->body) : Value();
}

bool Stage::waitForEvents(int64_t count, int limit) const {
  const Value answer =
      query("/api/wait?events=" + std::to_string(count) + "&timeout=" + std::to_string(limit));
  const Dictionary* dictionary = answer.dictionary();
  const Value* reached = dictionary != nullptr ? dictionary->find("reached") : nullptr;
  return reached != nullptr && reached->boolValue();
}

bool Stage::control(const std::string& path, const std::string& json) const {
  const auto answer = httpPut(httpBase() + path, json);
  return answer && answer->status / 100 == 2;
}

}  // namespace kyt::tools
