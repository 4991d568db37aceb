// Python over the module kytreporting: a class for each event, which sends itself.
#include <string_view>
#include <utility>

#include "tools/events/Generate.h"
#include "tools/events/Identifiers.h"
#include "tools/events/SourceText.h"

namespace kyt::tools {

namespace {

// Keywords, soft ones too, and what the classes use, of the language and of their own.
constexpr std::string_view kReserved[] = {
    "False",    "None",    "True",   "and",    "as",       "assert",      "async",    "await",  "bool",
    "break",    "bytes",   "case",   "class",  "continue", "dataclasses", "datetime", "def",    "del",
    "dict",     "elif",    "else",   "except", "finally",  "flag",        "float",    "for",    "from",
    "global",   "if",      "import", "in",     "int",      "is",          "kyt",      "lambda", "match",
    "nonlocal", "not",     "or",     "pass",   "payload",  "property",    "raise",    "return", "self",
    "send",     "session", "str",    "try",    "type",     "typing",      "while",    "with",   "yield",
    "CATEGORY", "TYPE",    "print",  "exec"};

const char* typeOf(FieldType type) {
  static constexpr const char* kTypes[] = {"str",
                                           "int",
                                           "int",
                                           "float",
                                           "bool",
                                           "datetime.datetime",
                                           "bytes",
                                           "typing.Sequence[typing.Any]",
                                           "typing.Mapping[str, typing.Any]"};
  return kTypes[static_cast<size_t>(type)];
}

struct Member {
  const EventField& field;
  std::string name;
};

std::vector<Member> membersOf(const DeclaredEvent& event) {
  Scope scope(kReserved);
  std::vector<Member> members;
  for (const EventField& field : event.fields)
    members.push_back({field, scope.take(identifierOf(field.name))});
  return members;
}

std::string docOf(const DeclaredEvent& event, const std::vector<Member>& members) {
  std::string text = eventComment(event);
  if (!members.empty()) text += "\n";
  for (const Member& member : members) {
    text += "\n" + member.name + ": " + fieldComment(member.field, member.name);
    if (member.field.optional) text += " Left out where it is None.";
  }
  return docString(text, "    ");
}

std::string classOf(const std::string& type, const DeclaredEvent& event) {
  const std::vector<Member> members = membersOf(event);
  std::string out = "\n\n@dataclasses.dataclass(frozen=True, kw_only=True)\nclass " + type + ":\n" +
                    docOf(event, members) +
                    "\n    CATEGORY: typing.ClassVar[int] = " + std::to_string(event.category) +
                    "\n    TYPE: typing.ClassVar[int] = " + std::to_string(event.type) + "\n";
  for (const Member& member : members) {
    out += "    " + member.name + ": ";
    if (member.field.optional)
      out += std::string("typing.Optional[") + typeOf(member.field.type) + "] = None\n";
    else
      out += std::string(typeOf(member.field.type)) + "\n";
  }
  out +=
      "\n    def payload(self) -> typing.Dict[str, typing.Any]:\n"
      "        \"\"\"What it has under its fields' keys.\"\"\"\n";
  if (members.empty()) {
    out += "        return {}\n";
  } else {
    out += "        return {\n";
    for (const Member& member : members)
      out += "            " + pythonLiteral(member.field.name) + ": self." + member.name + ",\n";
    out += "        }\n";
  }
  return out +
         "\n    def send(self, session: kyt.Session, *, flag: int = kyt.Flag.NONE) -> bool:\n"
         "        \"\"\"Sends it; whether there was room for it.\"\"\"\n"
         "        return session.send(self.CATEGORY, self.TYPE, self.payload(), flag=flag)\n";
}

}  // namespace

std::string generatePython(const EventsFile& file) {
  std::string out = docString(
      "The events of " + baseNameOf(file) +
          ", made by kytctl events generate --lang python: change that file, "
          "not this one.\n\nA class for each. payload() is what it has under its fields' keys; send() sends it "
          "by a session.",
      "");
  out +=
      "\nfrom __future__ import annotations\n\nimport dataclasses\nimport datetime\nimport typing\n\n"
      "import kytreporting as kyt\n";
  Scope events(kReserved);
  for (const DeclaredEvent& event : file.events)
    out += classOf(events.take(capitalisedIdentifierOf(event.name)), event);
  return out;
}

}  // namespace kyt::tools
