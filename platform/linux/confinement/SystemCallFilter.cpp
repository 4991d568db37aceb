#include "platform/linux/confinement/SystemCallFilter.h"

#include <seccomp.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <memory>
#include <type_traits>

#include "platform/linux/files/Files.h"

namespace kyt {
namespace {

struct Release {
  void operator()(void* filter) const { seccomp_release(filter); }
};
using Filter = std::unique_ptr<std::remove_pointer_t<scmp_filter_ctx>, Release>;

uint32_t actionOf(int error) {
  return error == kEndsTheProcess ? SCMP_ACT_KILL_PROCESS : SCMP_ACT_ERRNO(static_cast<uint16_t>(error));
}

std::string failed(const char* what, int result) {
  return std::string("seccomp: ") + what + ": " + errorText(-result);
}

// One filter in the making; the first problem stays.
class FilterMaker {
 public:
  FilterMaker(uint32_t otherwise, bool recorded) : filter_(seccomp_init(otherwise)) {
    if (filter_ == nullptr) {
      problem_ = "seccomp: no memory";
      return;
    }
    set(SCMP_FLTATR_CTL_NNP, 0);  // it is set already
    set(SCMP_FLTATR_CTL_OPTIMIZE, 2);
    set(SCMP_FLTATR_ACT_BADARCH, SCMP_ACT_KILL_PROCESS);  // another architecture's numbers mean other calls
    if (recorded) set(SCMP_FLTATR_CTL_LOG, 1);
  }
  void add(uint32_t action, const SystemCallRule& rule) {
    std::array<scmp_arg_cmp, 6> comparisons;
    unsigned count = 0;
    for (const ArgumentCondition& each : rule.conditions)
      comparisons[count++] = {each.argument, SCMP_CMP_MASKED_EQ, each.mask, each.value};
    for (const int number : rule.numbers) {
      if (problem_) return;
      const int result = seccomp_rule_add_array(filter_.get(), action, number, count, comparisons.data());
      if (result != 0) problem_ = failed(rule.call.c_str(), result);
    }
  }
  void add(uint32_t action, const std::vector<SystemCallRule>& rules) {
    for (const SystemCallRule& rule : rules) add(action, rule);
  }
  [[nodiscard]] const std::optional<std::string>& problem() const { return problem_; }
  [[nodiscard]] std::optional<std::string> load() {
    if (problem_) return problem_;
    if (const int result = seccomp_load(filter_.get()); result != 0) return failed("load", result);
    return std::nullopt;
  }

 private:
  void set(scmp_filter_attr attribute, uint32_t value) {
    if (problem_) return;
    if (const int result = seccomp_attr_set(filter_.get(), attribute, value); result != 0)
      problem_ = failed("attribute", result);
  }
  Filter filter_;
  std::optional<std::string> problem_;
};

}  // namespace

std::optional<std::string> enterSystemCallFilter(const SystemCallProfile& profile) {
  FilterMaker lists(actionOf(profile.otherwise), true);
  lists.add(SCMP_ACT_ALLOW, profile.allow);
  lists.add(SCMP_ACT_ALLOW, profile.untilListening);
  if (profile.otherwise != kEndsTheProcess) lists.add(SCMP_ACT_KILL_PROCESS, profile.kill);
  FilterMaker quiet(SCMP_ACT_ALLOW, false);
  for (const auto& [error, rules] : profile.errors) {
    lists.add(SCMP_ACT_ALLOW, rules);
    quiet.add(actionOf(error), rules);
  }
  if (lists.problem()) return lists.problem();
  // The quiet one first: the other forbids what entering needs, unless its list says otherwise.
  if (auto problem = quiet.load()) return problem;
  return lists.load();
}

std::optional<std::string> endStartOfSystemCallFilter(const SystemCallProfile& profile) {
  FilterMaker later(SCMP_ACT_ALLOW, true);
  later.add(actionOf(EPERM), profile.untilListening);
  return later.load();
}

std::optional<int> systemCallNumber(const std::string& name) {
  const int number = seccomp_syscall_resolve_name(name.c_str());
  if (number == __NR_SCMP_ERROR) return std::nullopt;
  return number;
}

}  // namespace kyt
