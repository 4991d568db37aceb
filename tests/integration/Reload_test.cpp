// What a daemon that runs takes up of changed settings (SIGHUP), and what `kytreportingd --check-config` says beforehand.
#include <csignal>
#include <filesystem>
#include <fstream>
#include <regex>
#include <string>
#include <vector>

#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

class Reload : public StageTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.logLevel = "";  // the settings'
    lay(std::move(options));
    settings_ = contents(settingsFile());
    putBag("cadmor", {entry("person"), wifiOnly("wifi")});
  }
  [[nodiscard]] Dictionary wifiOnly(const std::string& name) const {
    Dictionary client = entry(name);
    client.set("use_wifi_only", 1);
    return client;
  }
  [[nodiscard]] std::string settingsFile() const {
    return stage_->folder() + "/etc/kytreportingd/kytreportingd.toml";
  }
  // The stage's settings, and these.
  void write(const std::string& further) {
    ASSERT_FALSE(tools::writeFile(settingsFile(), settings_ + further, 0644));
  }
  void reload() { stage_->daemon()->signal(SIGHUP); }
  void expectTold(const std::string& line) const {
    EXPECT_TRUE(eventually([&] { return logged("reload: " + line + "\n"); })) << line << "\n" << daemonLog();
  }
  [[nodiscard]] int send(const std::string& name, int category, const std::string& payload = "{}") const {
    return kytctl({"session", "-"},
                  R"({"do":"open","sessionInfo":{"SessionID":1,"ClientType":20,"BatchEvent":true,)"
                  R"("RequireUserInfo":true},"userInfo":{"ClientName":")" +
                      name + "\"}}\n{\"do\":\"configure\"}\n{\"do\":\"send\",\"category\":" +
                      std::to_string(category) + ",\"type\":1,\"payload\":" + payload +
                      "}\n{\"do\":\"finish\"}\n")
        .status;
  }

  std::string settings_;
};

TEST_F(Reload, TakesUpTheLogLevel) {
  startDaemon();
  EXPECT_EQ(send("person", 3), 0);
  EXPECT_TRUE(arrive("client=person&method=3", 1));
  EXPECT_FALSE(logged("<7>"));
  settings_ = std::regex_replace(settings_, std::regex("\\[log\\]\n"), "[log]\nlevel = \"debug\"\n");
  write("");
  reload();
  expectTold("log.level: taken up");
  EXPECT_EQ(send("person", 4), 0);
  EXPECT_TRUE(
      eventually([&] { return logged("<7>sendMessageWithDictionary: Sending message for session 1"); }));
}

TEST_F(Reload, TakesUpLimits) {
  startDaemon();
  write("[limits]\nmax_batch_bytes = 1000\n");
  reload();
  expectTold("limits.max_batch_bytes: taken up");
  EXPECT_EQ(send("person", 3, "{\"text\":\"" + std::string(4000, 'x') + "\"}"), 0);
  EXPECT_TRUE(eventually([&] { return logged("the batch of backend httppost is full (1000 bytes)"); }))
      << daemonLog();
}

TEST_F(Reload, TakesUpAUsersShares) {
  startDaemon();
  TestClient first(socket(), 20, "person");
  ASSERT_EQ(first.configure(), "live: httppost");
  write("[limits]\nmax_connections_per_user = 1\n");
  reload();
  expectTold("limits.max_connections_per_user: taken up");
  EXPECT_EQ(kytctl({"send", "--client-type", "20", "--category", "3", "--type", "4"}).status, 1)
      << "the user has one already";
  EXPECT_TRUE(first.finish());
}

TEST_F(Reload, TakesUpCellularInterfaces) {
  write("[network]\ncellular_interfaces = [\"lo\"]\n");
  startDaemon();
  EXPECT_EQ(send("wifi", 3), 0);
  write("");
  reload();
  expectTold("network.cellular_interfaces: taken up");
  EXPECT_EQ(send("wifi", 4), 0);
  EXPECT_TRUE(arrive("client=wifi&method=4", 1));
}

