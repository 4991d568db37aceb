// The page: its policy, and in a real browser that it shows what was posted and runs nothing of it.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

// What the browser makes of the page, or nothing when there is no browser.
std::string renderedBy(const std::string& browser, const std::string& url) {
  TemporaryFolder profile;
  const std::string command = "timeout 90 " + browser +
                              " --headless --no-sandbox --disable-gpu --disable-quic --no-first-run "
                              "--disable-background-networking --disable-component-update --disable-sync "
                              "--disable-dev-shm-usage --user-data-dir=" +
                              profile.path().string() + " --virtual-time-budget=10000 --dump-dom '" + url +
                              "' 2>/dev/null";
  std::string text;
  FILE* output = popen(command.c_str(), "r");
  char block[4096];
  size_t count = 0;
  while (output != nullptr && (count = fread(block, 1, sizeof block, output)) > 0) text.append(block, count);
  if (output != nullptr) pclose(output);
  return text;
}

class PageTest : public testing::Test {
 protected:
  PageTest() : server_(state_.path()) {}
  void SetUp() override { ASSERT_TRUE(server_.isReady()) << server_.errors(); }
  TemporaryFolder state_;
  ServerProcess server_;
};

TEST_F(PageTest, RunsNothingButItsOwnScript) {
  const Response page = server_.http("/");
  EXPECT_EQ(page.status, 200);
  EXPECT_EQ(page.header("content-type"), "text/html; charset=utf-8");
  const std::string policy = page.header("content-security-policy");
  EXPECT_TRUE(policy.starts_with("default-src 'none'; script-src 'sha256-")) << policy;
  EXPECT_EQ(policy.find("unsafe"), std::string::npos) << policy;
  EXPECT_NE(policy.find("frame-ancestors 'none'"), std::string::npos) << policy;
  EXPECT_EQ(page.body.find("innerHTML"), std::string::npos);
  EXPECT_EQ(page.body.find("src=\"http"), std::string::npos);
}

TEST_F(PageTest, ShowsAPostedEventInABrowser) {
  if (access("/usr/bin/chromium", X_OK) != 0) GTEST_SKIP() << "chromium is not installed";
  const std::string evil = "<img src=x onerror=document.title='owned'>";
  ASSERT_EQ(
      server_
          .post("/events", message(R"({"_method":4711,"text":")" + evil + R"(","bell":"ding\u0007\u202e"})"),
                {"X-KYT-Client-Name: <b>camera</b>"})
          .status,
      200);
  const std::string url = "http://127.0.0.1:" + std::to_string(server_.httpPort()) + "/?snapshot#post=1";
  const std::string page = renderedBy("/usr/bin/chromium", url);
  ASSERT_NE(page.find("</html>"), std::string::npos) << "the browser gave: " << page.substr(0, 1000);
  EXPECT_NE(page.find("<title>kytdevserver</title>"), std::string::npos);
  EXPECT_NE(page.find("id=\"total-events\">1</dd>"), std::string::npos);
  EXPECT_NE(page.find("&lt;b&gt;camera&lt;/b&gt;"), std::string::npos);
  EXPECT_NE(page.find(">4711</td>"), std::string::npos);
  EXPECT_NE(page.find("ding\\u0007\\u202e"), std::string::npos);
  EXPECT_NE(page.find("&lt;img src=x"), std::string::npos);
  EXPECT_EQ(page.find("<img"), std::string::npos);
  EXPECT_NE(page.find("<dt>X-KYT-Client-Name</dt>"), std::string::npos);
}

TEST_F(PageTest, SaysSoWhenThereIsNothingYet) {
  if (access("/usr/bin/chromium", X_OK) != 0) GTEST_SKIP() << "chromium is not installed";
  const std::string page = renderedBy(
      "/usr/bin/chromium", "http://127.0.0.1:" + std::to_string(server_.httpPort()) + "/?snapshot");
  EXPECT_NE(page.find("No event has arrived yet."), std::string::npos);
  EXPECT_NE(page.find("No device has fetched a storebag yet."), std::string::npos);
}

}  // namespace
}  // namespace kyt::devserver::test
