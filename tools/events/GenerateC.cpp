// C over the C interface: a struct and a function for each event.
#include <array>
#include <string_view>
#include <utility>

#include "tools/events/Generate.h"
#include "tools/events/Identifiers.h"
#include "tools/events/SourceText.h"

namespace kyt::tools {

namespace {

// Keywords of C and C++, what headers define in lower case, and the types that the struct's own members have.
constexpr std::string_view kReserved[] = {"alignas",     "alignof",       "and",
                                          "and_eq",      "asm",           "auto",
                                          "bitand",      "bitor",         "bool",
                                          "break",       "case",          "catch",
                                          "char",        "char16_t",      "char32_t",
                                          "char8_t",     "class",         "co_await",
                                          "co_return",   "co_yield",      "compl",
                                          "complex",     "concept",       "const",
                                          "const_cast",  "consteval",     "constexpr",
                                          "constinit",   "continue",      "decltype",
                                          "default",     "delete",        "do",
                                          "double",      "dynamic_cast",  "else",
                                          "enum",        "errno",         "explicit",
                                          "export",      "extern",        "false",
                                          "float",       "for",           "friend",
                                          "goto",        "i386",          "if",
                                          "imaginary",   "inline",        "int",
                                          "int64_t",     "kyt_array",     "kyt_dictionary",
                                          "linux",       "long",          "mutable",
                                          "namespace",   "new",           "noexcept",
                                          "noreturn",    "not",           "not_eq",
                                          "nullptr",     "operator",      "or",
                                          "or_eq",       "private",       "protected",
                                          "public",      "register",      "reinterpret_cast",
                                          "requires",    "restrict",      "return",
                                          "short",       "signed",        "size_t",
                                          "sizeof",      "static",        "static_assert",
                                          "static_cast", "stderr",        "stdin",
                                          "stdout",      "struct",        "switch",
                                          "template",    "this",          "thread_local",
                                          "throw",       "true",          "try",
                                          "typedef",     "typeid",        "typename",
                                          "typeof",      "typeof_unqual", "uint64_t",
                                          "union",       "unix",          "unsigned",
                                          "using",       "virtual",       "void",
                                          "volatile",    "wchar_t",       "while",
                                          "xor",         "xor_eq"};

struct Member {
  const EventField& field;
  std::string name;
  std::string second;  // whether it is there, or its size; empty: none of these
};

// Of C's types; in front of a member's name.
const char* typeOf(FieldType type) {
  switch (type) {
    case FieldType::string:
      return "const char* ";
    case FieldType::integer:
      return "int64_t ";
    case FieldType::unsignedInteger:
      return "uint64_t ";
    case FieldType::number:
    case FieldType::date:
      return "double ";
    case FieldType::boolean:
      return "int ";
    case FieldType::data:
      return "const void* ";
    case FieldType::array:
      return "const kyt_array* ";
    case FieldType::dictionary:
      return "const kyt_dictionary* ";
  }
  return "";
}

const char* setterOf(FieldType type) {
  static constexpr const char* kSetters[] = {"string", "int",  "uint",  "double",    "bool",
                                             "date",   "data", "array", "dictionary"};
  return kSetters[static_cast<size_t>(type)];
}

bool isPointer(FieldType type) {
  return type == FieldType::string || type == FieldType::data || type == FieldType::array ||
         type == FieldType::dictionary;
}

std::vector<Member> membersOf(const DeclaredEvent& event) {
  Scope scope(kReserved);
  std::vector<Member> members;
  for (const EventField& field : event.fields) {
    std::string name = identifierOf(field.name);
    if (looksLikeAMacro(name)) name += "_";
    members.push_back({field, scope.take(name), ""});
  }
  for (Member& member : members) {
    if (member.field.type == FieldType::data) member.second = scope.take(member.name + "_size");
    if (member.field.optional && !isPointer(member.field.type))
      member.second = scope.take("has_" + member.name);
  }
  return members;
}

std::string commentOf(const Member& member) {
  std::string text = fieldComment(member.field, member.name);
  if (member.field.type == FieldType::date) text += " Seconds since 1970.";
  if (member.field.optional)
    text += " Left out where " + (isPointer(member.field.type) ? "null." : member.second + " is 0.");
  return text;
}

std::string structOf(const std::string& type, const DeclaredEvent& event,
                     const std::vector<Member>& members) {
  std::string out = blockComment(eventComment(event), "") + "typedef struct " + type + " {\n";
  for (const Member& member : members) {
    out += blockComment(commentOf(member), "  ") + "  " + typeOf(member.field.type) + member.name + ";\n";
    if (!member.second.empty())
      out += std::string("  ") + (member.field.type == FieldType::data ? "size_t " : "int ") + member.second +
             ";\n";
  }
  return out + "} " + type + ";\n";
}

// What lets the whole event fail; empty: nothing.
std::string missing(const Member& member) {
  if (member.field.optional || !isPointer(member.field.type)) return {};
  const std::string isNull = "event->" + member.name + " == NULL";
  return member.second.empty() ? isNull : "(" + isNull + " && event->" + member.second + " != 0)";
}

std::string setting(const Member& member) {
  std::string out = "  ";
  if (member.field.optional)
    out += "if (event->" + (isPointer(member.field.type) ? member.name + " != NULL" : member.second) + ") ";
  out += std::string("kyt_dictionary_set_") + setterOf(member.field.type) + "(payload, " +
         literal(member.field.name) + ", event->" + member.name;
  if (member.field.type == FieldType::data) out += ", event->" + member.second;
  return out + ");\n";
}

std::string functionOf(const std::string& name, const std::string& type, const DeclaredEvent& event,
                       const std::vector<Member>& members) {
  const std::string head = "static inline kyt_error kyt_send_event_" + name + "(kyt_session* session, ";
  const std::string numbers = std::to_string(event.category) + ", " + std::to_string(event.type);
  if (members.empty())
    return blockComment(eventComment(event), "") + head +
           "uint32_t flag) {\n  return kyt_session_try_send(session, " + numbers +
           ", NULL, flag, NULL, 0);\n}\n";
  std::string out = head + "const " + type + "* event, uint32_t flag) {\n";
  std::string wrong = "event == NULL";
  for (const Member& member : members)
    if (const std::string one = missing(member); !one.empty()) wrong += " ||\n      " + one;
  out +=
      "  if (" + wrong + ") return KYT_ERROR_INVALID;\n  kyt_dictionary* payload = kyt_dictionary_new();\n";
  for (const Member& member : members) out += setting(member);
  return out + "  kyt_error error = kyt_session_try_send(session, " + numbers +
         ", payload, flag, NULL, 0);\n  kyt_dictionary_free(payload);\n  return error;\n}\n";
}

}  // namespace

std::string generateC(const EventsFile& file) {
  std::string out = blockComment(
      "The events of " + baseNameOf(file) +
          ", made by kytctl events generate --lang c: change that file, "
          "not this one.\n\nEach function sends one event as kyt_session_try_send does: KYT_ERROR_NONE when "
          "it was taken. KYT_ERROR_INVALID: a text, data, an array or a dictionary is null that is not "
          "optional. Flags: 1 realtime, 2 expedite, 3 both.",
      "");
  out +=
      "/* clang-format off */\n#pragma once\n\n#include <stddef.h>\n#include <stdint.h>\n\n"
      "#include <kytreporting/kytreporting.h>\n";
  Scope events({});
  for (const DeclaredEvent& event : file.events) {
    const std::string name = events.take(identifierOf(event.name)), type = "kyt_event_" + name;
    const std::vector<Member> members = membersOf(event);
    out += "\n";
    if (!members.empty()) out += structOf(type, event, members) + "\n";
    out += functionOf(name, type, event, members);
  }
  return out;
}

}  // namespace kyt::tools
