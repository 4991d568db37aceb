#include "devserver/AcknowledgementRules.h"

#include <rapidjson/document.h>

#include <array>
#include <string_view>
#include <utility>

#include "devserver/JsonText.h"

namespace kyt::devserver {
namespace {

using Action = AcknowledgementRule::Action;

constexpr std::array<std::pair<std::string_view, Action>, 5> kActions = {{{"lose", Action::lose},
                                                                          {"delay", Action::delay},
                                                                          {"repeat", Action::repeat},
                                                                          {"corrupt", Action::corrupt},
                                                                          {"shorten", Action::shorten}}};
constexpr unsigned kMaxDelayMilliseconds = 600000;
constexpr unsigned kMaxCopies = 100;
constexpr size_t kMaxRules = 1000;

// One member of the rule; false when its value does not fit or its name is unknown.
bool readMember(std::string_view name, const rapidjson::Value& value, AcknowledgementRule& rule) {
  if (name == "action" && value.IsString()) {
    for (const auto& [text, action] : kActions) {
      if (text != std::string_view(value.GetString(), value.GetStringLength())) continue;
      rule.action = action;
      return true;
    }
    return false;
  }
  if (name == "times" && value.IsUint64()) {
    rule.times = value.GetUint64();
  } else if (name == "delayMs" && value.IsUint() && value.GetUint() <= kMaxDelayMilliseconds) {
    rule.delay = std::chrono::milliseconds(value.GetUint());
  } else if (name == "copies" && value.IsUint() && value.GetUint() <= kMaxCopies) {
    rule.copies = value.GetUint();
  } else {
    return false;
  }
  return true;
}

}  // namespace

std::variant<AcknowledgementRule, std::string> AcknowledgementRules::parse(const std::string& json) {
  rapidjson::Document document;
  document.Parse<rapidjson::kParseIterativeFlag | rapidjson::kParseValidateEncodingFlag>(json.data(),
                                                                                         json.size());
  if (document.HasParseError() || !document.IsObject()) return "the rule is no JSON object";
  AcknowledgementRule rule;
  const rapidjson::Value& members = document;
  for (const auto& member : members.GetObject()) {
    const std::string_view name(member.name.GetString(), member.name.GetStringLength());
    if (!readMember(name, member.value, rule))
      return "\"" + printable(name) + "\" is unknown or has a value that does not fit";
  }
  if (!document.HasMember("action")) return "\"action\" is missing";
  return rule;
}

void AcknowledgementRules::add(AcknowledgementRule rule) {
  MutexLock lock(mutex_);
  if (rules_.size() >= kMaxRules) rules_.erase(rules_.begin());
  rules_.push_back(rule);
}

void AcknowledgementRules::clear() {
  MutexLock lock(mutex_);
  rules_.clear();
}

std::optional<AcknowledgementRule> AcknowledgementRules::take() {
  MutexLock lock(mutex_);
  if (rules_.empty()) return std::nullopt;
  const AcknowledgementRule taken = rules_.front();
  if (taken.times == 1)
    rules_.erase(rules_.begin());
  else if (taken.times > 1)
    --rules_.front().times;
  return taken;
}

const char* AcknowledgementRules::nameOf(Action action) {
  for (const auto& [text, known] : kActions)
    if (known == action) return text.data();
  return "";
}

std::string AcknowledgementRules::asJson() {
  MutexLock lock(mutex_);
  JsonText json;
  json.object().key("rules").array();
  for (const AcknowledgementRule& rule : rules_) {
    json.object().member("action", nameOf(rule.action)).member("times", rule.times);
    json.member("delayMs", int64_t{rule.delay.count()}).member("copies", rule.copies).endObject();
  }
  return json.endArray().endObject().text();
}

}  // namespace kyt::devserver