TEST_F(Reload, TakesUpTheCertificateAuthorities) {
  putBag("dulvek", {entry("person")});
  const std::string right = stage_->folder() + "/server/ca.pem",
                    wrong = stage_->folder() + "/server/other.pem";
  ASSERT_EQ(runProgram("openssl", {"req", "-x509", "-newkey", "rsa:2048", "-nodes", "-subj", "/CN=other",
                                   "-keyout", "/dev/null", "-out", wrong})
                .status,
            0);
  const std::string good = settings_;
  settings_ =
      std::regex_replace(settings_, std::regex("ca_file = \"[^\"]+\""), "ca_file = \"" + wrong + "\"");
  write("");
  startDaemon();
  EXPECT_EQ(kytctl({"send", "--client-type", "8", "--category", "3", "--type", "4"}).text,
            "storebag not available\n");
  settings_ = good;
  write("");
  reload();
  expectTold("tls.ca_file: taken up");
  EXPECT_EQ(send("person", 3), 0) << "another storebag, which was not asked for yet";
  EXPECT_TRUE(arrive("client=person&method=3", 1));
}

TEST_F(Reload, KeepsTheCertificateAuthoritiesWhereTheNewFileHasNone) {
  startDaemon();
  const std::string empty = stage_->folder() + "/server/empty.pem";
  ASSERT_FALSE(tools::writeFile(empty, "no certificate\n", 0644));
  const std::string good = settings_;
  const auto use = [&](const std::string& file) {
    settings_ = std::regex_replace(good, std::regex("ca_file = \"[^\"]+\""), "ca_file = \"" + file + "\"");
    write("");
    return kytctl({"reload", "--json"}).text;
  };
  EXPECT_EQ(use(empty), "{\"settings\":[\"tls.ca_file: not taken up: " + empty +
                            " holds no certificates that can be read\"]}\n");
  EXPECT_EQ(send("person", 3), 0);
  EXPECT_TRUE(arrive("client=person&method=3", 1)) << "those of before hold";
  const std::string missing = stage_->folder() + "/server/missing.pem";
  EXPECT_EQ(use(missing),
            "{\"settings\":[\"tls.ca_file: counts after a restart, the daemon that runs cannot read " +
                missing + ": No such file or directory\"]}\n");
  settings_ = good;
  write("");
  EXPECT_EQ(kytctl({"reload"}).text, "no setting has changed\n");
}

TEST_F(Reload, OfAnotherSettingLeavesTheLevelThatAnAdministratorHasSet) {
  startDaemon();
  EXPECT_EQ(kytctl({"log-level", "debug"}).text, "debug\n");
  write("[limits]\nmax_batch_bytes = 1000\n");
  EXPECT_EQ(kytctl({"reload"}).text, "limits.max_batch_bytes: taken up\n");
  EXPECT_EQ(kytctl({"log-level"}).text, "debug\n");
  settings_ = std::regex_replace(settings_, std::regex("\\[log\\]\n"), "[log]\nlevel = \"error\"\n");
  write("[limits]\nmax_batch_bytes = 1000\n");
  EXPECT_EQ(kytctl({"reload"}).text, "log.level: taken up\n");
  EXPECT_EQ(kytctl({"log-level"}).text, "error\n");
}

// What the unit's ExecReload does, without a service manager: its lines as they stand, with the process that it would name.
TEST_F(Reload, IsDoneByTheCommandsOfTheUnit) {
  startDaemon();
  std::ifstream unit(std::string(KYT_UNITS) + "/kytreportingd.service.in");
  std::vector<std::string> commands;
  for (std::string line; std::getline(unit, line);)
    if (line.starts_with("ExecReload=")) commands.push_back(line.substr(line.find('=') + 1));
  ASSERT_EQ(commands.size(), 2U);
  // The manager puts its variables in before a shell sees them; the daemon of this test has another root.
  const auto run = [&](std::string command) {
    command = std::regex_replace(command, std::regex("@KYT_PROGRAMS@/kytreportingd"),
                                 stage_->program("kytreportingd") + " --root " + stage_->folder());
    command = std::regex_replace(command, std::regex("\\$MAINPID"), std::to_string(stage_->daemon()->pid()));
    return runProgram("/bin/sh", {"-c", command}).status;
  };
  write("[limits]\nmax_batch_bytes = 1000\n");
  for (const std::string& command : commands) ASSERT_EQ(run(command), 0) << command;
  expectTold("limits.max_batch_bytes: taken up");
  write("[limits]\nmax_batch_byte = 1\n");
  EXPECT_NE(run(commands[0]), 0) << "a wrong file keeps the manager from the second";
}

