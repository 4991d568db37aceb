// events.toml as tests write it.
#pragma once

#include <string>
#include <variant>
#include <vector>

#include "tools/events/EventsFile.h"

namespace kyt::tools {

inline std::string eventText(const std::string& name, int category, int type,
                             const std::string& fields = "") {
  return "[[event]]\nevent = \"" + name + "\"\ncategory = " + std::to_string(category) +
         "\ntype = " + std::to_string(type) + "\ndescription = \"Something.\"\n" + fields;
}

// A line.
inline std::string fieldText(const std::string& name, const std::string& type, bool personal = false) {
  return "fields." + tomlKey(name) + " = { type = \"" + type +
         "\", personal = " + (personal ? "true" : "false") + ", description = \"What.\" }\n";
}

// The file, or one without events where it is wrong.
inline EventsFile eventsOf(const std::string& text) {
  auto read = parseEvents(text, "e.toml");
  auto* file = std::get_if<EventsFile>(&read);
  return file != nullptr ? std::move(*file) : EventsFile();
}

// What is wrong, a text each; empty: nothing.
inline std::vector<std::string> problemsOf(const std::string& text) {
  std::vector<std::string> texts;
  const auto read = parseEvents(text, "e.toml");
  if (const auto* problems = std::get_if<EventsProblems>(&read))
    for (const TomlError& problem : *problems) texts.push_back(problem.text);
  return texts;
}

}  // namespace kyt::tools
