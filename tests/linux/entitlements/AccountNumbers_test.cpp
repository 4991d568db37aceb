#include "platform/linux/entitlements/AccountNumbers.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <map>
#include <string>

namespace kyt {
namespace {

std::map<std::string, uint32_t> users;
int refusal = 0;

int lookUp(const std::string& name, std::optional<uint32_t>& found) {
  if (refusal != 0) return refusal;
  const auto user = users.find(name);
  if (user != users.end()) found = user->second;
  return 0;
}

class AccountNumbersTest : public testing::Test {
 protected:
  AccountNumbersTest() {
    users = {{"someone", 1234}};
    refusal = 0;
  }
  std::optional<uint32_t> number(const std::string& name) { return numbers_.user(NameOrNumber(name)); }
  AccountNumbers numbers_{lookUp, lookUp};
};

TEST_F(AccountNumbersTest, FindsWhoHasTheName) {
  EXPECT_EQ(number("someone"), 1234U);
  EXPECT_EQ(number("nobody of that name"), std::nullopt);
  EXPECT_EQ(numbers_.group(NameOrNumber(int64_t{55})), 55U);
  EXPECT_EQ(numbers_.user(NameOrNumber(int64_t{UINT32_MAX})), std::nullopt) << "stands for nobody";
}

TEST_F(AccountNumbersTest, TheLastNumberCountsWhileTheSystemRefusesToLook) {
  EXPECT_EQ(number("someone"), 1234U);
  users["someone"] = 4321;
  for (const int error : {EMFILE, ENFILE, ENOMEM, EIO, EAGAIN}) {
    refusal = error;
    EXPECT_EQ(number("someone"), 1234U) << error;
    EXPECT_EQ(number("another"), std::nullopt) << error << ": was never found";
    EXPECT_EQ(numbers_.group(NameOrNumber("someone")), std::nullopt)
        << error << ": was never found as a group";
  }
  refusal = 0;
  EXPECT_EQ(number("someone"), 4321U);
}

TEST_F(AccountNumbersTest, AnyOtherAnswerForgetsTheName) {
  for (const int error : {0, ENOENT, EPERM}) {
    refusal = 0;
    users = {{"someone", 1234}};
    EXPECT_EQ(number("someone"), 1234U);
    users.clear();
    refusal = error;
    EXPECT_EQ(number("someone"), std::nullopt) << error;
    refusal = EMFILE;
    EXPECT_EQ(number("someone"), std::nullopt) << error;
  }
}

TEST_F(AccountNumbersTest, RemembersNoMoreNamesThanItSays) {
  for (size_t i = 0; i <= AccountNumbers::kMostRemembered; ++i)
    users["user " + std::to_string(i)] = static_cast<uint32_t>(i);
  for (size_t i = 0; i < AccountNumbers::kMostRemembered; ++i)
    EXPECT_EQ(number("user " + std::to_string(i)), i);
  const std::string last = "user " + std::to_string(AccountNumbers::kMostRemembered);
  EXPECT_EQ(number("user 1"), 1U);
  EXPECT_EQ(number(last), AccountNumbers::kMostRemembered);
  refusal = EMFILE;
  EXPECT_EQ(number(last), AccountNumbers::kMostRemembered);
  EXPECT_EQ(number("user 1"), std::nullopt) << "all were forgotten for the one more";
}

}  // namespace
}  // namespace kyt
