// Servers that misbehave towards the daemon: storebags with a wrong type at each key, replies that never end, are
// huge, cut or garbage, for storebags and for posts. The daemon goes on and answers its clients.
#include <gtest/gtest.h>

#include <atomic>
#include <functional>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5, kBrisca = 6;
using Behaviour = TestHTTPServer::Behaviour;

struct Variant {
  std::string where;
  Value bag;
};

const std::vector<std::pair<const char*, Value>>& wrongValues() {
  static const std::vector<std::pair<const char*, Value>> values{
      {"string", "text"},
      {"empty string", ""},
      {"integer", -7},
      {"real", 1e300},
      {"boolean", true},
      {"array", Array{Array{}, Dictionary{}, 1, "x", false}},
      {"dictionary", Dictionary{{"k", Array{1}}}},
      {"data", Data("\x01\x02")},
      {"date", Date{1769860800}}};
  return values;
}

// Calls `use` with every copy of `value` in which one value, at any depth, is replaced by another kind's.
void forEachVariant(const Value& value, const std::string& where,
                    const std::function<void(const std::string&, const Value&)>& use) {
  for (const auto& [name, wrong] : wrongValues())
    if (wrong.kind() != value.kind()) use(where + " as " + name, wrong);
  if (const Dictionary* dictionary = value.dictionary()) {
    for (const DictionaryEntry& entry : *dictionary) {
      forEachVariant(entry.value, where + "/" + entry.key.str(),
                     [&](const std::string& at, const Value& inner) {
                       Dictionary changed = *dictionary;
                       changed.set(entry.key, inner);
                       use(at, Value(std::move(changed)));
                     });
    }
  } else if (const Array* array = value.array()) {
    for (size_t i = 0; i < array->size(); ++i) {
      forEachVariant(array->begin()[i], where + "/" + std::to_string(i),
                     [&](const std::string& at, const Value& inner) {
                       Array changed = *array;
                       changed.mutableBegin()[i] = inner;
                       use(at, Value(std::move(changed)));
                     });
    }
  }
}

class HostileServer : public ::testing::Test {
 protected:
  void SetUp() override {
    daemon_.writeSettings(settings("0.5"));
    daemon_.root().write("etc/kytreportingd/device.toml",
                         "ReleaseType = \"Internal\"\ncountry = \"DE\"\nDeviceName = \"Demo\"\n"
                         "ProductType = \"Board7,1\"\n");
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  void TearDown() override {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  std::string settings(const std::string& grace) {
    return "[storebag]\ninternal_host = \"" + storebags_.url("") + "\"\npublic_host = \"" +
           storebags_.url("") +
           "\"\n[log]\ntarget = \"stderr\"\n[service]\nshutdown_grace_seconds = " + grace + "\n";
  }
  void restart() {
    daemon_.terminate();
    ASSERT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
    ASSERT_TRUE(daemon_.startAndWait());
  }
  Dictionary goodBag() {
    const Dictionary entry{
        {"client", "a,b"},
        {"service", "test"},
        {"expedite", 0},
        {"enabledSince", "7.0"},
        {"custom_clientId", "yes"},
        {"override_dnu", 1},
        {"extras_on_internal", 1},
        {"locale_whitelist", Array{"DE", "all"}},
        {"device_whitelist", Array{"Demo"}},
        {"device_blacklist", Array{"B8"}},
        {"filters", Array{Dictionary{{"key", "secret"}, {"action", "remove"}, {"method", 9}, {"status", 1}}}},
        {"sampling_threshold", 1.0},
        {"per_country_sampling_thresholds", Array{Dictionary{{"country", Array{"DE"}}, {"threshold", 1.0}}}},
        {"override_sampling", 0.5},
        {"event_threshold", 10},
        {"event_whitelist", Array{0, 9}},
        {"event_blacklist", Array{8}},
        {"use_wifi_only", 0},
        {"post_url", posts_.url("/events")},
        {"realtime_post_url", posts_.url("/realtime")}};
    const Dictionary backend{{"display_url", "https://display.example.org/"}, {"clients", Array{entry}}};
    return Dictionary{{"version", "1"},
                      {"refresh_cycle", 0},
                      {"vantu_internal", Dictionary{{"httppost", backend}, {"qrs", backend}}}};
  }
  void serve(std::string document) {
    TestHTTPServer::Reply reply;
    reply.headers = {{"Cache-Control", "max-age=0"}};
    reply.body = std::move(document);
    storebags_.setReply(reply);
  }
  // A whole session under what is served now; what it was told when configuring.
  std::string runSession(int clientType = kTorvel) {
    TestClient client(daemon_.socketPath(), clientType, "a");
    const std::string states = client.configure();
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"secret", "s"}, {"k", 1}}));
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"k", 2}}, 1));
    EXPECT_NE(client.displayURL(), "no answer");
    EXPECT_NE(client.flush(), "no answer");
    EXPECT_TRUE(client.finish());
    return states;
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer posts_, storebags_;
  DaemonProcess daemon_{"http://127.0.0.1:9"};  // replaced by SetUp()
};

