#include "platform/linux/system/SystemdLibrary.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

TEST(SystemdLibrary, HasAllFunctions) {
  const auto loaded = SystemdLibrary::load();
  ASSERT_TRUE(std::holds_alternative<SystemdLibrary>(loaded)) << std::get<std::string>(loaded);
  const auto& functions = std::get<SystemdLibrary>(loaded);
  EXPECT_NE(functions.journalSend, nullptr);
}

TEST(SystemdLibrary, AMissingOneIsATextThatNamesIt) {
  const auto loaded = SystemdLibrary::load("libkytnosuch.so.0");
  ASSERT_TRUE(std::holds_alternative<std::string>(loaded));
  EXPECT_NE(std::get<std::string>(loaded).find("libkytnosuch.so.0"), std::string::npos);
}

}  // namespace
}  // namespace kyt
