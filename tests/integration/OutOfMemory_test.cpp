// The daemon when the system refuses it memory.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <memory>
#include <vector>

#include "tests/integration/DaemonProcess.h"
#include "tests/support/PlainClient.h"
#include "tests/support/Sanitizers.h"

namespace kyt {
namespace {

using test::PlainClient;

TEST(OutOfMemory, TheDaemonEndsInOrderWithALineAndStatusOne) {
  if (kSanitized) GTEST_SKIP() << "a sanitizer needs terabytes of addresses";
  DaemonProcess daemon("http://127.0.0.1:1");
  daemon.addSettings("[limits]\nmax_bytes_per_user = 1099511627776\n");
  daemon.setBeforeExecution([] {
    const rlimit limit = {rlim_t{512} << 20, rlim_t{512} << 20};
    ::setrlimit(RLIMIT_AS, &limit);
  });
  daemon.start({"--log-level", "default"});
  ASSERT_TRUE(eventually([&] { return daemon.logged("main: Listener resumes with sandbox, start loop."); }))
      << daemon.log();
  std::string calls;
  MessageWriter writer(calls);
  for (uint32_t serial = 1; calls.size() < 140000; ++serial) {
    writer.beginCall(serial, {.path = "/com/vantu/kytreportingd",
                              .interface = "org.freedesktop.DBus.Introspectable",
                              .member = "Introspect"});
    ASSERT_TRUE(writer.end());
  }
  std::vector<std::unique_ptr<PlainClient>> clients;
  for (int i = 0; i < 2000 && !daemon.logged("main: The system refuses memory, ending"); ++i) {
    clients.push_back(std::make_unique<PlainClient>(daemon.socketPath()));
    if (!clients.back()->connected() || !clients.back()->shakeHands()) continue;
    std::string_view rest = calls;
    pollfd waiting{clients.back()->descriptor(), POLLOUT, 0};
    while (!rest.empty() && ::poll(&waiting, 1, 100) == 1) {
      const ssize_t sent =
          ::send(clients.back()->descriptor(), rest.data(), rest.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
      if (sent <= 0) break;
      rest.remove_prefix(static_cast<size_t>(sent));
    }
  }
  EXPECT_TRUE(daemon.logged("main: The system refuses memory, ending")) << daemon.log();
  EXPECT_EQ(daemon.exitStatus(), 1) << daemon.log();
  EXPECT_TRUE(daemon.logged("main: Ending, the system refuses memory")) << daemon.log();
  EXPECT_TRUE(daemon.logged("shutDown: ")) << daemon.log();
}

}  // namespace
}  // namespace kyt
