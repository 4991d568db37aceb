// kytctl storebag publish, diff and probe, and kytctl ring, as people run them: bags on their way to devices.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <chrono>
#include <ctime>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/integration/Nginx.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/support/TestHTTPServer.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

const std::string kBag =
    "version = \"1\"\n[[release.httppost.clients]]\nclient = \"person\"\nlocale_whitelist = [\"DE\"]\n"
    "filters = []\nsampling_threshold = 0.1\nevent_threshold = 49\npost_url = \"https://x.example.org/e\"\n";

bool has(const std::string& text, const std::string& part) {
  return text.find(part) != std::string::npos;
}

std::string replaced(std::string text, const std::string& what, const std::string& by) {
  const size_t at = text.find(what);
  return at == std::string::npos ? "" : text.replace(at, what.size(), by);
}

class KytctlRollOut : public ::testing::Test {
 protected:
  [[nodiscard]] ProgramRun run(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"--root", folder_.path()});
    return runProgram(KYT_PROGRAMS "/kytctl", arguments);
  }
  void SetUp() override {
    std::filesystem::create_directories(folder_ / "var/lib/kytreportingd/defaults");
    std::filesystem::create_directories(folder_ / "www");
    ASSERT_EQ(run({"keys", "make", folder_ / "keys"}).status, 0);
  }
  [[nodiscard]] ProgramRun publish(const std::string& bag, std::vector<std::string> further = {}) const {
    further.insert(further.begin(), {"storebag", "publish", folder_.write("dulvek.toml", bag), "--key",
                                     folder_ / "keys/private.pem", "--to", folder_ / "www"});
    return run(std::move(further));
  }
  [[nodiscard]] std::string published(const std::string& document = "www/dulvek") const {
    return run({"storebag", "show", folder_ / document}).text;
  }
  [[nodiscard]] std::string serial(const std::string& document = "www/dulvek") const {
    const std::string text = published(document);
    const size_t at = text.find("\"serial\": ");
    return at == std::string::npos ? "none" : text.substr(at + 10, text.find_first_of(",\n", at) - at - 10);
  }

  TemporaryFolder folder_;
};

TEST_F(KytctlRollOut, PublishesASignedBagWithASerialThatGrows) {
  const ProgramRun first = publish(kBag);
  EXPECT_EQ(first.status, 0) << first.text;
  EXPECT_EQ(
      run({"storebag", "verify", folder_ / "www/dulvek", "--public-key", folder_ / "keys/publicKey.der"})
          .status,
      0);
  const long before = std::stol(serial());
  EXPECT_NEAR(before, std::time(nullptr), 60);
  EXPECT_TRUE(has(first.text, "version 1, serial " + std::to_string(before))) << first.text;
  const ProgramRun second = publish(kBag);
  EXPECT_EQ(second.status, 0) << second.text;
  EXPECT_GT(std::stol(serial()), before);
  EXPECT_TRUE(has(second.text, "the one before: " + (folder_ / "www/.published/dulvek.2"))) << second.text;
}

TEST_F(KytctlRollOut, PublishesNoBagThatDevicesWouldRefuse) {
  EXPECT_EQ(publish("serial = 5\n" + kBag).status, 0);
  EXPECT_EQ(serial(), "5");
  const ProgramRun same = publish("serial = 5\n" + kBag);
  EXPECT_EQ(same.status, 1);
  EXPECT_TRUE(has(same.text, "the bag's serial is 5, what is published has 5")) << same.text;
  EXPECT_EQ(publish(kBag, {"--serial", "4"}).status, 1);
  EXPECT_EQ(publish(kBag, {"--serial", "6", "--expires-in-days", "30", "--name", "dulvek"}).status, 0);
  EXPECT_EQ(serial(), "6");
  EXPECT_TRUE(has(published(), "\"expires\": ")) << published();
  EXPECT_EQ(publish("serial = \"x\"\n" + kBag).status, 1);
  EXPECT_EQ(publish(kBag, {"--name", "../elsewhere"}).status, 1);
  EXPECT_EQ(publish("[release]\n").status, 1) << "without a version";
}

