// Each group of rows in small: every row of the list is printed, with a figure; nothing is lost on the way. The document
// names the same rows.
#include <gtest/gtest.h>

#include <fstream>
#include <set>
#include <sstream>

#include "bench/Rows.h"
#include "tests/support/Sanitizers.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::bench {
namespace {

std::string textOf(const std::string& file) {
  std::ostringstream text;
  text << std::ifstream(file).rdbuf();
  return text.str();
}

// What the benchmark printed; its status too.
std::string printed(std::vector<std::string> arguments, int& status) {
  const std::string file = testing::TempDir() + "kyt-bench-" + std::to_string(getpid());
  tools::ChildProcess::Options how;
  how.outputFile = file;
  auto program = tools::ChildProcess::start(KYT_PROGRAMS "/kyt_bench_daemon", arguments, how);
  status = program ? program->wait(std::chrono::seconds(280)).value_or(-1) : -1;
  std::string text = textOf(file);
  static_cast<void>(std::remove(file.c_str()));
  return text;
}

std::set<std::string> groups() {
  std::set<std::string> names;
  for (const RowName& row : allRows()) names.insert(row.group);
  return names;
}

class DaemonBench : public testing::TestWithParam<std::string> {};

TEST_P(DaemonBench, MeasuresEachRowOfTheGroup) {
  if (kSanitized) GTEST_SKIP() << "a million events through a sanitizer's daemon take many minutes";
  int status = -1;
  const std::string out = printed({"--programs", KYT_PROGRAMS, "--share", KYT_SHARE, "--only", GetParam(),
                                   "--events", "6000", "--sessions", "20", "--quiet-seconds", "0.2"},
                                  status);
  EXPECT_EQ(status, 0) << out;
  EXPECT_EQ(out.find("NOT ALL ARRIVED"), std::string::npos) << out;
  EXPECT_EQ(out.find("nan"), std::string::npos) << out;
  EXPECT_EQ(out.find("inf"), std::string::npos) << out;
  for (const RowName& row : allRows()) {
    const size_t at = out.find(row.what + " ");
    if (row.group != GetParam()) {
      EXPECT_EQ(at, std::string::npos) << row.what;
      continue;
    }
    ASSERT_NE(at, std::string::npos) << row.what << " is missing in\n" << out;
    const std::string line = out.substr(at, out.find('\n', at) - at);
    const std::string figure =
        line.substr(line.find('|') + 1, line.find('|', line.find('|') + 1) - line.find('|') - 1);
    EXPECT_NE(figure.find_first_of("0123456789"), std::string::npos) << line;
  }
}

INSTANTIATE_TEST_SUITE_P(Rows, DaemonBench, testing::ValuesIn(groups()),
                         [](const auto& group) { return group.param; });

TEST(DaemonBenchList, HasEachRowOnce) {
  std::set<std::string> seen;
  for (const RowName& row : allRows()) EXPECT_TRUE(seen.insert(row.what).second) << row.what;
}

TEST(DaemonBenchList, CoversWhatUsersDo) {
  int status = -1;
  const std::string list = printed({"--list"}, status);
  EXPECT_EQ(status, 0);
  for (const char* what : {"random digits, consent off, 1 client,",
                           "random digits, consent given, 4 clients,",
                           "ordinary events, consent off, 1 client,",
                           "ordinary events, consent off, 4 clients,",
                           "ordinary events, consent given, 1 client,",
                           "ordinary events, consent given, 4 clients,",
                           "1 field,",
                           "10 fields,",
                           "50 fields,",
                           "200 fields,",
                           "5,000 a second: ordinary events, consent given",
                           "TLS, 64 sessions, batches of 50",
                           "TLS, 64 sessions, batches of 1000",
                           "TLS, 1000 sessions, batches of 50",
                           "TLS, 1000 sessions, batches of 1000",
                           "rate, memory: ordinary events, consent off, 1 client",
                           "1000 busy sessions",
                           "an idle configured session",
                           "sendMessage",
                           "processor time, its library's thread"})
    EXPECT_NE(list.find(what), std::string::npos) << what;
}

TEST(DaemonBenchList, StandsInItsDocument) {
  const std::string document = textOf(KYT_SOURCE_DIR "/bench/README.md");
  for (const std::string& group : groups())
    EXPECT_NE(document.find("| `" + group + "`"), std::string::npos) << group;
}

TEST(DaemonBenchList, RefusesAGroupThatIsNotThere) {
  int status = 0;
  EXPECT_NE(printed({"--only", "everything"}, status).find("everything"), std::string::npos);
  EXPECT_NE(status, 0);
}

}  // namespace
}  // namespace kyt::bench
