#include "sources/boots/EndedBoots.h"

#include <algorithm>
#include <charconv>
#include <map>

#include "sources/Journal.h"

namespace kyt::sources {

namespace {

constexpr char kStarted[] = "MESSAGE_ID=39f53479d3a045ac8e11786248231fbf";
constexpr char kStartupFinished[] = "MESSAGE_ID=b07a249cd024414a82dd00cd181378ff";
constexpr int kMostKernelLines = 1000;  // from the end; a panic is among the last

std::unique_ptr<Journal> openJournal(const std::string& folder, std::vector<std::string> matches,
                                     std::string& problem) {
  auto opened = Journal::open({folder, true, std::move(matches)});
  if (auto* why = std::get_if<std::string>(&opened)) {
    problem = std::move(*why);
    return nullptr;
  }
  return std::get<std::unique_ptr<Journal>>(std::move(opened));
}

struct OrderlyEnd {
  std::string
      reason;  // of the target that the service manager reached last, on its way to the end; empty: it reached none
  uint64_t reached = 0;  // when, the first of them
};
OrderlyEnd orderlyEnd(const std::string& folder, const std::string& boot, std::string& problem) {
  static constexpr std::pair<const char*, const char*> kTargets[] = {{"reboot.target", "reboot"},
                                                                     {"poweroff.target", "power-off"},
                                                                     {"halt.target", "halt"},
                                                                     {"kexec.target", "kexec"},
                                                                     {"shutdown.target", "shutdown"}};
  std::vector<std::string> matches = {"_BOOT_ID=" + boot, "_PID=1", kStarted};
  for (const auto& [target, reason] : kTargets) matches.push_back(std::string("UNIT=") + target);
  const auto journal = openJournal(folder, std::move(matches), problem);
  OrderlyEnd end;
  if (!journal) return end;
  journal->goToTime(0);
  while (journal->next()) {
    const std::string unit = journal->field("UNIT");
    for (const auto& [target, reason] : kTargets) {
      if (unit != target) continue;
      if (end.reached == 0) end.reached = journal->microseconds();
      if (end.reason.empty() || std::string_view(reason) != "shutdown") end.reason = reason;
    }
  }
  return end;
}

bool kernelPanicked(const std::string& folder, const std::string& boot, std::string& problem) {
  const auto journal = openJournal(folder, {"_BOOT_ID=" + boot, "_TRANSPORT=kernel"}, problem);
  if (!journal) return false;
  journal->goToEnd();
  for (int line = 0; line < kMostKernelLines && journal->previous(); ++line)
    if (journal->field("MESSAGE").starts_with("Kernel panic")) return true;
  return false;
}

std::optional<EndedBoot> timesOf(const std::string& folder, const std::string& boot, std::string& problem) {
  const auto journal = openJournal(folder, {"_BOOT_ID=" + boot}, problem);
  if (!journal) return std::nullopt;
  EndedBoot found;
  found.boot = boot;
  journal->goToTime(0);
  if (!journal->next()) return std::nullopt;
  found.began = journal->microseconds();
  journal->goToEnd();
  if (!journal->previous()) return std::nullopt;
  found.ended = journal->microseconds();
  return found;
}

// The run to which a dump of that time belongs: the latest that had begun, or none. Where no time was kept the memory holds
// but the last kernel's. `boots`: the oldest first.
EndedBoot* runOf(std::vector<EndedBoot>& boots, uint64_t written) {
  if (boots.empty()) return nullptr;
  if (written == 0) return &boots.back();
  EndedBoot* found = nullptr;
  for (EndedBoot& boot : boots)
    if (boot.began <= written) found = &boot;
  return found;
}

// Runs of which a kernel left a panic behind, and when the last was written; 0: nobody knows. What systemd-pstore moved in the
// current run is of the last one; what it moved before was told before.
std::map<const EndedBoot*, uint64_t> panickedRuns(std::vector<EndedBoot>& boots, uint64_t currentBegan,
                                                  const PanicDumps& panics) {
  std::map<const EndedBoot*, uint64_t> panicked;
  const auto add = [&](const EndedBoot* boot, uint64_t when) {
    const auto [found, isNew] = panicked.emplace(boot, when);
    if (!isNew) found->second = found->second == 0 || when == 0 ? 0 : std::max(found->second, when);
  };
  for (const uint64_t written : panics.written)
    if (const EndedBoot* boot = runOf(boots, written)) add(boot, written);
  for (const uint64_t moved : panics.moved)
    if (currentBegan != 0 && moved >= currentBegan && !boots.empty()) add(&boots.back(), 0);
  return panicked;
}

}  // namespace

EndedBoots endedBoots(const std::string& folder, const std::string& current, uint64_t after,
                      const KeptSigns& signs) {
  EndedBoots result;
  const auto journal = openJournal(folder, {}, result.problem);
  if (!journal) return result;
  uint64_t currentBegan = 0;
  for (const std::string& boot : journal->valuesOf("_BOOT_ID")) {
    const auto found = timesOf(folder, boot, result.problem);
    if (found && boot == current) currentBegan = found->began;
    if (found && boot != current && found->ended > after) result.boots.push_back(*found);
  }
  std::sort(result.boots.begin(), result.boots.end(),
            [](const EndedBoot& a, const EndedBoot& b) { return a.ended < b.ended; });
  const auto panicked = panickedRuns(result.boots, currentBegan, signs.panics);
  for (EndedBoot& boot : result.boots) {
    // An end in order may fail: a kernel that panics or hangs then, the usual hang of devices, is told as that.
    const OrderlyEnd orderly = orderlyEnd(folder, boot.boot, result.problem);
    const auto dump = panicked.find(&boot);
    const bool leftADump = dump != panicked.end() && (dump->second == 0 || dump->second >= orderly.reached);
    const bool isLast = &boot == &result.boots.back();
    if (leftADump || kernelPanicked(folder, boot.boot, result.problem))
      boot.reason = "panic";
    else if (isLast && signs.watchdogFired)
      boot.reason = "watchdog";
    else
      boot.reason = orderly.reason.empty() ? "unclean" : orderly.reason;
  }
  return result;
}

std::optional<uint64_t> startupMilliseconds(const std::string& folder, const std::string& boot) {
  std::string problem;
  const auto journal = openJournal(folder, {"_BOOT_ID=" + boot, "_PID=1", kStartupFinished}, problem);
  if (!journal) return std::nullopt;
  journal->goToTime(0);
  if (!journal->next()) return std::nullopt;
  uint64_t sum = 0;
  for (const char* part : {"KERNEL_USEC", "INITRD_USEC", "USERSPACE_USEC"}) {
    const std::string text = journal->field(part);
    uint64_t microseconds = 0;
    std::from_chars(text.data(), text.data() + text.size(), microseconds);
    sum += microseconds;
  }
  return sum / 1000;
}

}  // namespace kyt::sources
