// Both compression libraries, for suites that run with each. libdeflate must be there: the packages that tests need name it.
#pragma once

#include <gtest/gtest.h>

#include <array>
#include <memory>
#include <string>
#include <variant>

#include "platform/linux/data/LibdeflateDeflate.h"
#include "platform/linux/data/ZlibDeflate.h"

namespace kyt {

struct DeflateLibrary {
  const char* name;
  std::unique_ptr<Deflate> (*make)(int level);
};

inline std::unique_ptr<Deflate> makeZlib(int level) {
  return std::make_unique<ZlibDeflate>(level);
}

inline std::unique_ptr<Deflate> makeLibdeflate(int level) {
  auto loaded = LibdeflateDeflate::load(level);
  if (const auto* problem = std::get_if<std::string>(&loaded)) ADD_FAILURE() << *problem;
  return std::move(std::get<std::unique_ptr<LibdeflateDeflate>>(loaded));
}

inline constexpr std::array kDeflateLibraries = {DeflateLibrary{"zlib", makeZlib},
                                                 DeflateLibrary{"libdeflate", makeLibdeflate}};

inline std::string nameOfLibrary(const testing::TestParamInfo<DeflateLibrary>& info) {
  return info.param.name;
}

inline void PrintTo(const DeflateLibrary& library, std::ostream* out) {
  *out << library.name;
}

}  // namespace kyt
