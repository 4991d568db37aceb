// The administration socket of the built daemon, from outside: with the D-Bus tools that every system has, as root and as
// others.
#include <grp.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>
#include <vector>

#include "tests/integration/DaemonProcess.h"
#include "tests/support/Programs.h"

namespace kyt {
namespace {

constexpr char kName[] = "com.vantu.kytreportingd";
constexpr char kPath[] = "/com/vantu/kytreportingd";
constexpr char kInterface[] = "com.vantu.kytreportingd.Administration";
constexpr char kNobody[] = "65534";

class Window : public ::testing::Test {
 protected:
  void SetUp() override {
    if (!isInstalled("gdbus") || !isInstalled("busctl")) GTEST_SKIP() << "gdbus or busctl is not installed";
  }
  void start(const std::string& settings = {}) {
    if (!settings.empty()) daemon_.addSettings(settings);
    ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  }
  [[nodiscard]] std::string path() const { return daemon_.root() / "run/kytreportingd/admin"; }
  [[nodiscard]] ProgramRun call(const std::string& method, const std::vector<std::string>& launcher = {},
                                const std::vector<std::string>& arguments = {}) const {
    std::vector<std::string> all = launcher;
    all.insert(all.end(), {"gdbus", "call", "--address", "unix:path=" + path(), "--dest", kName,
                           "--object-path", kPath, "--method", std::string(kInterface) + "." + method});
    all.insert(all.end(), arguments.begin(), arguments.end());
    return runProgram(all[0], {all.begin() + 1, all.end()});
  }
  // As an ordinary user, in a group besides or in none.
  static std::vector<std::string> asNobody(const std::string& group = {}) {
    return {"setpriv", "--reuid=" + std::string(kNobody), "--regid=" + std::string(kNobody),
            group.empty() ? "--clear-groups" : "--groups=" + group};
  }
  // Others must get as far as the socket.
  void openTheWay() const {
    for (const char* folder : {"", "run", "run/kytreportingd"})
      std::filesystem::permissions(daemon_.root() / folder, std::filesystem::perms(0755));
  }
  [[nodiscard]] struct stat socket() const {
    struct stat status {};
    EXPECT_EQ(::stat(path().c_str(), &status), 0);
    return status;
  }

  DaemonProcess daemon_{"http://127.0.0.1:9"};
};

TEST_F(Window, AnswersGDBusAndBusctlAsTheyAre) {
  start();
  const ProgramRun status = call("Status");
  EXPECT_EQ(status.status, 0) << status.text << daemon_.log();
  EXPECT_NE(status.text.find("'pid': <int64 " + std::to_string(daemon_.process()) + ">"), std::string::npos)
      << status.text;
  for (const char* method : {"Sessions", "Books", "Storebags"}) {
    const ProgramRun rows = call(method);
    EXPECT_EQ(rows.status, 0) << rows.text;
  }
  const ProgramRun tree = runProgram("busctl", {"--address=unix:path=" + path(), "introspect", kName, kPath});
  EXPECT_EQ(tree.status, 0) << tree.text;
  for (const char* method : {".Status", ".Sessions", ".Books", ".Storebags", ".Metrics", ".SetLogLevel"})
    EXPECT_NE(tree.text.find(method), std::string::npos) << tree.text;
  EXPECT_EQ(tree.text.find("SendMessage"), std::string::npos) << tree.text;
  const ProgramRun level = call("SetLogLevel", {}, {"loud"});
  EXPECT_NE(level.text.find("InvalidArgs"), std::string::npos) << level.text;
}

TEST_F(Window, IsClosedToOthersWhereNoGroupIsNamed) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  start();
  openTheWay();
  EXPECT_EQ(socket().st_mode & 0777U, 0600U);
  const ProgramRun status = call("Status", asNobody());
  EXPECT_NE(status.status, 0);
  EXPECT_NE(status.text.find("Permission denied"), std::string::npos) << status.text;
}

TEST_F(Window, IsOpenToTheGroupThatTheSettingsName) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  const group* adm = ::getgrnam("adm");
  if (adm == nullptr) GTEST_SKIP() << "there is no group adm";
  start("[admin]\ngroup = \"adm\"\n");
  openTheWay();
  EXPECT_EQ(socket().st_mode & 0777U, 0660U);
  EXPECT_EQ(socket().st_gid, adm->gr_gid);
  const ProgramRun member = call("Status", asNobody(std::to_string(adm->gr_gid)));
  EXPECT_EQ(member.status, 0) << member.text;
  EXPECT_NE(call("Status", asNobody()).status, 0);
}

