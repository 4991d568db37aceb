// One program that reports as fast as it can: its batches are posted beside its session's queue, and none of its events
// is lost, doubled or out of order within its post, also when the daemon has to end in the middle.
#include <gtest/gtest.h>
#include <zlib.h>

#include <algorithm>
#include <chrono>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kCadmor = 20, kEvents = 5000, kThreshold = 200;

std::string unzipped(const std::string& body) {
  z_stream stream = {};
  if (inflateInit2(&stream, 31) != Z_OK) return {};
  std::string out(1 << 21, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int status = inflate(&stream, Z_FINISH);
  out.resize(status == Z_STREAM_END ? stream.total_out : 0);
  inflateEnd(&stream);
  return out;
}

class BusyProgram : public testing::TestWithParam<bool> {
 protected:
  void SetUp() override {
    const bool consent = GetParam();
    const Array entries{Dictionary{{"client", "program"},
                                   {"locale_whitelist", Array{"DE"}},
                                   {"filters", Array{}},
                                   {"sampling_threshold", 1.0},
                                   {"override_dnu", consent ? 0 : 1},
                                   {"event_threshold", kThreshold},
                                   {"post_url", server_.url("/events")}}};
    const Dictionary bag{{"version", "1"},
                         {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", entries}}}}}};
    server_.setHandler([document = signedBag(bag, propertyLists_)](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      if (request.method == "GET") reply.body = document;
      return reply;
    });
    daemon_.root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
    daemon_.root().write("var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml",
                         consent ? "consent = true\n" : "consent = false\n");
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  static void report(TestClient& client) {
    for (int i = 0; i < kEvents; ++i)
      while (!client.send(9, 1, Dictionary{{"number", i}, {"name", "event " + std::to_string(i * 7919)}}))
        std::this_thread::yield();
  }
  // Of all posts, each of which must have its events in order.
  std::vector<int> arrived() {
    std::vector<int> numbers;
    for (const TestHTTPServer::Request& request : server_.requests()) {
      if (request.method != "POST") continue;
      const auto message = RapidJSON().parse(unzipped(request.body));
      const Value* events = std::get<Value>(message).dictionary()->find("events");
      int last = -1;
      for (const Value& event : *events->array()) {
        const Value* number = event.dictionary()->find("number");
        if (number == nullptr) continue;  // the session's start and end
        EXPECT_GT(number->intValue(), last);
        last = number->intValue();
        numbers.push_back(last);
      }
    }
    std::sort(numbers.begin(), numbers.end());
    return numbers;
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_{server_.url("")};
};

INSTANTIATE_TEST_SUITE_P(WithConsentAndWithout, BusyProgram, testing::Bool());

TEST_P(BusyProgram, HasEachEventPostedOnceThoughItsSessionAndTheDaemonEndAtOnce) {
  {
    TestClient client(daemon_.socketPath(), kCadmor, "program");
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    report(client);
    EXPECT_TRUE(client.finish());
  }
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  const std::vector<int> numbers = arrived();
  ASSERT_EQ(numbers.size(), static_cast<size_t>(kEvents)) << daemon_.log();
  for (int i = 0; i < kEvents; ++i) ASSERT_EQ(numbers[static_cast<size_t>(i)], i);
}

TEST_P(BusyProgram, LeavesTheLinesOfAPostBeforeThoseOfTheNextEvent) {
  {
    TestClient client(daemon_.socketPath(), kCadmor, "program");
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    report(client);
    EXPECT_TRUE(client.finish());
  }
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0);
  std::istringstream log(daemon_.log());
  int posts = 0;
  bool awaited = false;
  for (std::string line; std::getline(log, line);) {
    if (line.find("as we reached event threshold") != std::string::npos) awaited = true;
    if (awaited && line.find(": Compressed file from") != std::string::npos) {
      awaited = false;
      ++posts;
    }
    ASSERT_FALSE(awaited && line.find("HTTPSPostBackend(sendMessage)") != std::string::npos)
        << "after " << posts << " posts: " << line;
  }
  EXPECT_GE(posts, kEvents / kThreshold - 1);
}

TEST_P(BusyProgram, LosesNothingThatTheDaemonHasTakenWhenItMustEndInBetween) {
  TestClient client(daemon_.socketPath(), kCadmor, "program");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  report(client);
  ASSERT_TRUE(eventually([&] { return !arrived().empty(); })) << daemon_.log();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  const std::vector<int> numbers = arrived();
  ASSERT_FALSE(numbers.empty());
  for (size_t i = 0; i < numbers.size(); ++i) ASSERT_EQ(numbers[i], static_cast<int>(i)) << "a gap";
}

}  // namespace
}  // namespace kyt
