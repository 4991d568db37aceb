// What the owner of the device sees of what leaves it, takes along, and erases.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Counters.h"
#include "platform/base/Paths.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/data/RapidJSON.h"
#include "platform/linux/device/DepartureFile.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/linux/files/Files.h"
#include "platform/queues/Log.h"
#include "tools/StorebagFile.h"
#include "tools/kytctl/Columns.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/WaitingEvents.h"
#include "tools/kytctl/WaitingPosts.h"

namespace kyt::tools {

namespace {

constexpr size_t kMostLogBytes = 80u << 20;  // a message log has 64 MiB
// The daemon gives what waits up at once; its threads are not waited for.
constexpr Duration kDaemonEnds = std::chrono::seconds(30);

class ComplaintSink final : public LogSink {
 public:
  void write(LogLevel /*level*/, std::string_view line) override { failed(std::string(line)); }
};

struct MessageLog {
  std::string path;
  uint64_t bytes = 0;
};

std::string dateText(double seconds) {
  const auto time = static_cast<time_t>(seconds);
  struct tm parts = {};
  char text[32] = "?";
  if (localtime_r(&time, &parts) != nullptr) std::strftime(text, sizeof text, "%Y-%m-%d %H:%M", &parts);
  return text;
}

// "1.2M": four characters at most.
std::string sizeText(uint64_t bytes) {
  constexpr char kUnits[] = " KMGTPE";
  auto size = static_cast<double>(bytes);
  size_t unit = 0;
  for (; size >= 999.5 && unit < 6; ++unit) size /= 1024;
  char text[16];
  std::snprintf(text, sizeof text, unit > 0 && size < 9.95 ? "%.1f%c" : "%.0f%c", size, kUnits[unit]);
  std::string shown = text;
  while (shown.ends_with(' ')) shown.pop_back();
  return shown;
}

// Cut and padded to so many characters.
std::string fitted(std::string_view given, size_t width) {
  const std::string text = cutText(given.empty() ? "-" : given, width);
  return text + std::string(width - charactersIn(text), ' ');
}

// All that is on the device of what the daemon did.
class Owner {
 public:
  explicit Owner(const std::string& root)
      : root_(root),
        paths_(Paths::of(root, "/")),
        defaults_({.folder = paths_.userDefaults()}, log_, counters_, clock_),
        table_(DepartureFile::read(paths_.userDefaults(), json_)) {
    table_.dropOld(clock_.timeOfDay().asSeconds());
    findLogs();
    findIdentifiers();
  }

  // False: something may not be read, which was said.
  [[nodiscard]] bool isWhole() const {
    return counters_.value(Reason::badUserDefaultsFile) == 0 && !refused_;
  }

  [[nodiscard]] Dictionary object() {
    Array identifiers, logs;
    for (const Identifier& one : identifiers_)
      identifiers.append(Dictionary{{"name", std::string_view(one.name)},
                                    {"value", std::string_view(one.value)},
                                    {"made", one.made > 0 ? Value(one.made) : Value()}});
    for (const MessageLog& one : logs_)
      logs.append(Dictionary{{"path", std::string_view(one.path)}, {"bytes", one.bytes}});
    return {{"consent", hasConsent()},
            {"since", since()},
            {"left", left()},
            {"identifiers", std::move(identifiers)},
            {"waiting", WaitingEvents(root_).object()},
            {"logs", std::move(logs)}};
  }

  void print() {
    printLeft();
    printIdentifiers();
    std::printf("\nConsent to diagnostics-and-usage upload: %s\n", hasConsent() ? "granted" : "not given");
    std::printf("%s", WaitingEvents(root_).text().c_str());
    for (const MessageLog& one : logs_)
      std::printf("Message log: %s, %s bytes\n", escapedText(one.path).c_str(), sizeText(one.bytes).c_str());
    if (logs_.empty()) std::printf("Message log: none\n");
  }

  [[nodiscard]] std::optional<Error> exportTo(const std::string& file) {
    Dictionary all = object();
    Array logs;
    for (const MessageLog& one : logs_) {
      const auto contents = readRegularFile(one.path, kMostLogBytes);
      const auto* read = std::get_if<FileContents>(&contents);
      logs.append(Dictionary{{"path", std::string_view(one.path)},
                             {"bytes", one.bytes},
                             {"text", read != nullptr ? Value(std::string_view(read->bytes)) : Value()}});
    }
    all.set("logs", std::move(logs));
    all.set("defaults", defaults_.values(kKYTReportingDefaultsDomain));
    all.set("leftByHour", table_.object());
    if (DaemonLock::holder(paths_.userDefaults()) <= 0) {
      all.set("outbox", postsThatWait(paths_));
    } else if (WaitingPosts::of(root_, paths_, true).posts() != 0) {
      std::fprintf(stderr,
                   "kytctl: What waits in the outbox is counted, not written: the daemon has it open\n");
    }
    const std::string text = prettyJSON(all) + "\n";
    if (file != "-") return writeFile(file, text, 0600);
    std::fwrite(text.data(), 1, text.size(), stdout);
    return std::nullopt;
  }

