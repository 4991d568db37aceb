// The upload of log data.
#include <thread>

#include "platform/base/Limits.h"
#include "platform/base/Semaphore.h"
#include "platform/objects/KeyedArchive.h"
#include "tests/backends/dashboard/DashboardFixture.h"

namespace kyt {
namespace {

class LogData : public DashboardFixture {
 protected:
  LogData() {
    make(profile({{"post_url", "https://logs.example.org/logdata"}}));
    backend_->setReportingSessionConnectivityDelegate(poster_);
  }
  const Array entries_{Dictionary{{"text", "first"}, {"time", Date{1769860800}}}, "second"};
  std::shared_ptr<AnsweringPoster> poster_ = std::make_shared<AnsweringPoster>();
};

TEST_F(LogData, IsPostedAsOneArchive) {
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  ASSERT_EQ(poster_->requests.size(), 1u);
  const URLRequest& request = poster_->requests[0];
  EXPECT_EQ(request.method, "POST");
  EXPECT_EQ(request.url, "https://logs.example.org/logdata");
  EXPECT_EQ(request.headers,
            (std::vector<std::pair<std::string, std::string>>{{"Content-Type", "application/octet-stream"}}));
  EXPECT_FALSE(request.timeout);
  EXPECT_TRUE(request.isAwaited);
  const auto archived = unarchivedObject(request.body.view());
  ASSERT_TRUE(std::holds_alternative<Value>(archived));
  EXPECT_EQ(std::get<Value>(archived), Value(entries_));
  EXPECT_EQ(platform_.sink.count(LogLevel::normal,
                                 "DashboardBackend(uploadLogData): Log data uploaded to "
                                 "https://logs.example.org/4711"),
            1u);
}

// Records what reaches the numbered operation, whose default the class keeps.
class RecordingDashboard final : public DashboardBackend {
 public:
  static std::shared_ptr<RecordingDashboard> make(TestPlatform& platform, const Dictionary& profile) {
    return std::make_shared<RecordingDashboard>(
        platform.platform, profile, std::get<std::unique_ptr<UDPSocket>>(platform.udpSockets.open()));
  }
  RecordingDashboard(Platform& platform, const Dictionary& profile, std::unique_ptr<UDPSocket> socket)
      : DashboardBackend(Making(), platform, "dashboard", profile, std::make_shared<SessionFacts>(),
                         std::move(socket)) {}
  using DashboardBackend::sendMessage;
  Value sendMessage(Dictionary message, const TimeValue& timestamp, uint16_t method, uint16_t respCode,
                    EventID eventID, MessageFlag flag) override {
    messages.push_back(std::move(message));
    numbers = {timestamp.seconds, timestamp.microseconds,         method,
               respCode,          static_cast<uint16_t>(eventID), static_cast<int>(flag)};
    return {};
  }
  std::vector<Dictionary> messages;
  std::vector<int64_t> numbers;
};

TEST_F(LogData, ReportsItsLocationAsAnEvent) {
  const auto recording =
      RecordingDashboard::make(platform_, profile({{"post_url", "https://logs.example.org"}}));
  recording->setReportingSessionConnectivityDelegate(poster_);
  platform_.clock.setTimeOfDay({1769860801, 250000});
  EXPECT_TRUE(recording->uploadLogData(entries_));
  ASSERT_EQ(recording->messages.size(), 1u);
  EXPECT_EQ(recording->messages[0], (Dictionary{{"LogDataUploadLocation", "https://logs.example.org/4711"}}));
  EXPECT_EQ(recording->numbers, (std::vector<int64_t>{1769860801, 250000, 0, 2, 1, 0}));
  EXPECT_TRUE(recording->uploadLogData(entries_));
  EXPECT_EQ(recording->numbers[4], 2);  // numbered like every event
}

TEST_F(LogData, TheEventOfItsLocationIsNotSent) {
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  platform_.executor.runAll();
  EXPECT_EQ(socket().attempts, 0u);
}

TEST_F(LogData, TheEventOfItsLocationIsOneOfTheDaemonsOwnInTheBooks) {
  backend_->setProgram(std::make_shared<const ReportingProgram>(ReportingProgram{1000, 7, "a", "s"}));
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  const std::vector<BookRow> rows = platform_.books.snapshot();
  ASSERT_EQ(rows.size(), 1u);
  EXPECT_TRUE(rows[0].isInternal);
  EXPECT_EQ(rows[0].taken, 1u);
  EXPECT_EQ(rows[0].droppedFor(Reason::notForThisBackEnd), 1u);
}

TEST_F(LogData, IsRefusedWithoutAnAddress) {
  ASSERT_NE(makeWithoutProfile(String("192.0.2.7"), 1), nullptr);
  backend_->setReportingSessionConnectivityDelegate(poster_);
  EXPECT_FALSE(backend_->uploadLogData(entries_));
  ASSERT_NE(make(profile({{"post_url", 5}})), nullptr);
  EXPECT_FALSE(backend_->uploadLogData(entries_));
  EXPECT_EQ(errors("DashboardBackend(uploadLogData): Post URL for log data array is nil"), 2u);
  EXPECT_TRUE(poster_->requests.empty());
}

TEST_F(LogData, IsRefusedWhenItCannotBeArchived) {
  Value nested = 1;
  for (int depth = 0; depth < Limits::maxObjectDepth; ++depth) nested = Array{nested};
  EXPECT_FALSE(backend_->uploadLogData(nested));
  EXPECT_EQ(errors("DashboardBackend(uploadLogData): Failed to serialize log data array for upload"), 1u);
  EXPECT_TRUE(poster_->requests.empty());
}

// Deliberately a success.
TEST_F(LogData, IsTakenForPostedWhenThePosterIsGone) {
  poster_.reset();
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  EXPECT_TRUE(platform_.sink.lines().empty());
  EXPECT_EQ(platform_.counters.value(Reason::postWithoutPoster), 1u);
}

TEST_F(LogData, FailsWithTheErrorOfTheRequest) {
  poster_->error = Error{kKYTURLErrorDomain, 7, "Could not connect to server"};
  EXPECT_FALSE(backend_->uploadLogData(entries_));
  EXPECT_EQ(
      errors("DashboardBackend(uploadLogData): Error uploading log data array (Could not connect to server)"),
      1u);
  EXPECT_EQ(platform_.sink.lines().size(), 1u);
  EXPECT_EQ(platform_.counters.value(Reason::postFailed), 1u);
}

// Answers with whatever a test wants, one thing beside the other.
class AnyPoster final : public ReportingSessionConnectivityInterface {
 public:
  AnyPoster(std::optional<Data> data, std::optional<Error> error)
      : data_(std::move(data)), error_(std::move(error)) {}
  void postURLRequestWithCompletionHandler(URLRequest, URLCompletion completion) override {
    completion(data_, std::nullopt, error_);
  }

