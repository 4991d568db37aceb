// User defaults as one flat TOML file a domain, in a folder of the daemon's own. Read on every access (a
// stat; the content only after a change), so that an administrator's change counts at once.
//
// Writers of any process exclude each other by a lock file beside the file (DOMAIN.lock). Of this process one writes at a
// time; all of them wait five seconds at most for a lock that somebody keeps, and then fail at once for a minute, unless
// it is free again. Who writes, or waits to, announces it to the worker pool (BlockingScope). A file is replaced by renaming a complete, synced one over it: whoever reads, and
// whatever crashes when, there is the old content or the new. Mode and, as far as this process may, owner and
// group of the file are kept; a new file gets those of the folder and mode 0640.
//
// A file that may not be read, cannot be parsed or is not flat has no values, is counted and logged once for
// each of its states, and is never overwritten. What the machine refuses for a moment (FlatToml.h) changes nothing but
// for a line. At most Limits::maxCustomIdentifiers keys "uuid:…" are
// stored, each of at most kMaxIdentifierKey bytes, since clients choose their names; for one user's clients only some of
// them. Beside each stands for whom it was made: "uuidOwner:…" with the user's number, in the same replacement; and beside
// every identifier when: "uuidMade:" with its key, in seconds since 1970.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <variant>

#include "platform/UserDefaults.h"
#include "platform/base/Clock.h"
#include "platform/base/Counters.h"
#include "platform/base/Limits.h"
#include "platform/base/Mutex.h"
#include "platform/linux/toml/FlatToml.h"
#include "platform/queues/Gate.h"
#include "platform/queues/Log.h"

namespace kyt {

struct TomlUserDefaultsOptions {
  std::string folder;
  Duration lockWait = std::chrono::seconds(5);
  // For tests: told the name of each step of a replacement as it is reached.
  void (*step)(const char* name) = nullptr;
  Duration lockPause = std::chrono::seconds(60);  // how long it is not waited for again
  size_t mostIdentifiersOfAUser = Limits::maxCustomIdentifiers;
};

class TomlUserDefaults final : public UserDefaults {
 public:
  static constexpr size_t kMaxIdentifierKey = 512;

  TomlUserDefaults(TomlUserDefaultsOptions options, Log& log, Counters& counters, const Clock& clock);
  ~TomlUserDefaults() override;

  [[nodiscard]] Value value(std::string_view domain, std::string_view key) override EXCLUDES(mutex_);
  [[nodiscard]] std::optional<Error> set(std::string_view domain, std::string_view key, Value value) override
      EXCLUDES(writing_);
  using UserDefaults::stringOrStore;
  [[nodiscard]] String stringOrStore(std::string_view domain, std::string_view key, String value,
                                     std::optional<uint32_t> owner) override EXCLUDES(mutex_, writing_);

  // All values of a domain, by key.
  [[nodiscard]] Dictionary values(std::string_view domain) EXCLUDES(mutex_);
  // The keys under which identifiers of this device stand: "uuidRespectDnu", "uuidOverrideDnu", "uuid:…"; and the key under
  // which stands when such a one was made and stored, in seconds since 1970.
  [[nodiscard]] static bool isIdentifier(std::string_view key);
  [[nodiscard]] static std::string madeKeyOf(std::string_view key);
  // All of them, with what is noted beside them; in one replacement of the file.
  [[nodiscard]] std::optional<Error> removeIdentifiers(std::string_view domain) EXCLUDES(writing_);
  // One to 128 of the characters A-Z a-z 0-9 . _ -, not beginning with a point, and nowhere two points in a
  // row.
  [[nodiscard]] static bool isDomainName(std::string_view domain);

 private:
  enum class Mode { replace, keepString };
  // What is stored afterwards, or an error.
  std::variant<Value, Error> store(std::string_view domain, std::string_view key, Value value, Mode mode,
                                   std::optional<uint32_t> owner = std::nullopt) REQUIRES(writing_);
  [[nodiscard]] std::optional<Error> refusalOfAnother(const FlatToml& content,
                                                      std::optional<uint32_t> owner) const;
  [[nodiscard]] std::variant<FlatToml, Error> contentOf(const std::string& file) const;
  std::optional<Error> replaceFile(const std::string& domain, std::string_view text) REQUIRES(writing_);
  const FlatToml& current(std::string_view domain) REQUIRES(mutex_);
  std::variant<Descriptor, Error> lockDomain(const std::string& domain) REQUIRES(writing_);
  [[nodiscard]] bool lockWithinPatience(const std::string& domain, int file) REQUIRES(writing_);
  [[nodiscard]] std::string path(std::string_view domain, std::string_view suffix) const;
  void reached(const char* step) const {
    if (options_.step != nullptr) options_.step(step);
  }

  const TomlUserDefaultsOptions options_;
  Log& log_;
  Counters& counters_;
  const Clock& clock_;
  Gate writing_;  // one writer of this process
  // Until when a domain's lock that somebody keeps is waited for: by all who come, once.
  std::map<std::string, MonotonicTime> lockDeadlines_ GUARDED_BY(writing_);
  Mutex mutex_;
  std::map<std::string, std::unique_ptr<FlatTomlFile>, std::less<>> domains_ GUARDED_BY(mutex_);
};

}  // namespace kyt
