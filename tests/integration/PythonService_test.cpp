// A service in Python, on the real chain.
#include <gtest/gtest.h>
#include <signal.h>

#include <algorithm>
#include <map>
#include <sstream>
#include <vector>

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
  // What each of its processes printed, by its number.
  [[nodiscard]] std::map<long, Dictionary> books() const {
    std::map<long, Dictionary> read;
    std::istringstream lines(said());
    RapidJSON json;
    for (std::string line; std::getline(lines, line);) {
      auto parsed = json.parse(line);
      const Dictionary* book =
          std::holds_alternative<Value>(parsed) ? std::get<Value>(parsed).dictionary() : nullptr;
      EXPECT_NE(book, nullptr) << line;
      if (book != nullptr) read.emplace(book->integer("process"), *book);
    }
    return read;
  }
  // The numbers of the messages that the server has of each process, in the order of their coming.
  [[nodiscard]] std::map<long, std::vector<long>> numbersAtTheServer() const {
    std::map<long, std::vector<long>> numbers;
    for (int64_t last = 0, before = -1; last != before;) {
      before = last;
      const Value page =
          stage_->query("/api/events?limit=10000&client=service&method=10&since=" + std::to_string(last));
      const Dictionary* answer = page.dictionary();
      const Array* events = answer != nullptr ? answer->array("events") : nullptr;
      if (events == nullptr) continue;
      for (const Value& event : *events) {
        last = event.dictionary()->integer("id");
        const Dictionary* record = event.dictionary()->dictionary("record");
        if (record != nullptr) numbers[record->integer("process")].push_back(record->integer("number"));
      }
    }
    return numbers;
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

  // What it holds has left, so nothing arrives while that is counted.
  ASSERT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog();

  // One that ends while it fetches a storebag has no back end for what it took: what is missing at the server is compared
  // with a daemon that keeps everything, in bindings/python/tests/test_books.py.
  EXPECT_TRUE(arrive("client=service&method=10", 1)) << daemonLog();
  const std::map<long, Dictionary> all = books();
  EXPECT_EQ(all.size(), 21U);
  std::map<long, std::vector<long>> arrivals = numbersAtTheServer();
  long taken = 0;
  long counted = 0;
  for (const auto& [process, book] : all) {
    const auto figure = [&book = book](const char* key) { return static_cast<long>(book.integer(key)); };
    std::vector<long>& numbers = arrivals[process];
    counted += static_cast<long>(numbers.size());
    taken += figure("taken");
    EXPECT_EQ(figure("accepted"), figure("taken")) << description(book);
    EXPECT_EQ(figure("accepted"), figure("sent") + figure("queued") + figure("lost_on_connection_end") +
                                      figure("lost_in_queue") + figure("dropped_unsendable") +
                                      figure("dropped_too_late"))
        << description(book);
    EXPECT_EQ(figure("queued"), 0) << description(book);
    EXPECT_LE(static_cast<long>(numbers.size()), figure("sent") + figure("lost_on_connection_end"));
    std::ranges::sort(numbers);
    EXPECT_EQ(std::ranges::adjacent_find(numbers), numbers.end())
        << "one came twice of " << description(book);
    EXPECT_TRUE(numbers.empty() || numbers.back() < figure("taken")) << description(book);
  }
  EXPECT_EQ(counted, arrived("client=service&method=10")) << "of processes that said nothing";
  EXPECT_GE(taken, 20 * 50 + 50);
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