TEST_F(HostileServer, ABagWithAWrongTypeAnywhereLeavesTheDaemonSound) {
  serve(signedBag(goodBag(), propertyLists_));
  ASSERT_EQ(runSession(), "live: httppost qrs") << daemon_.log();
  int variants = 0, refused = 0;
  forEachVariant(Value(goodBag()), "bag", [&](const std::string& where, const Value& bag) {
    SCOPED_TRACE(where);
    serve(signedDocument(propertyLists_.serialize(bag), propertyLists_));
    const std::string states = runSession();
    EXPECT_EQ(states.find("live:"), 0U) << states << ": a failed fetch keeps the section before it";
    ++variants;
    if (!daemon_.logged("Unable to fetch storebag")) return;
    ++refused;
    restart();  // a failed fetch is not tried again for a while
    serve(signedBag(goodBag(), propertyLists_));
    EXPECT_EQ(runSession(), "live: httppost qrs");
  });
  EXPECT_GT(variants, 200);
  EXPECT_GT(refused, 10) << "a bag without version, sections or back ends is a failed fetch";
}

TEST_F(HostileServer, ADocumentWithWrongTypesIsAFailure) {
  const std::string good = signedBag(goodBag(), propertyLists_);
  const auto parsed = propertyLists_.parse(good);
  int variants = 0;
  forEachVariant(std::get<Value>(parsed), "document", [&](const std::string& where, const Value& document) {
    SCOPED_TRACE(where);
    serve(propertyLists_.serialize(document));
    EXPECT_EQ(runSession(), "none");
    EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type 5"));
    ++variants;
    restart();
  });
  EXPECT_GT(variants, 20);
}

TEST_F(HostileServer, StorebagRepliesThatAreNoneAreFailures) {
  TestHTTPServer::Reply huge, cut, garbage, nothing, deep;
  huge.body.assign(5u << 20, 'x');
  cut.body = signedBag(goodBag(), propertyLists_);
  cut.behaviour = Behaviour::stopMidBody;
  garbage.body = std::string("\x16\x03\x01\x00garbage\r\n\r\n\0\xff", 17);
  garbage.behaviour = Behaviour::raw;
  nothing.behaviour = Behaviour::close;
  for (int i = 0; i < 100000; ++i) deep.body += "<array>";
  const std::pair<const char*, TestHTTPServer::Reply> replies[] = {
      {"huge", huge}, {"cut", cut}, {"garbage", garbage}, {"nothing", nothing}, {"deep", deep}};
  int clientType = kTorvel;
  for (const auto& [what, reply] : replies) {
    SCOPED_TRACE(what);
    if (clientType == 7) ++clientType;  // the family that has a built-in bag
    storebags_.setReply(reply);
    EXPECT_EQ(runSession(clientType), "none");
    EXPECT_TRUE(daemon_.logged("fetchAndCacheStorebag: Unable to fetch storebag for client type " +
                               std::to_string(clientType)));
    ++clientType;
  }
}

TEST_F(HostileServer, AStorebagThatNeverEndsIsGivenUpAfterFifteenSeconds) {
  TestHTTPServer::Reply drip;
  drip.body.assign(1u << 20, 'x');
  drip.behaviour = Behaviour::drip;
  drip.interval = std::chrono::milliseconds(50);
  storebags_.setReply(drip);
  const auto begin = std::chrono::steady_clock::now();
  EXPECT_EQ(runSession(), "none");
  const auto took = std::chrono::steady_clock::now() - begin;
  EXPECT_GE(took, std::chrono::seconds(14));
  EXPECT_LT(took, std::chrono::seconds(25));
}

