// An old storebag that is played back to a daemon whose administrator does not want that: refused with its reason in the
// log, in what the daemon says of itself and in what becomes of an event, also after a restart.
#include <gtest/gtest.h>

#include <string>

#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/Programs.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kTorvel = 5;
const std::string kRefusal =
    "the storebag is refused: its serial is 6; one with the serial 7 was taken before";

class StorebagRefusals : public ::testing::Test {
 protected:
  void serve(int serial, const std::string& backend) {
    const Dictionary entry{{"post_url", server_.url("/events")}};
    const Dictionary section{{backend, Dictionary{{"clients", Array{entry}}}}};
    TestHTTPServer::Reply reply;
    reply.body = signedBag(
        Dictionary{{"version", std::to_string(serial)}, {"serial", serial}, {"vantu_internal", section}},
        propertyLists_);
    server_.setReply(reply);
  }
  std::string configured() {
    TestClient client(daemon_.socketPath(), kTorvel);
    return client.configure();
  }
  void restart() {
    daemon_.terminate();
    ASSERT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  [[nodiscard]] std::string kytctl(std::vector<std::string> arguments) const {
    arguments.insert(arguments.begin(), {"--root", daemon_.root().path()});
    return runProgram(KYT_PROGRAMS "/kytctl", arguments).text;
  }
  void TearDown() override {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_{server_.url("")};
};

TEST_F(StorebagRefusals, AnOldBagIsRefusedAlsoAfterARestart) {
  daemon_.writeSettings("[storebag]\ninternal_host = \"" + server_.url("") + "\"\npublic_host = \"" +
                        server_.url("") + "\"\nrefuse_older = true\n[log]\ntarget = \"stderr\"\n");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  serve(7, "httppost");
  EXPECT_EQ(configured(), "live: httppost") << daemon_.log();
  restart();
  serve(6, "httppost2");
  EXPECT_EQ(configured().find("httppost"), std::string::npos) << daemon_.log();
  EXPECT_TRUE(
      daemon_.logged("fetchStorebagWithName: The storebag is refused: its serial is 6; one with the serial 7 "
                     "was taken before"))
      << daemon_.log();
  const std::string standing = kytctl({"storebags", "--json"});
  EXPECT_NE(standing.find(kRefusal), std::string::npos) << standing;
  const std::string explained =
      kytctl({"explain", R"({"Category":3,"Type":4})", "--client-type", "5", "--json"});
  EXPECT_NE(explained.find("The storebag is refused: its serial is 6"), std::string::npos) << explained;
}

TEST_F(StorebagRefusals, AnOldBagIsTakenWhereNobodyRefusesIt) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  serve(7, "httppost");
  EXPECT_EQ(configured(), "live: httppost") << daemon_.log();
  restart();
  serve(6, "httppost2");
  EXPECT_EQ(configured(), "live: httppost2") << daemon_.log();
}

}  // namespace
}  // namespace kyt
