// What a program reports, as its events.toml says.
#include <cstdio>
#include <filesystem>
#include <system_error>
#include <utility>
#include <variant>

#include "platform/base/TextEscape.h"
#include "tools/StorebagFile.h"
#include "tools/events/Document.h"
#include "tools/events/EventsCheck.h"
#include "tools/events/EventsFile.h"
#include "tools/events/Generate.h"
#include "tools/kytctl/Commands.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/StorebagServices.h"

namespace kyt::tools {

namespace {

constexpr int kCannotTell = 2;

// Says what is wrong with the file.
void tell(const EventsProblems& problems) {
  for (const TomlError& problem : problems) std::fprintf(stderr, "kytctl: %s\n", problem.text.c_str());
}

size_t numberOfFields(const EventsFile& file) {
  size_t number = 0;
  for (const DeclaredEvent& event : file.events) number += event.fields.size();
  return number;
}

void print(const EventsFile& file, const EventsVerdict& verdict) {
  for (const EventFinding& finding : verdict.findings) {
    const std::string line = finding.line != 0 ? ":" + std::to_string(finding.line) : "";
    std::printf("%s%s: %s: %s\n", escapedText(file.name).c_str(), line.c_str(), finding.kind.c_str(),
                finding.text.c_str());
  }
  if (verdict.further != 0)
    std::printf("%s: and %zu more\n", escapedText(file.name).c_str(), verdict.further);
  if (verdict.findings.empty())
    std::printf("%s: nothing found; events: %zu, fields: %zu\n", escapedText(file.name).c_str(),
                file.events.size(), numberOfFields(file));
}

void printJSON(const EventsFile& file, const std::string& bag, const EventsVerdict& verdict) {
  Array findings;
  for (const EventFinding& finding : verdict.findings) {
    Dictionary row{{"line", unsigned{finding.line}}, {"kind", finding.kind}};
    if (!finding.event.empty()) row.set("event", finding.event);
    if (!finding.field.empty()) row.set("field", finding.field);
    row.set("text", finding.text);
    findings.append(std::move(row));
  }
  const Dictionary report{{"file", escapedText(file.name)}, {"storebag", escapedText(bag)},
                          {"events", file.events.size()},   {"fields", numberOfFields(file)},
                          {"findings", findings},           {"further", verdict.further}};
  std::printf("%s\n", prettyJSON(report).c_str());
}

// What is made of a file must not take its place.
int write(const std::string& text, const std::string& output, const std::string& source) {
  std::error_code none;
  if (output != "-" && std::filesystem::equivalent(output, source, none))
    return failed(output + ": is the file that describes the events");
  if (output == "-") {
    const bool isWritten =
        std::fwrite(text.data(), 1, text.size(), stdout) == text.size() && std::fflush(stdout) == 0;
    return isWritten ? 0 : failed("standard output takes no more");
  }
  if (auto error = writeFile(output, text, 0644)) return failed(*error);
  return 0;
}

EventsLanguage languageNamed(const std::string& name) {
  if (name == "c") return EventsLanguage::c;
  return name == "python" ? EventsLanguage::python : EventsLanguage::cxx;
}

}  // namespace

int checkEventsCommand(const EventsOptions& options) {
  const auto read = readEvents(options.file);
  if (const auto* problems = std::get_if<EventsProblems>(&read)) {
    tell(*problems);
    return kCannotTell;
  }
  StorebagServices services;
  const auto bag = services.file.openOrRead(options.bag);
  if (const auto* error = std::get_if<Error>(&bag)) {
    failed(*error);
    return kCannotTell;
  }
  const EventsFile& file = std::get<EventsFile>(read);
  const EventsVerdict verdict = checkEvents(file, std::get<Dictionary>(bag));
  if (options.json)
    printJSON(file, options.bag, verdict);
  else
    print(file, verdict);
  return verdict.findings.empty() ? 0 : 1;
}

int generateEventsCommand(const GenerateOptions& options) {
  const auto read = readEvents(options.file);
  if (const auto* problems = std::get_if<EventsProblems>(&read)) {
    tell(*problems);
    return 1;
  }
  const EventsFile& file = std::get<EventsFile>(read);
  for (const DeclaredEvent& event : file.events)
    if (event.category == 0)
      return failed(tomlError(options.file, event.line, "category 0 is the daemon's own").text);
  return write(generateEvents(file, languageNamed(options.language)), options.output, options.file);
}

int documentEventsCommand(const GenerateOptions& options) {
  const auto read = readEvents(options.file);
  if (const auto* problems = std::get_if<EventsProblems>(&read)) {
    tell(*problems);
    return 1;
  }
  return write(documentEvents(std::get<EventsFile>(read)), options.output, options.file);
}

}  // namespace kyt::tools