  [[nodiscard]] int erase() {
    if (!identityOf(paths_.userDefaults()).exists()) {
      std::printf("Nothing to erase: no daemon ever ran here\n");
      return 0;
    }
    ErasureMark mark(paths_.userDefaults());
    if (!mark.set()) return failedAt(mark.path());
    const int status = eraseWithMark();
    return mark.remove() ? status : failedAt(mark.path());
  }

 private:
  struct Identifier {
    std::string name, value;
    double made = 0;  // seconds since 1970; 0: not known
  };
  struct Row {
    ReportingProgram program;
    std::string server;
    DepartureKind kind;
    friend auto operator<=>(const Row&, const Row&) = default;
  };

  static int failedAt(const std::string& path) { return failed(path + ": " + errorText(errno)); }
  [[nodiscard]] bool hasConsent() {
    return defaults_.value(kDiagnosticsDefaultsDomain, "consent").boolValue();
  }
  // From when on the file knows what left.
  [[nodiscard]] double since() const {
    const double day = clock_.timeOfDay().asSeconds() - DepartureTable::kHours * 3600;
    return std::max(table_.since(), day - static_cast<double>(static_cast<int64_t>(day) % 3600));
  }

  void findLogs() {
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator(paths_.messageLogs(), error))
      if (isMessageLog(entry.path().filename().string()) && entry.is_regular_file(error))
        logs_.push_back({entry.path().string(), entry.file_size(error)});
    if (error && error != std::errc::no_such_file_or_directory) {
      refused_ = true;
      failed(paths_.messageLogs() + ": " + error.message());
    }
  }
  static bool isMessageLog(const std::string& name) {
    return name.starts_with("kytreportingd_") && name.ends_with("_messageLog.diag") &&
           std::count(name.begin(), name.end(), '_') == 2;
  }

  void findIdentifiers() {
    const Dictionary all = defaults_.values(kKYTReportingDefaultsDomain);
    for (const DictionaryEntry& entry : all) {
      const std::string name = entry.key.str();
      if (!TomlUserDefaults::isIdentifier(name) || !entry.value.isString()) continue;
      const Value* made = all.find(TomlUserDefaults::madeKeyOf(name));
      identifiers_.push_back({name, entry.value.string()->str(), made != nullptr ? made->doubleValue() : 0});
    }
  }

  [[nodiscard]] std::map<Row, DepartureTable::Sum> sums() const {
    std::map<Row, DepartureTable::Sum> sums;
    for (const auto& [key, more] : table_.rows()) {
      DepartureTable::Sum& sum = sums[{key.program, key.server, key.kind}];
      sum.posts += more.posts;
      sum.events += more.events;
      sum.bytes += more.bytes;
      sum.unanswered += more.unanswered;
      sum.last = std::max(sum.last, more.last);
    }
    return sums;
  }
  [[nodiscard]] Array left() const {
    Array rows;
    for (const auto& [row, sum] : sums())
      rows.append(Dictionary{{"user", row.program.user},
                             {"clientType", row.program.clientType},
                             {"client", std::string_view(row.program.clientName)},
                             {"service", std::string_view(row.program.service)},
                             {"server", std::string_view(row.server)},
                             {"kind", nameOf(row.kind)},
                             {"posts", sum.posts},
                             {"events", sum.events},
                             {"bytes", sum.bytes},
                             {"unanswered", sum.unanswered},
                             {"last", sum.last}});
    return rows;
  }

  void printLeft() const {
    const auto rows = sums();
    if (rows.empty()) {
      std::printf("Nothing left the device since %s\n",
                  table_.since() > 0 ? dateText(since()).c_str() : "records are kept");
      return;
    }
    std::printf("Left the device since %s:\n\n", dateText(since()).c_str());
    std::printf("%-20s %-12s %4s %6s %-28s %8s %6s %5s\n", "PROGRAM", "SERVICE", "TYPE", "USER", "SERVER",
                "EVENTS", "POSTS", "BYTES");
    uint64_t posts = 0, unanswered = 0;
    for (const auto& [row, sum] : rows) {
      const bool isMany = row.program.clientType == DepartureTable::kManyPrograms;
      const std::string what =
          row.kind == DepartureKind::events ? std::to_string(sum.events) : nameOf(row.kind);
      const bool isOfMany = row.program.user == DepartureTable::kManyUsers;
      std::printf("%s %s %4s %6s %s %8s %6" PRIu64 " %5s\n",
                  fitted(isMany ? "(further programs)" : row.program.clientName, 20).c_str(),
                  fitted(row.program.service, 12).c_str(),
                  isMany ? "-" : std::to_string(row.program.clientType).c_str(),
                  isOfMany ? "-" : std::to_string(row.program.user).c_str(), fitted(row.server, 28).c_str(),
                  what.c_str(), sum.posts, sizeText(sum.bytes).c_str());
      posts += sum.posts;
      unanswered += sum.unanswered;
    }
    if (unanswered > 0)
      std::printf("\n%" PRIu64 " of these %" PRIu64
                  " posts were not answered: they may have arrived or not\n",
                  unanswered, posts);
  }

