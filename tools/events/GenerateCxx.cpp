// C++ over the C++ interface: a struct for each event, which sends itself.
#include <string_view>
#include <utility>

#include "tools/events/Generate.h"
#include "tools/events/Identifiers.h"
#include "tools/events/SourceText.h"

namespace kyt::tools {

namespace {

// Keywords, what headers define in lower case, and names that the structs have or use.
constexpr std::string_view kReserved[] = {
    "alignas",      "alignof",   "and",           "and_eq",       "asm",      "auto",
    "bitand",       "bitor",     "bool",          "break",        "case",     "catch",
    "char",         "char16_t",  "char32_t",      "char8_t",      "class",    "co_await",
    "co_return",    "co_yield",  "compl",         "concept",      "const",    "const_cast",
    "consteval",    "constexpr", "constinit",     "continue",     "decltype", "default",
    "delete",       "do",        "double",        "dynamic_cast", "else",     "entries",
    "enum",         "errno",     "explicit",      "export",       "extern",   "false",
    "flag",         "float",     "for",           "friend",       "goto",     "i386",
    "if",           "inline",    "int",           "kCategory",    "kType",    "kyt",
    "linux",        "long",      "mutable",       "namespace",    "new",      "noexcept",
    "not",          "not_eq",    "nullptr",       "operator",     "or",       "or_eq",
    "payload",      "private",   "protected",     "public",       "register", "reinterpret_cast",
    "requires",     "return",    "send",          "session",      "short",    "signed",
    "sizeof",       "static",    "static_assert", "static_cast",  "std",      "stderr",
    "stdin",        "stdout",    "struct",        "switch",       "template", "this",
    "thread_local", "throw",     "true",          "try",          "typedef",  "typeid",
    "typename",     "typeof",    "union",         "unix",         "unsigned", "using",
    "virtual",      "void",      "volatile",      "wchar_t",      "while",    "xor",
    "xor_eq"};

const char* typeOf(FieldType type) {
  static constexpr const char* kTypes[] = {"std::string", "std::int64_t", "std::uint64_t",
                                           "double",      "bool",         "::kyt::Date",
                                           "::kyt::Data", "::kyt::Array", "::kyt::Dictionary"};
  return kTypes[static_cast<size_t>(type)];
}

// So that none is without a value; what has one of its own is left to the compiler's warnings.
const char* defaultOf(FieldType type) {
  switch (type) {
    case FieldType::integer:
    case FieldType::unsignedInteger:
    case FieldType::number:
      return " = 0";
    case FieldType::boolean:
      return " = false";
    default:
      return "";
  }
}

struct Member {
  const EventField& field;
  std::string name;
};

std::vector<Member> membersOf(const std::string& type, const DeclaredEvent& event) {
  Scope scope(kReserved);
  scope.reserve(type);
  std::vector<Member> members;
  for (const EventField& field : event.fields) {
    std::string name = identifierOf(field.name);
    if (looksLikeAMacro(name)) name += "_";
    members.push_back({field, scope.take(name)});
  }
  return members;
}

std::string declaration(const Member& member) {
  const EventField& field = member.field;
  std::string text = fieldComment(field, member.name);
  if (field.optional) text += " Left out where it has no value.";
  std::string out = lineComment(text, "  ") + "  ";
  if (field.optional)
    out += std::string("std::optional<") + typeOf(field.type) + "> " + member.name + " = std::nullopt";
  else
    out += std::string(typeOf(field.type)) + " " + member.name + defaultOf(field.type);
  return out + ";\n";
}

std::string structOf(const std::string& type, const DeclaredEvent& event) {
  const std::vector<Member> members = membersOf(type, event);
  std::string out = lineComment(eventComment(event), "") + "struct " + type +
                    " {\n  static constexpr std::uint16_t kCategory = " + std::to_string(event.category) +
                    ", kType = " + std::to_string(event.type) + ";\n";
  for (const Member& member : members) out += declaration(member);
  out += "\n  [[nodiscard]] ::kyt::Dictionary payload() const {\n    ::kyt::Dictionary entries;\n";
  if (!members.empty()) out += "    entries.reserve(" + std::to_string(members.size()) + ");\n";
  for (const Member& member : members) {
    const std::string key = literal(member.field.name);
    if (member.field.optional)
      out += "    if (" + member.name + ") entries.set(" + key + ", ::kyt::Value(*" + member.name + "));\n";
    else
      out += "    entries.set(" + key + ", ::kyt::Value(" + member.name + "));\n";
  }
  return out +
         "    return entries;\n  }\n  bool send(::kyt::KYTReporting& session, std::uint32_t flag = 0) const {\n"
         "    return session.sendMessage(kCategory, kType, payload(), flag);\n  }\n};\n";
}

}  // namespace

std::string generateCxx(const EventsFile& file) {
  std::string out = lineComment(
      "The events of " + baseNameOf(file) +
          ", made by kytctl events generate --lang c++: change that file, not this "
          "one.\n\nA struct for each. payload() is what it has under its fields' keys; send() sends it, and returns whether "
          "it was taken. Flags: 1 realtime, 2 expedite, 3 both.",
      "");
  out +=
      "// clang-format off\n#pragma once\n\n#include <cstdint>\n#include <optional>\n#include <string>\n\n"
      "#include <kytreporting/KYTReporting.h>\n\nnamespace kyt::events {\n";
  Scope events({});
  for (const DeclaredEvent& event : file.events) {
    std::string type = capitalisedIdentifierOf(event.name);
    if (looksLikeAMacro(type)) type += "_";
    out += "\n" + structOf(events.take(type), event);
  }
  return out + "\n}  // namespace kyt::events\n";
}

}  // namespace kyt::tools
