#include "platform/linux/device/TomlUserDefaults.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <thread>
#include <utility>

#include "platform/base/Blocking.h"
#include "platform/base/Limits.h"

namespace kyt {
namespace {

constexpr std::string_view kIdentifierPrefix = "uuid:";
constexpr std::string_view kOwnerPrefix = "uuidOwner:";
constexpr std::string_view kMadePrefix = "uuidMade:";
constexpr std::string_view kAllIdentifiers = "uuid";  // and what is noted beside them

Error failure(int code, std::string text) {
  return Error{"KYTUserDefaultsErrorDomain", code, std::move(text)};
}
Error systemFailure(int error, const std::string& what) {
  return failure(error, what + ": " + errorText(error));
}

std::string identifierOwnedBy(std::string_view ownerKey) {
  return std::string(kIdentifierPrefix).append(ownerKey.substr(kOwnerPrefix.size()));
}

std::optional<std::string> withEntry(std::string_view text, std::string_view file, std::string_view key,
                                     int64_t value) {
  const auto parsed = parseFlatToml(text, file);
  const auto* content = std::get_if<FlatToml>(&parsed);
  if (content == nullptr) return std::nullopt;
  return content->textWith(key, Value(value));
}

std::string ownerKeyOf(std::string_view identifier) {
  return std::string(kOwnerPrefix).append(identifier.substr(kIdentifierPrefix.size()));
}

// Takes the owner and group of `like` as far as this process may; who may not give files away keeps its own.
void adoptOwner(int fd, uint32_t owner, uint32_t group) {
  if (::fchown(fd, owner, group) != 0) {
    if (::fchown(fd, static_cast<uid_t>(-1), group) != 0) errno = 0;
  }
}

}  // namespace

TomlUserDefaults::TomlUserDefaults(TomlUserDefaultsOptions options, Log& log, Counters& counters,
                                   const Clock& clock)
    : options_(std::move(options)), log_(log), counters_(counters), clock_(clock) {}

TomlUserDefaults::~TomlUserDefaults() = default;

bool TomlUserDefaults::isDomainName(std::string_view domain) {
  constexpr std::string_view kAllowed = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-";
  return !domain.empty() && domain.size() <= 128 && domain[0] != '.' &&
         domain.find("..") == std::string_view::npos &&
         domain.find_first_not_of(kAllowed) == std::string_view::npos;
}

std::string TomlUserDefaults::path(std::string_view domain, std::string_view suffix) const {
  std::string path = options_.folder + "/";
  path += domain;
  path += suffix;
  return path;
}

const FlatToml& TomlUserDefaults::current(std::string_view domain) {
  auto found = domains_.find(domain);
  if (found == domains_.end()) {
    found =
        domains_.emplace(std::string(domain), std::make_unique<FlatTomlFile>(path(domain, ".toml"), clock_))
            .first;
  }
  std::optional<TomlError> problem;
  const FlatToml& content = found->second->current(problem);
  if (problem) {
    counters_.add(Reason::badUserDefaultsFile);
    log_.error("userDefaults: %s", problem->text.c_str());
  }
  return content;
}

Value TomlUserDefaults::value(std::string_view domain, std::string_view key) {
  if (!isDomainName(domain)) return {};
  MutexLock lock(mutex_);
  return current(domain).value(key);
}

Dictionary TomlUserDefaults::values(std::string_view domain) {
  Dictionary all;
  if (!isDomainName(domain)) return all;
  MutexLock lock(mutex_);
  for (const auto& [key, entry] : current(domain).entries)
    all.set(String(std::string_view(key)), entry.value);
  return all;
}

std::optional<Error> TomlUserDefaults::set(std::string_view domain, std::string_view key, Value value) {
  const GateLock lock(writing_);
  const BlockingScope blocking;
  auto result = store(domain, key, std::move(value), Mode::replace);
  if (auto* error = std::get_if<Error>(&result)) return std::move(*error);
  return std::nullopt;
}

String TomlUserDefaults::stringOrStore(std::string_view domain, std::string_view key, String value,
                                       std::optional<uint32_t> owner) {
  const Value known = this->value(domain, key);
  if (known.string() != nullptr) return *known.string();
  const GateLock lock(writing_);
  const BlockingScope blocking;
  auto result = store(domain, key, Value(value), Mode::keepString, owner);
  if (const auto* error = std::get_if<Error>(&result)) {
    if (counters_.addAndMayLog(Reason::customIdentifierRefused, clock_.monotonic())) {
      log_.error("userDefaults: An identifier was not stored: %s", error->localizedDescription.c_str());
    }
    return value;
  }
  const String* stored = std::get<Value>(result).string();
  return stored != nullptr ? *stored : value;
}

// False: errno says why.
bool TomlUserDefaults::lockWithinPatience(const std::string& domain, int file) {
  while (::flock(file, LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK && errno != EINTR) return false;
    const MonotonicTime now = std::chrono::steady_clock::now();
    MonotonicTime& deadline = lockDeadlines_.try_emplace(domain, now + options_.lockWait).first->second;
    if (now >= deadline + options_.lockPause) deadline = now + options_.lockWait;
    if (now >= deadline) {
      errno = ETIMEDOUT;
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(2));
  }
  lockDeadlines_.erase(domain);
  return true;
}

std::variant<Descriptor, Error> TomlUserDefaults::lockDomain(const std::string& domain) {
  const std::string name = path(domain, ".lock");
  Descriptor file =
      ownDescriptor(::open(name.c_str(), O_RDONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, 0600));
  if (!file) return systemFailure(errno, name);
  struct stat status = {}, folder = {};
  if (::fstat(file.get(), &status) == 0 && ::stat(options_.folder.c_str(), &folder) == 0 &&
      status.st_uid != folder.st_uid) {
    adoptOwner(file.get(), folder.st_uid, folder.st_gid);
  }
  if (!lockWithinPatience(domain, file.get())) return systemFailure(errno, name);
  return file;
}

// Identifiers whose owner is not known, from before owners were noted or made by hand, count for nobody.
std::optional<Error> TomlUserDefaults::refusalOfAnother(const FlatToml& content,
                                                        std::optional<uint32_t> owner) const {
  if (content.countWithPrefix(kIdentifierPrefix) >= Limits::maxCustomIdentifiers)
    return failure(
        E2BIG, "there are " + std::to_string(Limits::maxCustomIdentifiers) + " custom identifiers already");
  if (!owner) return std::nullopt;
  size_t theirs = 0;
  for (auto entry = content.entries.lower_bound(kOwnerPrefix);
       entry != content.entries.end() && entry->first.starts_with(kOwnerPrefix); ++entry) {
    const bool owns = entry->second.value == Value(static_cast<int64_t>(*owner));
    if (owns && content.entries.contains(identifierOwnedBy(entry->first))) ++theirs;
  }
  if (theirs < options_.mostIdentifiersOfAUser) return std::nullopt;
  return failure(E2BIG, "there are " + std::to_string(theirs) + " custom identifiers of user " +
                            std::to_string(*owner) + " already");
}

bool TomlUserDefaults::isIdentifier(std::string_view key) {
  return key.starts_with(kAllIdentifiers) && !key.starts_with(kOwnerPrefix) && !key.starts_with(kMadePrefix);
}

std::string TomlUserDefaults::madeKeyOf(std::string_view key) {
  return std::string(kMadePrefix).append(key);
}

std::optional<Error> TomlUserDefaults::removeIdentifiers(std::string_view domainName) {
  const BlockingScope blocking;
  const GateLock one(writing_);
  const std::string domain(domainName);
  if (!isDomainName(domain)) return failure(EINVAL, "\"" + domain + "\" is no domain name");
  if (auto error = makeFolders(options_.folder, 0750)) return failure(EIO, *error);
  auto lock = lockDomain(domain);
  if (auto* error = std::get_if<Error>(&lock)) return std::move(*error);
  auto read = contentOf(path(domain, ".toml"));
  if (auto* error = std::get_if<Error>(&read)) return std::move(*error);
  const FlatToml& content = std::get<FlatToml>(read);
  if (content.countWithPrefix(kAllIdentifiers) == 0) return std::nullopt;
  return replaceFile(domain, content.textWithoutPrefix(kAllIdentifiers));
}

// Empty where there is no file.
std::variant<FlatToml, Error> TomlUserDefaults::contentOf(const std::string& file) const {
  struct stat status = {};
  if (::lstat(file.c_str(), &status) != 0) {
    if (errno == ENOENT) return FlatToml();
    return systemFailure(errno, file);
  }
  if (!S_ISREG(status.st_mode)) return failure(EINVAL, file + ": is no regular file");
  auto contents = readRegularFile(file, kMaxTomlBytes);
  if (const auto* wrong = std::get_if<ReadProblem>(&contents)) return failure(EIO, file + ": " + wrong->text);
  auto parsed = parseFlatToml(std::get<FileContents>(contents).bytes, file);
  if (auto* wrong = std::get_if<TomlError>(&parsed)) return failure(EINVAL, wrong->text);
  return std::move(std::get<FlatToml>(parsed));
}

std::variant<Value, Error> TomlUserDefaults::store(std::string_view domainName, std::string_view key,
                                                   Value value, Mode mode, std::optional<uint32_t> owner) {
  const std::string domain(domainName);
  if (!isDomainName(domain)) return failure(EINVAL, "\"" + domain + "\" is no domain name");
  const bool isCustom = key.starts_with(kIdentifierPrefix) && !value.isNull();
  if (isCustom && key.size() > kMaxIdentifierKey) return failure(E2BIG, "the identifier's key is too long");
  if (auto error = makeFolders(options_.folder, 0750)) return failure(EIO, *error);
  auto lock = lockDomain(domain);
  if (auto* error = std::get_if<Error>(&lock)) return std::move(*error);
  reached("locked");

  const std::string file = path(domain, ".toml");
  auto read = contentOf(file);
  if (auto* error = std::get_if<Error>(&read)) return std::move(*error);
  const FlatToml& content = std::get<FlatToml>(read);

  const Value known = content.value(key);
  if (mode == Mode::keepString && known.string() != nullptr) return known;
  if (value.isNull() && known.isNull()) return value;
  const bool isNew = isCustom && known.isNull();
  if (isNew)
    if (auto error = refusalOfAnother(content, owner)) return std::move(*error);
  auto text = content.textWith(key, value);
  if (text && isNew && owner) text = withEntry(*text, file, ownerKeyOf(key), static_cast<int64_t>(*owner));
  // Without this note rather than without the identifier.
  if (text && mode == Mode::keepString && isIdentifier(key))
    if (auto noted = withEntry(*text, file, madeKeyOf(key), clock_.timeOfDay().seconds))
      text = std::move(noted);
  if (!text)
    return failure(EINVAL, "such a value or key cannot be stored, or the file would become too large");
  if (auto error = replaceFile(domain, *text)) return std::move(*error);
  return value;
}

std::optional<Error> TomlUserDefaults::replaceFile(const std::string& domain, std::string_view text) {
  const std::string file = path(domain, ".toml");
  // One name for all writers, which the lock makes exclusive: what a crash left behind is replaced by the
  // next write.
  const std::string temporary = options_.folder + "/." + domain + ".toml.new";
  if (::unlink(temporary.c_str()) != 0 && errno != ENOENT) return systemFailure(errno, temporary);
  struct stat status = {};
  uint32_t mode = 0640;
  if (::stat(file.c_str(), &status) == 0) {
    mode = status.st_mode & 0777;
  } else if (::stat(options_.folder.c_str(), &status) != 0) {
    return systemFailure(errno, options_.folder);
  }
  const Descriptor folder =
      ownDescriptor(::open(options_.folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!folder) return systemFailure(errno, options_.folder);

  const Descriptor out =
      ownDescriptor(::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!out) return systemFailure(errno, temporary);
  reached("created");
  adoptOwner(out.get(), status.st_uid, status.st_gid);
  const bool written = writeAll(out.get(), text) && ::fchmod(out.get(), mode) == 0;
  if (written) reached("written");
  if (!written || ::fsync(out.get()) != 0) {
    const int error = errno;
    ::unlink(temporary.c_str());
    return systemFailure(error, temporary);
  }
  reached("synced");
  if (::rename(temporary.c_str(), file.c_str()) != 0) {
    const int error = errno;
    ::unlink(temporary.c_str());
    return systemFailure(error, file);
  }
  reached("renamed");
  // From here on readers see the new content; that it survives a power cut is what this adds.
  if (::fsync(folder.get()) != 0) return systemFailure(errno, options_.folder);
  reached("done");
  return std::nullopt;
}

}  // namespace kyt