  void printIdentifiers() const {
    if (identifiers_.empty()) std::printf("\nIdentifiers: none\n");
    if (!identifiers_.empty()) std::printf("\nIdentifiers:\n\n");
    for (const Identifier& one : identifiers_)
      std::printf("%s %s %s\n", fitted(one.name, 40).c_str(), fitted(one.value, 36).c_str(),
                  one.made > 0 ? ("since " + dateText(one.made)).c_str() : "since before this was noted");
  }

  // The lock is kept meanwhile: a daemon that starts waits for it, and finds nothing of before.
  [[nodiscard]] int eraseWithMark() {
    std::string problem;
    int ended = 0;
    const auto lock = DaemonLock::takeFromDaemon(paths_.userDefaults(), kDaemonEnds, problem, ended);
    if (!lock) return failed("the daemon has not ended, and nothing was erased: " + problem);
    // What it wrote until then counts.
    table_ = DepartureFile::read(paths_.userDefaults(), json_);
    identifiers_.clear();
    findIdentifiers();
    logs_.clear();
    findLogs();
    if (!isWhole()) return 1;
    if (const auto error = defaults_.removeIdentifiers(kKYTReportingDefaultsDomain)) return failed(*error);
    int status = 0;
    for (const MessageLog& one : logs_)
      if (::unlink(one.path.c_str()) != 0 && errno != ENOENT) status = failedAt(one.path);
    bool wasKept = false;
    for (const char* name :
         {"/outbox.sqlite", "/outbox.sqlite-wal", "/outbox.sqlite-journal", "/outbox.sqlite.damaged",
          "/outbox.sqlite.new", "/outbox.sqlite.new-wal", "/outbox.sqlite.new-journal"}) {
      const std::string kept = paths_.outbox() + name;
      if (::unlink(kept.c_str()) == 0)
        wasKept = true;
      else if (errno != ENOENT)
        status = failedAt(kept);
    }
    if (wasKept) std::printf("Erased: what could not be sent\n");
    const std::string file = DepartureFile::pathIn(paths_.userDefaults());
    if (::unlink(file.c_str()) != 0 && errno != ENOENT) status = failedAt(file);
    if (status == 0) tellErased(ended > 0);
    return status;
  }

  void tellErased(bool ended) const {
    std::printf("Erased: %zu identifiers, %zu message logs, the record of what left\n", identifiers_.size(),
                logs_.size());
    if (ended)
      std::printf(
          "The daemon was ended, and what waited in its memory was not sent; the next program that reports "
          "starts it again where its socket does that\n");
    std::printf("Not erased: your consent, and lines of the daemon in the system's journal\n");
    if (identifiers_.empty() && table_.rows().empty()) return;
    std::printf(
        "What left before cannot be called back. To have it deleted, ask who runs the servers, and name the "
        "identifiers that were in use:\n");
    std::map<std::string, bool> servers;
    for (const auto& [key, sum] : table_.rows())
      if (!key.server.empty()) servers[key.server] = true;
    for (const auto& [server, known] : servers) std::printf("  server     %s\n", escapedText(server).c_str());
    for (const Identifier& one : identifiers_)
      std::printf("  identifier %s\n", escapedText(one.value).c_str());
  }

  const std::string root_;
  const Paths paths_;
  ComplaintSink sink_;
  Log log_{sink_};
  Counters counters_;
  LinuxClock clock_;
  RapidJSON json_;
  TomlUserDefaults defaults_;
  DepartureTable table_;
  std::vector<MessageLog> logs_;
  std::vector<Identifier> identifiers_;
  bool refused_ = false;
};

}  // namespace

int ownerShowCommand(const std::string& root, bool json) {
  Owner owner(root);
  if (!json) {
    owner.print();
  } else {
    std::printf("%s\n", prettyJSON(owner.object()).c_str());
  }
  return owner.isWhole() ? 0 : 1;
}

int ownerExportCommand(const std::string& root, const std::string& file) {
  Owner owner(root);
  if (const auto error = owner.exportTo(file)) return failed(*error);
  return owner.isWhole() ? 0 : 1;
}

int ownerEraseCommand(const std::string& root) {
  Owner owner(root);
  return owner.isWhole() ? owner.erase() : 1;
}

}  // namespace kyt::tools
