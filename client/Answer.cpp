#include "client/Answer.h"

#include <algorithm>
#include <array>
#include <string_view>

#include "platform/ipc/BodyReader.h"

namespace kyt::client {

namespace {

bool readStates(BodyReader& in, Reply& out) {
  std::optional<Array> names;
  if (!in.readOptionalStrings(names)) return false;
  StateNames states;
  if (names) {
    states.emplace();
    for (const Value& name : *names)
      if (const String* text = name.string()) states->push_back(text->str());
  }
  out.result = std::move(states);
  return true;
}

bool readText(BodyReader& in, Reply& out) {
  String text;
  if (!in.readString(text)) return false;
  out.result = text.str();
  return true;
}

bool readObject(BodyReader& in, Reply& out) {
  Value object;
  if (!in.readOptionalValue(object)) return false;
  out.result = std::move(object);
  return true;
}

bool readObjectAndError(BodyReader& in, Reply& out) {
  return readObject(in, out) && in.readOptionalError(out.error);
}

bool readSuccess(BodyReader& in, Reply& out) {
  return in.readBoolean(out.result.emplace<bool>());
}

bool readSuccessAndError(BodyReader& in, Reply& out) {
  return readSuccess(in, out) && in.readOptionalError(out.error);
}

struct Form {
  std::string_view signature;
  bool (*read)(BodyReader&, Reply&);
};
constexpr std::array kForms{Form{"av", readObject}, Form{"aas", readStates},
                            Form{"s", readText},    Form{"ava(sis)", readObjectAndError},
                            Form{"b", readSuccess}, Form{"ba(sis)", readSuccessAndError}};

constexpr const Form* formOf(std::string_view signature) {
  for (const Form& form : kForms)
    if (form.signature == signature) return &form;
  return nullptr;
}
static_assert(std::all_of(wire::kMethods.begin(), wire::kMethods.end(),
                          [](const auto& row) { return row.reply.empty() || formOf(row.reply) != nullptr; }),
              "a reply of the contract that cannot be read");

template <typename Result>
using Completion = Function<void(Result, std::optional<Error>)>;

void run(std::monostate, Reply&) {}
template <typename Result>
void run(Completion<Result>& completion, Reply& reply) {
  completion(std::move(std::get<Result>(reply.result)), std::move(reply.error));
}

void refuse(std::monostate, ClientError, const std::string&) {}
template <typename Result>
void refuse(Completion<Result>& completion, ClientError code, const std::string& text) {
  completion(Result{}, clientError(code, text));
}

}  // namespace

Error clientError(ClientError code, std::string text) {
  return Error{kKYTReportingClientErrorDomain, static_cast<int32_t>(code), std::move(text)};
}

Error daemonError(const Message& message) {
  std::string text(message.errorName);
  BodyReader reader(message);
  std::string_view detail;
  if (reader.hasSignature("s") && reader.readStringView(detail)) text += ": " + std::string(detail);
  return clientError(ClientError::refused, std::move(text));
}

std::optional<Reply> readReply(wire::Method method, const Message& message) {
  Reply reply;
  const std::string_view signature = wire::contractOf(method).reply;
  if (signature.empty()) return reply;  // whatever it says
  BodyReader reader(message);
  if (!reader.hasSignature(signature) || !formOf(signature)->read(reader, reply) ||
      reader.finish() != BodyStatus::ok)
    return std::nullopt;
  return reply;
}

void Answer::give(Reply reply) {
  auto completion = std::exchange(completion_, {});
  std::visit([&reply](auto& waiting) { run(waiting, reply); }, completion);
}

void Answer::fail(ClientError code, const std::string& text) {
  auto completion = std::exchange(completion_, {});
  std::visit([&](auto& waiting) { refuse(waiting, code, text); }, completion);
}

}  // namespace kyt::client
