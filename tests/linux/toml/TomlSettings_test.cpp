#include "platform/linux/toml/TomlSettings.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>

#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

constexpr char kHosts[] =
    "[storebag]\ninternal_host = \"https://a.example\"\npublic_host = \"https://b.example\"\n";

Settings parsed(const std::string& text) {
  auto result = parseSettings(text, "k.toml");
  if (const auto* error = std::get_if<TomlError>(&result)) ADD_FAILURE() << error->text;
  return std::holds_alternative<Settings>(result) ? std::get<Settings>(result) : Settings{};
}

std::string errorOf(const std::string& text) {
  auto result = parseSettings(text, "k.toml");
  return std::holds_alternative<TomlError>(result) ? std::get<TomlError>(result).text : "no error";
}

TEST(TomlSettings, TheTwoHostsAreEnough) {
  const Settings settings = parsed(kHosts);
  EXPECT_EQ(settings.storebagInternalHost, "https://a.example");
  EXPECT_EQ(settings.storebagPublicHost, "https://b.example");
  EXPECT_EQ(settings.caFile, "");
  EXPECT_TRUE(settings.cellularInterfaces.empty());
  EXPECT_EQ(settings.logTarget, LogTarget::automatic);
  EXPECT_EQ(settings.compression, (CompressionSettings{CompressionLibrary::zlib, 6}));
  EXPECT_EQ(settings.adminGroup, "");
  EXPECT_EQ(settings.outbox, (OutboxSettings{false, 67108864, 1209600, 33554432}));
  const Limits defaults;
  EXPECT_EQ(settings.limits.maxMessageBytes, defaults.maxMessageBytes);
  EXPECT_EQ(settings.limits.maxSharedDataBytesPerUser, 16777216u);
  EXPECT_EQ(settings.limits.idleExitSeconds, 30);
}

TEST(TomlSettings, AShareOfAUserMayBeLeftToTheMachine) {
  const Settings settings = parsed(std::string(kHosts) + "[limits]\nmax_bytes_per_user = \"auto\"\n");
  EXPECT_EQ(settings.limits.maxBytesPerUser, std::nullopt);
  for (const char* wrong : {"0", "-1", "1.5", "\"all\"", "true"}) {
    const auto read = parseSettings(std::string(kHosts) + "[limits]\nmax_bytes_per_user = " + wrong, "f");
    ASSERT_TRUE(std::holds_alternative<TomlError>(read)) << wrong;
    EXPECT_NE(std::get<TomlError>(read).text.find("must be \"auto\" or a whole number of at least 1"),
              std::string::npos);
  }
}

TEST(TomlSettings, EveryKeyIsTaken) {
  const Settings settings = parsed(std::string(kHosts) + R"(
[tls]
ca_file = "/etc/ca.pem"
[network]
cellular_interfaces = ["wwan*", "ppp0"]
[limits]
max_message_bytes = 11
max_queued_bytes = 12
max_connections = 13
max_connections_per_user = 14
max_upload_bytes = 15
max_batch_bytes = 16
max_hierarchy_tokens_per_user = 17
max_shared_data_bytes_per_user = 18
max_bytes_per_user = 19
max_descriptors_per_user = 20
max_uploading_bytes_per_user = 21
max_custom_identifiers_per_user = 22
[service]
idle_exit_seconds = 1.5
shutdown_grace_seconds = 2
[log]
target = "stderr"
level = "debug"
[compression]
library = "libdeflate"
level = 9
[admin]
group = "adm"
[outbox]
enabled = true
max_bytes = 65536
max_age_seconds = 60
max_bytes_per_user = 65537
)");
  EXPECT_EQ(settings.logLevel, LogLevel::debug);
  EXPECT_EQ(settings.caFile, "/etc/ca.pem");
  EXPECT_EQ(settings.cellularInterfaces, (std::vector<std::string>{"wwan*", "ppp0"}));
  EXPECT_EQ(settings.limits.maxMessageBytes, 11u);
  EXPECT_EQ(settings.limits.maxQueuedBytes, 12u);
  EXPECT_EQ(settings.limits.maxConnections, 13u);
  EXPECT_EQ(settings.limits.maxConnectionsPerUser, 14u);
  EXPECT_EQ(settings.limits.maxUploadBytes, 15u);
  EXPECT_EQ(settings.limits.maxBatchBytes, 16u);
  EXPECT_EQ(settings.limits.maxHierarchyTokensPerUser, 17u);
  EXPECT_EQ(settings.limits.maxSharedDataBytesPerUser, 18u);
  EXPECT_EQ(settings.limits.maxBytesPerUser, 19u);
  EXPECT_EQ(settings.limits.maxDescriptorsPerUser, 20u);
  EXPECT_EQ(settings.limits.maxUploadingBytesPerUser, 21u);
  EXPECT_EQ(settings.limits.maxCustomIdentifiersPerUser, 22u);
  EXPECT_EQ(settings.limits.idleExitSeconds, 1.5);
  EXPECT_EQ(settings.limits.shutdownGraceSeconds, 2.0);
  EXPECT_EQ(settings.logTarget, LogTarget::standardError);
  EXPECT_EQ(settings.compression, (CompressionSettings{CompressionLibrary::libdeflate, 9}));
  EXPECT_EQ(settings.adminGroup, "adm");
  EXPECT_EQ(settings.outbox, (OutboxSettings{true, 65536, 60, 65537}));
}

