#include "receiver/Settings.h"

#include <gtest/gtest.h>

namespace kyt::receiver {
namespace {

const std::string kLeast = R"([log]
kind = "nats"
servers = ["nats://127.0.0.1:4222"]
[spool]
path = "/var/lib/kytreceiver"
[[path]]
url_path = "/v1/events"
)";

std::vector<std::string> errorsOf(const std::string& text) {
  const auto read = parseSettings(text, "r.toml");
  if (const auto* errors = std::get_if<SettingsErrors>(&read)) return errors->lines;
  return {};
}

TEST(ReceiverSettings, HaveDefaultsForAllButLogSpoolAndPath) {
  const auto read = parseSettings(kLeast, "r.toml");
  ASSERT_TRUE(std::holds_alternative<Settings>(read)) << errorsOf(kLeast).front();
  const auto& settings = std::get<Settings>(read);
  EXPECT_EQ(settings.listen, (ListenAddress{"127.0.0.1", 8480}));
  EXPECT_FALSE(settings.metrics);
  EXPECT_EQ(settings.log.stream, "kyt-events");
  EXPECT_EQ(settings.log.partitions, 1U);
  EXPECT_EQ(settings.log.publishTime, std::chrono::seconds(2));
  EXPECT_EQ(settings.log.maxAge, std::chrono::hours(7 * 24));
  EXPECT_EQ(settings.spoolMaxBytes, 1073741824U);
  EXPECT_EQ(settings.maxBodyBytes, 17825792U);
  EXPECT_EQ(settings.bodyTime, std::chrono::seconds(60));
  EXPECT_EQ(settings.idleTime, std::chrono::seconds(75));
  EXPECT_EQ(settings.paths.at(0).digest, DigestPolicy::none);
}

TEST(ReceiverSettings, ReadEverySetting) {
  const auto read = parseSettings(R"(listen = "[::1]:1"
metrics = "127.0.0.1:9480"
certificate = "/etc/c.pem"
key = "/etc/k.pem"
[log]
kind = "kafka"
servers = ["a:1", "b:2"]
stream = "other"
partitions = 12
publish_seconds = 0.5
ca_file = "/etc/ca.pem"
credentials = "/etc/creds"
replicas = 3
max_bytes = 1073741824
max_age_seconds = 86400
[spool]
path = "/s"
max_bytes = 2097152
[limits]
max_body_bytes = 4096
body_seconds = 5
idle_seconds = 7
[[path]]
url_path = "/a"
digest = "required"
digest_keys = { "QPW/videocall" = ["00fF", "11ee"] }
[[path]]
url_path = "/b"
digest = "optional"
)",
                                  "r.toml");
  ASSERT_TRUE(std::holds_alternative<Settings>(read)) << std::get<SettingsErrors>(read).lines.front();
  const auto& settings = std::get<Settings>(read);
  EXPECT_EQ(settings.listen, (ListenAddress{"::1", 1}));
  EXPECT_EQ(settings.metrics, (ListenAddress{"127.0.0.1", 9480}));
  EXPECT_EQ(settings.certificateFile + settings.keyFile, "/etc/c.pem/etc/k.pem");
  EXPECT_EQ(settings.log.kind, LogKind::kafka);
  EXPECT_EQ(settings.log.servers, (std::vector<std::string>{"a:1", "b:2"}));
  EXPECT_EQ(settings.log.stream, "other");
  EXPECT_EQ(settings.log.partitions, 12U);
  EXPECT_EQ(settings.log.publishTime, std::chrono::milliseconds(500));
  EXPECT_EQ(settings.log.maxAge, std::chrono::hours(24));
  EXPECT_EQ(settings.log.caFile + settings.log.credentials, "/etc/ca.pem/etc/creds");
  EXPECT_EQ(settings.log.replicas, 3);
  EXPECT_EQ(settings.log.maxBytes, 1073741824);
  EXPECT_EQ(settings.spoolPath, "/s");
  EXPECT_EQ(settings.spoolMaxBytes, 2097152U);
  EXPECT_EQ(settings.maxBodyBytes, 4096U);
  EXPECT_EQ(settings.bodyTime, std::chrono::seconds(5));
  EXPECT_EQ(settings.idleTime, std::chrono::seconds(7));
  ASSERT_EQ(settings.paths.size(), 2U);
  EXPECT_EQ(settings.paths[0].digest, DigestPolicy::required);
  EXPECT_EQ(settings.paths[0].digestKeys.at("QPW/videocall"),
            (std::vector<std::string>{{"\0\xff", 2}, "\x11\xee"}));
  EXPECT_EQ(settings.paths[1].digest, DigestPolicy::optional);
}