TEST_F(HostileServer, PostsThatAreAnsweredBadlyAreTheServersLoss) {
  serve(signedBag(goodBag(), propertyLists_));
  TestHTTPServer::Reply huge, cut, garbage, nothing, redirect;
  huge.body.assign(5u << 20, 'x');
  cut.body = "{}";
  cut.behaviour = Behaviour::stopMidBody;
  garbage.body = std::string("\x16\x03\x01\x00garbage\r\n\r\n\0\xff", 17);
  garbage.behaviour = Behaviour::raw;
  nothing.behaviour = Behaviour::close;
  redirect.status = 307;
  redirect.headers = {{"Location", posts_.url("/elsewhere")}};
  for (const auto& reply : {huge, cut, garbage, nothing, redirect}) {
    posts_.setReply(reply);
    EXPECT_EQ(runSession(), "live: httppost qrs") << daemon_.log();
  }
  for (const auto& request : posts_.requests()) EXPECT_NE(request.target, "/elsewhere");
  posts_.setReply({});
  TestClient client(daemon_.socketPath(), kBrisca, "a");
  EXPECT_EQ(client.configure(), "live: httppost qrs");
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"k", 1}}));
  EXPECT_EQ(client.flush(), "flushed") << daemon_.log();
}

TEST_F(HostileServer, APostThatIsAnsweredForeverDoesNotHoldUpTheEnd) {
  serve(signedBag(goodBag(), propertyLists_));
  TestHTTPServer::Reply drip;
  drip.body.assign(1u << 20, 'x');
  drip.behaviour = Behaviour::drip;
  posts_.setReply(drip);
  TestClient client(daemon_.socketPath(), kTorvel, "a");
  EXPECT_EQ(client.configure(), "live: httppost qrs");
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"k", 2}}, 1));
  ASSERT_TRUE(posts_.waitForRequests(1));
  const auto begin = std::chrono::steady_clock::now();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(20))
      << "half a second of grace, then some; the answer never ends";
  EXPECT_TRUE(daemon_.logged("requests that have not been answered in time")) << daemon_.log();
  ASSERT_TRUE(daemon_.startAndWait());
}

// Text that does not compress well.
std::string noise(size_t bytes, uint32_t seed) {
  std::mt19937 random(seed);
  std::string text(bytes, 0);
  for (char& c : text) c = static_cast<char>(' ' + 2 + random() % 64);
  return text;
}

TEST_F(HostileServer, PostsThatAreNeverAnsweredDoNotFillTheMemory) {
  serve(signedBag(goodBag(), propertyLists_));
  TestHTTPServer::Reply never;
  never.behaviour = Behaviour::hold;
  posts_.setReply(never);
  TestClient client(daemon_.socketPath(), kTorvel, "a");
  ASSERT_EQ(client.configure(), "live: httppost qrs");
  // A hundred and twenty megabytes of bodies for one session, and ten thousand small ones for another.
  const std::string text = noise(800000, 1);
  for (int i = 0; i < 120; ++i) {
    EXPECT_TRUE(client.send(9, 1, Dictionary{{"text", text}}, 1));
    ASSERT_NE(client.displayURL(), "no answer");  // the client's own queue has a limit too
  }
  const auto refusals = [&] {
    return daemon_.logged(
        "CurlURLSession(start): more than 67108864 bytes of requests are outstanding, refusing further ones");
  };
  ASSERT_TRUE(eventually(refusals)) << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"text", text}}));
  EXPECT_EQ(client.flush(), "error: Too much was outstanding");
  const long large = daemon_.anonymousKiB();
  TestClient other(daemon_.socketPath(), kTorvel, "a");
  ASSERT_EQ(other.configure(), "live: httppost qrs");
  for (int i = 0; i < 10000; ++i) {
    ASSERT_TRUE(other.send(9, 1, Dictionary{{"k", i}}, 1));
    if (i % 100 == 99) {
      ASSERT_NE(other.displayURL(), "no answer");
    }
  }
  const long both = daemon_.anonymousKiB();
  if (!kSanitized) {
    EXPECT_LT(large, 128 * 1024);
    EXPECT_LT(both - large, 96 * 1024);
  }
  posts_.setReply({});
  posts_.release();
  EXPECT_TRUE(eventually([&] {
    return other.send(9, 1, Dictionary{{"k", 1}}) && other.flush() == "flushed";
  })) << "there is room again";
}

TEST_F(HostileServer, AHangingStorebagDoesNotHoldUpTheEndOfSessionsThatWaitForIt) {
  TestHTTPServer::Reply never;
  never.behaviour = Behaviour::hold;
  storebags_.setReply(never);
  std::vector<std::unique_ptr<TestClient>> clients;
  for (int i = 0; i < 10; ++i) {
    clients.push_back(std::make_unique<TestClient>(daemon_.socketPath(), kTorvel + i, "a"));
    (*clients.back())->startConfiguration();
  }
  ASSERT_TRUE(storebags_.waitForRequests(1));
  const auto begin = std::chrono::steady_clock::now();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(12))
      << "a request's limit is 15 s";
  ASSERT_TRUE(daemon_.startAndWait());
}

}  // namespace
}  // namespace kyt
