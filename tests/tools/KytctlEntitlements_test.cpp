// What "kytctl entitlements check" tells of clients and files, and its exit status.
#include <grp.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "tests/support/Eventually.h"
#include "tests/support/OrdinaryUser.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr char kYes[] = "\"com.vantu.private.kytreportingd\" = true\n";
constexpr char kNo[] = "\"com.vantu.private.kytreportingd\" = false\n";
constexpr uint32_t kUser = 54321, kGroup = 54322;

// A program of a file of its own, as somebody runs it.
class ClientProcess {
 public:
  // `before` runs in the new process, before the program does.
  template <typename Before>
  ClientProcess(std::string program, Before before) : program_(std::move(program)) {
    process_ = ::fork();
    if (process_ != 0) return;
    if (!before()) ::_exit(126);
    ::execl(program_.c_str(), program_.c_str(), "1000", nullptr);
    ::_exit(127);
  }
  explicit ClientProcess(std::string program) : ClientProcess(std::move(program), [] { return true; }) {}
  ~ClientProcess() {
    ::kill(process_, SIGKILL);
    ::waitpid(process_, nullptr, 0);
  }
  ClientProcess(const ClientProcess&) = delete;
  ClientProcess& operator=(const ClientProcess&) = delete;
  [[nodiscard]] std::string number() const { return std::to_string(process_); }
  [[nodiscard]] bool runs() const {
    return eventually([this] {
      std::error_code error;
      return std::filesystem::read_symlink("/proc/" + number() + "/exe", error) == program_;
    });
  }

 private:
  const std::string program_;
  pid_t process_ = 0;
};

class KytctlEntitlements : public ::testing::Test {
 protected:
  KytctlEntitlements() {
    ::chmod(root_.path().c_str(), 0755);
    std::filesystem::copy_file(std::filesystem::canonical("/bin/sleep"), root_ / "client");
    std::filesystem::create_directories(root_ / "var/lib/kytreportingd");
  }
  void grant(const std::string& name, const std::string& text) {
    root_.write("etc/kytreportingd/entitlements.d/" + name, "[[grant]]\n" + text);
  }
  [[nodiscard]] std::string file(const std::string& name) const {
    return root_ / "etc/kytreportingd/entitlements.d/" + name;
  }
  [[nodiscard]] ProgramRun check(const std::vector<std::string>& what) const {
    std::vector<std::string> arguments = {"--root", root_.path(), "entitlements", "check"};
    arguments.insert(arguments.end(), what.begin(), what.end());
    return runProgram(KYT_PROGRAMS "/kytctl", arguments);
  }
  [[nodiscard]] ProgramRun checkOf(const ClientProcess& client) const {
    return check({"--pid", client.number()});
  }
  static std::string own() { return std::to_string(::geteuid()); }

  TemporaryFolder root_;
};

#define EXPECT_SAYS(run, part) EXPECT_NE((run).text.find(part), std::string::npos) << (run).text
#define EXPECT_DOES_NOT_SAY(run, part) EXPECT_EQ((run).text.find(part), std::string::npos) << (run).text

TEST_F(KytctlEntitlements, TellsAClientThatIsServed) {
  grant("a.toml", "user = " + own() + "\nexecutable = \"" + (root_ / "client") + "\"\n" + kYes);
  const ClientProcess client(root_ / "client");
  ASSERT_TRUE(client.runs());
  const ProgramRun run = checkOf(client);
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_SAYS(run, "process " + client.number() + " runs " + (root_ / "client") + "\n");
  EXPECT_SAYS(run, file("a.toml") + "\n  line 1: com.vantu.private.kytreportingd = true\n");
  EXPECT_SAYS(run, "    user " + own() + ": matches\n");
  EXPECT_SAYS(run, "    executable \"" + (root_ / "client") + "\": matches: device ");
  EXPECT_SAYS(run, "    so it matches, and grants it\ngranted: this client is served\n");
}