struct Mistake {
  const char* name;
  std::string text, error;
};

class MistakenReceiverSettings : public ::testing::TestWithParam<Mistake> {};

TEST_P(MistakenReceiverSettings, AreToldWithFileAndLine) {
  const std::vector<std::string> errors = errorsOf(GetParam().text);
  ASSERT_EQ(errors.size(), 1U) << errors.size();
  EXPECT_EQ(errors.front(), GetParam().error);
}

std::string with(const std::string& from, const std::string& to) {
  std::string text = kLeast;
  return text.replace(text.find(from), from.size(), to);
}

TEST(ReceiverSettings, TakesEachFormOfAServersAddress) {
  for (const char* server : {"nats://a", "tls://a:1", "a:4222", "nats://name:p@ss@a.example.org:4222",
                             "nats://[::1]:4222", "nats://[::1]", "nats://token@a"}) {
    const auto read = parseSettings(with("nats://127.0.0.1:4222", server), "r.toml");
    EXPECT_TRUE(std::holds_alternative<Settings>(read)) << server;
  }
}

INSTANTIATE_TEST_SUITE_P(
    Each, MistakenReceiverSettings,
    ::testing::Values(
        Mistake{"kind", with("\"nats\"", "\"mqtt\""), R"(r.toml:2: "log.kind" must be "nats" or "kafka")"},
        Mistake{"servers", with("[\"nats://127.0.0.1:4222\"]", "[]"),
                R"(r.toml:3: "log.servers" must be an array of texts, of one at least)"},
        Mistake{
            "scheme", with("nats://127", "http://127"),
            R"(r.toml:3: "log.servers" must hold addresses as "nats://10.0.0.1:4222" or "tls://10.0.0.1:4222")"},
        Mistake{
            "port", with(":4222", ":66000"),
            R"(r.toml:3: "log.servers" must hold addresses as "nats://10.0.0.1:4222" or "tls://10.0.0.1:4222")"},
        Mistake{
            "host", with("nats://127.0.0.1:4222", "::::"),
            R"(r.toml:3: "log.servers" must hold addresses as "nats://10.0.0.1:4222" or "tls://10.0.0.1:4222")"},
        Mistake{"query", with("/v1/events", "/v1/events?a"),
                R"(r.toml:7: "path.url_path" may hold no "?" and no "#": no post has such a path)"},
        Mistake{"unknown", kLeast + "digset = \"none\"\n",
                R"(r.toml:8: "path.digset" is no setting; did you mean "digest"?)"},
        Mistake{"required", kLeast + "digest = \"required\"\n", R"(r.toml:6: "path.digest_keys" is missing)"},
        Mistake{
            "key", kLeast + "digest_keys = { \"A/b\" = [\"0g\"] }\n",
            R"(r.toml:8: "path.digest_keys.A/b" must hold keys as hexadecimal digits, two for each byte)"},
        Mistake{"twice", kLeast + "[[path]]\nurl_path = \"/v1/events\"\n",
                R"(r.toml:8: "path.url_path" is there twice)"},
        Mistake{"relative", with("\"/var/lib/kytreceiver\"", "\"spool\""),
                R"(r.toml:5: "spool.path" must be an absolute path)"},
        Mistake{"listen", "listen = \"8480\"\n" + kLeast,
                R"(r.toml:1: "listen" must be an address and a port, as "127.0.0.1:8480")"},
        Mistake{"seconds", with("[spool]", "publish_seconds = 4.1\n[spool]"),
                R"(r.toml:4: "log.publish_seconds" must be a number of seconds, from 0.05 to 4)"},
        Mistake{"certificate", "certificate = \"/c\"\n" + kLeast, R"(r.toml: "key" is missing)"},
        Mistake{"stream", with("[spool]", "stream = \"a.b\"\n[spool]"),
                R"(r.toml:4: "log.stream" may hold letters, digits, "-" and "_")"}),
    [](const auto& test) { return std::string(test.param.name); });

}  // namespace
}  // namespace kyt::receiver
