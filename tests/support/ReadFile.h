// The whole of a file, in large pieces: tests look for lines in long logs again and again, and are compiled without
// optimisation.
#pragma once

#include <array>
#include <filesystem>
#include <fstream>
#include <string>

namespace kyt {

// What can be read of it; nothing of one that is not there. Files of /proc too, which have no size.
[[nodiscard]] inline std::string readFile(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  std::string text;
  std::array<char, 65536> piece;
  do {
    in.read(piece.data(), piece.size());
    text.append(piece.data(), static_cast<size_t>(in.gcount()));
  } while (in);
  return text;
}

}  // namespace kyt