TEST_F(KytctlRollOut, SignsWithBothDigests) {
  const std::string bag = folder_.write("bag.toml", kBag), document = folder_ / "document";
  ASSERT_EQ(
      run({"storebag", "sign", bag, "--key", folder_ / "keys/private.pem", "--serial", "3", "-o", document})
          .status,
      0);
  EXPECT_TRUE(has(folder_.read("document"), "signature256"));
  EXPECT_EQ(run({"storebag", "verify", document, "--public-key", folder_ / "keys/publicKey.der"}).status, 0);
  // A second signature that is none.
  std::string text = folder_.read("document");
  const size_t at = text.find("<string>", text.find("signature256")) + 20;
  text.replace(at, 4, text.substr(at, 4) == "AAAA" ? "BBBB" : "AAAA");
  const ProgramRun wrong = run(
      {"storebag", "verify", folder_.write("wrong", text), "--public-key", folder_ / "keys/publicKey.der"});
  EXPECT_EQ(wrong.status, 1);
  EXPECT_TRUE(has(wrong.text, "the signature over SHA-256 does not match")) << wrong.text;
}

TEST_F(KytctlRollOut, TellsTheDifferenceOfSignedAndUnsignedBags) {
  ASSERT_EQ(publish("serial = 1\n" + kBag).status, 0);
  const std::string next = folder_.write("next.toml", replaced("serial = 1\n" + kBag, "0.1", "0.5"));
  const ProgramRun changed = run({"storebag", "diff", folder_ / "www/dulvek", next});
  EXPECT_EQ(changed.status, 0);
  EXPECT_EQ(
      changed.text,
      "release, httppost, client \"person\", sampling_threshold: 0.1 becomes 0.5 (about 50 of 100 sessions "
      "report, before about 11 of 100 sessions report)\n");
  EXPECT_EQ(run({"storebag", "diff", next, next}).text, "nothing changes\n");
  EXPECT_EQ(run({"storebag", "diff", next, folder_ / "nowhere"}).status, 1);
}

TEST_F(KytctlRollOut, PutsADeviceIntoItsRing) {
  folder_.write("etc/kytreportingd/device.toml",
                "UniqueDeviceID = \"da39a3ee5e6b4b0d3255bfef95601890afd80709\"\n");
  EXPECT_EQ(run({"ring"}).text, "27\n");
  EXPECT_EQ(run({"ring", "--identifier", "0000000000000000000000000000000000000000"}).text, "26\n");
  const ProgramRun set = run({"ring", "--set", "https://bags.example.org/r{ring}/bags/tolvar"});
  EXPECT_EQ(set.status, 0);
  EXPECT_EQ(set.text, "27 https://bags.example.org/r27/bags/tolvar\n");
  EXPECT_EQ(run({"defaults", "read", "com.vantu.kytreporting", "kytreporting_storebag_url"}).text,
            "https://bags.example.org/r27/bags/tolvar\n");
  EXPECT_EQ(run({"ring", "--set", "https://bags.example.org/bags/tolvar"}).status, 1)
      << "no place for the ring";
  EXPECT_EQ(run({"ring", "--set", "{ring}"}).status, 1);
}

// How servers answer the three questions.
class KytctlProbe : public KytctlRollOut {
 protected:
  void SetUp() override {
    KytctlRollOut::SetUp();
    ASSERT_EQ(publish(kBag, {"--serial", "4"}).status, 0);
    document_ = folder_.read("www/dulvek");
  }
  [[nodiscard]] ProgramRun probe(const std::string& url, std::vector<std::string> further = {}) const {
    further.insert(further.begin(), {"storebag", "probe", url});
    return run(std::move(further));
  }
  [[nodiscard]] ProgramRun probe() const {
    return probe(server_.url("/bags/tolvar/dulvek"), {"--public-key", folder_ / "keys/publicKey.der"});
  }
  // A server that has a bag since 2023 and compares times as the real ones do.
  struct Kind {
    bool exactTimes = true;      // otherwise: whatever is not newer than asked is unchanged
    bool datesUnchanged = true;  // a 304 has Last-Modified
    std::string lastModified = "Tue, 14 Nov 2023 22:13:20 GMT", cacheControl = "max-age=600", age = "";
  };
  void serve(const Kind& kind) {
    server_.setHandler([kind, document = document_](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      reply.headers = {{"Cache-Control", kind.cacheControl}};
      if (!kind.age.empty()) reply.headers.emplace_back("Age", kind.age);
      const auto since = request.header("If-Modified-Since");
      const bool isUnchanged =
          since && !kind.lastModified.empty() && (!kind.exactTimes || *since == kind.lastModified);
      if (!kind.lastModified.empty() && (!isUnchanged || kind.datesUnchanged))
        reply.headers.emplace_back("Last-Modified", kind.lastModified);
      reply.status = isUnchanged ? 304 : 200;
      if (!isUnchanged) reply.body = document;
      return reply;
    });
  }

