#include "devserver/PostChecker.h"

#include <rapidjson/document.h>
#include <rapidjson/error/en.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <algorithm>

#include "devserver/Http.h"
#include "devserver/Text.h"
#include "http/Gzip.h"
#include "http/PostDigest.h"

namespace kyt::devserver {
namespace {

using Json = rapidjson::Value;
constexpr size_t kMaxDepth = 32;
constexpr unsigned kParseFlags = rapidjson::kParseValidateEncodingFlag | rapidjson::kParseIterativeFlag |
                                 rapidjson::kParseFullPrecisionFlag;

std::string_view textOf(const Json& value) {
  return {value.GetString(), value.GetStringLength()};
}

// The deepest nesting of brackets outside strings.
size_t depthOf(std::string_view json) {
  size_t depth = 0, deepest = 0;
  bool inString = false;
  for (size_t i = 0; i < json.size(); ++i) {
    const char c = json[i];
    if (inString) {
      if (c == '\\') ++i;
      if (c == '"') inString = false;
    } else if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      deepest = std::max(deepest, ++depth);
    } else if ((c == ']' || c == '}') && depth > 0) {
      --depth;
    }
  }
  return deepest;
}

const char* kindOf(const Json& value) {
  constexpr const char* kKinds[] = {"null",     "a boolean", "a boolean", "an object",
                                    "an array", "a string",  "a number"};
  return kKinds[value.GetType()];
}

std::optional<int64_t> integerMember(const Json& record, const char* name) {
  const auto member = record.FindMember(name);
  if (member == record.MemberEnd() || !member->value.IsInt64()) return std::nullopt;
  return member->value.GetInt64();
}

std::optional<double> numberMember(const Json& record, const char* name) {
  const auto member = record.FindMember(name);
  if (member == record.MemberEnd() || !member->value.IsNumber()) return std::nullopt;
  return member->value.GetDouble();
}

// A string's text or a number's digits.
std::string textMember(const Json& record, const char* name) {
  const auto member = record.FindMember(name);
  if (member == record.MemberEnd()) return {};
  if (member->value.IsString()) return std::string(textOf(member->value));
  if (member->value.IsInt64()) return std::to_string(member->value.GetInt64());
  return {};
}

template <typename Writer = rapidjson::Writer<rapidjson::StringBuffer>>
std::string written(const Json& value) {
  rapidjson::StringBuffer buffer;
  Writer writer(buffer);
  value.Accept(writer);
  return {buffer.GetString(), buffer.GetSize()};
}

std::string firstNotEmpty(std::string a, const std::string& b) {
  return a.empty() ? b : a;
}

Event eventOf(const Json& record, const Post& post) {
  Event event;
  event.method = integerMember(record, "_method");
  event.status = integerMember(record, "_status");
  event.number = integerMember(record, "_eventNumber");
  event.time = numberMember(record, "_clientTS");
  event.client = firstNotEmpty(post.client, textMember(record, "ClientName"));
  event.service = firstNotEmpty(post.service, textMember(record, "ServiceName"));
  event.sender = firstNotEmpty(textMember(record, "_sender"), post.sender);
  event.session = textMember(record, "_sessionID");
  event.record = written(record);
  return event;
}

// What is wrong with a record, or nothing: a posted value is a string, a number or a boolean.
std::optional<std::string> wrongRecord(const Json& record, size_t index) {
  const std::string place = "events[" + std::to_string(index) + "]";
  if (!record.IsObject()) return place + " is " + kindOf(record) + ", not an object";
  for (const auto& member : record.GetObject()) {
    if (member.value.IsString() || member.value.IsNumber() || member.value.IsBool()) continue;
    return place + ": \"" + printable(textOf(member.name)) + "\" is " + kindOf(member.value);
  }
  return std::nullopt;
}

std::optional<std::string> wrongMember(const Json& message, const char* name, bool (Json::*is)() const,
                                       const char* kind) {
  const auto member = message.FindMember(name);
  const std::string quoted = std::string("\"") + name + "\"";
  if (member == message.MemberEnd()) return quoted + " is missing";
  if (!(member->value.*is)()) return quoted + " is " + kindOf(member->value) + ", not " + kind;
  return std::nullopt;
}

// Reads the message into the post, or says what is wrong with it.
std::optional<std::string> readMessage(const std::string& text, Post& post) {
  if (depthOf(text) > kMaxDepth) return "the JSON is nested deeper than " + std::to_string(kMaxDepth);
  rapidjson::Document message;
  message.Parse<kParseFlags>(text.data(), text.size());
  if (message.HasParseError()) {
    return "the JSON is malformed at byte " + std::to_string(message.GetErrorOffset()) + ": " +
           rapidjson::GetParseError_En(message.GetParseError());
  }
  if (!message.IsObject()) return std::string("the message is ") + kindOf(message) + ", not an object";
  if (auto wrong = wrongMember(message, "postTime", &Json::IsNumber, "a number")) return wrong;
  if (auto wrong = wrongMember(message, "clientId", &Json::IsString, "a string")) return wrong;
  if (auto wrong = wrongMember(message, "events", &Json::IsArray, "an array")) return wrong;
  const Json& events = message["events"];
  for (rapidjson::SizeType i = 0; i < events.Size(); ++i) {
    if (auto wrong = wrongRecord(events[i], i)) return wrong;
  }
  post.postTime = message["postTime"].GetDouble();
  post.clientId = std::string(textOf(message["clientId"]));
  for (const Json& record : events.GetArray()) post.events.push_back(eventOf(record, post));
  return std::nullopt;
}

}  // namespace

