#include "receiver/Settings.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <initializer_list>
#include <utility>

#include "http/Text.h"
#include "platform/base/NearestName.h"
#include "platform/linux/toml/Toml.h"
#include "receiver/Limits.h"

namespace kyt::receiver {
namespace {

// One table of the file: takes its keys out one by one, and notes what is wrong with line and key.
class Section {
 public:
  Section(const TomlTable& table, uint32_t line, std::string where, std::string_view file,
          std::vector<std::string>& errors)
      : table_(table), line_(line), where_(std::move(where)), file_(file), errors_(errors) {}

  // Null: it is not there.
  const TomlNode* find(const char* key) {
    known_.emplace_back(key);
    const auto found = table_.find(key);
    return found == table_.end() ? nullptr : &found->second;
  }
  void wrong(uint32_t line, std::string_view key, std::string_view what) {
    const std::string text = "\"" + where_ + std::string(key) + "\" " + std::string(what);
    errors_.push_back(tomlError(file_, line, text).text);
  }
  void missing(const char* key) { wrong(line_, key, "is missing"); }

  bool text(const char* key, std::string& into) {
    const TomlNode* node = find(key);
    if (node == nullptr) return false;
    if (node->text() == nullptr || node->text()->empty()) {
      wrong(node->line, key, "must be text");
    } else {
      into = *node->text();
    }
    return true;
  }
  void path(const char* key, std::string& into) {
    std::string text;
    if (!this->text(key, text) || text.empty()) return;
    if (text.front() != '/') wrong(find(key)->line, key, "must be an absolute path");
    into = text;
  }
  template <typename Number>
  void count(const char* key, Number& into, int64_t least, int64_t most) {
    const TomlNode* node = find(key);
    if (node == nullptr) return;
    const auto* number = std::get_if<int64_t>(&node->value);
    if (number == nullptr || *number < least || *number > most) {
      wrong(node->line, key,
            "must be a whole number from " + std::to_string(least) + " to " + std::to_string(most));
    } else {
      into = static_cast<Number>(*number);
    }
  }
  // The index of the word in the list.
  std::optional<size_t> word(const char* key, std::initializer_list<std::string_view> words) {
    const TomlNode* node = find(key);
    if (node == nullptr) return std::nullopt;
    std::string list;
    for (size_t i = 0; i < words.size(); ++i) {
      const std::string_view word = *(words.begin() + i);
      if (node->text() != nullptr && *node->text() == word) return i;
      list += (i == 0 ? "\"" : " or \"") + std::string(word) + "\"";
    }
    wrong(node->line, key, "must be " + list);
    return std::nullopt;
  }
  // After all others: keys that nobody asked for.
  void end() {
    for (const auto& [key, node] : table_) {
      if (std::find(known_.begin(), known_.end(), key) != known_.end()) continue;
      std::string what = "is no setting";
      if (const auto nearest = nearestName(key, known_)) what += "; did you mean \"" + *nearest + "\"?";
      wrong(node.line, key, what);
    }
  }
  [[nodiscard]] uint32_t line() const { return line_; }

