#include "platform/linux/base/SharedLibrary.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

TEST(SharedLibrary, FindsFunctionsByName) {
  SharedLibrary library("libz.so.1");
  const char* (*version)() = nullptr;
  library.resolve(version, "zlibVersion");
  ASSERT_FALSE(library.problem()) << *library.problem();
  EXPECT_EQ(version()[0], '1');
}

TEST(SharedLibrary, AMissingOneIsATextThatNamesIt) {
  SharedLibrary library("libkytnosuch.so.7");
  const char* (*version)() = nullptr;
  library.resolve(version, "zlibVersion");
  ASSERT_TRUE(library.problem());
  EXPECT_NE(library.problem()->find("libkytnosuch.so.7"), std::string::npos) << *library.problem();
  EXPECT_EQ(version, nullptr);
}

TEST(SharedLibrary, AMissingFunctionIsATextThatNamesIt) {
  SharedLibrary library("libz.so.1");
  int (*missing)() = nullptr;
  library.resolve(missing, "kytNoSuchFunction");
  ASSERT_TRUE(library.problem());
  EXPECT_NE(library.problem()->find("kytNoSuchFunction"), std::string::npos) << *library.problem();
  EXPECT_EQ(missing, nullptr);
}

}  // namespace
}  // namespace kyt