std::optional<std::string> rewriteJson(std::string_view text, bool pretty) {
  if (depthOf(text) > kMaxDepth) return std::nullopt;
  rapidjson::Document document;
  document.Parse<kParseFlags>(text.data(), text.size());
  if (document.HasParseError()) return std::nullopt;
  return pretty ? written<rapidjson::PrettyWriter<rapidjson::StringBuffer>>(document) : written(document);
}

void PostChecker::readNames(Post& post) {
  const auto name = [&](const char* header) {
    const std::string* value = findHeader(post.headers, header);
    return value != nullptr ? validText(*value) : std::string();
  };
  post.client = name("X-KYT-Client-Name");
  post.service = name("X-KYT-Service-Name");
  post.sender = name("X-KYT-Sender");
}

void PostChecker::check(Post& post) const {
  readNames(post);
  if (!checkDigest(post)) return;
  const std::optional<std::string> text = textOf(post.headers, post.body, post.reason);
  if (!text) return;
  post.textSize = text->size();
  const std::optional<std::string> wrong = readMessage(*text, post);
  post.good = !wrong;
  if (wrong) {
    post.reason = *wrong;
    post.events.clear();
  }
}

std::optional<std::string> PostChecker::textOf(const std::vector<Header>& headers, std::string_view body,
                                               std::string& reason) const {
  const std::string* encoding = findHeader(headers, "Content-Encoding");
  if (encoding == nullptr || equalIgnoringCase(*encoding, "identity")) return std::string(body);
  if (!equalIgnoringCase(*encoding, "gzip")) {
    reason = "Content-Encoding \"" + printable(*encoding) + "\" is not gzip";
    return std::nullopt;
  }
  auto result = http::gunzip(body, maxInflatedBytes_);
  if (auto* text = std::get_if<std::string>(&result)) return std::move(*text);
  reason = std::get<http::GzipError>(result).reason;
  return std::nullopt;
}

bool PostChecker::checkDigest(Post& post) const {
  const auto own = [&](const DigestKey& key) { return !key.client.empty() && key.client == post.client; };
  const bool hasOwn = std::any_of(keys_.begin(), keys_.end(), own);
  std::vector<const DigestKey*> keys;
  for (const DigestKey& key : keys_) {
    if (hasOwn ? own(key) : key.client.empty()) keys.push_back(&key);
  }
  post.digest = "unchecked";
  if (keys.empty()) return true;
  const std::string* header = findHeader(post.headers, "X-KYT-DIGEST");
  if (header == nullptr) {
    post.digest = "missing";
    post.reason = "X-KYT-DIGEST is missing";
    return false;
  }
  const bool good = std::any_of(keys.begin(), keys.end(), [&](const DigestKey* key) {
    return http::digestFits(key->key, post.body, *header);
  });
  post.digest = good ? "good" : "bad";
  if (!good) post.reason = "X-KYT-DIGEST does not fit the body and a known key";
  return good;
}

}  // namespace kyt::devserver