 private:
  const TomlTable& table_;
  const uint32_t line_;
  const std::string where_;
  const std::string_view file_;
  std::vector<std::string>& errors_;
  std::vector<std::string> known_;
};

bool isSubjectName(std::string_view text) {
  return !text.empty() && text.size() <= 128 && std::all_of(text.begin(), text.end(), [](unsigned char c) {
    return (c >= '0' && c <= '9') || (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '-' || c == '_';
  });
}

// [nats://|tls://][NAME:PASSWORD@]HOST[:PORT], a host of IPv6 in brackets.
bool isServerOfNats(std::string_view text) {
  for (const std::string_view scheme : {"nats://", "tls://"})
    if (text.starts_with(scheme)) text.remove_prefix(scheme.size());
  if (const size_t at = text.rfind('@'); at != std::string_view::npos) text.remove_prefix(at + 1);
  const bool isBracketed = text.starts_with('[');
  const size_t end = isBracketed ? text.find(']') : std::min(text.find(':'), text.size());
  if (end == std::string_view::npos || end == (isBracketed ? 1 : 0)) return false;
  const std::string_view host = text.substr(0, end), port = text.substr(end + (isBracketed ? 1 : 0));
  if (host.find_first_of("/ ") != std::string_view::npos) return false;
  unsigned number = 1;
  if (port.empty()) return true;
  const auto [last, error] = std::from_chars(port.data() + 1, port.data() + port.size(), number);
  return port.front() == ':' && error == std::errc() && last == port.data() + port.size() && number >= 1 &&
         number <= 65535;
}

class Reading {
 public:
  Reading(const TomlTable& root, std::string_view file) : root_(root), file_(file) {}

  std::variant<Settings, SettingsErrors> read() {
    Section top(root_, 0, "", file_, errors_);
    listening(top);
    table(top, "log", true, [&](Section& section) { log(section); });
    table(top, "spool", true, [&](Section& section) {
      section.path("path", settings_.spoolPath);
      if (settings_.spoolPath.empty() && section.find("path") == nullptr) section.missing("path");
      section.count("max_bytes", settings_.spoolMaxBytes, 1 << 20, int64_t{1} << 50);
    });
    table(top, "limits", false, [&](Section& section) {
      section.count("max_body_bytes", settings_.maxBodyBytes, 1024, int64_t{64} << 20);
      int64_t seconds = settings_.bodyTime.count();
      section.count("body_seconds", seconds, 1, 3600);
      settings_.bodyTime = std::chrono::seconds(seconds);
      seconds = settings_.idleTime.count();
      section.count("idle_seconds", seconds, 1, 86400);
      settings_.idleTime = std::chrono::seconds(seconds);
    });
    settings_.log.maxBodyBytes = settings_.maxBodyBytes;
    paths(top);
    top.end();
    if (!errors_.empty()) return SettingsErrors{std::move(errors_)};
    return std::move(settings_);
  }

 private:
  template <typename Read>
  void table(Section& top, const char* name, bool isRequired, Read read) {
    const TomlNode* node = top.find(name);
    if (node == nullptr) {
      if (isRequired) top.missing(name);
      return;
    }
    if (node->table() == nullptr) {
      top.wrong(node->line, name, "must be a section");
      return;
    }
    Section section(*node->table(), node->line, std::string(name) + ".", file_, errors_);
    read(section);
    section.end();
  }

  void address(Section& top, const char* key, std::optional<ListenAddress>& into) {
    std::string text;
    if (!top.text(key, text) || text.empty()) return;
    into = listenAddressFrom(text);
    if (!into) top.wrong(top.find(key)->line, key, R"(must be an address and a port, as "127.0.0.1:8480")");
  }

  void listening(Section& top) {
    std::optional<ListenAddress> listen = settings_.listen;
    address(top, "listen", listen);
    if (listen) settings_.listen = *listen;
    address(top, "metrics", settings_.metrics);
    top.path("certificate", settings_.certificateFile);
    top.path("key", settings_.keyFile);
    if (settings_.certificateFile.empty() != settings_.keyFile.empty())
      top.missing(settings_.keyFile.empty() ? "key" : "certificate");
  }

  void log(Section& section) {
    LogSettings& log = settings_.log;
    if (const auto kind = section.word("kind", {"nats", "kafka"})) {
      log.kind = *kind == 0 ? LogKind::nats : LogKind::kafka;
    } else if (section.find("kind") == nullptr) {
      section.missing("kind");
    }
    const TomlNode* servers = section.find("servers");
    if (servers == nullptr) {
      section.missing("servers");
    } else if (servers->array() == nullptr || servers->array()->empty() ||
               !std::all_of(servers->array()->begin(), servers->array()->end(), [](const TomlNode& node) {
                 return node.text() != nullptr && !node.text()->empty();
               })) {
      section.wrong(servers->line, "servers", "must be an array of texts, of one at least");
    } else {
      for (const TomlNode& node : *servers->array()) {
        if (log.kind == LogKind::nats && !isServerOfNats(*node.text()))
          section.wrong(node.line, "servers",
                        "must hold addresses as \"nats://10.0.0.1:4222\" or \"tls://10.0.0.1:4222\"");
        log.servers.push_back(*node.text());
      }
    }
    section.text("stream", log.stream);
    if (!isSubjectName(log.stream))
      section.wrong(section.find("stream")->line, "stream", "may hold letters, digits, \"-\" and \"_\"");
    section.count("partitions", log.partitions, 1, Limits::maxPartitions);
    seconds(section, "publish_seconds", log.publishTime);
    section.path("ca_file", log.caFile);
    section.path("credentials", log.credentials);
    section.count("replicas", log.replicas, 1, 5);
    section.count("max_bytes", log.maxBytes, 1 << 20, int64_t{1} << 60);
    int64_t maxAge = log.maxAge.count();
    section.count("max_age_seconds", maxAge, 0, Limits::maxAgeSeconds);
    log.maxAge = std::chrono::seconds(maxAge);
  }

  static void seconds(Section& section, const char* key, std::chrono::milliseconds& into) {
    const TomlNode* node = section.find(key);
    if (node == nullptr) return;
    double number = -1;
    if (const auto* whole = std::get_if<int64_t>(&node->value)) number = static_cast<double>(*whole);
    if (const auto* real = std::get_if<double>(&node->value)) number = *real;
    if (!(number >= 0.05 && number <= Limits::maxPublishSeconds)) {
      section.wrong(node->line, key, "must be a number of seconds, from 0.05 to 4");
    } else {
      into = std::chrono::milliseconds(std::llround(number * 1000));
    }
  }

  void paths(Section& top) {
    const TomlNode* node = top.find("path");
    if (node == nullptr) return top.missing("path");
    if (node->array() == nullptr) return top.wrong(node->line, "path", "must be written [[path]]");
    for (const TomlNode& entry : *node->array()) {
      if (entry.table() == nullptr) {
        top.wrong(entry.line, "path", "must be written [[path]]");
        continue;
      }
      Section section(*entry.table(), entry.line, "path.", file_, errors_);
      onePath(section);
      section.end();
    }
  }

  void onePath(Section& section) {
    PathSettings& path = settings_.paths.emplace_back();
    if (!section.text("url_path", path.urlPath)) section.missing("url_path");
    if (!path.urlPath.empty() && path.urlPath.front() != '/')
      section.wrong(section.find("url_path")->line, "url_path", "must begin with \"/\"");
    if (path.urlPath.find_first_of("?#") != std::string::npos)
      section.wrong(section.find("url_path")->line, "url_path",
                    "may hold no \"?\" and no \"#\": no post has such a path");
    if (std::count_if(settings_.paths.begin(), settings_.paths.end(),
                      [&](const PathSettings& other) { return other.urlPath == path.urlPath; }) > 1)
      section.wrong(section.line(), "url_path", "is there twice");
    if (const auto policy = section.word("digest", {"required", "optional", "none"}))
      path.digest = static_cast<DigestPolicy>(*policy);
    const TomlNode* keys = section.find("digest_keys");
    if (keys == nullptr) {
      if (path.digest == DigestPolicy::required) section.missing("digest_keys");
    } else if (keys->table() == nullptr) {
      section.wrong(keys->line, "digest_keys", R"(must be a table, as { "QPW/client" = ["00ff…"] })");
    } else {
      for (const auto& [name, list] : *keys->table()) digestKeys(section, name, list, path);
    }
  }

  static void digestKeys(Section& section, const std::string& name, const TomlNode& list,
                         PathSettings& path) {
    const std::string key = "digest_keys." + name;
    if (name.find('/') == std::string::npos)
      section.wrong(list.line, key, R"(must be named "SENDER/CLIENT")");
    if (list.array() == nullptr || list.array()->empty())
      return section.wrong(list.line, key, "must be an array of keys, of one at least");
    for (const TomlNode& node : *list.array()) {
      const auto bytes = node.text() != nullptr ? http::bytesFromHex(*node.text()) : std::nullopt;
      if (!bytes || bytes->empty())
        section.wrong(node.line, key, "must hold keys as hexadecimal digits, two for each byte");
      else
        path.digestKeys[name].push_back(*bytes);
    }
  }

  const TomlTable& root_;
  const std::string_view file_;
  Settings settings_;
  std::vector<std::string> errors_;
};

std::variant<Settings, SettingsErrors> settingsFrom(const std::variant<TomlTable, TomlError>& parsed,
                                                    std::string_view name) {
  if (const auto* error = std::get_if<TomlError>(&parsed)) return SettingsErrors{{error->text}};
  return Reading(std::get<TomlTable>(parsed), name).read();
}

}  // namespace

std::optional<ListenAddress> listenAddressFrom(std::string_view text) {
  const size_t colon = text.rfind(':');
  if (colon == std::string_view::npos || colon == 0) return std::nullopt;
  std::string_view host = text.substr(0, colon);
  const std::string_view port = text.substr(colon + 1);
  if (host.front() == '[') {
    if (host.back() != ']' || host.size() < 4) return std::nullopt;
    host = host.substr(1, host.size() - 2);
  }
  ListenAddress result{std::string(host)};
  const auto [end, error] = std::from_chars(port.data(), port.data() + port.size(), result.port);
  if (port.empty() || error != std::errc() || end != port.data() + port.size()) return std::nullopt;
  return result;
}

std::variant<Settings, SettingsErrors> readSettings(const std::string& file) {
  return settingsFrom(readToml(file), file);
}

std::variant<Settings, SettingsErrors> parseSettings(std::string_view text, std::string_view name) {
  return settingsFrom(parseToml(text, name), name);
}

}  // namespace kyt::receiver
