// Reads what the manual pages, the documents and the programs' help say, so that tests can compare them.
#pragma once

#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/Programs.h"

namespace kyt {

using Names = std::set<std::string>;

inline std::string textOf(const std::string& path) {
  std::ifstream file(std::string(KYT_SOURCE_DIR) + "/" + path);
  std::ostringstream text;
  text << file.rdbuf();
  return text.str();
}

inline std::vector<std::string> linesOf(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream stream(text);
  for (std::string line; std::getline(stream, line);) lines.push_back(line);
  return lines;
}

// The first group of every match.
inline Names matchesIn(const std::string& text, const char* expression) {
  Names found;
  const std::regex regex(expression);
  for (std::sregex_iterator at(text.begin(), text.end(), regex), end; at != end; ++at) found.insert((*at)[1]);
  return found;
}

// A page's lines between `.Ss TITLE` (or `.Sh`) and the next section; the whole page for an empty title.
inline std::string sectionOf(const std::string& page, const std::string& title) {
  std::string section;
  bool inside = title.empty();
  for (const std::string& line : linesOf(textOf("packaging/man/" + page))) {
    if (!title.empty() && (line.starts_with(".Ss ") || line.starts_with(".Sh ")))
      inside = line.substr(4) == title;
    if (inside) section += line + "\n";
  }
  return section;
}

// The tags of lists.
inline std::string itemsOf(const std::string& section) {
  std::string items;
  for (const std::string& line : linesOf(section))
    if (line.starts_with(".It ")) items += line + "\n";
  return items;
}

// "--name" and "-n" of the tags.
inline Names optionsOf(const std::string& section) {
  const std::string items = itemsOf(section);
  Names options;
  for (const std::string& name : matchesIn(items, "Fl Fl ([a-z][a-z-]*)")) options.insert("--" + name);
  for (const std::string& name : matchesIn(items, "(?:It|,) Fl ([a-z])[ \n]")) options.insert("-" + name);
  return options;
}

// What the help of a program or of one of its commands names.
struct Help {
  Names options, commands;
  Names flags;                          // of the options, those without a value
  std::map<std::string, Names> values;  // of options that take one of a few
};

inline Help helpOf(const std::string& program, std::vector<std::string> command = {}) {
  Help help;
  command.emplace_back("--help");
  bool commands = false;
  for (const std::string& line :
       linesOf(runProgram(std::string(KYT_PROGRAMS) + "/" + program, command).text)) {
    if (!line.starts_with("  ")) commands = line == "Subcommands:";
    std::smatch match;
    if (commands && std::regex_search(line, match, std::regex("^  ([a-z-]+)")))
      help.commands.insert(match[1]);
    if (!std::regex_search(line, match, std::regex("^  ((?:-[a-z],)?(?:--[a-z-]+)?)"))) continue;
    std::string last;
    for (const std::string& option : matchesIn(match[1], "(--?[a-z][a-z-]*)")) {
      help.options.insert(option);
      last = option;
    }
    if (std::regex_search(line, match, std::regex("^  (--[a-z-]+)(?:  | Excludes:|$)")))
      help.flags.insert(match[1]);
    if (std::regex_search(line, match, std::regex("^  (--[a-z-]+) TEXT:\\{([a-z,+]+)\\}")))
      help.values[match[1]] = matchesIn(match[2], "([a-z+]+)");
  }
  return help;
}

// The first fenced block of that language in a document.
inline std::string blockOf(const std::string& document, const std::string& language) {
  const std::string text = textOf("docs/" + document), fence = "\n```" + language + "\n";
  const size_t start = text.find(fence);
  if (start == std::string::npos) return "no block " + language + " in " + document + "\n";
  const size_t begin = start + fence.size();
  return text.substr(begin, text.find("\n```", begin) + 1 - begin);
}

// The display behind `.\" example: NAME`, as a reader of the page copies it.
inline std::string exampleOf(const std::string& page, const std::string& name) {
  std::string example;
  bool found = false, inside = false;
  for (std::string line : linesOf(textOf("packaging/man/" + page))) {
    if (line == ".\\\" example: " + name) found = true;
    if (inside && line == ".Ed") return example;
    if (inside) {
      for (const auto& [escape, character] : {std::pair("\\-", "-"), std::pair("\\e", "\\")})
        for (size_t at = 0; (at = line.find(escape, at)) != std::string::npos; ++at)
          line.replace(at, 2, character);
      example += line + "\n";
    }
    if (found && line.starts_with(".Bd -literal")) inside = true;
  }
  return "no example " + name + " in " + page + "\n";
}

}  // namespace kyt
