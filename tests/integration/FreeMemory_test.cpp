// When the daemon gives the system what it holds and does not use.
#include <gtest/gtest.h>

#include <atomic>
#include <future>
#include <memory>

#include "platform/linux/data/PugixmlPropertyLists.h"
#include "tests/integration/FailingDaemon.h"
#include "tests/integration/TestClient.h"
#include "tests/support/SignedBag.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

TEST(FreeMemory, IsGivenBackAlsoAfterAPostThatEndsWhenAllElseHasLongBeenQuiet) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer's own library must be loaded first";
  std::promise<void> answers;
  const std::shared_future<void> mayAnswer = answers.get_future().share();
  std::atomic<int> posts{0};
  PugixmlPropertyLists propertyLists;
  TestHTTPServer server;
  const Dictionary entry{{"post_url", server.url("/slow")}, {"event_threshold", 1000}};
  const std::string bag = signedBag(
      Dictionary{{"version", "1"},
                 {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", Array{entry}}}}}}},
      propertyLists);
  server.setHandler([&](const TestHTTPServer::Request& request) {
    TestHTTPServer::Reply reply;
    if (request.method == "GET") {
      reply.body = bag;
    } else {
      ++posts;
      mayAnswer.wait_for(kTestDeadline * 2);
    }
    return reply;
  });
  FailingDaemon daemon(server.url(""));
  daemon.start({"--log-level", "default"});
  ASSERT_TRUE(eventually([&] { return daemon.logged("start loop."); })) << daemon.log();
  {
    TestClient client(daemon.socketPath(), 5);
    ASSERT_EQ(client.configure(), "live: httppost") << daemon.log();
    static_cast<void>(client.send(10, 1, Dictionary{{"n", 1}}));
    static_cast<void>(client.startFlush());
    ASSERT_TRUE(eventually([&] { return posts == 1; })) << daemon.log();
  }
  // Workers end when they have been idle for ten seconds, also those which ran the storebag's completion.
  ASSERT_TRUE(eventually(
      [&] { return daemon.threadsNamed("kyt-worker") == 0 && daemon.threadsNamed("kyt-url") == 0; }));
  daemon.count(kyt_failing_malloc_trim);
  answers.set_value();
  EXPECT_TRUE(eventually([&] { return daemon.calls() > 0; })) << daemon.log();
  daemon.terminate();
  EXPECT_EQ(daemon.exitStatus(), 0) << daemon.log();
}

}  // namespace
}  // namespace kyt
