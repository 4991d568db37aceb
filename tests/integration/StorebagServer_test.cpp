// The daemon with its storebags on a real nginx: conditional requests, lifetimes, changed, broken and
// unreachable bags, seen through a client's answers, the server's access log and the daemon's log.
#include <gtest/gtest.h>

#include <chrono>
#include <optional>
#include <string>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/Nginx.h"
#include "tests/integration/TestClient.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

// Client types by their storebags' names.
constexpr int kTorvel = 5, kBrisca = 6, kCadmor = 7, kEmrit = 9, kFosska = 10;

class StorebagServer : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!Nginx::isHere()) GTEST_SKIP() << "nginx is not installed";
    nginx_.emplace(authority_.issue());
    startDaemon(authority_);
  }
  void TearDown() override {
    if (!started_) return;
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  void startDaemon(const TestCertificateAuthority& trusted) {
    daemon_.writeSettings("[storebag]\ninternal_host = \"" + nginx_->base() + "\"\npublic_host = \"" +
                          nginx_->base() + "\"\n[tls]\nca_file = \"" + trusted.file() +
                          "\"\n[log]\ntarget = \"stderr\"\n");
    started_ = daemon_.startAndWait();
    ASSERT_TRUE(started_) << daemon_.log();
  }
  // A bag that makes this back end, which posts to the sink.
  std::string bag(const std::string& backend, const std::string& version = "1") {
    const Dictionary entry{{"post_url", sink_.url("/events")}, {"event_threshold", 1000}};
    const Dictionary section{{backend, Dictionary{{"clients", Array{entry}}}}};
    return signedBag(Dictionary{{"version", version}, {"vantu_internal", section}}, propertyLists_);
  }
  // What a new session of this type is told.
  std::string configured(int clientType) {
    TestClient client(daemon_.socketPath(), clientType);
    return client.configure();
  }
  std::string context() { return daemon_.log() + nginx_->errors(); }

  PugixmlPropertyLists propertyLists_;
  TestCertificateAuthority authority_;
  TestHTTPServer sink_;
  std::optional<Nginx> nginx_;
  DaemonProcess daemon_{"https://127.0.0.1:9"};  // replaced by startDaemon()
  bool started_ = false;
};

TEST_F(StorebagServer, IsAskedOverHTTP2AndOnlyOnceWithinTheLifetime) {
  nginx_->put("torvel", bag("httppost"), 10);
  TestClient client(daemon_.socketPath(), kTorvel);
  EXPECT_EQ(client.configure(), "live: httppost") << context();
  EXPECT_EQ(configured(kTorvel), "live: httppost");
  EXPECT_TRUE(daemon_.logged("storebagForSession: Cached storebag found for client type 5"));
  EXPECT_TRUE(client.send(3, 4, Dictionary{{"key", "value"}}));
  EXPECT_EQ(client.flush(), "flushed");
  EXPECT_TRUE(sink_.waitForRequests(1)) << "events go where the bag says";
  ASSERT_TRUE(nginx_->waitForAccesses(1));
  EXPECT_EQ(nginx_->accesses(),
            std::vector<std::string>{"GET /storebags/tolvar/torvel 200 HTTP/2.0 since=\"-\""});
}

TEST_F(StorebagServer, AnswersUnchangedAfterTheLifetimeAndThenWithTheChangedBag) {
  nginx_->put("brisca", bag("httppost"), 10);
  EXPECT_EQ(configured(kBrisca), "live: httppost") << context();
  EXPECT_EQ(configured(kBrisca), "live: httppost") << context();
  ASSERT_TRUE(nginx_->waitForAccesses(2)) << context();
  EXPECT_EQ(nginx_->accesses()[0], "GET /storebags/tolvar/brisca 200 HTTP/2.0 since=\"-\"");
  EXPECT_EQ(nginx_->accesses()[1].find("GET /storebags/tolvar/brisca 304 HTTP/2.0 since=\""), 0U)
      << nginx_->accesses()[1];
  EXPECT_TRUE(
      daemon_.logged("fetchStorebagWithName: storebag content has not changed. using its cached version"));
  nginx_->put("brisca", bag("httppost2", "2"), 5);
  EXPECT_EQ(configured(kBrisca), "live: httppost2") << context();
  EXPECT_EQ(configured(kBrisca), "live: httppost2") << context();
  ASSERT_TRUE(nginx_->waitForAccesses(4));
  EXPECT_EQ(nginx_->accesses()[2].find("GET /storebags/tolvar/brisca 200 "), 0U) << nginx_->accesses()[2];
  EXPECT_EQ(nginx_->accesses()[3].find("GET /storebags/tolvar/brisca 304 "), 0U) << nginx_->accesses()[3];
}

TEST_F(StorebagServer, TakesABagThatIsPutBackWithItsOlderTime) {
  nginx_->put("brisca", bag("httppost2", "2"), 5);
  EXPECT_EQ(configured(kBrisca), "live: httppost2") << context();
  nginx_->put("brisca", bag("httppost"), 10);
  EXPECT_EQ(configured(kBrisca), "live: httppost") << context();
}

TEST_F(StorebagServer, IsAskedAgainWhenTheLifetimeIsOver) {
  nginx_->put("emrit", bag("httppost"), 10);
  const auto begin = std::chrono::system_clock::now();
  EXPECT_EQ(configured(kEmrit), "live: httppost") << context();
  std::string last = "live: httppost";
  ASSERT_TRUE(eventually([&] {
    last = configured(kEmrit);
    return last != "live: httppost" || nginx_->accesses().size() >= 2;
  }));
  ASSERT_EQ(last, "live: httppost") << context();
  EXPECT_GE(std::chrono::system_clock::now() - begin, std::chrono::seconds(1));
  EXPECT_EQ(nginx_->accesses()[1].find("GET /storebags/tolvar/emrit 304 "), 0U) << nginx_->accesses()[1];
}

