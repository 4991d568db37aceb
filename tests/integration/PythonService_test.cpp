// A service in Python, on the real chain.
#include <gtest/gtest.h>
#include <signal.h>

#include <sstream>

#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

class PythonService : public StageTest {
 protected:
  void SetUp() override {
    if (kSanitized) GTEST_SKIP() << "the interpreter is built without the sanitizer";
    if (!isInstalled("/usr/bin/python3")) GTEST_SKIP() << "python3 is not installed";
    lay();
    putBag("cadmor", {entry("service")});
    startDaemon();
  }
  [[nodiscard]] std::optional<tools::ChildProcess> start(const std::string& program,
                                                         const std::string& argument) const {
    tools::ChildProcess::Options how;
    how.outputFile = stage_->folder() + "/service.log";
    return tools::ChildProcess::start(
        "env",
        {"PYTHONPATH=" KYT_PYTHON, "PYTHONDONTWRITEBYTECODE=1", "LD_LIBRARY_PATH=" KYT_LIBRARIES,
         "KYTREPORTING_SOCKET=" + socket(), "/usr/bin/python3", KYT_PYTHON "/tests/" + program, argument},
        how);
  }
  [[nodiscard]] std::string said() const { return contents(stage_->folder() + "/service.log"); }
  // The sums over the lines that its processes printed.
  [[nodiscard]] Dictionary figures(long& processes) const {
    Dictionary sums;
    std::istringstream lines(said());
    RapidJSON json;
    for (std::string line; std::getline(lines, line); ++processes) {
      auto parsed = json.parse(line);
      const Dictionary* read =
          std::holds_alternative<Value>(parsed) ? std::get<Value>(parsed).dictionary() : nullptr;
      EXPECT_NE(read, nullptr) << line;
      if (read == nullptr) continue;
      for (const auto& [key, value] : *read) {
        const Value* before = sums.find(key);
        sums.set(key, value.longLongValue() + (before != nullptr ? before->longLongValue() : 0));
      }
    }
    return sums;
  }
};

TEST_F(PythonService, ClosesItsBooksUnderFiftyRestartsOfTheDaemonAndTwentyForks) {
  auto service = start("service.py", "20");
  ASSERT_TRUE(service);
  ASSERT_TRUE(arrive("client=service&method=0", 1)) << said();
  for (int restart = 0; restart < 50; ++restart) {
    ASSERT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog();
    startDaemon();
    ASSERT_TRUE(service->isRunning());
  }
  service->signal(SIGTERM);
  ASSERT_EQ(service->wait(std::chrono::seconds(120)).value_or(-1), 0) << said();

  long processes = 0;
  const Dictionary sums = figures(processes);
  const auto sum = [&sums](const char* key) {
    const Value* value = sums.find(key);
    return value != nullptr ? static_cast<long>(value->longLongValue()) : -1;
  };
  EXPECT_EQ(processes, 21);
  EXPECT_EQ(sum("accepted"), sum("sent") + sum("queued") + sum("lost_on_connection_end") +
                                 sum("lost_in_queue") + sum("dropped_unsendable") + sum("dropped_too_late"))
      << description(sums);
  EXPECT_EQ(sum("queued"), 0) << description(sums);
  EXPECT_GE(sum("accepted"), 20 * 50 + 50);
  // What ended with a connection the daemon took all of, or none, or something between; and one that ends while it fetches
  // a storebag has no back end for what it took.
  EXPECT_TRUE(arrive("client=service&method=10", 1)) << daemonLog();
  EXPECT_LE(arrived("client=service&method=10"), sum("sent") + sum("lost_on_connection_end"));
}

size_t countOf(const std::string& text, const std::string& part) {
  size_t count = 0;
  for (size_t at = text.find(part); at != std::string::npos; at = text.find(part, at + 1)) ++count;
  return count;
}

TEST_F(PythonService, AggregatesUntilTheDaemonEndsWhateverItsCallbackThrows) {
  auto service = start("aggregator.py", "");
  ASSERT_TRUE(service);
  ASSERT_TRUE(eventually([&] { return countOf(said(), "{\"ready\": true}") == 1 || !service->isRunning(); }));
  for (int number = 0; number < 3; ++number)
    EXPECT_TRUE(eventually([&] {
      return countOf(said(), "{\"session\": 2, \"category\": 12, \"type\": 9, \"payload\": {\"number\": " +
                                 std::to_string(number) + ", \"text\": \"\\u00e4\"}, \"is_last\": false}") ==
             1;
    })) << said();
  EXPECT_EQ(countOf(said(), "\"is_last\": true"), 0U) << said();
  ASSERT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog();
  EXPECT_EQ(service->wait(std::chrono::seconds(60)).value_or(-1), 0) << said();
  EXPECT_EQ(
      countOf(said(), "{\"session\": 0, \"category\": 0, \"type\": 0, \"payload\": null, \"is_last\": true}"),
      1U)
      << said();
  EXPECT_EQ(countOf(said(), "ValueError: not that one"), 3U) << said();
}

}  // namespace
}  // namespace kyt