TEST_F(Reload, TellsWhatWantsARestart) {
  startDaemon();
  settings_ = std::regex_replace(settings_, std::regex("level = 5"), "level = 6");
  write("[service]\nidle_exit_seconds = 7\nshutdown_grace_seconds = 4\n");
  reload();
  expectTold("compression.level: counts after a restart");
  expectTold("service.idle_exit_seconds: counts after a restart");
  expectTold("service.shutdown_grace_seconds: taken up");
  reload();
  EXPECT_TRUE(eventually([&] {
    const std::string log = daemonLog(), line = "reload: service.idle_exit_seconds: counts after a restart\n";
    return log.find(line) != log.rfind(line);
  })) << "as long as it differs from what the daemon runs with";
}

TEST_F(Reload, ChangesNothingWhenTheFileIsWrong) {
  startDaemon();
  write("[limits]\nmax_batch_bytes = 1000\nmax_conections = 5\n");
  reload();
  EXPECT_TRUE(eventually([&] {
    return logged(
        "unknown key \"limits.max_conections\"; the nearest known one is \"limits.max_connections\": "
        "nothing is taken up\n");
  })) << daemonLog();
  EXPECT_EQ(send("person", 3, "{\"text\":\"" + std::string(4000, 'x') + "\"}"), 0);
  EXPECT_TRUE(arrive("client=person&method=3", 1)) << "the limit of the wrong file does not count";
}

TEST_F(Reload, IsAskedForAndToldByKytctl) {
  EXPECT_EQ(kytctl({"reload"}).status, 3) << "no daemon runs";
  startDaemon();
  EXPECT_EQ(kytctl({"reload"}).text, "no setting has changed\n");
  write("[limits]\nmax_batch_bytes = 1000\n[service]\nidle_exit_seconds = 7\n");
  const std::string told =
      "limits.max_batch_bytes: taken up\nservice.idle_exit_seconds: counts after a restart\n";
  EXPECT_EQ(kytctl({"reload"}).text, told);
  EXPECT_EQ(kytctl({"reload", "--json"}).text,
            "{\"settings\":[\"service.idle_exit_seconds: counts after a restart\"]}\n");
  write("[limits]\nmax_batch_byte = 1\n");
  const ProgramRun wrong = kytctl({"reload"});
  EXPECT_EQ(wrong.status, 1);
  EXPECT_NE(wrong.text.find("; the nearest known one is \"limits.max_batch_bytes\": nothing is taken up\n"),
            std::string::npos)
      << wrong.text;
}

TEST_F(Reload, LeavesTheCommandLinesLevel) {
  stage_ = nullptr;
  lay();  // with --log-level default
  settings_ =
      std::regex_replace(contents(settingsFile()), std::regex("\\[log\\]\n"), "[log]\nlevel = \"debug\"\n");
  startDaemon();
  write("");
  reload();
  expectTold("log.level: the command line's counts");
  EXPECT_FALSE(logged("<7>"));
}

class CheckConfig : public Reload {
 protected:
  [[nodiscard]] ProgramRun check(std::vector<std::string> further = {}) const {
    further.insert(further.begin(), {"--root", stage_->folder(), "--check-config"});
    return runProgram(stage_->program("kytreportingd"), further);
  }
  void put(const std::string& path, const std::string& text) const {
    ASSERT_FALSE(tools::writeFile(stage_->folder() + path, text, 0644));
  }
  // Says so, and nothing else.
  void expectOnly(const std::string& problem) const {
    const ProgramRun run = check();
    EXPECT_EQ(run.status, 1);
    EXPECT_EQ(run.text, stage_->folder() + problem + "\n");
  }
};

TEST_F(CheckConfig, FindsNothingInAGoodConfiguration) {
  const ProgramRun run = check();
  EXPECT_EQ(run.text, "the configuration is good\n");
  EXPECT_EQ(run.status, 0);
  EXPECT_FALSE(std::filesystem::exists(stage_->folder() + "/run/kytreportingd/com.vantu.kytreportingd"))
      << "and starts nothing";
}