TEST(TomlSettings, AHostsTrailingSlashIsDropped) {
  EXPECT_EQ(parsed("[storebag]\ninternal_host = 'http://localhost:80/'\npublic_host = 'https://b//'\n")
                .storebagInternalHost,
            "http://localhost:80");
}

TEST(TomlSettings, BothHostsAreRequired) {
  EXPECT_EQ(errorOf(""), "k.toml: \"storebag.internal_host\" is missing");
  EXPECT_EQ(errorOf("[storebag]\ninternal_host = 'https://a'\n"),
            "k.toml: \"storebag.public_host\" is missing");
}

TEST(TomlSettings, UnknownKeysAndSectionsAreErrorsWithTheirLine) {
  EXPECT_EQ(errorOf(std::string(kHosts) + "[limits]\nmax_message_byte = 1\n"),
            "k.toml:5: unknown key \"limits.max_message_byte\"; the nearest known one is "
            "\"limits.max_message_bytes\"");
  EXPECT_EQ(errorOf(std::string(kHosts) + "\n[limit]\n"),
            "k.toml:5: unknown section or key \"limit\"; the nearest known one is \"limits\"");
  EXPECT_EQ(errorOf(std::string(kHosts) + "\n[unheard]\n"), "k.toml:5: unknown section or key \"unheard\"");
  EXPECT_EQ(errorOf("log = 1\n" + std::string(kHosts)), "k.toml:1: \"log\" must be a section");
}

TEST(TomlSettings, ProblemsAreToldAllAtOnce) {
  const TemporaryFolder folder;
  const std::string path = folder.write("k.toml", std::string(kHosts) +
                                                      "[limits]\nmax_batch_byte = 1\nmax_connections = 0\n"
                                                      "[log]\nlevel = \"loud\"\n");
  std::vector<std::string> texts;
  for (const TomlError& problem : problemsOfSettings(path)) texts.push_back(problem.text.substr(path.size()));
  EXPECT_EQ(texts,
            (std::vector<std::string>{":5: unknown key \"limits.max_batch_byte\"; the nearest known one is "
                                      "\"limits.max_batch_bytes\"",
                                      ":6: \"limits.max_connections\" must be a whole number of at least 1",
                                      ":8: \"log.level\" must be \"debug\", \"default\" or \"error\""}));
  folder.write("k.toml", kHosts);
  EXPECT_TRUE(problemsOfSettings(path).empty());
}

TEST(TomlSettings, ChangesAreToldWithWhenTheyCount) {
  const Settings before = parsed(kHosts);
  EXPECT_TRUE(changedSettings(before, parsed(kHosts)).empty());
  const Settings after = parsed(std::string(kHosts) +
                                "[limits]\nmax_batch_bytes = 16\nmax_bytes_per_user = 19\n"
                                "[log]\nlevel = \"error\"\ntarget = \"stderr\"\n"
                                "[compression]\nlevel = 9\n");
  const std::vector<SettingChange> changes = changedSettings(before, after);
  Settings running = before;
  std::string told;
  for (const SettingChange& change : changes) {
    told += change.name + (change.taking == Taking::whileRunning ? " " : " (start) ");
    change.take(running, after);
  }
  EXPECT_EQ(
      told,
      "limits.max_bytes_per_user limits.max_batch_bytes log.target (start) log.level compression.level (start) ");
  EXPECT_EQ(running, after);
}

