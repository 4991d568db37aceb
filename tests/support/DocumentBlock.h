// The worked examples of docs/, for the tests that compare them with what the code makes. Needs KYT_DOCS_DIR.
#pragma once

#include <charconv>
#include <fstream>
#include <sstream>
#include <string>

namespace kyt {

// The text of the fenced block with that label, without its last line break.
inline std::string documentBlock(const std::string& file, const std::string& label) {
  std::ifstream stream(KYT_DOCS_DIR "/" + file);
  std::ostringstream text;
  text << stream.rdbuf();
  const std::string document = text.str(), fence = "```" + label + "\n";
  const size_t start = document.find(fence);
  if (start == std::string::npos) return "no block " + label + " in " + file;
  const size_t begin = start + fence.size();
  return document.substr(begin, document.find("\n```", begin) - begin);
}

// The bytes of a block of hexadecimal pairs.
inline std::string bytesOfHex(const std::string& text) {
  std::string bytes;
  std::istringstream pairs(text);
  for (std::string pair; pairs >> pair;) {
    unsigned byte = 256;
    std::from_chars(pair.data(), pair.data() + pair.size(), byte, 16);
    if (pair.size() != 2 || byte > 255) return "no hexadecimal pair: " + pair;
    bytes += static_cast<char>(byte);
  }
  return bytes;
}

}  // namespace kyt
