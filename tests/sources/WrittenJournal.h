// A journal of a test's own: real journal files, written by systemd's own program from texts.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <string>
#include <utility>
#include <vector>

#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {

class WrittenJournal {
 public:
  using Fields = std::vector<std::pair<std::string, std::string>>;
  static constexpr char kWriter[] = "/usr/lib/systemd/systemd-journal-remote";
  static constexpr char kBoot[] = "0123456789abcdef0123456789abcdef";
  // Of the first entry; each later one is a millisecond after the one before.
  static constexpr uint64_t kBegin = 1'760'000'000'000'000, kStep = 1000;

  [[nodiscard]] static bool canBeWritten() { return isInstalled(kWriter); }
  // The folder of the files.
  [[nodiscard]] std::string folder() const { return folder_ / "journal"; }
  [[nodiscard]] uint64_t nextTime() const { return time_; }
  void setNextTime(uint64_t microseconds) { time_ = microseconds; }

  // Adds an entry to what write() writes.
  void add(const Fields& fields, const std::string& boot = kBoot) {
    text_ += "__REALTIME_TIMESTAMP=" + std::to_string(time_) +
             "\n__MONOTONIC_TIMESTAMP=" + std::to_string(time_ - kBegin + 1) + "\n_BOOT_ID=" + boot + "\n";
    for (const auto& [name, value] : fields) text_ += name + "=" + value + "\n";
    text_ += "\n";
    time_ += kStep;
  }
  // Files are named as the journal's own; each write to one goes on where it ended.
  void write(const std::string& file = "system.journal") {
    std::filesystem::create_directories(folder());
    const ProgramRun run = runProgram(kWriter, {"-o", folder() + "/" + file, "-"}, text_);
    ASSERT_EQ(run.status, 0) << run.text;
    text_.clear();
  }
  void removeFile(const std::string& file) const { std::filesystem::remove(folder() + "/" + file); }

 private:
  TemporaryFolder folder_;
  std::string text_;
  uint64_t time_ = kBegin;
};

// What the service manager writes.
inline WrittenJournal::Fields failureOf(const std::string& unit, const std::string& result = "exit-code") {
  return {{"_PID", "1"},
          {"MESSAGE_ID", "d9b373ed55a64feb8242e02dbe79a49c"},
          {"UNIT", unit},
          {"UNIT_RESULT", result},
          {"MESSAGE", unit + ": Failed with result '" + result + "'."}};
}
inline WrittenJournal::Fields restartOf(const std::string& unit) {
  return {
      {"_PID", "1"}, {"MESSAGE_ID", "5eb03494b6584870a536b337290809b3"}, {"UNIT", unit}, {"N_RESTARTS", "3"}};
}
inline WrittenJournal::Fields anyLine(const std::string& text) {
  return {{"_PID", "4711"}, {"_SYSTEMD_UNIT", "noise.service"}, {"MESSAGE", text}};
}

}  // namespace kyt