// A package's guide and what an editor left behind: a unit whose reload failed for them could never be reloaded.
TEST_F(CheckConfig, TakesNoFileThatIsNotReadForAMistake) {
  const std::string folder = stage_->folder() + "/etc/kytreportingd/entitlements.d/";
  ASSERT_FALSE(tools::writeFile(folder + "README", "How to grant", 0644));
  ProgramRun run = check();
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_EQ(run.text, "the configuration is good\n");
  ASSERT_FALSE(tools::writeFile(folder + "own.toml~", "[[grant]]", 0644));
  run = check();
  EXPECT_EQ(run.status, 0) << run.text;
  EXPECT_EQ(run.text, folder +
                          "own.toml~: is not read: its name must end in .toml and not begin with a point\n"
                          "the configuration is good\n");
}

TEST_F(CheckConfig, NamesEachMistakeOfTheSettingsWithItsLineAndTheNearestKey) {
  put("/etc/kytreportingd/kytreportingd.toml",
      settings_ + "[limits]\nmax_conections = 1\nmax_batch_bytes = 0\n");
  const ProgramRun run = check();
  EXPECT_EQ(run.status, 1);
  const std::string file = settingsFile();
  const long lines = std::count(settings_.begin(), settings_.end(), '\n');
  EXPECT_EQ(run.text, file + ":" + std::to_string(lines + 2) +
                          ": unknown key \"limits.max_conections\"; the nearest known one is "
                          "\"limits.max_connections\"\n" +
                          file + ":" + std::to_string(lines + 3) +
                          ": \"limits.max_batch_bytes\" must be a whole number of at least 1\n");
}

TEST_F(CheckConfig, LooksAtTheFileThatIsNamed) {
  put("/other.toml", "[storebag]\n");
  EXPECT_EQ(check({"--config", stage_->folder() + "/other.toml"}).status, 1);
}

TEST_F(CheckConfig, LooksAtGrantsDevicePropertiesUserDefaultsKeysAndCertificates) {
  put("/etc/kytreportingd/entitlements.d/b.toml",
      "[[grant]]\nuser = 1\nexcutable = \"/bin/true\"\n\"com.vantu.private.kytreportingd\" = true\n");
  expectOnly(
      "/etc/kytreportingd/entitlements.d/b.toml:3: \"excutable\" is unknown; the nearest known one is "
      "\"executable\". The grant is ignored");
  std::filesystem::remove(stage_->folder() + "/etc/kytreportingd/entitlements.d/b.toml");
  const std::string device = contents(stage_->folder() + "/etc/kytreportingd/device.toml");
  put("/etc/kytreportingd/device.toml", "ProductVersoin = \"1\"\n");
  expectOnly(
      "/etc/kytreportingd/device.toml:1: unknown key \"ProductVersoin\"; the nearest known one is "
      "\"ProductVersion\"");
  put("/etc/kytreportingd/device.toml", device);
  put("/var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml", "consent = \"yes\"\n");
  expectOnly(
      "/var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml:1: \"consent\" must be true or false");
  put("/var/lib/kytreportingd/defaults/com.vantu.diagnostics.toml", "consent = true\n");
  put("/var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml", "a = \"b\"\nenvironmentType = 5\n");
  expectOnly(
      "/var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml:2: \"environmentType\" must be a number from 0 to 4");
  std::filesystem::remove(stage_->folder() + "/var/lib/kytreportingd/defaults/com.vantu.kytreporting.toml");
  put("/usr/share/kytreporting/KYTReporting.bundle/publicKey2.der", "no key");
  expectOnly("/usr/share/kytreporting/KYTReporting.bundle/publicKey2.der: is no RSA public key in DER");
  std::filesystem::remove(stage_->folder() + "/usr/share/kytreporting/KYTReporting.bundle/publicKey2.der");
  put("/server/ca.pem", "no certificate");
  expectOnly("/server/ca.pem: holds no certificates that can be read (tls.ca_file)");
}

TEST_F(CheckConfig, LooksAtTheProfile) {
  const std::string profile = "/usr/share/kytreporting/com.vantu.kytreportingd.profile";
  put(profile, "raed = []\n" + contents(stage_->folder() + profile));
  const ProgramRun run = check();
  EXPECT_EQ(run.status, 1);
  EXPECT_TRUE(run.text.starts_with(stage_->folder() + profile + ":1: unknown key \"raed\"")) << run.text;
}

}  // namespace
}  // namespace kyt