TEST_F(KytctlEntitlements, TellsEachCriterionThatDiffersWithWhatTheClientHas) {
  grant("a.toml", std::string("user = 54399\ngroup = \"no-such-group\"\nexecutable = \"/bin/cat\"\n") +
                      "security_label = \"no such label\"\n" + kYes);
  const ClientProcess client(root_ / "client");
  ASSERT_TRUE(client.runs());
  const ProgramRun run = checkOf(client);
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, "    user 54399: does not match: the client is ");
  EXPECT_SAYS(run, "    group \"no-such-group\": does not match: there is no such group\n");
  EXPECT_SAYS(run, "    executable \"/bin/cat\": does not match: the client runs " + (root_ / "client") +
                       " (device ");
  EXPECT_SAYS(run, "    security_label \"no such label\": does not match: the client");
  EXPECT_SAYS(run, "    so it does not match\nrefused: no grant matches\n");
}

TEST_F(KytctlEntitlements, TellsHowNumbersAreWritten) {
  grant("a.toml", "user = \"" + own() + "\"\ngroup = \"0\"\n" + kYes);
  const ProgramRun quoted = check({"--user", own()});
  EXPECT_EQ(quoted.status, 1) << quoted.text;
  EXPECT_SAYS(quoted, "    user \"" + own() + "\": does not match: there is no such user\n      warning: \"" +
                          own() + "\" in quotes is a name; a number is written without: user = " + own() +
                          "\n");
  EXPECT_SAYS(quoted, "a number is written without: group = 0\n");
  grant("a.toml", "user = " + own() + "\n" + kYes);
  const ProgramRun number = check({"--user", own()});
  EXPECT_EQ(number.status, 0) << number.text;
  EXPECT_DOES_NOT_SAY(number, "warning");
}

TEST_F(KytctlEntitlements, CountsSupplementaryGroups) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give a process groups";
  const ClientProcess client(root_ / "client", [] {
    const gid_t groups[] = {kGroup + 1, kGroup};
    return ::setgroups(2, groups) == 0 && ::setresgid(kUser, kUser, kUser) == 0 &&
           ::setresuid(kUser, kUser, kUser) == 0;
  });
  ASSERT_TRUE(client.runs());
  grant("a.toml", "group = " + std::to_string(kGroup) + "\n" + kYes);
  EXPECT_EQ(checkOf(client).status, 0) << checkOf(client).text;
  grant("a.toml", "group = " + std::to_string(kGroup + 2) + "\n" + kYes);
  const ProgramRun run = checkOf(client);
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, "group 54324: does not match: the client is in 54321, 54322, 54323\n");
}

TEST_F(KytctlEntitlements, TellsThatAnUpdateReplacedTheProgramOfARunningClient) {
  grant("a.toml", "executable = \"" + (root_ / "client") + "\"\n" + kYes);
  const ClientProcess client(root_ / "client");
  ASSERT_TRUE(client.runs());
  ASSERT_EQ(checkOf(client).status, 0);
  std::filesystem::copy_file(root_ / "client", root_ / "client.new");
  std::filesystem::rename(root_ / "client.new", root_ / "client");
  const ProgramRun run = checkOf(client);
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, (root_ / "client") + " (deleted)");
  EXPECT_SAYS(run, "The client's file was replaced or removed since it was started: start it again\n");
  const ClientProcess next(root_ / "client");
  ASSERT_TRUE(next.runs());
  EXPECT_EQ(checkOf(next).status, 0);
}

TEST_F(KytctlEntitlements, ComparesTheSecurityLabel) {
  const ClientProcess client(root_ / "client");
  ASSERT_TRUE(client.runs());
  std::string label;
  std::ifstream current("/proc/" + client.number() + "/attr/current", std::ios::binary);
  std::getline(current, label);
  label = label.substr(0, label.find('\0'));
  grant("a.toml", "security_label = \"" + label + "x\"\n" + kYes);
  const ProgramRun run = checkOf(client);
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, label.empty() ? "the client has none" : "the client's is \"" + label + "\"");
  if (label.empty()) GTEST_SKIP() << "processes have no label here, so none can match";
  grant("a.toml", "security_label = \"" + label + "\"\n" + kYes);
  EXPECT_EQ(checkOf(client).status, 0);
}