TEST(TomlSettings, WrongTypesAndNumbersOutOfRangeAreErrorsWithTheirLine) {
  const auto limit = [](const std::string& line) {
    return errorOf(std::string(kHosts) + "[limits]\n" + line + "\n");
  };
  const std::string count = "k.toml:5: \"limits.max_batch_bytes\" must be a whole number of at least 1";
  EXPECT_EQ(limit("max_batch_bytes = \"1\""), count);
  EXPECT_EQ(limit("max_batch_bytes = 0"), count);
  EXPECT_EQ(limit("max_batch_bytes = -5"), count);
  EXPECT_EQ(limit("max_batch_bytes = 1.0"), count);
  EXPECT_EQ(limit("max_message_bytes = 134217729"), "k.toml:5: \"limits.max_message_bytes\" is too large");
  const auto other = [](const std::string& lines) { return errorOf(std::string(kHosts) + lines); };
  EXPECT_NE(
      other("[service]\nidle_exit_seconds = -1\n").find("k.toml:5: \"service.idle_exit_seconds\" must be"),
      std::string::npos);
  EXPECT_NE(other("[service]\nidle_exit_seconds = nan\n").find("must be a number of seconds"),
            std::string::npos);
  EXPECT_EQ(other("[log]\ntarget = \"file\"\n"),
            "k.toml:5: \"log.target\" must be \"auto\", \"journal\" or \"stderr\"");
  EXPECT_EQ(other("[compression]\nlibrary = \"isal\"\n"),
            "k.toml:5: \"compression.library\" must be \"zlib\" or \"libdeflate\"");
  for (const char* level : {"0", "10", "-1", "5.0", "\"5\""})
    EXPECT_EQ(other(std::string("[compression]\nlevel = ") + level + "\n"),
              "k.toml:5: \"compression.level\" must be a whole number from 1 to 9");
  for (const char* group : {"4", "\"\"", "[]"})
    EXPECT_EQ(other(std::string("[admin]\ngroup = ") + group + "\n"),
              "k.toml:5: \"admin.group\" must be the name of a group");
  EXPECT_EQ(other("[outbox]\nenabled = 1\n"), "k.toml:5: \"outbox.enabled\" must be true or false");
  for (const char* bytes : {"0", "65535", "1099511627777", "true", "1e6"})
    EXPECT_EQ(other(std::string("[outbox]\nmax_bytes = ") + bytes + "\n"),
              "k.toml:5: \"outbox.max_bytes\" must be a whole number from 65536 to 1099511627776");
  EXPECT_EQ(other("[outbox]\nmax_age_seconds = 0\n"),
            "k.toml:5: \"outbox.max_age_seconds\" must be a whole number from 1 to 31536000");
  EXPECT_EQ(other("[tls]\nca_file = \"ca.pem\"\n"),
            "k.toml:5: \"tls.ca_file\" must be the absolute path of a file");
  EXPECT_EQ(other("[network]\ncellular_interfaces = \"wwan0\"\n"),
            "k.toml:5: \"network.cellular_interfaces\" must be an array of texts");
  EXPECT_NE(other("[network]\ncellular_interfaces = [1]\n").find("k.toml:5:"), std::string::npos);
}

TEST(TomlSettings, HostsMustBeAddresses) {
  const auto hostError = [](const std::string& host) {
    return errorOf("[storebag]\ninternal_host = \"" + host + "\"\npublic_host = 'https://b'\n");
  };
  for (const char* host : {"bags.example.org", "https://", "ftp://a", "https:///path", ""}) {
    EXPECT_EQ(hostError(host),
              "k.toml:2: \"storebag.internal_host\" must be an address like \"https://bags.example.org\"")
        << host;
  }
  EXPECT_EQ(hostError("https://a b"),
            "k.toml:2: \"storebag.internal_host\" must hold no blank and no control character");
}

