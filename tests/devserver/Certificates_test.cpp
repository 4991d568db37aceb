// The server's own certificate authority, seen by a client that trusts it and nothing else.
#include <curl/curl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <tuple>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

unsigned modeOf(const std::filesystem::path& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 ? status.st_mode & 0777 : 0;
}

TEST(Certificates, AreMadeAtTheFirstStartAndUsedAgainLater) {
  TemporaryFolder state;
  std::string authority, server;
  {
    ServerProcess first(state.path());
    ASSERT_TRUE(first.isReady());
    EXPECT_EQ(first.https("/").status, 404);
    authority = state.read("ca.pem");
    server = state.read("server.pem");
    EXPECT_EQ(first.stop(), 0) << first.errors();
  }
  EXPECT_NE(authority.find("BEGIN CERTIFICATE"), std::string::npos);
  ServerProcess second(state.path());
  ASSERT_TRUE(second.isReady());
  EXPECT_EQ(second.https("/").status, 404);
  EXPECT_EQ(state.read("ca.pem"), authority);
  EXPECT_EQ(state.read("server.pem"), server);
}

TEST(Certificates, KeysAndDatabaseBelongToTheOwnerAlone) {
  TemporaryFolder state;
  ServerProcess server(state.path());
  ASSERT_TRUE(server.isReady());
  EXPECT_EQ(modeOf(state.path() / "ca-key.pem"), 0600U);
  EXPECT_EQ(modeOf(state.path() / "server-key.pem"), 0600U);
  EXPECT_EQ(modeOf(state.path() / "devserver.sqlite"), 0600U);
  EXPECT_EQ(modeOf(state.path() / "ca.pem"), 0644U);
}

TEST(Certificates, AreVerifiedForNameAndAddressAndOnlyWithTheAuthority) {
  TemporaryFolder state, other;
  ServerProcess server(state.path());
  ASSERT_TRUE(server.isReady());
  const std::string port = std::to_string(server.httpsPort());
  Call call;
  call.ca = server.caFile();
  EXPECT_EQ(perform("https://localhost:" + port + "/", call).error, CURLE_OK);
  EXPECT_EQ(perform("https://127.0.0.1:" + port + "/", call).error, CURLE_OK);
  call.ca = "/etc/ssl/certs/ca-certificates.crt";
  EXPECT_EQ(perform("https://localhost:" + port + "/", call).error, CURLE_PEER_FAILED_VERIFICATION);
  ServerProcess stranger(other.path());
  ASSERT_TRUE(stranger.isReady());
  call.ca = stranger.caFile();
  EXPECT_EQ(perform("https://localhost:" + port + "/", call).error, CURLE_PEER_FAILED_VERIFICATION);
}

TEST(Certificates, AFurtherHostGetsANewServerCertificateFromTheSameAuthority) {
  TemporaryFolder state;
  { ASSERT_TRUE(ServerProcess(state.path()).isReady()); }
  const std::string authority = state.read("ca.pem"), before = state.read("server.pem");
  {
    ServerProcess server(state.path(), {"--host", "devbox.example", "--host", "10.1.2.3"});
    ASSERT_TRUE(server.isReady());
    EXPECT_EQ(server.https("/").status, 404);
  }
  EXPECT_EQ(state.read("ca.pem"), authority);
  EXPECT_NE(state.read("server.pem"), before);
}

TEST(Certificates, ADamagedKeyIsReplaced) {
  TemporaryFolder state;
  { ASSERT_TRUE(ServerProcess(state.path()).isReady()); }
  state.write("server-key.pem", "no key");
  ServerProcess server(state.path());
  ASSERT_TRUE(server.isReady());
  EXPECT_EQ(server.https("/").status, 404);
}

TEST(Certificates, OldVersionsOfTLSAreRefused) {
  TemporaryFolder state;
  ServerProcess server(state.path());
  ASSERT_TRUE(server.isReady());
  Call call;
  call.tlsAtMost = CURL_SSLVERSION_MAX_TLSv1_1;
  EXPECT_EQ(server.https("/", call).error, CURLE_SSL_CONNECT_ERROR);
  call.tlsAtMost = CURL_SSLVERSION_MAX_TLSv1_2;
  EXPECT_EQ(server.https("/", call).error, CURLE_OK);
}

TEST(StateFolder, IsUsedByOneServerAtATime) {
  TemporaryFolder state;
  ServerProcess first(state.path());
  ASSERT_TRUE(first.isReady());
  ServerProcess second(state.path());
  EXPECT_FALSE(second.isReady());
  EXPECT_NE(second.errors().find("another server uses the folder"), std::string::npos);
  EXPECT_EQ(first.https("/").status, 404);
}

TEST(StateFolder, ThatCannotBeMadeIsAClearError) {
  TemporaryFolder folder;
  folder.write("file", "");
  ServerProcess server(folder.path() / "file" / "state");
  EXPECT_FALSE(server.isReady());
  EXPECT_EQ(server.stop(), 1);
  EXPECT_NE(server.errors().find("can't use the folder"), std::string::npos) << server.errors();
}

TEST(CommandLine, ThatMakesNoSenseIsAClearError) {
  TemporaryFolder state;
  const std::tuple<std::vector<std::string>, int, const char*> cases[] = {
      {{"--digest-key", "xyz"}, 2, "--digest-key takes [CLIENT=]HEX"},
      {{"--host", "a,b"}, 2, "--host takes a name or an address"},
      {{"--listen", "nowhere"}, 1, "\"nowhere\" is no address to listen on"},
      {{"--ready-file", "/nowhere/at/all"}, 1, "can't write /nowhere/at/all"},
  };
  for (const auto& [options, status, text] : cases) {
    ServerProcess server(state.path(), options);
    EXPECT_FALSE(server.isReady());
    EXPECT_EQ(server.stop(), status);
    EXPECT_NE(server.errors().find(text), std::string::npos) << server.errors();
  }
}

TEST(CommandLine, APortInUseIsAClearError) {
  TemporaryFolder state, other;
  ServerProcess first(state.path());
  ASSERT_TRUE(first.isReady());
  ServerProcess second(other.path(), {"--listen", "127.0.0.1", "--max-age", "1"}, first.httpPort());
  EXPECT_FALSE(second.isReady());
  EXPECT_EQ(second.stop(), 1);
  EXPECT_NE(second.errors().find("Address already in use"), std::string::npos) << second.errors();
}

TEST(ReadyFile, HoldsThePorts) {
  TemporaryFolder state;
  ServerProcess server(state.path(), {"--ready-file", (state.path() / "ready.json").string()});
  ASSERT_TRUE(server.isReady());
  rapidjson::Document ready;
  ready.Parse(state.read("ready.json").c_str());
  ASSERT_TRUE(ready.IsObject());
  EXPECT_EQ(ready["https"].GetUint(), server.httpsPort());
  EXPECT_EQ(ready["http"].GetUint(), server.httpPort());
  EXPECT_TRUE(std::filesystem::equivalent(ready["ca"].GetString(), server.caFile()));
}

}  // namespace
}  // namespace kyt::devserver::test
