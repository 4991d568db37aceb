#include "tools/events/Document.h"

#include <algorithm>
#include <string_view>
#include <vector>

#include "tools/events/Generate.h"
#include "tools/events/SourceText.h"

namespace kyt::tools {

namespace {

// For people: a reader of the page writes no program.
const char* wordsFor(FieldType type) {
  static constexpr const char* kWords[] = {"text", "whole number", "whole number", "number", "yes or no",
                                           "date", "bytes",        "list",         "table"};
  return kWords[static_cast<size_t>(type)];
}

// One that a table's cell can hold too.
std::string codeOf(const std::string& name) {
  return name.find_first_of("`|\\") == std::string::npos ? "`" + name + "`" : markdownText(name);
}

// What Markdown reads as a list, a line under a heading or a number only where a line begins with it.
bool needsEscapeAtBegin(std::string_view line) {
  if (line.starts_with('-') || line.starts_with('+') || line.starts_with('=')) return true;
  const size_t digits = std::min(line.find_first_not_of("0123456789"), line.size());
  return digits != 0 && digits < line.size() && (line[digits] == '.' || line[digits] == ')');
}

bool isLetterOrDigit(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
}

// An underscore within a word is none.
bool isMark(std::string_view line, size_t at) {
  static constexpr std::string_view kMarks = "\\`*[]<>|#~&";
  if (line[at] != '_') return kMarks.find(line[at]) != std::string_view::npos;
  return at == 0 || at + 1 == line.size() || !isLetterOrDigit(line[at - 1]) || !isLetterOrDigit(line[at + 1]);
}

std::string escapedLine(std::string_view line) {
  std::string out;
  size_t at = 0;
  if (needsEscapeAtBegin(line)) {
    at = std::min(line.find_first_not_of("0123456789"), line.size() - 1);
    out = std::string(line.substr(0, at)) + "\\" + line[at];
    ++at;
  }
  for (; at < line.size(); ++at) {
    if (isMark(line, at)) out += '\\';
    out += line[at];
  }
  return out;
}

// A cell has no line breaks of its own.
std::string cellOf(const std::string& text) {
  std::string out = markdownText(text);
  for (size_t at = 0; (at = out.find("\n\n", at)) != std::string::npos;) out.replace(at, 2, "<br>");
  return out;
}

std::string counted(size_t number, const char* one, const char* many) {
  return std::to_string(number) + " " + (number == 1 ? one : many);
}

// Which fields are about a person, before anything else.
std::string summaryOf(const EventsFile& file) {
  size_t fields = 0;
  std::string personal;
  for (const DeclaredEvent& event : file.events)
    for (const EventField& field : event.fields) {
      ++fields;
      if (field.personal)
        personal += (personal.empty() ? "" : ", ") + codeOf(field.name) + " of " + codeOf(event.name);
    }
  return counted(file.events.size(), "event", "events") + " with " + counted(fields, "field", "fields") +
         ". " +
         (personal.empty() ? std::string("No field is about a person.")
                           : "About a person: " + personal + ".");
}

std::string programOf(const EventsFile& file) {
  if (file.client.empty() && file.service.empty()) return {};
  std::string text = "It names itself ";
  if (!file.client.empty()) text += codeOf(file.client) + " (client)";
  if (!file.service.empty()) text += (file.client.empty() ? "" : ", ") + codeOf(file.service) + " (service)";
  return text + ".\n\n";
}

std::string sectionOf(const DeclaredEvent& event) {
  std::string out = "\n## " + markdownText(event.name) + "\n\n" + markdownText(event.description) +
                    "\n\nCategory " + std::to_string(event.category) + ", type " +
                    std::to_string(event.type) + ".";
  if (event.fields.empty()) return out + " It has no fields.\n";
  out += "\n\n| field | what it is | about a person | meaning |\n|---|---|---|---|\n";
  for (const EventField& field : event.fields)
    out += "| " + codeOf(field.name) + " | " + wordsFor(field.type) +
           (field.optional ? ", may be missing" : "") + " | " + (field.personal ? "**yes**" : "no") + " | " +
           cellOf(field.description) + " |\n";
  return out;
}

}  // namespace

std::string markdownText(std::string_view text) {
  std::string out, paragraph;
  std::vector<std::string> lines = wrapped(text, text.size());
  lines.emplace_back();
  for (const std::string& line : lines) {
    if (!line.empty()) {
      paragraph += (paragraph.empty() ? "" : " ") + line;
    } else if (!paragraph.empty()) {
      out += (out.empty() ? "" : "\n\n") + escapedLine(paragraph);
      paragraph.clear();
    }
  }
  return out;
}

std::string documentEvents(const EventsFile& file) {
  const std::string name = file.client.empty() ? baseNameOf(file) : file.client;
  std::string out =
      "# What " + markdownText(name) + " reports\n\n" + summaryOf(file) + "\n\n" + programOf(file) +
      "What of it leaves a device is decided by its owner's consent and by the storebag. Made by `kytctl "
      "events document` from " +
      codeOf(baseNameOf(file)) + ".\n";
  for (const DeclaredEvent& event : file.events) out += sectionOf(event);
  return out;
}

}  // namespace kyt::tools