TEST_F(StorebagServer, KeepsItsLastGoodBagWhenTheNextIsNotSigned) {
  nginx_->put("brisca", bag("httppost"), 10);
  EXPECT_EQ(configured(kBrisca), "live: httppost") << context();
  const std::string good = bag("httppost2"), other = bag("httppost");
  // The signature of one bag around the content of another.
  const auto content = [](const std::string& document) { return document.find("<key>bag</key>"); };
  nginx_->put("brisca", other.substr(0, content(other)) + good.substr(content(good)), 5);
  EXPECT_EQ(configured(kBrisca), "live: httppost") << "the section before it is kept";
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: Signature can not be verified, "));
  EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 6"));
  nginx_->put("brisca", good, 1);
  EXPECT_EQ(configured(kBrisca), "live: httppost") << "a failure is not tried again for a while";
  EXPECT_TRUE(
      daemon_.logged("storebagForSession: Not fetching storebag for client type 6 - must wait 900 seconds "
                     "between attempts"));
  ASSERT_TRUE(nginx_->waitForAccesses(2));
  EXPECT_EQ(nginx_->accesses().size(), 2U);
}

TEST_F(StorebagServer, ATruncatedBagIsAFailure) {
  const std::string document = bag("httppost");
  nginx_->put("torvel", document.substr(0, document.size() / 2), 10);
  EXPECT_EQ(configured(kTorvel), "none");
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: propertyListWithData error ")) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: Signature is missing"));
  EXPECT_TRUE(
      daemon_.logged("fetchStorebagForEnvironmentAndClientType: Could not fetch storebag for client type 5"));
}

TEST_F(StorebagServer, AMissingBagIsAFailure) {
  EXPECT_EQ(configured(kTorvel), "none");
  EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 5"));
  ASSERT_TRUE(nginx_->waitForAccesses(1));
  EXPECT_EQ(nginx_->accesses()[0], "GET /storebags/tolvar/torvel 404 HTTP/2.0 since=\"-\"");
  EXPECT_TRUE(daemon_.logged("/storebags/tolvar/torvel?version=8.0 answered with status 404"))
      << daemon_.log();
}

// The bundle's key is a link, as the package makes it, to where the deployment puts it.
TEST_F(StorebagServer, IsBelievedFromTheMomentThatItsKeyIsInstalled) {
  const std::string bundle = "usr/share/kytreporting/KYTReporting.bundle/";
  const std::string key = daemon_.root().read(bundle + "publicKey.der");
  for (const std::string name : {"publicKey.der", "publicKey2.der"}) {
    std::filesystem::remove(daemon_.root() / (bundle + name));
    std::filesystem::create_symlink(daemon_.root() / ("etc/kytreportingd/" + name),
                                    daemon_.root() / (bundle + name));
  }
  for (const char* name : {"torvel", "brisca", "emrit"}) nginx_->put(name, bag("httppost"), 10);
  EXPECT_EQ(configured(kTorvel), "none");
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: The bundle has no publicKey.der that could be read"))
      << daemon_.log();
  daemon_.root().write("etc/kytreportingd/publicKey.der", otherPublicKey().view());
  EXPECT_EQ(configured(kBrisca), "none");
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: Signature can not be verified, ")) << daemon_.log();
  daemon_.root().write("etc/kytreportingd/publicKey2.der", key);
  EXPECT_EQ(configured(kEmrit), "live: httppost") << context();
}

TEST_F(StorebagServer, MayDieInTheMiddleOfABag) {
  nginx_->put("fosska", bag("httppost"), 10);
  TestClient client(daemon_.socketPath(), kFosska);
  auto answer = std::make_shared<std::promise<std::string>>();
  client->startConfiguration([answer](auto states, auto) { answer->set_value(states ? "some" : "none"); });
  ASSERT_TRUE(
      eventually([this] { return nginx_->errors().find("/storebags/tolvar/fosska") != std::string::npos; }));
  nginx_->kill();
  EXPECT_EQ(TestClient::waitFor(answer), "none");
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: Error resolving with lookup server " + nginx_->base() +
                             "/storebags/tolvar/fosska?version=8.0, sendSynchronousRequest error "))
      << daemon_.log();
}

TEST_F(StorebagServer, BeingDeadLeavesOneFamilyItsBuiltInBagAndOthersNone) {
  nginx_->kill();
  EXPECT_EQ(configured(kTorvel), "none");
  EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 5"));
  EXPECT_FALSE(daemon_.logged("Loading default storebag"));
  EXPECT_EQ(configured(kCadmor), "live: qdx");  // the built-in bag names the diagnostics adaptor alone
  EXPECT_TRUE(daemon_.logged("fetchStorebagWithName: Loading default storebag 'cadmor'"));
  EXPECT_FALSE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 7"));
}

TEST_F(StorebagServer, IsNotBelievedWithoutATrustedCertificate) {
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0);
  const TestCertificateAuthority other;
  startDaemon(other);
  nginx_->put("torvel", bag("httppost"), 10);
  EXPECT_EQ(configured(kTorvel), "none");
  EXPECT_TRUE(daemon_.logged("sendSynchronousRequest error ")) << daemon_.log();
  EXPECT_TRUE(nginx_->accesses().empty());
}

}  // namespace
}  // namespace kyt