TEST_F(Window, LetsTheGroupWatchWithoutBodies) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  const group* adm = ::getgrnam("adm");
  if (adm == nullptr) GTEST_SKIP() << "there is no group adm";
  start("[admin]\ngroup = \"adm\"\n");
  openTheWay();
  const std::vector<std::string> member = asNobody(std::to_string(adm->gr_gid));
  const ProgramRun without = call("Watch", member, {"{'category': <uint16 5>}"});
  EXPECT_EQ(without.status, 0) << without.text;
  const ProgramRun bodies = call("Watch", member, {"{'bodies': <true>}"});
  EXPECT_NE(bodies.status, 0);
  EXPECT_NE(bodies.text.find("org.freedesktop.DBus.Error.AccessDenied: Only root and the daemon's own user "
                             "may see what is in events"),
            std::string::npos)
      << bodies.text;
  EXPECT_EQ(call("Watch", {}, {"{'bodies': <true>}"}).status, 0);
  const ProgramRun wrong = call("Watch", {}, {"{'kind': <5>}"});
  EXPECT_NE(wrong.text.find("InvalidArgs: the filter's keys are"), std::string::npos) << wrong.text;
}

TEST_F(Window, RefusesWhoeverReachesItInSpiteOfItsMode) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  start();
  openTheWay();
  std::filesystem::permissions(path(), std::filesystem::perms(0666));
  for (const char* method : {"Status", "Sessions", "Books", "Storebags", "Metrics"}) {
    const ProgramRun refused = call(method, asNobody());
    EXPECT_NE(refused.status, 0) << method;
    EXPECT_NE(
        refused.text.find("org.freedesktop.DBus.Error.AccessDenied: Only root, the daemon's own user may"),
        std::string::npos)
        << refused.text;
  }
  EXPECT_NE(call("SetLogLevel", asNobody(), {"error"}).status, 0);
  const ProgramRun watching = call("Watch", asNobody(), {"@a{sv} {}"});
  EXPECT_NE(watching.text.find("org.freedesktop.DBus.Error.AccessDenied"), std::string::npos)
      << watching.text;
  EXPECT_EQ(call("Status").status, 0);
}

TEST_F(Window, ServesWithoutTheGroupThatTheSystemDoesNotKnow) {
  start("[admin]\ngroup = \"no-such-group\"\n");
  EXPECT_TRUE(daemon_.logged("There is no group \"no-such-group\"")) << daemon_.log();
  EXPECT_EQ(socket().st_mode & 0777U, 0600U);
  EXPECT_EQ(call("Status").status, 0);
}

TEST_F(Window, IsOpenToRootWhereTheDaemonMayNotMakeASocketForTheGroup) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root";
  daemon_.addSettings("[admin]\ngroup = \"adm\"\n");
  ASSERT_EQ(runProgram("chown", {"-R", std::string(kNobody) + ":" + kNobody, daemon_.root().path()}).status,
            0);
  daemon_.setLauncher(asNobody());
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  EXPECT_TRUE(daemon_.logged("The group \"adm\" cannot look at the daemon: ")) << daemon_.log();
  EXPECT_EQ(socket().st_mode & 0777U, 0600U);
  const ProgramRun status = call("Status");
  EXPECT_EQ(status.status, 0) << status.text;
}

TEST_F(Window, KeepsNoDaemonFromEndingAndGoesWithIt) {
  daemon_.activateBySocket();
  start();
  const ProgramRun status = call("Status");
  EXPECT_EQ(status.status, 0) << status.text;
  // An open connection, which says nothing.
  const int looking = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  path().copy(address.sun_path, sizeof address.sun_path - 1);
  ASSERT_EQ(::connect(looking, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  ::close(looking);
  EXPECT_FALSE(std::filesystem::exists(path()));
}

}  // namespace
}  // namespace kyt
