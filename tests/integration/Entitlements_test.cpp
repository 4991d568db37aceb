// Who is served, by the real daemon with its real helpers: grants by program, changed files, and the line about a refusal.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "platform/linux/base/Descriptors.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/TestClient.h"
#include "tests/support/Programs.h"

namespace kyt {
namespace {

class EntitlementsOfADaemon : public ::testing::Test {
 protected:
  void grant(const std::string& criteria) {
    daemon_.root().write(
        "etc/kytreportingd/entitlements.d/test.toml",
        criteria.empty() ? "" : "[[grant]]\n" + criteria + "\n\"com.vantu.private.kytreportingd\" = true\n");
  }
  [[nodiscard]] bool isServed() const { return TestClient(daemon_.socketPath(), 5).configure() == "none"; }
  // Waits for the end of a connection that says nothing: that of a refused one.
  [[nodiscard]] bool isRefused() const {
    const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    daemon_.socketPath().copy(address.sun_path, sizeof address.sun_path - 1);
    if (::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
      return false;
    const timeval patience = {20, 0};  // less than the daemon waits for a handshake
    ::setsockopt(socket.get(), SOL_SOCKET, SO_RCVTIMEO, &patience, sizeof patience);
    char byte = 0;
    return ::recv(socket.get(), &byte, 1, 0) == 0;
  }
  [[nodiscard]] ProgramRun check() const {
    return runProgram(KYT_PROGRAMS "/kytctl", {"--root", daemon_.root().path(), "entitlements", "check",
                                               "--pid", std::to_string(::getpid())});
  }
  static std::string ownProgram() { return std::filesystem::read_symlink("/proc/self/exe").string(); }
  void TearDown() override {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }

  DaemonProcess daemon_{"http://127.0.0.1:9"};
};

TEST_F(EntitlementsOfADaemon, ChangedFilesCountForTheNextConnectionAndKytctlTellsTheSame) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  for (int round = 0; round < 3; ++round) {
    grant("user = " + std::to_string(::geteuid()));
    EXPECT_TRUE(isServed()) << daemon_.log();
    EXPECT_EQ(check().status, 0) << check().text;
    grant(round == 1 ? "" : "user = 54399");
    EXPECT_TRUE(isRefused()) << daemon_.log();
    EXPECT_EQ(check().status, 1) << check().text;
  }
}

TEST_F(EntitlementsOfADaemon, AProgramIsGrantedByItsFile) {
  grant("executable = \"" + ownProgram() + "\"");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  if (!isServed()) {
    ASSERT_TRUE(daemon_.logged("entitlements: Grants by executable cannot match: ")) << daemon_.log();
    GTEST_SKIP() << "kernel or privilege does not tell which program a client runs here";
  }
  EXPECT_EQ(check().status, 0) << check().text;
  grant("executable = \"/bin/true\"");
  EXPECT_TRUE(isRefused()) << daemon_.log();
  EXPECT_EQ(check().status, 1) << check().text;
}

TEST_F(EntitlementsOfADaemon, TheLineAboutARefusalNamesTheClientAndTheCommandThatTellsWhy) {
  grant("user = 54399");
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  ASSERT_TRUE(isRefused()) << daemon_.log();
  const std::string pid = std::to_string(::getpid());
  const std::string client = "of process " + pid + ", user " + std::to_string(::geteuid());
  const std::string command = ", see \"kytctl entitlements check --pid " + pid +
                              "\", does not have required kytreporting entitlement. Closing connection...\n";
  ASSERT_TRUE(eventually([&] { return daemon_.logged(command); })) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("<7>listener: new VRP connection 1 " + client)) << daemon_.log();
  // Known where the helper may look at this process, which keeps its program while the line is made.
  EXPECT_TRUE(daemon_.logged(client + " (" + ownProgram() + ")" + command) ||
              daemon_.logged(client + command))
      << daemon_.log();
}

}  // namespace
}  // namespace kyt