TEST_F(KytctlEntitlements, NamesFilesThatCountForNothingAndWhy) {
  grant("a.toml", "user = " + own() + "\n" + kYes);
  ASSERT_EQ(::chmod(file("a.toml").c_str(), 0666), 0);
  root_.write("etc/kytreportingd/entitlements.d/b.toml", "[[grant]]\nuser = 1\n[[grant\n");
  grant("c.toml", "usr = 1\n" + std::string(kYes));
  grant("d.toml", kYes);
  grant("e.txt", "user = " + own() + "\n" + kYes);
  grant(".f.toml", "user = " + own() + "\n" + kYes);
  const ProgramRun run = check({"--user", own()});
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run,
              file("a.toml") +
                  ": others than root can write the file. It is ignored\n  its mode is 0666, its owner ");
  EXPECT_SAYS(run, file("b.toml") + ":3: ");
  EXPECT_SAYS(run, file("c.toml") +
                       ":2: \"usr\" is unknown; the nearest known one is \"user\". The grant is ignored\n");
  EXPECT_SAYS(run,
              file("d.toml") + ":1: a grant without user, group, executable and security_label is ignored\n");
  for (const char* name : {"e.txt", ".f.toml"})
    EXPECT_SAYS(run, file(name) + "\n  is not read: its name must end in .toml and not begin with a point\n");
}

TEST_F(KytctlEntitlements, GoesThroughSeveralFilesAndOneMatchSuffices) {
  grant("a.toml", "user = 54399\n" + std::string(kYes));
  grant("b.toml", "user = " + own() + "\n\"com.vantu.other\" = true\n");
  grant("c.toml", "user = " + own() + "\n" + kNo);
  ProgramRun run = check({"--user", own()});
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, "  line 1: grants other entitlements only\n");
  EXPECT_SAYS(run, "    so it matches, and that value is no\n");
  grant("d.toml", "user = " + own() + "\n" + kYes);
  run = check({"--user", own()});
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_LT(run.text.find(file("a.toml")), run.text.find(file("d.toml")));
}

TEST_F(KytctlEntitlements, CannotTellOfAUserWhatDependsOnTheProcess) {
  grant("a.toml", "user = " + own() + "\nexecutable = \"/bin/cat\"\n" + kYes);
  ProgramRun run = check({"--user", own()});
  EXPECT_EQ(run.status, 2) << run.text;
  EXPECT_SAYS(
      run,
      "executable \"/bin/cat\": cannot be judged: it depends on the process\n    so it cannot be judged\n");
  EXPECT_SAYS(run, "cannot tell: ");
  run = check({"--user", "54398"});
  EXPECT_EQ(run.status, 1) << "another criterion differs already: " << run.text;
}

TEST_F(KytctlEntitlements, ReadsTheFilesAsTheDaemonsUserDoes) {
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to read as another";
  grant("a.toml", "user = 0\n" + std::string(kYes));
  ASSERT_EQ(check({"--user", "0"}).status, 0);
  ASSERT_EQ(::chown((root_ / "var/lib/kytreportingd").c_str(), 33, 33), 0);  // www-data, whom each Debian has
  EXPECT_EQ(check({"--user", "0"}).status, 0);
  ASSERT_EQ(::chmod(file("a.toml").c_str(), 0600), 0);
  const ProgramRun run = check({"--user", "0"});
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, "files are read as the daemon's user, www-data (33)\n");
  EXPECT_SAYS(run, file("a.toml") + ": Permission denied. The file is ignored\n");
}

TEST_F(KytctlEntitlements, CannotTellWithoutAClient) {
  const pid_t ended = ::fork();
  if (ended == 0) ::_exit(0);
  ASSERT_EQ(::waitpid(ended, nullptr, 0), ended);
  const ProgramRun none = check({"--pid", std::to_string(ended)});
  EXPECT_EQ(none.status, 2);
  EXPECT_SAYS(none, "there is no process " + std::to_string(ended));
  const ProgramRun user = check({"--user", "no-such-user"});
  EXPECT_EQ(user.status, 2);
  EXPECT_SAYS(user, "there is no user \"no-such-user\"");
  for (const std::vector<std::string>& wrong :
       {std::vector<std::string>{}, {"--pid", "0"}, {"--pid", "x"}, {"--pid", "1", "--user", "0"}})
    EXPECT_EQ(check(wrong).status, 2);
}

TEST_F(KytctlEntitlements, WithoutFilesRefuses) {
  const ProgramRun run = check({"--user", own()});
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_SAYS(run, "entitlements.d: No such file or directory\n");
}

}  // namespace
}  // namespace kyt
