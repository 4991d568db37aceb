// Flush, file uploads and log data: who is asked, and how the answers combine.
#include <atomic>
#include <thread>

#include "session/FileURL.h"
#include "session/FlushFanIn.h"
#include "tests/session/SessionFixture.h"

namespace kyt {
namespace {

class SessionFlush : public SessionFixture {
 protected:
  void configureHolding(std::initializer_list<const char*> names) {
    factory_.prepare = [](RecordingBackend& made) { made.holdsFlushes = true; };
    configure(names);
  }
  void flush() {
    client_.session->flushMessagesWithCompletion([this](Value result, std::optional<Error> error) {
      ++answers_;
      result_ = std::move(result);
      error_ = std::move(error);
    });
  }
  void finish(const char* name, Value result, std::optional<Error> error = std::nullopt) {
    FlushCompletion completion = std::move(backend(name).flushes.at(0));
    completion(std::move(result), std::move(error));
  }
  int answers_ = 0;
  Value result_;
  std::optional<Error> error_;
};

TEST_F(SessionFlush, OfASessionThatWasNeverConfiguredIsAnError) {
  flush();
  EXPECT_EQ(answers_, 1);
  EXPECT_TRUE(result_.isNull());
  EXPECT_EQ(error_, (Error{"KYTReportingErrorDomain", -1, "No backends available to send message"}));
  EXPECT_TRUE(logged(LogLevel::debug, "flushMessagesWithCompletion: Flushing messages for session 0"));
  EXPECT_TRUE(
      logged(LogLevel::debug, "internalFlushMessagesWithCompletion: No backends available to send message"));
  client_.session->flushMessagesWithCompletion(nullptr);
}

TEST_F(SessionFlush, AnswersWithTheResultOfTheLastToFinish) {
  configureHolding({"httppost", "dashboard", "qdx"});
  flush();
  finish("qdx", "third");
  finish("httppost", "first");
  EXPECT_EQ(answers_, 0);
  finish("dashboard", "second");
  EXPECT_EQ(answers_, 1);
  EXPECT_EQ(result_, Value("second"));
  EXPECT_FALSE(error_);
  EXPECT_EQ(messageLog_.lines(),
            (std::vector<std::string>{"[qdx -> flushMessages] third", "[httppost -> flushMessages] first",
                                      "[dashboard -> flushMessages] second"}));
  EXPECT_TRUE(logged(LogLevel::debug, "internalFlushMessagesWithCompletion: dashboard"));
}

TEST_F(SessionFlush, WantsTextsForAClientThatWaitsAndOtherwiseAsTheMessageLogDoes) {
  configure({"httppost"});
  backend("httppost").answer = Value("text");
  backend("httppost").answersIfWanted = 100;
  messageLog_.setFull(true);
  flush();
  EXPECT_EQ(result_, Value("text"));
  EXPECT_TRUE(messageLog_.asked().empty());
  EXPECT_EQ(messageLog_.lines().size(), 1U);
  client_.session->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(messageLog_.lines().size(), 1U);
  EXPECT_EQ(messageLog_.asked(), std::vector<size_t>{100});
  messageLog_.setFull(false);
  client_.session->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(messageLog_.lines().size(), 2U);
}

TEST_F(SessionFlush, AnswersAtOnceWithTheFirstError) {
  configureHolding({"httppost", "dashboard", "qdx"});
  flush();
  const Error failure{kKYTReportingErrorDomain, 500, "server"};
  finish("dashboard", nullptr, failure);
  EXPECT_EQ(answers_, 1);
  EXPECT_EQ(error_, failure);
  finish("httppost", "late", Error{kKYTReportingErrorDomain, 501, "later"});
  finish("qdx", "last");
  EXPECT_EQ(answers_, 1);
  EXPECT_EQ(messageLog_.lines(),
            (std::vector<std::string>{"[httppost -> flushMessages] late", "[qdx -> flushMessages] last"}));
}

TEST_F(SessionFlush, AnswersOfBackEndsWithNothingToSayAreNotLogged) {
  configure({"httppost", "dashboard"});
  flush();
  EXPECT_EQ(answers_, 1);
  EXPECT_TRUE(result_.isNull());
  EXPECT_FALSE(error_);
  EXPECT_TRUE(messageLog_.lines().empty());
}

TEST_F(SessionFlush, WithoutACompletionStillAsksTheBackEnds) {
  configure({"httppost"});
  client_.session->flushMessagesWithCompletion(nullptr);
  EXPECT_EQ(backend("httppost").flushCount, 1);
}

TEST_F(SessionFlush, IsLoggedByTheBackEndsNameAndItsResultByTheKey) {
  auto fanIn = std::make_shared<FlushFanIn>(class_, 7, nullptr, 1);
  fanIn->backendFinished("key", "name", "result", std::nullopt);
  EXPECT_TRUE(logged(LogLevel::debug, "internalFlushMessagesWithCompletion: name"));
  EXPECT_EQ(messageLog_.lines(), std::vector<std::string>{"[key -> flushMessages] result"});
  EXPECT_EQ(messageLog_.users(), std::vector<uint32_t>{7});
}

TEST_F(SessionFlush, RacingAnswersCallTheCompletionOnce) {
  for (int round = 0; round < 50; ++round) {
    constexpr int kBackends = 4;
    std::atomic<int> answers{0};
    auto fanIn = std::make_shared<FlushFanIn>(
        class_, 7, [&answers](Value, std::optional<Error>) { ++answers; }, kBackends);
    std::vector<std::jthread> threads;
    for (int i = 0; i < kBackends; ++i) {
      threads.emplace_back([fanIn, i, round] {
        std::optional<Error> error;
        if (round % 2 == 1 && i % 2 == 1) error = Error{"d", i, "failed"};
        fanIn->backendFinished("key", "name", i, error);
      });
    }
    threads.clear();
    ASSERT_EQ(answers, 1);
  }
}

class SessionUpload : public SessionFixture {
 protected:
  bool upload(const std::string& url) {
    std::optional<bool> success;
    client_.session->uploadFileAtPath(url, "token", std::nullopt, [&](bool s) { success = s; });
    EXPECT_TRUE(success.has_value());
    return success.value_or(false);
  }
  bool uploadLogs(Value data) {
    std::optional<bool> success;
    client_.session->uploadLogData(std::move(data), [&](bool s, std::optional<Error> error) {
      success = s;
      EXPECT_FALSE(error);
    });
    EXPECT_TRUE(success.has_value());
    return success.value_or(false);
  }
};

TEST_F(SessionUpload, SucceedsWhenOneBackEndAcceptsAndAsksAll) {
  configure({"uploadserver", "httppost"});
  backend("uploadserver").acceptsFiles = true;
  EXPECT_TRUE(upload("file:///tmp/a%20b.log"));
  EXPECT_EQ(backend("uploadserver").uploadedPaths, std::vector<std::string>{"/tmp/a b.log"});
  EXPECT_EQ(backend("httppost").uploadedPaths, std::vector<std::string>{"/tmp/a b.log"});
  EXPECT_EQ(backend("httppost").tokens, std::vector<std::string>{"token"});
  EXPECT_TRUE(logged(LogLevel::debug, "uploadFileAtPath: Uploading file for session 42"));
  EXPECT_TRUE(logged(LogLevel::debug, "uploadFileWithURL: File upload successful for /tmp/a b.log"));
  EXPECT_EQ(messageLog_.lines(),
            std::vector<std::string>{"[uploadFileWithURL] Upload succeeded for file file:///tmp/a%20b.log"});
}

TEST_F(SessionUpload, AClientsAddressCannotBeginALineOfTheMessageLog) {
  configure({"httppost"});
  EXPECT_FALSE(upload("file:///tmp/a\n(2026-01-31 12:00:00 +0000) forged"));
  EXPECT_EQ(
      messageLog_.lines(),
      std::vector<std::string>{
          "[uploadFileWithURL] Upload failed for file file:///tmp/a\\n(2026-01-31 12:00:00 +0000) forged"});
}

TEST_F(SessionUpload, AnAddressTooLongForAnyFileIsAskedOfNobodyAndIsCutInTheMessageLog) {
  configure({"uploadserver"});
  backend("uploadserver").acceptsFiles = true;
  const std::string longest = "/" + std::string(4094, 'x');
  EXPECT_TRUE(upload("file://" + longest));
  EXPECT_FALSE(upload("file://" + longest + "y"));
  EXPECT_FALSE(upload("file:///" + std::string(900000, 'x')));
  EXPECT_EQ(backend("uploadserver").uploadedPaths, std::vector<std::string>{longest});
  ASSERT_EQ(messageLog_.lines().size(), 3u);
  EXPECT_EQ(messageLog_.lines()[2],
            "[uploadFileWithURL] Upload failed for file file:///" + std::string(12280, 'x') + " (cut)");
  EXPECT_EQ(messageLog_.users(), std::vector<uint32_t>(3, 1000)) << "whose connection it is";
}

TEST_F(SessionUpload, AnAddressIsCutInTheMessageLogOnceItIsEscapedAndNotWithinACharacter) {
  configure({"uploadserver"});
  const auto times = [](size_t count, const std::string& text) {
    std::string all;
    for (size_t i = 0; i < count; ++i) all += text;
    return all;
  };
  EXPECT_FALSE(upload("file:///" + times(5000, "\x01")));
  EXPECT_FALSE(upload("file:///a" + times(7000, "\u00e4")));
  const std::string failed = "[uploadFileWithURL] Upload failed for file file:///";
  ASSERT_EQ(messageLog_.lines().size(), 2u);
  EXPECT_EQ(messageLog_.lines()[0], failed + times(3070, "\\x01") + " (cut)");
  EXPECT_EQ(messageLog_.lines()[1], failed + "a" + times(6139, "\u00e4") + " (cut)");
}

TEST_F(SessionUpload, FailsWhenNobodyAccepts) {
  configure({"httppost"});
  EXPECT_FALSE(upload("file:///tmp/a.log"));
  EXPECT_TRUE(logged(LogLevel::error, "uploadFileWithURL: File upload failed for /tmp/a.log"));
  EXPECT_EQ(messageLog_.lines(),
            std::vector<std::string>{"[uploadFileWithURL] Upload failed for file file:///tmp/a.log"});
}

TEST_F(SessionUpload, FailsWithoutBackEnds) {
  EXPECT_FALSE(upload("file:///tmp/a.log"));
  EXPECT_FALSE(uploadLogs(Array{"x"}));
  EXPECT_TRUE(logged(LogLevel::error, "uploadLogData: Log data array upload failed"));
}

TEST_F(SessionUpload, AsksNobodyForAURLThatNamesNoFile) {
  configure({"uploadserver"});
  backend("uploadserver").acceptsFiles = true;
  EXPECT_FALSE(upload("https://example.org/a"));
  EXPECT_TRUE(backend("uploadserver").uploadedPaths.empty());
  EXPECT_TRUE(logged(LogLevel::error, "uploadFileWithURL: File upload failed for (null)"));
}

TEST_F(SessionUpload, LogDataGoesToAllAndOneSuffices) {
  configure({"dashboard", "httppost"});
  backend("dashboard").acceptsLogData = true;
  EXPECT_TRUE(uploadLogs(Array{"x"}));
  EXPECT_EQ(backend("httppost").logData, std::vector<Value>{Value(Array{"x"})});
  EXPECT_TRUE(logged(LogLevel::debug, "uploadLogData: Log data array upload successful"));
  backend("dashboard").acceptsLogData = false;
  EXPECT_FALSE(uploadLogs(Array{"x"}));
  EXPECT_TRUE(logged(LogLevel::error, "uploadLogData: Log data array upload failed"));
}

TEST(FileURL, GivesThePathOfAFileURLOnly) {
  EXPECT_EQ(pathOfFileURL("file:///a/b"), String("/a/b"));
  EXPECT_EQ(pathOfFileURL("file://localhost/a%2Fb%c3%A9"), String("/a/b\xc3\xa9"));
  EXPECT_EQ(pathOfFileURL("file:///a?query#part"), String("/a"));
  for (const char* url :
       {"", "/a/b", "file:a", "file://host/a", "http:///a", "file:///a%2", "file:///a%zz", "file:///a%00b"})
    EXPECT_FALSE(pathOfFileURL(url)) << url;
}

}  // namespace
}  // namespace kyt
