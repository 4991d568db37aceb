#include "tools/events/Identifiers.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <vector>

#include "platform/base/TextEscape.h"

namespace kyt::tools {

namespace {

bool isLower(char c) {
  return c >= 'a' && c <= 'z';
}
bool isUpper(char c) {
  return c >= 'A' && c <= 'Z';
}
bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

std::string hexadecimal(uint32_t number) {
  char text[16];
  std::snprintf(text, sizeof text, "%X", static_cast<unsigned>(number));
  return text;
}

uint32_t codeOf(std::string_view character) {
  if (character.size() == 1) return static_cast<unsigned char>(character[0]);
  uint32_t code = static_cast<unsigned char>(character[0]) & (0x7FU >> character.size());
  for (const char c : character.substr(1)) code = code << 6 | (static_cast<unsigned char>(c) & 0x3FU);
  return code;
}

std::vector<std::string> wordsOf(std::string_view name) {
  std::vector<std::string> words;
  std::string signs;  // what a name without a word is called by
  bool isInWord = false;
  while (!name.empty()) {
    const std::string_view character = name.substr(0, std::max<size_t>(utf8SequenceLength(name), 1));
    name.remove_prefix(character.size());
    const char c = character[0];
    const bool isASCII = character.size() == 1;
    if (isASCII && !isLower(c) && !isUpper(c) && !isDigit(c)) {
      isInWord = false;
      signs += hexadecimal(codeOf(character));
      continue;
    }
    if (!isInWord) words.emplace_back();
    isInWord = true;
    words.back() += isASCII ? std::string(character) : "u" + hexadecimal(codeOf(character));
  }
  if (words.empty()) words.push_back("x" + signs);
  return words;
}

}  // namespace

std::string identifierOf(std::string_view name) {
  std::string identifier;
  for (const std::string& word : wordsOf(name)) identifier += (identifier.empty() ? "" : "_") + word;
  return isDigit(identifier[0]) ? "n" + identifier : identifier;
}

std::string capitalisedIdentifierOf(std::string_view name) {
  std::string identifier;
  for (std::string word : wordsOf(name)) {
    if (isLower(word[0])) word[0] = static_cast<char>(word[0] - 'a' + 'A');
    identifier += word;
  }
  return isDigit(identifier[0]) ? "N" + identifier : identifier;
}

bool looksLikeAMacro(std::string_view identifier) {
  return std::none_of(identifier.begin(), identifier.end(), isLower);
}

std::string Scope::take(const std::string& wanted) {
  if (taken_.insert(wanted).second) return wanted;
  std::string base = wanted.ends_with('_') ? wanted : wanted + "_";
  if (taken_.insert(base).second) return base;
  for (size_t& number = lastNumbers_.try_emplace(base, 1).first->second;;) {
    std::string identifier = base + std::to_string(++number);
    if (taken_.insert(identifier).second) return identifier;
  }
}

}  // namespace kyt::tools
