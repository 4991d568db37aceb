// kytsource-resources in front of a real daemon and a server.
#include "kytreporting/FakeDaemon.h"
#include "tests/sources/EventsFile.h"
#include "tests/sources/SourceFixture.h"

namespace kyt {
namespace {

class ResourcesSource : public SourceOnAStage {
 protected:
  void start(const std::string& socket, const char* patience = "30") {
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "output";
    program_ = tools::ChildProcess::start(std::string(KYT_PROGRAMS) + "/kytsource-resources",
                                          {"--period", "2", "--interval", "1", "--state", folder_ / "state",
                                           "--patience", patience, "--socket", socket},
                                          how);
    ASSERT_TRUE(program_);
  }
  TemporaryFolder folder_;
  std::optional<tools::ChildProcess> program_;
};

TEST_F(ResourcesSource, ReportsOneEventForAPeriodWithTheFieldsThatItsEventsFileNames) {
  lay("resources", "lurra");
  start(stage_->socketPath());
  ASSERT_GE(arrived(304, 2).size(), 2U) << folder_.read("output");
  program_->signal(SIGTERM);
  EXPECT_EQ(program_->wait(std::chrono::seconds(60)), 0);
  EXPECT_EQ(folder_.read("output"), "");
  const FieldNames declared = declaredFields("resources", 304, 1);
  EXPECT_FALSE(declared.contains("personal!"));
  std::set<int> numbers;
  for (const Dictionary& event : arrived(304, 3)) {
    const Dictionary& record = *event.dictionary("record");
    numbers.insert(record.integer("report"));
    EXPECT_TRUE(record.contains("memoryMean"));
    for (const std::string& name : fieldsOf(record))
      if (name.ends_with("Min") || name.ends_with("Mean") || name.ends_with("Max")) {
        EXPECT_TRUE(declared.contains(name)) << name;
      }
  }
  // One of the end, of what the last period had by then.
  EXPECT_GE(numbers.size(), 3U);
  EXPECT_EQ(*numbers.rbegin() - *numbers.begin() + 1, static_cast<int>(numbers.size())) << "without a gap";
  EXPECT_EQ(*numbers.begin() % 86400, 0) << "the day's";
}

TEST_F(ResourcesSource, TriesAReportAgainAsItWasThatADaemonGotAndDidNotAnswer) {
  const auto messages = [](const testing::FakeDaemon& daemon) {
    return daemon.events(testing::Kind::message);
  };
  const auto listen = [this](uint64_t dieAfter) {
    testing::FakeDaemon::Options options;
    options.socketPath = folder_ / "socket";
    options.dieAfter = dieAfter;
    auto made = std::make_unique<testing::FakeDaemon>(std::move(options));
    EXPECT_EQ(made->start(), std::nullopt);
    return made;
  };
  auto daemon = listen(1);
  start(folder_ / "socket", "5");
  ASSERT_TRUE(tools::waitUntil(std::chrono::seconds(60), [&] { return messages(*daemon).size() == 1; }))
      << folder_.read("output");
  const auto first = messages(*daemon).front().payload;
  daemon.reset();
  daemon = listen(0);
  ASSERT_TRUE(tools::waitUntil(std::chrono::seconds(60), [&] { return messages(*daemon).size() >= 3; }))
      << folder_.read("output");
  program_->signal(SIGTERM);
  EXPECT_EQ(program_->wait(std::chrono::seconds(60)), 0);
  EXPECT_EQ(messages(*daemon)[0].payload, first);
  EXPECT_EQ(messages(*daemon)[1].payload.integer("report"), first.integer("report") + 1);
  EXPECT_EQ(first.integer("waits"), 0);
  EXPECT_GE(messages(*daemon)[1].payload.integer("waits"), 1) << "the first was not taken at once";
  EXPECT_EQ(messages(*daemon)[2].payload.integer("waits"), 0) << "told by the one before";
}

TEST_F(ResourcesSource, GoesOnSummingUpWhereThereIsNoDaemon) {
  start(folder_ / "none", "1");
  ASSERT_TRUE(tools::waitUntil(std::chrono::seconds(60), [&] { return !folder_.read("output").empty(); }));
  program_->signal(SIGTERM);
  EXPECT_EQ(program_->wait(std::chrono::seconds(90)), 0);
  EXPECT_EQ(folder_.read("output"), "kytsource-resources: the summary waits: " + (folder_ / "none") +
                                        ": No such file or directory\n");
}

}  // namespace
}  // namespace kyt
