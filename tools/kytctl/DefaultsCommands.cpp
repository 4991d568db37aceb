// User defaults and the owner's consent.
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <cstdlib>

#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "platform/linux/base/LinuxClock.h"
#include "platform/linux/device/TomlUserDefaults.h"
#include "platform/queues/Log.h"
#include "tools/kytctl/Commands.h"

namespace kyt::tools {

namespace {

// What the files' reader has to say is the command's own complaint.
class ComplaintSink final : public LogSink {
 public:
  void write(LogLevel /*level*/, std::string_view line) override { failed(std::string(line)); }
};

struct Defaults {
  explicit Defaults(const std::string& root)
      : defaults({.folder = root + "/var/lib/kytreportingd/defaults"}, log, counters, clock) {}
  // A file that may not be read, or is none, was complained about: what it holds is not known, which is not the same as
  // having no value.
  [[nodiscard]] bool unknown() const { return counters.value(Reason::badUserDefaultsFile) != 0; }
  ComplaintSink sink;
  Log log{sink};
  Counters counters;
  LinuxClock clock;
  TomlUserDefaults defaults;
};

std::optional<Value> parsed(const std::string& type, const std::string& text) {
  if (type == "string") return Value(text);
  if (type == "boolean") {
    if (text == "true" || text == "yes" || text == "1") return Value(true);
    if (text == "false" || text == "no" || text == "0") return Value(false);
    return std::nullopt;
  }
  const char* const end = text.data() + text.size();
  if (type == "integer") {
    int64_t number = 0;
    const auto result = std::from_chars(text.data(), end, number);
    return result.ec == std::errc() && result.ptr == end ? std::optional<Value>(number) : std::nullopt;
  }
  double number = 0;
  const auto result = std::from_chars(text.data(), end, number);
  return result.ec == std::errc() && result.ptr == end ? std::optional<Value>(number) : std::nullopt;
}

const char* kindName(const Value& value) {
  switch (value.kind()) {
    case Value::Kind::boolean:
      return "boolean";
    case Value::Kind::integer:
    case Value::Kind::unsignedInteger:
      return "integer";
    case Value::Kind::real:
      return "real";
    default:
      return "string";
  }
}

}  // namespace

int failed(const std::string& text) {
  std::fprintf(stderr, "kytctl: %s\n", escapedText(text).c_str());
  return 1;
}

int failed(const Error& error) {
  return failed(error.localizedDescription);
}

int defaultsReadCommand(const std::string& root, const std::string& domain, const std::string& key) {
  if (!TomlUserDefaults::isDomainName(domain)) return failed("\"" + domain + "\" is no domain name");
  Defaults stored(root);
  if (!key.empty()) {
    const Value value = stored.defaults.value(domain, key);
    if (stored.unknown()) return 1;
    if (value.isNull()) return failed(domain + " has no value for " + key);
    std::printf("%s\n", escapedText(description(value)).c_str());
    return 0;
  }
  for (const DictionaryEntry& entry : stored.defaults.values(domain))
    std::printf("%s = %s (%s)\n", escapedText(entry.key.view()).c_str(),
                escapedText(description(entry.value)).c_str(), kindName(entry.value));
  return stored.unknown() ? 1 : 0;
}

int defaultsWriteCommand(const std::string& root, const std::string& domain, const std::string& key,
                         const std::string& type, const std::optional<std::string>& value) {
  if (!TomlUserDefaults::isDomainName(domain)) return failed("\"" + domain + "\" is no domain name");
  Value made;
  if (value) {
    const std::optional<Value> read = parsed(type, *value);
    if (!read) return failed("\"" + *value + "\" is no " + type);
    made = *read;
  }
  Defaults stored(root);
  if (auto error = stored.defaults.set(domain, key, made)) return failed(*error);
  return 0;
}

int consentCommand(const std::string& root, const std::string& change) {
  Defaults stored(root);
  if (change != "show") {
    if (auto error = stored.defaults.set(kDiagnosticsDefaultsDomain, "consent", change == "grant"))
      return failed(*error);
  }
  const bool granted = stored.defaults.value(kDiagnosticsDefaultsDomain, "consent").boolValue();
  const bool known = !stored.unknown();
  std::printf("consent to diagnostics-and-usage upload: %s\n", !known    ? "cannot be read"
                                                               : granted ? "granted"
                                                                         : "not given");
  return known ? 0 : 1;
}

}  // namespace kyt::tools
