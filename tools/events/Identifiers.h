// Names of an events.toml, which may be any text, as identifiers of a programming language: the letters and digits of ASCII
// that they have, so that the same file gives the same identifiers everywhere. One thread.
#pragma once

#include <cstddef>
#include <map>
#include <set>
#include <span>
#include <string>
#include <string_view>

namespace kyt::tools {

// Its words with an underscore between them: "page-opened" is page_opened. What is no ASCII becomes its number ("ü" is
// uFC), a digit at the beginning gets an "n" in front.
[[nodiscard]] std::string identifierOf(std::string_view name);
// Its words, each beginning with a capital: PageOpened.
[[nodiscard]] std::string capitalisedIdentifierOf(std::string_view name);
// Whether it has no lower-case letter, as macros have none.
[[nodiscard]] bool looksLikeAMacro(std::string_view identifier);

// The identifiers of one scope, no two of them the same.
class Scope {
 public:
  // What the language or the code around it has taken already.
  explicit Scope(std::span<const std::string_view> reserved) : taken_(reserved.begin(), reserved.end()) {}
  void reserve(const std::string& identifier) { taken_.insert(identifier); }
  // The wanted one; with an underscore where it is taken, and then with a number.
  [[nodiscard]] std::string take(const std::string& wanted);

 private:
  std::set<std::string, std::less<>> taken_;
  std::map<std::string, size_t, std::less<>> lastNumbers_;
};

}  // namespace kyt::tools