  TestHTTPServer server_;
  std::string document_;
};

TEST_F(KytctlProbe, AsksAsTheDaemonDoes) {
  serve({});
  const ProgramRun run = probe();
  EXPECT_EQ(run.status, 0) << run.text;
  const auto requests = server_.requests();
  ASSERT_EQ(requests.size(), 3U);
  EXPECT_EQ(requests[0].target, "/bags/tolvar/dulvek?version=8.0");
  EXPECT_EQ(requests[0].header("If-Modified-Since"), std::nullopt);
  EXPECT_EQ(requests[0].header("X-KYT-Source-Application"), "com.vantu.system.diagnostics");
  EXPECT_EQ(requests[1].header("If-Modified-Since"), "Tue, 14 Nov 2023 22:13:20 GMT");
  EXPECT_EQ(requests[2].header("If-Modified-Since"), "Tue, 14 Nov 2023 22:13:21 GMT");
  for (const char* told : {"status 200, ", "Last-Modified: Tue, 14 Nov 2023 22:13:20 GMT",
                           "asked again after 600 seconds", "signature: holds, over SHA-256 too",
                           "version 1, serial 4, refresh_cycle none", "devices get this bag"})
    EXPECT_TRUE(has(run.text, told)) << told << "\n" << run.text;
  EXPECT_FALSE(has(run.text, "warning")) << run.text;
}

TEST_F(KytctlProbe, FindsA304WithoutLastModified) {
  serve({.datesUnchanged = false});
  const ProgramRun run = probe();
  EXPECT_EQ(run.status, 1);
  EXPECT_TRUE(has(run.text, "FAULT: there is no Last-Modified: the daemon counts that as a failed fetch"))
      << run.text;
}

TEST_F(KytctlProbe, FindsThatABagWithAnOlderTimeIsHidden) {
  serve({.exactTimes = false});
  const ProgramRun run = probe();
  EXPECT_EQ(run.status, 0) << "who publishes with newer times is served";
  EXPECT_TRUE(has(run.text, "warning: a bag that is put back with its old time never arrives")) << run.text;
}

TEST_F(KytctlProbe, FindsMissingTimesAndMisreadLifetimes) {
  serve({.lastModified = "", .cacheControl = "public,max-age=600", .age = "30"});
  const ProgramRun run = probe();
  EXPECT_EQ(run.status, 0);
  for (const char* told : {"warning: there is no Last-Modified: each refresh carries the whole bag",
                           "warning: its max-age is not read", "warning: a cache sent this (Age: 30)"})
    EXPECT_TRUE(has(run.text, told)) << told << "\n" << run.text;
}

TEST_F(KytctlProbe, FindsWhatIsNoBagOfThisKey) {
  serve({});
  ASSERT_EQ(run({"keys", "make", folder_ / "other"}).status, 0);
  const ProgramRun other = probe(server_.url("/dulvek"), {"--public-key", folder_ / "other/publicKey.der"});
  EXPECT_EQ(other.status, 1);
  EXPECT_TRUE(has(other.text, "FAULT: the signature does not match")) << other.text;
  document_ = "<html>not found</html>";
  serve({});
  EXPECT_EQ(probe().status, 1);
  EXPECT_EQ(probe("http://127.0.0.1:9/dulvek").status, 1) << "nobody is there";
}

