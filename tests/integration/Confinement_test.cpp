// The confinement of the real daemon: a plug-in of the test's, which is code in exactly the place that an
// intruder would have, tries what must not be; and the daemon starts on a kernel that is older than this one.
#include <gtest/gtest.h>
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <string>
#include <utility>

#include "platform/linux/base/Descriptors.h"
#include "platform/linux/confinement/LinuxConfinement.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/OldKernel.h"
#include "tests/support/attempts/Attempts.h"

namespace kyt {
namespace {

constexpr int kWithAdaptor = 7;

long landlockVersion() {
  return ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
}

class ConfinedDaemon : public StageTest {
 protected:
  void SetUp() override {
    lay();
    ::setenv("KYT_ATTEMPTS_ROOT", stage_->folder().c_str(), 1);
    root_ = stage_->folder();
    abstract_ = ownDescriptor(openAbstractSocketForAttempts(root_.c_str()));
    ASSERT_GE(abstract_.get(), 0);
    std::filesystem::create_directories(root_ + "/outside");
    std::ofstream(root_ + "/outside/file") << "o";
    const std::string bundle =
        root_ + "/System/Library/PrivateFrameworks/Cadmor.framework/Frameworks/TQSPerformance.framework";
    std::filesystem::create_directories(bundle);
    std::filesystem::copy_file(KYT_ATTEMPT_PLUGIN, bundle + "/TQSPerformance.so");
    ::chmod((bundle + "/TQSPerformance.so").c_str(), 0644);
    Dictionary backends = section({entry("adapting")});
    backends.set("qdx", Dictionary{});
    const auto problem = stage_->putStorebag("cadmor", Dictionary{{"version", "1"}, {"release", backends}});
    ASSERT_FALSE(problem) << problem->localizedDescription;
  }
  void TearDown() override {
    ::unsetenv("KYT_ATTEMPTS_ROOT");
    client_.reset();
    StageTest::TearDown();
  }
  // An event for the plug-in. Whether the daemon took it.
  bool order(const char* attempt) {
    client_ = std::make_unique<TestClient>(socket(), kWithAdaptor, "adapting");
    if (client_->configure() != "live: httppost qdx") return false;
    return client_->send(9, 200, Dictionary{{"attempt", attempt}});
  }
  [[nodiscard]] std::string outcomeOf(const Attempt& attempt) const {
    const std::string begin = std::string("attempt ") + attempt.name + ": ";
    const std::string log = daemonLog();
    const size_t at = log.find(begin);
    if (at == std::string::npos || log.find('\n', at) == std::string::npos) return "";
    return log.substr(at + begin.size(), log.find('\n', at) - at - begin.size());
  }
  static int expected(const Attempt& attempt) {
    if (attempt.landlock > landlockVersion()) return 0;
    // Under a sanitizer that call is there, for the leak check, but not for what lies outside the confinement.
    const bool tracing = std::string_view(attempt.name) == "traceAProcess";
    return tracing && LinuxConfinement::staysDumpable() ? EPERM : attempt.expected;
  }
  std::string root_;
  Descriptor abstract_;
  std::unique_ptr<TestClient> client_;  // stays: what it sent is lost when it ends before that has left
};

TEST_F(ConfinedDaemon, RefusesWhatItsPlugInTriesAndGoesOn) {
  startDaemon();
  int tried = 0;
  for (size_t i = 0; i < kAttemptCount; ++i) {
    const Attempt& attempt = kAttempts[i];
    if (expected(attempt) == kAttemptEndsTheProcess) continue;
    SCOPED_TRACE(attempt.name);
    ASSERT_TRUE(order(attempt.name)) << daemonLog();
    ASSERT_TRUE(eventually([&] { return !outcomeOf(attempt).empty(); })) << daemonLog();
    EXPECT_EQ(outcomeOf(attempt), std::to_string(expected(attempt)));
    ++tried;
  }
  EXPECT_GT(tried, 30);
}

TEST_F(ConfinedDaemon, EndsWhenItsPlugInTriesWhatOnlyAnIntruderWould) {
  for (size_t i = 0; i < kAttemptCount; ++i) {
    const Attempt& attempt = kAttempts[i];
    if (expected(attempt) != kAttemptEndsTheProcess) continue;
    SCOPED_TRACE(attempt.name);
    startDaemon();
    ASSERT_TRUE(order(attempt.name)) << daemonLog();
    ASSERT_EQ(stage_->daemon()->wait(std::chrono::seconds(30)), 128 + SIGSYS) << daemonLog();
    client_.reset();
    EXPECT_TRUE(logged(std::string("begins ") + attempt.name + "\n")) << daemonLog();
    EXPECT_EQ(outcomeOf(attempt), "");
  }
  startDaemon();  // the others were the last to end so
}

TEST_F(ConfinedDaemon, HasItsFiltersAndLimits) {
  startDaemon();
  const std::string process = "/proc/" + std::to_string(stage_->daemon()->pid());
  const std::string status = contents(process + "/status");
  EXPECT_NE(status.find("NoNewPrivs:\t1\n"), std::string::npos) << status;
  EXPECT_NE(status.find("Seccomp:\t2\n"), std::string::npos) << status;
  EXPECT_NE(status.find("Seccomp_filters:\t3\n"), std::string::npos) << status;
  const std::string limits = contents(process + "/limits");
  EXPECT_NE(limits.find("Max core file size        0                    0"), std::string::npos) << limits;
  if (LinuxConfinement::limitsAddressSpace()) {
    EXPECT_NE(limits.find("Max address space         68719476736          68719476736"), std::string::npos)
        << limits;
  }
}

class DaemonOnAnOldKernel : public ::testing::Test {
 protected:
  DaemonProcess daemon_{"http://127.0.0.1:9"};
  OldKernel kernel_;
};

TEST_F(DaemonOnAnOldKernel, StartsAndSaysWhatItCannotEnforce) {
  daemon_.setBeforeExecution([this] { kernel_.installHere(); });
  daemon_.start();
  kernel_.serve();
  ASSERT_TRUE(eventually([this] {
    return daemon_.logged("main: Listener resumes with sandbox, start loop.");
  })) << daemon_.log();
  for (const char* what :
       {"stop the cutting of files that may only be read by Landlock (6.2 can)",
        "stop the binding of TCP ports by Landlock (6.7 can)", "stop device controls by Landlock (6.10 can)",
        "stop signals and abstract sockets to processes outside by Landlock (6.12 can)",
        "tell which process is connected (6.5 can): grants that name an executable match nobody"}) {
    const std::string line = std::string("<6>confinement: this kernel cannot ") + what + "\n";
    EXPECT_TRUE(daemon_.logged(line)) << line << daemon_.log();
  }
  EXPECT_TRUE(kernel_.wasAskedForVersion());
  EXPECT_EQ(kernel_.refusedRulesets(), 0) << "rights that such a kernel does not know";
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(DaemonOnAnOldKernel, ServesClientsAndMatchesNoProgram) {
  const auto grant = [this](const std::string& criterion) {
    daemon_.root().write("etc/kytreportingd/entitlements.d/test.toml",
                         "[[grant]]\n" + criterion + "\n\"com.vantu.private.kytreportingd\" = true\n");
  };
  grant("executable = \"" + std::filesystem::read_symlink("/proc/self/exe").string() + "\"");
  daemon_.setBeforeExecution([this] { kernel_.installHere(); });
  daemon_.start();
  kernel_.serve();
  ASSERT_TRUE(eventually([this] { return daemon_.logged("start loop."); })) << daemon_.log();
  TestClient refused(daemon_.socketPath(), 5);
  refused->startConfiguration([](const auto&, const auto&) {});
  EXPECT_TRUE(eventually([this] {
    return daemon_.logged("does not have required kytreporting entitlement");
  })) << daemon_.log();
  EXPECT_TRUE(daemon_.logged(
      "<3>entitlements: Grants by executable cannot match: the kernel does not tell which process is "
      "connected\n"))
      << daemon_.log();
  refused.close();
  grant("user = " + std::to_string(::geteuid()));
  EXPECT_EQ(TestClient(daemon_.socketPath(), 5).configure(), "none") << daemon_.log();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

TEST_F(DaemonOnAnOldKernel, DoesNotRunOnOneThatCannotConfineIt) {
  const std::pair<void (*)(), const char*> kernels[] = {
      {takeLandlockAwayHere, "the kernel has no Landlock: Function not implemented"},
      {takeSeccompAwayHere, "seccomp: "}};
  for (const auto& [takeAway, why] : kernels) {
    daemon_.setBeforeExecution(takeAway);
    daemon_.start();
    EXPECT_EQ(daemon_.exitStatus(), 255) << daemon_.log();
    EXPECT_TRUE(daemon_.logged(std::string("<3>main: confine_init() fails: ") + why)) << daemon_.log();
    EXPECT_FALSE(std::filesystem::exists(daemon_.socketPath()));
  }
}

TEST_F(DaemonOnAnOldKernel, IsSilentOnOneThatCanAll) {
  ASSERT_TRUE(daemon_.startAndWait()) << daemon_.log();
  if (landlockVersion() < 6) GTEST_SKIP() << "this kernel's Landlock is older";
  EXPECT_FALSE(daemon_.logged("by Landlock")) << daemon_.log();
  daemon_.terminate();
  EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
}

}  // namespace
}  // namespace kyt
