#include "tools/fleet/Postgres.h"

#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <vector>

#include "tools/StorebagFile.h"

namespace kyt::tools {

namespace fs = std::filesystem;

namespace {

constexpr std::chrono::seconds kPatience{60};

Error failure(std::string text) {
  return Error{"KYTToolsErrorDomain", -1, std::move(text)};
}

// Debian keeps each version's programs in a folder of their own.
std::string programs() {
  std::vector<std::string> folders;
  std::error_code none;
  for (const auto& entry : fs::directory_iterator("/usr/lib/postgresql", none))
    if (fs::exists(entry.path() / "bin/initdb")) folders.push_back(entry.path() / "bin");
  std::sort(folders.begin(), folders.end());
  return folders.empty() ? std::string() : folders.back();
}

std::string contentsOf(const std::string& path) {
  auto text = readFile(path);
  return std::holds_alternative<std::string>(text) ? std::get<std::string>(std::move(text)) : std::string();
}

}  // namespace

bool Postgres::isHere() {
  return !programs().empty();
}

std::variant<std::unique_ptr<Postgres>, Error> Postgres::start() {
  std::unique_ptr<Postgres> made(new Postgres);
  std::string folder = (fs::temp_directory_path() / "kyt-postgres-XXXXXX").string();
  if (mkdtemp(folder.data()) == nullptr) return failure(folder + ": " + std::strerror(errno));
  made->folder_ = folder;
  if (geteuid() == 0) {
    made->user_ = User::of("nobody");
    if (!made->user_ || chown(folder.c_str(), made->user_->user, made->user_->group) != 0)
      return failure(folder + " cannot be given to nobody");
  }
  if (auto error = made->makeCluster()) return *error;
  if (auto error = made->run()) return *error;
  return made;
}

std::optional<Error> Postgres::makeCluster() {
  ChildProcess::Options how;
  how.outputFile = folder_ + "/initdb.log";
  how.user = user_;
  auto made = ChildProcess::start(programs() + "/initdb",
                                  {"--pgdata=" + folder_ + "/data", "--username=kyt", "--auth=trust",
                                   "--encoding=UTF8", "--locale=C", "--no-sync"},
                                  how);
  if (!made) return failure(programs() + "/initdb: " + std::strerror(errno));
  if (made->wait(kPatience) == 0) return std::nullopt;
  return failure("initdb failed: " + contentsOf(how.outputFile));
}

std::optional<Error> Postgres::run() {
  ChildProcess::Options how;
  how.outputFile = folder_ + "/log";
  how.user = user_;
  auto started = ChildProcess::start(programs() + "/postgres",
                                     {"-D", folder_ + "/data", "-k", folder_, "-c", "listen_addresses=", "-c",
                                      "max_connections=20", "-c", "shared_buffers=32MB"},
                                     how);
  if (!started) return failure(programs() + "/postgres: " + std::strerror(errno));
  process_ = std::move(*started);
  if (waitUntil(kPatience, [this] { return query("SELECT 1") == "1\n" || !process_.isRunning(); }) &&
      process_.isRunning())
    return std::nullopt;
  return failure("postgres did not start: " + log());
}

Postgres::~Postgres() {
  // The fast way: connections are ended. SIGTERM would wait for them.
  if (process_.pid() > 0) {
    process_.signal(SIGINT);
    (void)process_.wait(std::chrono::seconds(10));
  }
  process_ = ChildProcess();
  std::error_code ignored;
  if (!folder_.empty()) fs::remove_all(folder_, ignored);
}

std::optional<Error> Postgres::restart() {
  process_.signal(SIGQUIT);  // as a machine that stops: what is committed is in its log
  (void)process_.wait(kPatience);
  return run();
}

std::string Postgres::query(const std::string& sql) const {
  const std::string file = folder_ + "/answer";
  std::error_code ignored;
  fs::remove(file, ignored);
  ChildProcess::Options how;
  how.outputFile = file;
  auto asked =
      ChildProcess::start(programs() + "/psql", {"-X", "-A", "-t", "-q", "-d", database(), "-c", sql}, how);
  if (!asked || !asked->wait(kPatience)) return {};
  return contentsOf(file);
}

std::string Postgres::log() const {
  return contentsOf(folder_ + "/log");
}

}  // namespace kyt::tools
