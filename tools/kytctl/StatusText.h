// What "kytctl status" prints: is it working, since when, how much has left, what is lost and why, which back ends are off
// and why, which storebags are in force, and what went wrong last at each server. Lines of at most 100 characters.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/objects/Value.h"

namespace kyt::tools {

[[nodiscard]] std::string statusText(const Dictionary& status, const std::vector<Dictionary>& storebags);

// Of an answer's dictionary; 0 and empty where there is none.
[[nodiscard]] int64_t numberIn(const Dictionary& dictionary, const char* key);
[[nodiscard]] std::string textIn(const Dictionary& dictionary, const char* key);
// What decided a back end's state: "consent", "503 at 14:05:02"; empty where nothing did.
[[nodiscard]] std::string ruleText(const Dictionary& backEnd, int64_t now);

}  // namespace kyt::tools
