#include "devserver/ReplyRules.h"

#include <rapidjson/document.h>
#include <rapidjson/error/en.h>

#include "devserver/JsonText.h"

namespace kyt::devserver {
namespace {

constexpr int64_t kMaxDelayMilliseconds = 600000;
constexpr size_t kMaxRules = 1000;

std::string_view textOf(const rapidjson::Value& value) {
  return {value.GetString(), value.GetStringLength()};
}

bool isHeaderText(std::string_view text) {
  return text.find_first_of(std::string_view("\r\n\0", 3)) == std::string_view::npos;
}

bool readHeaders(const rapidjson::Value& value, ReplyRule& rule) {
  if (!value.IsObject()) return false;
  for (const auto& member : value.GetObject()) {
    if (!member.value.IsString() || !isHeaderText(textOf(member.name)) ||
        !isHeaderText(textOf(member.value))) {
      return false;
    }
    rule.headers.push_back({std::string(textOf(member.name)), std::string(textOf(member.value))});
  }
  return true;
}

// One member of the rule; false when its value is of the wrong kind or its name is unknown.
bool readMember(std::string_view name, const rapidjson::Value& value, ReplyRule& rule) {
  if (name == "path" && value.IsString()) {
    rule.path = std::string(textOf(value));
  } else if (name == "body" && value.IsString()) {
    rule.body = std::string(textOf(value));
  } else if (name == "status" && value.IsUint() && value.GetUint() >= 200 && value.GetUint() <= 999) {
    rule.status = value.GetUint();
  } else if (name == "times" && value.IsUint64()) {
    rule.times = value.GetUint64();
  } else if (name == "delayMs" && value.IsUint() && value.GetUint() <= kMaxDelayMilliseconds) {
    rule.delay = std::chrono::milliseconds(value.GetUint());
  } else if (name == "hang" && value.IsBool()) {
    rule.hang = value.GetBool();
  } else if (name == "close" && value.IsBool()) {
    rule.close = value.GetBool();
  } else {
    return name == "headers" && readHeaders(value, rule);
  }
  return true;
}

bool fits(std::string_view rulePath, std::string_view path) {
  if (!path.starts_with(rulePath)) return false;
  return path.size() == rulePath.size() || rulePath.ends_with('/') || path[rulePath.size()] == '/';
}

}  // namespace

std::variant<ReplyRule, std::string> ReplyRules::parse(const std::string& json) {
  rapidjson::Document document;
  document.Parse<rapidjson::kParseIterativeFlag | rapidjson::kParseValidateEncodingFlag>(json.data(),
                                                                                         json.size());
  if (document.HasParseError()) {
    return std::string("the rule is no JSON: ") + rapidjson::GetParseError_En(document.GetParseError());
  }
  if (!document.IsObject()) return "the rule is no JSON object";
  ReplyRule rule;
  const rapidjson::Value& members = document;
  for (const auto& member : members.GetObject()) {
    if (!readMember(textOf(member.name), member.value, rule)) {
      return "\"" + printable(textOf(member.name)) + "\" is unknown or has a value that does not fit";
    }
  }
  if (!rule.path.starts_with('/')) return "\"path\" is missing or does not begin with a slash";
  return rule;
}

void ReplyRules::add(ReplyRule rule) {
  MutexLock lock(mutex_);
  if (rules_.size() >= kMaxRules) rules_.erase(rules_.begin());
  rules_.push_back(std::move(rule));
}

void ReplyRules::clear() {
  MutexLock lock(mutex_);
  rules_.clear();
  ++generation_;
}

std::optional<ReplyRule> ReplyRules::take(std::string_view path) {
  MutexLock lock(mutex_);
  for (auto rule = rules_.begin(); rule != rules_.end(); ++rule) {
    if (!fits(rule->path, path)) continue;
    ReplyRule taken = *rule;
    if (rule->times == 1) {
      rules_.erase(rule);
    } else if (rule->times > 1) {
      --rule->times;
    }
    return taken;
  }
  return std::nullopt;
}

std::string ReplyRules::asJson() {
  MutexLock lock(mutex_);
  JsonText json;
  json.object().key("rules").array();
  for (const ReplyRule& rule : rules_) {
    json.object().member("path", rule.path).member("times", rule.times).member("hang", rule.hang);
    json.member("close", rule.close).member("delayMs", int64_t{rule.delay.count()});
    json.member("status", rule.status).member("body", rule.body).endObject();
  }
  return json.endArray().endObject().text();
}

uint64_t ReplyRules::generation() {
  MutexLock lock(mutex_);
  return generation_;
}

}  // namespace kyt::devserver