 private:
  const std::optional<Data> data_;
  const std::optional<Error> error_;
};

TEST_F(LogData, FailsWithAnErrorWhateverDataCameWithIt) {
  const auto poster = std::make_shared<AnyPoster>(Data(std::string_view("https://logs")),
                                                  Error{kKYTURLErrorDomain, 18, "cut off"});
  backend_->setReportingSessionConnectivityDelegate(poster);
  EXPECT_FALSE(backend_->uploadLogData(entries_));
  EXPECT_EQ(errors("DashboardBackend(uploadLogData): Error uploading log data array (cut off)"), 1u);
}

TEST_F(LogData, FailsWithoutDataInTheReply) {
  poster_->data.reset();
  EXPECT_FALSE(backend_->uploadLogData(entries_));
  EXPECT_EQ(errors("DashboardBackend(uploadLogData): Error uploading log data array ((null))"), 1u);
}

// The status is not looked at.
TEST_F(LogData, TakesAnyBodyForTheLocation) {
  poster_->status = 500;
  poster_->data = Data(std::string_view("broken"));
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  EXPECT_TRUE(platform_.sink.contains("DashboardBackend(uploadLogData): Log data uploaded to broken"));
  poster_->data = Data();
  EXPECT_TRUE(backend_->uploadLogData(entries_));
}

TEST_F(LogData, TakesABodyThatIsNoTextForNoLocation) {
  const auto recording =
      RecordingDashboard::make(platform_, profile({{"post_url", "https://logs.example.org"}}));
  recording->setReportingSessionConnectivityDelegate(poster_);
  poster_->data = Data(std::string_view("https://logs\xff"));
  EXPECT_TRUE(recording->uploadLogData(entries_));
  EXPECT_TRUE(platform_.sink.contains(LogLevel::normal,
                                      "DashboardBackend(uploadLogData): Log data uploaded to (null)"));
  ASSERT_EQ(recording->messages.size(), 1u);
  EXPECT_EQ(recording->messages[0], (Dictionary{{"LogDataUploadLocation", nullptr}}));
}

class WaitingPoster final : public ReportingSessionConnectivityInterface {
 public:
  void postURLRequestWithCompletionHandler(URLRequest, URLCompletion c) override {
    completion = std::move(c);
    asked.signal();
  }
  URLCompletion completion;
  Semaphore asked;
};

TEST_F(LogData, ItsCallerWaitsUntilTheServerHasAnswered) {
  const auto waiting = std::make_shared<WaitingPoster>();
  backend_->setReportingSessionConnectivityDelegate(waiting);
  std::atomic<int> result{-1};
  std::thread caller([&] { result = backend_->uploadLogData(entries_) ? 1 : 0; });
  waiting->asked.wait();
  EXPECT_EQ(result, -1);
  waiting->completion(Data(std::string_view("there")), URLResponse(), std::nullopt);
  caller.join();
  EXPECT_EQ(result, 1);
}

TEST_F(LogData, ThatLeftIsToldTheOwner) {
  EXPECT_TRUE(backend_->uploadLogData(entries_));
  const auto left = platform_.departures.all();
  ASSERT_EQ(left.size(), 1U);
  EXPECT_EQ(left[0].kind, DepartureKind::logData);
  EXPECT_EQ(left[0].server, "https://logs.example.org");
  EXPECT_EQ(left[0].bytes, poster_->requests[0].body.size());
}

}  // namespace
}  // namespace kyt
