// The daemon when the system refuses it memory.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <memory>
#include <vector>

#include "platform/objects/Keys.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using test::PlainClient;

class OutOfMemory : public testing::Test {
 protected:
  void start() {
    if (kSanitized) GTEST_SKIP() << "a sanitizer needs terabytes of addresses";
    daemon_.addSettings(
        "[limits]\nmax_bytes_per_user = 1099511627776\n"
        "max_shared_data_bytes_per_user = 1099511627776\n");
    daemon_.setBeforeExecution([] {
      const rlimit limit = {rlim_t{512} << 20, rlim_t{512} << 20};
      ::setrlimit(RLIMIT_AS, &limit);
    });
    daemon_.start({"--log-level", "default"});
    ASSERT_TRUE(eventually([&] {
      return daemon_.logged("main: Listener resumes with sandbox, start loop.");
    })) << daemon_.log();
  }
  // Client after client that says this, reads nothing and stays, until the daemon has no memory for more of them.
  void useUpMemory(std::string_view bytes) {
    for (int i = 0; i < 2000 && !daemon_.logged("main: The system refuses memory, ending"); ++i) {
      clients_.push_back(std::make_unique<PlainClient>(daemon_.socketPath()));
      if (!clients_.back()->connected() || !clients_.back()->shakeHands()) continue;
      std::string_view rest = bytes;
      pollfd waiting{clients_.back()->descriptor(), POLLOUT, 0};
      while (!rest.empty() && ::poll(&waiting, 1, 100) == 1) {
        const ssize_t sent =
            ::send(clients_.back()->descriptor(), rest.data(), rest.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
        if (sent <= 0) break;
        rest.remove_prefix(static_cast<size_t>(sent));
      }
    }
  }
  void expectAnOrderlyEnd() {
    EXPECT_TRUE(daemon_.logged("main: The system refuses memory, ending")) << daemon_.log();
    EXPECT_EQ(daemon_.exitStatus(), 1) << daemon_.log();
    EXPECT_TRUE(daemon_.logged("main: Ending, the system refuses memory")) << daemon_.log();
    EXPECT_TRUE(daemon_.logged("shutDown: ")) << daemon_.log();
  }

  DaemonProcess daemon_{"http://127.0.0.1:1"};
  std::vector<std::unique_ptr<PlainClient>> clients_;
};

TEST_F(OutOfMemory, TheDaemonEndsInOrderWithALineAndStatusOne) {
  start();
  if (IsSkipped()) return;
  std::string calls;
  MessageWriter writer(calls);
  for (uint32_t serial = 1; calls.size() < 140000; ++serial) {
    writer.beginCall(serial, {.path = "/com/vantu/kytreportingd",
                              .interface = "org.freedesktop.DBus.Introspectable",
                              .member = "Introspect"});
    ASSERT_TRUE(writer.end());
  }
  useUpMemory(calls);
  expectAnOrderlyEnd();
}

// What sessions share is kept as objects, whose memory is malloc's.
TEST_F(OutOfMemory, ThatWentIntoObjectsEndsTheDaemonInOrderToo) {
  start();
  if (IsSkipped()) return;
  PlainClient client(daemon_.socketPath());
  ASSERT_TRUE(client.connected() && client.shakeHands());
  client.call(
      "SetSessionInfo", "a{sv}aa{sv}avb",
      [](MessageWriter& out) {
        out.writeDictionary(Dictionary{{kKYTReportingSessionInfoSessionID, 7},
                                       {kKYTReportingSessionInfoClientType, 20},
                                       {kKYTReportingSessionInfoHierarchyToken,
                                        Dictionary{{kKYTReportingHierarchyTokenTokenID, "shares much"},
                                                   {kKYTReportingHierarchyTokenLevel, 0}}}});
        out.writeOptionalDictionary(std::nullopt);
        out.writeOptionalValue(nullptr);
        out.writeBoolean(false);
      },
      false);
  // Small messages, and so none of the daemon's memory for half ones.
  const std::string text(1000, 'x');
  for (int i = 0; i < 2000000 && !daemon_.hasEnded(); ++i) {
    client.call(
        "UpdateSharedDataForKey", "sav",
        [&](MessageWriter& out) {
          out.writeString("key " + std::to_string(i));
          out.writeOptionalValue(Value(text));
        },
        false);
  }
  expectAnOrderlyEnd();
}

}  // namespace
}  // namespace kyt
