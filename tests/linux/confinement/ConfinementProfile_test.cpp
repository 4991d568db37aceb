#include "platform/linux/confinement/ConfinementProfile.h"

#include <gtest/gtest.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>

namespace kyt {
namespace {

const ProfileVariables kVariables = {{"A", ""}, {"B", "/b"}};
constexpr const char* kNoCalls = "[system_calls]\notherwise = 'EPERM'\n";

std::string problemOf(const std::string& text) {
  const auto parsed = parseProfile(text, "p", kVariables);
  const auto* error = std::get_if<TomlError>(&parsed);
  return error != nullptr ? error->text : "none";
}

ConfinementProfile parsed(const std::string& text) {
  auto result = parseProfile(text, "p", kVariables);
  const auto* error = std::get_if<TomlError>(&result);
  EXPECT_EQ(error, nullptr) << error->text;
  return error == nullptr ? std::get<ConfinementProfile>(std::move(result)) : ConfinementProfile();
}

std::vector<ArgumentCondition> conditionsOf(const std::string& entry) {
  auto rule = parseSystemCallRule(entry);
  const auto* problem = std::get_if<std::string>(&rule);
  EXPECT_EQ(problem, nullptr) << *problem;
  return problem == nullptr ? std::get<SystemCallRule>(rule).conditions : std::vector<ArgumentCondition>();
}

std::string problemOfRule(const std::string& entry) {
  const auto rule = parseSystemCallRule(entry);
  const auto* problem = std::get_if<std::string>(&rule);
  return problem != nullptr ? *problem : "none";
}

TEST(ConfinementProfile, WhatIsWrongIsAnErrorWithItsLine) {
  EXPECT_EQ(problemOf("read = []\nexecute = ['/bin']\n"), "p:2: unknown key \"execute\"");
  EXPECT_EQ(problemOf("read = '/etc'\n"), "p:1: \"read\" must be an array of texts");
  EXPECT_EQ(problemOf("write = [\n 1 ]\n"), "p:2: \"write\" must be an array of texts");
  EXPECT_EQ(problemOf("read = ['${HOME}/x']\n"), "p:1: \"${HOME}/x\" names an unknown variable");
  EXPECT_EQ(problemOf("read = ['${HOME']\n"), "p:1: \"${HOME\" has a variable without an end");
  EXPECT_EQ(problemOf("read = ['/a/${B}']\n"), "p:1: \"/a/${B}\" has a variable in its middle");
  EXPECT_EQ(problemOf("read = ['etc']\n"), "p:1: \"etc\" is no absolute path");
  EXPECT_TRUE(problemOf("read = [\n").starts_with("p:"));
  EXPECT_EQ(problemOf("limits = 1\n"), "p:1: \"limits\" must be a section");
  EXPECT_EQ(problemOf("[limits]\nstack = 1\n"), "p:2: unknown key \"stack\"");
  EXPECT_EQ(problemOf("[limits]\ncore = 'none'\n"), "p:2: \"core\" must be a number, not less than 0");
  EXPECT_EQ(problemOf("[limits]\ncore = -1\n"), "p:2: \"core\" must be a number, not less than 0");
}

TEST(ConfinementProfile, WhatIsWrongWithSystemCallsIsAnErrorWithItsLine) {
  const std::string calls = kNoCalls;
  EXPECT_EQ(problemOf("read = []\n"), "p: the section [system_calls] is missing");
  EXPECT_EQ(problemOf("system_calls = 1\n"), "p:1: \"system_calls\" must be a section");
  EXPECT_EQ(problemOf("[system_calls]\nallow = []\n"), "p:1: \"otherwise\" is missing");
  EXPECT_EQ(problemOf("[system_calls]\notherwise = 'allow'\n"),
            "p:2: \"otherwise\" must be \"kill\" or the name of an error");
  EXPECT_EQ(problemOf(calls + "forbid = []\n"), "p:3: unknown key \"forbid\"");
  EXPECT_EQ(problemOf(calls + "allow = 'read'\n"), "p:3: \"allow\" must be an array of texts");
  EXPECT_EQ(problemOf(calls + "allow = [\n'read',\n'raed']\n"), "p:5: \"raed\" is no system call");
  EXPECT_EQ(problemOf(calls + "kill = ['read(1)']\n"),
            "p:3: \"read(1)\" has arguments, which only \"allow\" may have");
  EXPECT_EQ(problemOf(calls + "allow = ['read']\nkill = ['read']\n"),
            "p:4: \"read\" stands in \"allow\" too");
  EXPECT_EQ(problemOf(calls + "errors = 1\n"), "p:3: \"errors\" must be a section");
  EXPECT_EQ(problemOf(calls + "[system_calls.errors]\nEFUN = []\n"),
            "p:4: \"EFUN\" is no error that a call can fail with here");
}

TEST(ConfinementProfile, AnEntryOfAnEmptyVariableFallsAway) {
  const auto profile = parsed(std::string("read = ['${A}', '${B}/x']\n") + kNoCalls);
  EXPECT_EQ(profile.read, std::vector<std::string>{"/b/x"});
  EXPECT_TRUE(profile.write.empty());
}

TEST(ConfinementProfile, HoldsThePathsOfEachKind) {
  const auto profile =
      parsed(std::string("read = ['/r']\nwrite = ['/w']\nfolders = ['/f']\nsockets = ['/s']\n") + kNoCalls);
  EXPECT_EQ(profile.read, std::vector<std::string>{"/r"});
  EXPECT_EQ(profile.write, std::vector<std::string>{"/w"});
  EXPECT_EQ(profile.folders, std::vector<std::string>{"/f"});
  EXPECT_EQ(profile.sockets, std::vector<std::string>{"/s"});
}

TEST(ConfinementProfile, HoldsItsLimitsAndLists) {
  const auto profile = parsed(
      "[limits]\naddress_space = 4_096\ncore = 0\n[system_calls]\notherwise = 'kill'\nallow = ['read']\n"
      "until_listening = ['listen']\nkill = ['ptrace']\n[system_calls.errors]\nENOSYS = ['clone3']\n");
  EXPECT_EQ(profile.limits.addressSpace, 4096U);
  EXPECT_EQ(profile.limits.core, 0U);
  EXPECT_FALSE(profile.limits.descriptors);
  EXPECT_EQ(profile.systemCalls.otherwise, kEndsTheProcess);
  ASSERT_EQ(profile.systemCalls.allow.size(), 1U);
  EXPECT_EQ(profile.systemCalls.allow[0].numbers, std::vector<int>{SYS_read});
  ASSERT_EQ(profile.systemCalls.untilListening.size(), 1U);
  ASSERT_EQ(profile.systemCalls.kill.size(), 1U);
  ASSERT_EQ(profile.systemCalls.errors.count(ENOSYS), 1U);
}

TEST(SystemCallRules, ComparesArguments) {
  EXPECT_TRUE(conditionsOf("read").empty());
  EXPECT_TRUE(conditionsOf("read(*, *)").empty());
  EXPECT_EQ(conditionsOf("socket(AF_UNIX, *, 0x10)"),
            (std::vector<ArgumentCondition>{{0, 0xFFFFFFFF, 1}, {2, 0xFFFFFFFF, 16}}));
  EXPECT_EQ(conditionsOf("mmap(*,*,no PROT_EXEC)"), (std::vector<ArgumentCondition>{{2, 4, 0}}));
  EXPECT_EQ(conditionsOf("mmap(*, *, only PROT_READ | PROT_EXEC)"),
            (std::vector<ArgumentCondition>{{2, 0xFFFFFFFA, 0}}));
  EXPECT_EQ(conditionsOf("clone(has CLONE_VM|CLONE_THREAD no CLONE_NEWUSER)"),
            (std::vector<ArgumentCondition>{{0, 0x10010100, 0x10100}}));
  EXPECT_EQ(conditionsOf("prlimit64(0, *, NULL)"),
            (std::vector<ArgumentCondition>{{0, 0xFFFFFFFF, 0}, {2, ~0ULL, 0}}));
  EXPECT_EQ(conditionsOf("tgkill(SELF)"),
            (std::vector<ArgumentCondition>{{0, 0xFFFFFFFF, static_cast<uint64_t>(::getpid())}}));
}

TEST(SystemCallRules, SaysWhatIsWrong) {
  EXPECT_EQ(problemOfRule(""), "is no system call");
  EXPECT_EQ(problemOfRule("read(1"), "has no closing parenthesis");
  EXPECT_EQ(problemOfRule("read(1) "), "has no closing parenthesis");
  EXPECT_EQ(problemOfRule("read()"), "has a wrong argument \"\"");
  EXPECT_EQ(problemOfRule("read(1, )"), "has a wrong argument \"\"");
  EXPECT_EQ(problemOfRule("read(AF_NONE)"), "has a wrong argument \"AF_NONE\"");
  EXPECT_EQ(problemOfRule("read(only)"), "has a wrong argument \"only\"");
  EXPECT_EQ(problemOfRule("read(only 1|)"), "has a wrong argument \"only 1|\"");
  EXPECT_EQ(problemOfRule("read(has 3 no 1)"), "has a wrong argument \"has 3 no 1\"");
  EXPECT_EQ(problemOfRule("read(-1)"), "has a wrong argument \"-1\"");
  EXPECT_EQ(problemOfRule("read(*,*,*,*,*,*,*)"), "has more than six arguments");
  EXPECT_EQ(problemOfRule("5..4"), "is no range of numbers");
  EXPECT_EQ(problemOfRule("1..4096"), "is no range of numbers");
  EXPECT_EQ(problemOfRule("1.."), "is no range of numbers");
}

TEST(SystemCallRules, SkipsWhatThisArchitectureDoesNotHave) {
  const auto rule = std::get<SystemCallRule>(parseSystemCallRule("s390_pci_mmio_read"));
  EXPECT_TRUE(rule.numbers.empty());
}

TEST(SystemCallRules, SkipsWhatHidesItsArgumentsOnI386) {
  const auto unconditional = std::get<SystemCallRule>(parseSystemCallRule("mmap"));
  const auto conditional = std::get<SystemCallRule>(parseSystemCallRule("mmap(*, *, no PROT_EXEC)"));
#ifdef __i386__
  EXPECT_EQ(unconditional.numbers, std::vector<int>{SYS_mmap});
  EXPECT_TRUE(conditional.numbers.empty());
#elif defined(SYS_mmap)
  EXPECT_EQ(unconditional.numbers, std::vector<int>{SYS_mmap});
  EXPECT_EQ(conditional.numbers, std::vector<int>{SYS_mmap});
#else
  EXPECT_TRUE(unconditional.numbers.empty());
#endif
}

TEST(SystemCallRules, ARangeIsAllItsNumbers) {
  const auto rule = std::get<SystemCallRule>(parseSystemCallRule("451..453"));
  EXPECT_EQ(rule.numbers, (std::vector<int>{451, 452, 453}));
}

}  // namespace
}  // namespace kyt
