// The page: its policy, and in a real browser that it shows what was posted and runs nothing of it.
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/socket.h>
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
  EXPECT_NE(page.find("yet. Posts to /events appear here at once.</p>"), std::string::npos);
  EXPECT_NE(page.find("No device has fetched a storebag yet.</p>"), std::string::npos);
  EXPECT_NE(page.find("No datagram has arrived yet.</p>"), std::string::npos);
  EXPECT_NE(page.find("No log data has arrived yet.</p>"), std::string::npos);
}

// What came by the other roads, with markup and marks that turn text round wherever a sender can put them.
class PageOfAllRoads : public testing::Test {
 protected:
  PageOfAllRoads() : server_(state_.path(), {"--udp-port", "0", "--http-events"}) {}
  void SetUp() override {
    if (access("/usr/bin/chromium", X_OK) != 0) GTEST_SKIP() << "chromium is not installed";
    ASSERT_TRUE(server_.isReady()) << server_.errors();
  }
  [[nodiscard]] bool arrived(const std::string& what) const {
    return server_.get("/api/wait?timeout=30&" + what)["reached"].GetBool();
  }
  [[nodiscard]] std::string page(const std::string& place = {}) const {
    return renderedBy("/usr/bin/chromium",
                      "http://127.0.0.1:" + std::to_string(server_.httpPort()) + "/?snapshot" + place);
  }
  void sendDatagram(const std::string& bytes) const {
    const int socket = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    sockaddr_in to{};
    to.sin_family = AF_INET;
    to.sin_port = htons(server_.udpPort());
    to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    EXPECT_EQ(
        sendto(socket, bytes.data(), bytes.size(), 0, reinterpret_cast<const sockaddr*>(&to), sizeof to),
        static_cast<ssize_t>(bytes.size()));
    close(socket);
  }
  // Version 8, client type 6, at 5.120 s, session 77, client version 3, method 21, response code 22, event 23.
  static std::string datagram(const std::string& device, const std::string& text) {
    const auto length = static_cast<uint16_t>(~(64 + text.size()));
    std::string bytes("\x08\x06\x01\x1e\x00\x00\x00\x05\xff\xff\xff\xb2\xff\xfc", 14);
    bytes += {static_cast<char>(length >> 8), static_cast<char>(length), 0, 21, 0, 22};
    bytes += device + std::string(40 - device.size(), '\0');
    return bytes + std::string("\x00\x17\x00\x00", 4) + text;
  }

  TemporaryFolder state_;
  ServerProcess server_;
};

TEST_F(PageOfAllRoads, ShowsDatagramsAsText) {
  sendDatagram(datagram("<b>device</b>", " k=<img src=x onerror=document.title='owned'> turned=\u202e"));
  sendDatagram("short");
  ASSERT_TRUE(arrived("lines=2"));
  const std::string shown = page();
  EXPECT_NE(shown.find("id=\"total-lines\">2</dd>"), std::string::npos) << shown.substr(0, 1000);
  EXPECT_NE(shown.find("<title>kytdevserver</title>"), std::string::npos);
  EXPECT_NE(shown.find("&lt;b&gt;device&lt;/b&gt;</td>"), std::string::npos);
  for (const char* cell : {">21</td>", ">22</td>", ">77</td>", ">23</td>", ">not asked for</td>"})
    EXPECT_NE(shown.find(cell), std::string::npos) << cell;
  EXPECT_NE(shown.find("k=&lt;img src=x onerror=document.title='owned'&gt; turned=\\u202e</td>"),
            std::string::npos);
  EXPECT_EQ(shown.find("<img"), std::string::npos);
  EXPECT_NE(shown.find("it has 5 bytes, fewer than a header</span>"), std::string::npos);
}

TEST_F(PageOfAllRoads, ShowsLogDataAsTextAndAVeryLongOneCut) {
  ASSERT_EQ(server_.post("/logdata", "\x81\x78\x21<script>document.title=2</script>").status, 200);
  ASSERT_EQ(server_.post("/logdata", "\x81\xff").status, 400);
  ASSERT_EQ(
      server_.post("/logdata", std::string("\x81\x7a\x00\x10\x00\x00", 6) + std::string(1 << 20, 'z')).status,
      200);
  ASSERT_TRUE(arrived("logs=3"));
  const std::string shown = page();
  EXPECT_NE(shown.find("id=\"total-logs\">3</dd>"), std::string::npos) << shown.substr(0, 1000);
  EXPECT_NE(shown.find("<title>kytdevserver</title>"), std::string::npos);
  EXPECT_NE(shown.find("[\"&lt;script&gt;document.title=2&lt;/script&gt;\"]</td>"), std::string::npos);
  EXPECT_NE(shown.find("/logdata/"), std::string::npos) << "its location";
  EXPECT_NE(shown.find("the archive is malformed at byte 1: "), std::string::npos);
  EXPECT_NE(shown.find("zzz…</td>"), std::string::npos);
  EXPECT_LT(shown.size(), 200000u);
}

TEST_F(PageOfAllRoads, ShowsUploadsAsText) {
  const auto upload = [&](const std::string& name) {
    return server_
        .post("/upload?uuid=device&sequence=7&filename=" + name, gzip("contents"), {"Content-Encoding: gzip"})
        .status;
  };
  ASSERT_EQ(upload("report.log.gz"), 200);
  ASSERT_EQ(upload("%3Cimg%20src=x%3E%E2%80%AE.gz"), 200);
  ASSERT_EQ(upload("..%2Fevil.gz"), 400);
  ASSERT_TRUE(arrived("posts=3"));
  const std::string shown = page("#post=2");
  EXPECT_NE(shown.find("id=\"total-posts\">3</dd>"), std::string::npos) << shown.substr(0, 1000);
  EXPECT_NE(shown.find(">report.log.gz</td>"), std::string::npos);
  EXPECT_NE(shown.find("&lt;img src=x&gt;\\u202e.gz</td>"), std::string::npos);
  EXPECT_NE(shown.find(">upload</td>"), std::string::npos);
  EXPECT_NE(shown.find("\"filename\" is missing or names no file</span>"), std::string::npos);
  EXPECT_NE(shown.find("contents</pre>"), std::string::npos) << "the post that is open";
  EXPECT_EQ(shown.find("<img"), std::string::npos);
}

}  // namespace
}  // namespace kyt::devserver::test