TEST_F(KytctlProbe, FindsNoFaultWithNginx) {
  if (!Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  TestCertificateAuthority authority;
  const Nginx nginx(authority.issue());
  nginx.put("torvel", document_, 10);
  const ProgramRun run =
      probe(nginx.base() + "/storebags/tolvar/torvel",
            {"--public-key", folder_ / "keys/publicKey.der", "--ca-file", authority.file()});
  EXPECT_EQ(run.status, 0) << run.text << nginx.errors();
  EXPECT_FALSE(has(run.text, "warning")) << run.text;
  EXPECT_TRUE(has(run.text, "asked again after 3600 seconds")) << run.text;
}

// The guide's example: each ring's address is a link to what its devices get, and moving links moves devices.
TEST_F(KytctlRollOut, MovesDevicesByTheLinksOfTheirRings) {
  if (!Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
  TestCertificateAuthority authority;
  const std::string www = folder_ / "www";
  for (const char* release : {"a", "b"}) std::filesystem::create_directories(www + "/" + release);
  for (int ring = 0; ring < 100; ++ring)
    std::filesystem::create_directory_symlink("a",
                                              www + "/r" + (ring < 10 ? "0" : "") + std::to_string(ring));
  const Nginx nginx(authority.issue(), "location ~ ^/r[0-9][0-9]/ { root " + www + "; }\n");
  const auto publishTo = [&](const std::string& release, const std::string& version) {
    return run({"storebag", "publish",
                folder_.write("dulvek.toml", replaced(kBag, "\"1\"", "\"" + version + "\"")), "--key",
                folder_ / "keys/private.pem", "--to", www + "/" + release})
        .status;
  };
  ASSERT_EQ(publishTo("a", "old"), 0);
  ASSERT_EQ(publishTo("b", "new"), 0);
  folder_.write("etc/kytreportingd/device.toml",
                "UniqueDeviceID = \"da39a3ee5e6b4b0d3255bfef95601890afd80709\"\n");
  ASSERT_EQ(run({"ring", "--set", nginx.base() + "/r{ring}"}).status, 0);
  const std::string address =
      run({"defaults", "read", "com.vantu.kytreporting", "kytreporting_storebag_url"}).text;
  const auto version = [&] {
    return run({"storebag", "probe", address.substr(0, address.size() - 1) + "/dulvek", "--ca-file",
                authority.file()})
        .text;
  };
  const auto widen = [&](int rings) {
    for (int ring = 0; ring < rings; ++ring) {
      const std::string link = www + "/r" + (ring < 10 ? "0" : "") + std::to_string(ring);
      std::filesystem::remove(link);
      std::filesystem::create_directory_symlink("b", link);
    }
  };
  EXPECT_TRUE(has(version(), "version old")) << version() << nginx.errors();
  widen(25);
  EXPECT_TRUE(has(version(), "version old")) << "its ring is 27";
  widen(28);
  EXPECT_TRUE(has(version(), "version new")) << version();
}

// The guide's lines themselves.
TEST_F(KytctlRollOut, TheGuidesLinesMoveTheRings) {
  const std::string guide = textOf("docs/FLEET.md");
  const size_t at = guide.find("```sh\nmkdir -p www/stable");
  ASSERT_NE(at, std::string::npos);
  const std::string lines = guide.substr(at + 6, guide.find("\n```", at) - at - 5);
  folder_.write("dulvek.toml", kBag);
  std::filesystem::create_directories(folder_ / "changed");
  folder_.write("changed/dulvek.toml", replaced(kBag, "0.1", "0.5"));
  const auto linked = [&] {
    int next = 0;
    for (const auto& entry : std::filesystem::directory_iterator(folder_ / "www"))
      if (entry.is_symlink() && std::filesystem::read_symlink(entry) == "next") ++next;
    return next;
  };
  const std::string begin = "set -e; cd " + folder_.path() + "; PATH=" KYT_PROGRAMS ":$PATH\n";
  const size_t first = lines.find("for ring in 00 01");
  ASSERT_NE(first, std::string::npos);
  const ProgramRun one = runProgram("bash", {"-c", begin + lines.substr(0, first)});
  EXPECT_EQ(one.status, 0) << one.text;
  EXPECT_TRUE(has(one.text, "0.1 becomes 0.5")) << one.text;
  EXPECT_EQ(linked(), 1);
  // Otherwise a server tells a device whose ring moves that it has the newest.
  const auto timeOf = [&](const char* release) {
    return std::filesystem::last_write_time(folder_ / "www/" + release + "/bags/tolvar/dulvek");
  };
  EXPECT_GT(timeOf("next"), timeOf("stable"));
  EXPECT_GT(serial("www/next/bags/tolvar/dulvek"), serial("www/stable/bags/tolvar/dulvek"));
  std::vector<int> steps;
  for (const std::string& line : linesOf(lines.substr(first))) {
    if (line.empty()) continue;
    EXPECT_EQ(runProgram("bash", {"-c", begin + line}).status, 0) << line;
    steps.push_back(linked());
  }
  EXPECT_EQ(steps, (std::vector<int>{5, 25, 100}));
  EXPECT_TRUE(has(run({"storebag", "show", folder_ / "www/42/bags/tolvar/dulvek"}).text, "0.5"));
}

}  // namespace
}  // namespace kyt
