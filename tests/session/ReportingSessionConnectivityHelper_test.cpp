#include "session/ReportingSessionConnectivityHelper.h"

#include <gtest/gtest.h>

#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

URLRequest requestTo(const char* url) {
  URLRequest request;
  request.method = "POST";
  request.url = url;
  return request;
}

TEST(ReportingSessionConnectivityHelper, ChangesTwoSettingsOfTheDefaultConfiguration) {
  const URLSessionConfiguration configuration = ReportingSessionConnectivityHelper::privateURLSessionConfig();
  EXPECT_EQ(configuration.sourceApplication, "com.vantu.system.diagnostics");
  EXPECT_TRUE(configuration.waitsForConnectivity);
}

TEST(ReportingSessionConnectivityHelper, ForwardsTheReplyUnchanged) {
  TestPlatform test;
  const auto helper = ReportingSessionConnectivityHelper::init(test.urlSessions);
  int status = 0;
  std::string body;
  helper->postURLRequestWithCompletionHandler(
      requestTo("https://h/p"),
      [&](std::optional<Data> data, std::optional<URLResponse> response, std::optional<Error> error) {
        EXPECT_FALSE(error);
        status = response->status;
        body = std::string(data->view());
      });
  EXPECT_EQ(test.urlSessions.lastRequest().url, "https://h/p");
  EXPECT_TRUE(test.urlSessions.complete(0, 500, {}, "text"));
  EXPECT_EQ(status, 500);
  EXPECT_EQ(body, "text");
}

TEST(ReportingSessionConnectivityHelper, ForwardsAnError) {
  TestPlatform test;
  const auto helper = ReportingSessionConnectivityHelper::init(test.urlSessions);
  std::optional<Error> seen;
  helper->postURLRequestWithCompletionHandler(
      requestTo("https://h/p"),
      [&](std::optional<Data>, std::optional<URLResponse>, std::optional<Error> error) { seen = error; });
  const Error failure{kKYTURLErrorDomain, 7, "refused"};
  EXPECT_TRUE(test.urlSessions.fail(0, failure));
  EXPECT_EQ(seen, failure);
}

TEST(ReportingSessionConnectivityHelper, SendsWithoutACompletion) {
  TestPlatform test;
  const auto helper = ReportingSessionConnectivityHelper::init(test.urlSessions);
  helper->postURLRequestWithCompletionHandler(requestTo("https://h/p"), nullptr);
  EXPECT_EQ(test.urlSessions.requestCount(), 1U);
  EXPECT_TRUE(test.urlSessions.complete(0, 200));
}

TEST(ReportingSessionConnectivityHelper, CompletesRequestsThatWereStartedBeforeItWasReleased) {
  TestPlatform test;
  auto helper = ReportingSessionConnectivityHelper::init(test.urlSessions);
  bool completed = false;
  helper->postURLRequestWithCompletionHandler(
      requestTo("https://h/p"),
      [&](std::optional<Data>, std::optional<URLResponse>, std::optional<Error>) { completed = true; });
  helper.reset();
  EXPECT_EQ(test.urlSessions.sessionsInvalidated(), 1U);
  EXPECT_TRUE(test.urlSessions.complete(0, 200));
  EXPECT_TRUE(completed);
}

}  // namespace
}  // namespace kyt