TEST(TomlSettings, BrokenTextIsAnErrorWithItsLineInOnePlainLine) {
  const std::string error = errorOf("[storebag]\ninternal_host = \n");
  EXPECT_EQ(error.find("k.toml:2: "), 0u) << error;
  const std::string control = errorOf("[storebag]\n\x1b[2J = 1\n");
  EXPECT_EQ(control.find('\x1b'), std::string::npos) << control;
  EXPECT_EQ(control.find('\n'), std::string::npos) << control;
}

TEST(TomlSettings, StrayCharactersOfAnyScriptAreErrors) {
  // The whole area that the parser's test for blanks knows, and beyond.
  for (uint32_t c = 0xA1; c < 0x10000; ++c) {
    if (c >= 0xD800 && c < 0xE000) continue;
    std::string text = "[log]\ntarget";
    if (c < 0x800) {
      text += static_cast<char>(0xC0 | c >> 6);
    } else {
      text += static_cast<char>(0xE0 | c >> 12);
      text += static_cast<char>(0x80 | (c >> 6 & 0x3F));
    }
    text += static_cast<char>(0x80 | (c & 0x3F));
    ASSERT_EQ(errorOf(text + " = 1\n").find("k.toml:"), 0u) << std::hex << c;
  }
}

TEST(TomlSettings, ASectionsNameMustBeAKey) {
  for (char c = 1; c > 0; ++c) {
    const std::string name(1, c);
    const bool isKey = std::isalnum(static_cast<unsigned char>(c)) != 0 || c == '_' || c == '-';
    if (!isKey) {
      EXPECT_EQ(errorOf("[" + name + "]\n").find("k.toml:"), 0u) << static_cast<int>(c);
    }
  }
  EXPECT_EQ(errorOf("[`a]\n").find("k.toml:1: "), 0u);
}

TEST(TomlSettings, ControlCharactersAreErrors) {
  EXPECT_EQ(errorOf(std::string("[log]\n\0", 7)), "k.toml:2: a control character");
  EXPECT_EQ(errorOf("[log]\n# \x7f\n"), "k.toml:2: a control character");
}

TEST(TomlSettings, DeepNestingIsAnErrorAndNoOverflow) {
  EXPECT_NE(errorOf("a = " + std::string(100000, '[')).find("k.toml:1: "), std::string::npos);
  std::string dotted = "a";
  for (int i = 0; i < 100000; ++i) dotted += ".a";
  EXPECT_EQ(errorOf(dotted + " = 1"), "k.toml:1: too many dots");
}

TEST(TomlSettings, FilesThatCannotBeReadAreErrors) {
  const TemporaryFolder folder;
  const auto error = [](const std::string& path) { return std::get<TomlError>(readSettings(path)).text; };
  EXPECT_EQ(error(folder / "none.toml"), (folder / "none.toml") + ": No such file or directory");
  EXPECT_EQ(error(folder.path()), folder.path() + ": is no regular file");
  EXPECT_EQ(error(folder.write("big.toml", std::string(kMaxTomlBytes + 1, '#'))),
            (folder / "big.toml") + ": is too large");
  const auto good = readSettings(folder.write("good.toml", kHosts));
  EXPECT_TRUE(std::holds_alternative<Settings>(good));
}

TEST(TomlSettings, AFileThatOthersCanWriteIsAnError) {
  const TemporaryFolder folder;
  const std::string file = folder.write("settings.toml", kHosts);
  const auto isRefused = [&file] {
    const auto read = readSettings(file);
    const auto* error = std::get_if<TomlError>(&read);
    if (error == nullptr) return false;
    EXPECT_EQ(error->text, file + ": others than root and the daemon's user can write the file");
    return true;
  };
  for (const mode_t mode : {0664, 0646, 0666}) {
    ASSERT_EQ(::chmod(file.c_str(), mode), 0);
    EXPECT_TRUE(isRefused());
  }
  ASSERT_EQ(::chmod(file.c_str(), 0640), 0);
  EXPECT_FALSE(isRefused());
  if (::geteuid() != 0) GTEST_SKIP() << "needs root to give files away";
  ASSERT_EQ(::chown(file.c_str(), 1234, 0), 0);
  EXPECT_TRUE(isRefused());
}

}  // namespace
}  // namespace kyt
