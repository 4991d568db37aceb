#include "tools/events/SourceText.h"

#include <cstdio>

namespace kyt::tools {

namespace {

constexpr size_t kWidth = 110;

std::vector<std::string_view> linesOf(std::string_view text) {
  std::vector<std::string_view> lines;
  for (;;) {
    const size_t end = text.find('\n');
    lines.push_back(text.substr(0, end));
    if (end == std::string_view::npos) return lines;
    text.remove_prefix(end + 1);
  }
}

void replaceAll(std::string& text, std::string_view what, std::string_view by) {
  for (size_t at = 0; (at = text.find(what, at)) != std::string::npos; at += by.size())
    text.replace(at, what.size(), by);
}

// Without what the language reads as something else in a comment: its begin, its end, the three characters that stand for
// one, and a line's end that is taken away.
std::string commented(std::string_view text) {
  std::string out(text);
  replaceAll(out, "*/", "* /");
  replaceAll(out, "/*", "/ *");
  for (size_t at = 0; (at = out.find("??", at)) != std::string::npos; ++at) out.insert(at + 1, " ");
  return out;
}

// A backslash there would join the next line.
std::string lineEndMade(std::string line) {
  if (line.ends_with('\\')) line += " .";
  return line;
}

}  // namespace

std::vector<std::string> wrapped(std::string_view text, size_t width) {
  std::vector<std::string> lines;
  for (std::string_view line : linesOf(text)) {
    std::string out;
    while (!line.empty()) {
      const size_t begin = line.find_first_not_of(" \t");
      if (begin == std::string_view::npos) break;
      line.remove_prefix(begin);
      const std::string_view word = line.substr(0, line.find_first_of(" \t"));
      line.remove_prefix(word.size());
      if (!out.empty() && out.size() + 1 + word.size() > width) {
        lines.push_back(std::move(out));
        out.clear();
      }
      out += (out.empty() ? "" : " ") + std::string(word);
    }
    lines.push_back(std::move(out));
  }
  while (lines.size() > 1 && lines.back().empty()) lines.pop_back();
  while (lines.size() > 1 && lines.front().empty()) lines.erase(lines.begin());
  return lines;
}

std::string blockComment(std::string_view text, const std::string& indent) {
  const std::vector<std::string> lines = wrapped(commented(text), kWidth - indent.size() - 6);
  if (lines.size() == 1) return indent + "/* " + lines[0] + " */\n";
  std::string out;
  for (size_t i = 0; i < lines.size(); ++i)
    out += indent + (i == 0 ? "/*" : " *") + (lines[i].empty() ? "" : " ") + lineEndMade(lines[i]) + "\n";
  return out + indent + " */\n";
}

std::string lineComment(std::string_view text, const std::string& indent) {
  std::string out;
  for (const std::string& line : wrapped(commented(text), kWidth - indent.size() - 3))
    out += indent + "//" + (line.empty() ? "" : " ") + lineEndMade(line) + "\n";
  return out;
}

std::string docString(std::string_view text, const std::string& indent) {
  // A quote is the last one also where only what is left out stands behind it.
  text = text.substr(0, text.find_last_not_of(" \t\r\n") + 1);
  std::string escaped;
  for (size_t at = 0; at < text.size(); ++at) {
    const bool isLast = at + 1 == text.size();
    if (text[at] == '\\' || (text[at] == '"' && (isLast || text[at + 1] == '"'))) escaped += '\\';
    escaped += text[at];
  }
  const std::vector<std::string> lines = wrapped(escaped, kWidth - indent.size() - 3);
  std::string out;
  for (size_t i = 0; i < lines.size(); ++i)
    out += (i == 0 ? indent + "\"\"\"" : "\n" + (lines[i].empty() ? "" : indent)) + lines[i];
  return out + (lines.size() == 1 ? "" : "\n" + indent) + "\"\"\"\n";
}

std::string literal(std::string_view text) {
  std::string out = "\"";
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (c == '"' || c == '\\' || c == '?') {
      out += '\\';
      out += c;
    } else if (byte < 0x20 || byte > 0x7E) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\%03o", static_cast<unsigned>(byte));
      out += escape;
    } else {
      out += c;
    }
  }
  return out + "\"";
}

std::string pythonLiteral(std::string_view text) {
  std::string out(text);
  replaceAll(out, "\\", "\\\\");
  replaceAll(out, "\"", "\\\"");
  return "\"" + out + "\"";
}

}  // namespace kyt::tools
