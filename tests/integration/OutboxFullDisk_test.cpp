// The built daemon whose outbox lies on a disk of its own, which is full or may not be written: in a mount namespace, so that
// nobody else sees it.
#include <random>

#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/OutboxDaemonFixture.h"
#include "tests/support/Programs.h"

namespace kyt {
namespace {

class OutboxOnADiskOfItsOwn : public OutboxOfTheDaemon {
 protected:
  void SetUp() override {
    if (runProgram("unshare", {"--user", "--map-root-user", "--mount", "true"}).status != 0)
      GTEST_SKIP() << "no user namespaces here";
  }
  // What is done with the disk after it is mounted: "$DISK" is its place.
  void mount(const std::string& options, const std::string& then = "true") {
    std::filesystem::create_directories(folder());
    daemon_.setLauncher({"unshare", "--user", "--map-root-user", "--mount", "sh", "-c",
                         "DISK='" + folder() + "'; mount -t tmpfs -o mode=0700," + options +
                             " tmpfs \"$DISK\" && " + then + " && exec \"$0\" \"$@\""});
  }
  // Nothing in it can be made smaller.
  std::string payload(size_t bytes) {
    std::string text;
    while (text.size() < bytes) text += static_cast<char>('0' + random_() % 75);
    return text;
  }
  [[nodiscard]] Dictionary kytctl(const std::string& command) const {
    const ProgramRun run = runProgram(std::string(KYT_PROGRAMS) + "/kytctl",
                                      {"--root", daemon_.root().path(), command, "--json"});
    EXPECT_EQ(run.status, 0) << run.text;
    auto parsed = RapidJSON().parse(run.text);
    const auto* value = std::get_if<Value>(&parsed);
    return value != nullptr && value->dictionary() != nullptr ? *value->dictionary() : Dictionary();
  }
  // Of all rows.
  [[nodiscard]] int64_t booked(const char* column) const {
    const Dictionary books = kytctl("books");
    const Array* rows = books.array("rows");
    int64_t sum = 0;
    for (size_t i = 0; rows != nullptr && i < rows->size(); ++i)
      sum += (rows->begin() + i)->dictionary()->integer(column);
    return sum;
  }
  [[nodiscard]] bool closes() const {
    return booked("taken") == booked("queued") + booked("batched") + booked("inFlight") + booked("waiting") +
                                  booked("outbox") + booked("delivered") + booked("dropped");
  }
};

TEST_F(OutboxOnADiskOfItsOwn, LosesWhatFindsNoRoomAndDeliversTheRest) {
  settings(kOn);
  mount("size=256k");
  start();
  size_t flushed = 0;
  {
    TestClient client(daemon_.socketPath(), kTorvel, "plain");
    ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
    for (; flushed < 60; ++flushed) {
      EXPECT_TRUE(client.send(9, 1, Dictionary{{"text", payload(12000)}}));
      if (client.flush() != "flushed") break;
    }
  }
  EXPECT_GE(flushed, 4U) << daemon_.log();
  EXPECT_LT(flushed, 60U) << "there is no such disk";
  EXPECT_TRUE(eventually([&] { return daemon_.logged("Outbox: Its file cannot be used for now"); }))
      << daemon_.log();
  EXPECT_TRUE(eventually([&] { return closes(); }));
  const int64_t kept = booked("outbox");
  EXPECT_GT(kept, 0);
  const int64_t before = booked("delivered");
  take(100);
  // Somebody makes room. The disk is tried again after half a minute.
  const std::string process = std::to_string(daemon_.process());
  const ProgramRun room = runProgram("nsenter", {"-t", process, "-U", "--preserve-credentials", "-m", "mount",
                                                 "-o", "remount,size=1m", folder()});
  ASSERT_EQ(room.status, 0) << room.text;
  const auto isDone = [&] { return booked("outbox") == 0; };
  EXPECT_TRUE(eventually(isDone) || eventually(isDone) || eventually(isDone)) << daemon_.log();
  EXPECT_GE(booked("delivered"), before + kept);
  EXPECT_TRUE(closes());
  for (const auto& [body, times] : taken()) EXPECT_EQ(times, 1);
}

TEST_F(OutboxOnADiskOfItsOwn, GoesTheUsualWayWhereItMayNotWrite) {
  settings(kOn);
  mount("size=256k", "mount -o remount,ro \"$DISK\"");
  start();
  TestClient client(daemon_.socketPath(), kTorvel, "plain");
  ASSERT_EQ(client.configure(), "live: httppost") << daemon_.log();
  EXPECT_TRUE(client.send(9, 1, Dictionary{{"text", "x"}}));
  EXPECT_NE(client.flush(), "flushed") << "the server's answer counts as without an outbox";
  EXPECT_TRUE(eventually([&] { return daemon_.logged("Outbox: Its file cannot be used for now"); }))
      << daemon_.log();
  EXPECT_TRUE(eventually([&] { return closes(); }));
  EXPECT_EQ(booked("outbox"), 0);
  EXPECT_GT(booked("dropped"), 0);
}

}  // namespace
}  // namespace kyt
