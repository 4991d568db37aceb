#include "devserver/Storebags.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdio>

#define TOML_EXCEPTIONS 0
#include <toml++/toml.h>

#include "devserver/Files.h"
#include "devserver/Text.h"

namespace kyt::devserver {
namespace {

constexpr size_t kMaxStorebag = 16 << 20;
constexpr size_t kMaxOverrides = 64 * 1024;

bool isName(std::string_view name) {
  return !name.empty() && name.size() <= 64 && std::all_of(name.begin(), name.end(), [](unsigned char c) {
    return std::isalnum(c) != 0 || c == '-' || c == '_';
  });
}

}  // namespace

std::optional<Storebags::Source> Storebags::sourceOf(const std::string& name) const {
  constexpr std::pair<const char*, const char*> kSources[] = {
      {".plist", nullptr}, {".bag.toml", "toml"}, {".bag.json", "json"}, {".bag.plist", "plist"}};
  for (const auto& [extension, format] : kSources) {
    if (format != nullptr && !signer_) break;
    Source source;
    source.path = folder_ / (name + extension);
    source.format = format;
    struct stat status {};
    if (stat(source.path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) continue;
    source.seconds = status.st_mtim.tv_sec;
    source.version = {status.st_mtim.tv_sec, status.st_mtim.tv_nsec, status.st_ino, status.st_size};
    return source;
  }
  return std::nullopt;
}

std::variant<std::string, SigningError> Storebags::documentOf(const Source& source) const {
  std::optional<std::string> content = readFile(source.path, kMaxStorebag);
  if (!content) return SigningError{"it can't be read"};
  if (source.format == nullptr) return std::move(*content);
  return signer_->sign(*content, source.format);
}

std::optional<Storebag> Storebags::find(const std::string& name) {
  if (folder_.empty() || !isName(name)) return std::nullopt;
  MutexLock lock(mutex_);
  const std::optional<Source> source = sourceOf(name);
  if (!source) return std::nullopt;
  Entry& entry = entries_[name];
  if (!entry.content || entry.version != source->version) {
    auto document = documentOf(*source);
    if (const auto* error = std::get_if<SigningError>(&document)) {
      Storebag bad;
      bad.problem = source->path.filename().string() + ": " + error->reason;
      return bad;
    }
    auto content = std::make_shared<const std::string>(std::move(std::get<std::string>(document)));
    const bool sameSecond =
        entry.content && *entry.content != *content && source->seconds <= entry.lastModified;
    entry.lastModified = sameSecond ? entry.lastModified + 1 : source->seconds;
    entry.version = source->version;
    entry.content = std::move(content);
  }
  Storebag bag{entry.content, httpDate(entry.lastModified), "max-age=" + std::to_string(maxAge_), {}};
  applyOverrides(name, bag);
  return bag;
}

void Storebags::applyOverrides(const std::string& name, Storebag& bag) const {
  const std::filesystem::path path = folder_ / (name + ".toml");
  const std::optional<std::string> text = readFile(path, kMaxOverrides);
  if (!text) return;
  const toml::parse_result result = toml::parse(std::string_view(*text));
  if (!result) {
    std::fprintf(stderr, "kytdevserver: %s is no TOML and has no effect: %s\n", path.c_str(),
                 printable(result.error().description()).c_str());
    return;
  }
  const toml::table& table = result.table();
  if (const auto maxAge = table["max_age"].value<int64_t>())
    bag.cacheControl = "max-age=" + std::to_string(*maxAge);
  if (const auto whole = table["cache_control"].value<std::string>()) bag.cacheControl = printable(*whole);
  if (!table["last_modified"].value_or(true)) bag.lastModified.clear();
}

}  // namespace kyt::devserver
