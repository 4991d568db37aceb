// Storebags as a device fetches them: conditional requests, lifetimes, changes.
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <openssl/pem.h>

#include <algorithm>
#include <cctype>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

class StorebagsTest : public testing::Test {
 protected:
  StorebagsTest() {
    bags_.write("cadmor.plist", "<plist>one</plist>");
    server_ = std::make_unique<ServerProcess>(
        state_.path(), std::vector<std::string>{"--bags", bags_.path().string(), "--max-age", "120"});
  }
  void SetUp() override { ASSERT_TRUE(server_->isReady()) << server_->errors(); }

  [[nodiscard]] Response fetch(const std::string& path, const std::string& ifModifiedSince = {}) const {
    Call call;
    if (!ifModifiedSince.empty()) call.headers = {"If-Modified-Since: " + ifModifiedSince};
    return server_->https(path, call);
  }

  TemporaryFolder state_, bags_;
  std::unique_ptr<ServerProcess> server_;
};

TEST_F(StorebagsTest, AreServedOnBothPathsWithTheirLifetime) {
  for (const char* path : {"/storebags/tolvar/cadmor?version=8.0", "/bags/tolvar/cadmor?version=9.1"}) {
    const Response response = fetch(path);
    EXPECT_EQ(response.status, 200);
    EXPECT_EQ(response.body, "<plist>one</plist>");
    EXPECT_EQ(response.header("cache-control"), "max-age=120");
    EXPECT_TRUE(response.header("last-modified").ends_with(" GMT")) << response.header("last-modified");
  }
  EXPECT_EQ(server_->http("/bags/tolvar/cadmor").status, 200);
}

TEST_F(StorebagsTest, ThatDidNotChangeAreAnswered304WithLastModifiedAndNoBody) {
  const std::string lastModified = fetch("/bags/tolvar/cadmor").header("last-modified");
  const Response again = fetch("/bags/tolvar/cadmor", lastModified);
  EXPECT_EQ(again.status, 304);
  EXPECT_EQ(again.body, "");
  EXPECT_EQ(again.header("last-modified"), lastModified);
  EXPECT_EQ(again.header("content-length"), "18");  // of what a 200 would carry
  EXPECT_EQ(again.header("cache-control"), "max-age=120");
  EXPECT_EQ(fetch("/bags/tolvar/cadmor", "Thu, 01 Jan 1970 00:00:00 GMT").status, 200);
}

TEST_F(StorebagsTest, ThatChangedWithinTheSameSecondAreServedAnew) {
  std::string lastModified = fetch("/bags/tolvar/cadmor").header("last-modified");
  for (const char* content : {"<plist>two</plist>", "<plist>three</plist>", "<plist>four!</plist>"}) {
    const auto before = std::filesystem::last_write_time(bags_.path() / "cadmor.plist");
    bags_.write("cadmor.plist", content);
    // Whatever the clock says, the file's time stays within the second; only the nanoseconds tell.
    std::filesystem::last_write_time(bags_.path() / "cadmor.plist", before + std::chrono::nanoseconds(1));
    const Response changed = fetch("/bags/tolvar/cadmor", lastModified);
    EXPECT_EQ(changed.status, 200);
    EXPECT_EQ(changed.body, content);
    EXPECT_NE(changed.header("last-modified"), lastModified);
    lastModified = changed.header("last-modified");
  }
  EXPECT_EQ(fetch("/bags/tolvar/cadmor", lastModified).status, 304);
}

TEST_F(StorebagsTest, FileBesideTheBagOverridesTheHeaders) {
  bags_.write("cadmor.toml", "max_age = 7\n");
  EXPECT_EQ(fetch("/bags/tolvar/cadmor").header("cache-control"), "max-age=7");
  bags_.write("cadmor.toml", "cache_control = 'public, max-age=600'\nlast_modified = false\n");
  const Response response = fetch("/bags/tolvar/cadmor");
  EXPECT_EQ(response.header("cache-control"), "public, max-age=600");
  EXPECT_EQ(response.header("last-modified"), "");
  bags_.write("cadmor.toml", "this is no TOML");
  EXPECT_EQ(fetch("/bags/tolvar/cadmor").header("cache-control"), "max-age=120");
  server_->stop();
  EXPECT_NE(server_->errors().find("cadmor.toml is no TOML"), std::string::npos);
}

TEST_F(StorebagsTest, NothingBesideTheFolderIsServed) {
  state_.write("outside.plist", "secret");
  for (const std::string path :
       {"/bags/tolvar/none", "/bags/tolvar/", "/bags/tolvar", "/bags/tolvar/cadmor.plist",
        "/bags/tolvar/../cadmor", "/bags/tolvar/%2e%2e%2foutside", "/bags/tolvar/x/cadmor",
        "/bags/other/cadmor", "/storebags/tolvarcadmor"}) {
    EXPECT_EQ(fetch(path).status, 404) << path;
  }
  std::filesystem::create_directory(bags_.path() / "folder.plist");
  EXPECT_EQ(fetch("/bags/tolvar/folder").status, 404);
  Call call;
  call.method = "DELETE";
  EXPECT_EQ(server_->https("/bags/tolvar/cadmor", call).status, 405);
}

std::string elementAfter(const std::string& key, const std::string& plist) {
  const size_t begin = plist.find("<string>", plist.find("<key>" + key + "</key>")) + 8;
  return plist.substr(begin, plist.find("</string>", begin) - begin);
}

std::string fromBase64(std::string text) {
  std::erase_if(text, [](unsigned char c) { return std::isspace(c) != 0; });
  std::string bytes(text.size(), '\0');
  const int size =
      EVP_DecodeBlock(reinterpret_cast<unsigned char*>(bytes.data()),
                      reinterpret_cast<const unsigned char*>(text.data()), static_cast<int>(text.size()));
  const auto padding = std::count(text.begin(), text.end(), '=');
  bytes.resize(size < 0 ? 0 : static_cast<size_t>(size - padding));
  return bytes;
}

TEST(UnsignedStorebags, AreSignedWithTheKeyAndServed) {
  TemporaryFolder state, bags;
  const std::unique_ptr<EVP_PKEY, void (*)(EVP_PKEY*)> key(EVP_RSA_gen(2048), EVP_PKEY_free);
  const std::string keyFile = bags.path() / "private.pem";
  FILE* file = fopen(keyFile.c_str(), "w");
  ASSERT_NE(file, nullptr);
  PEM_write_PrivateKey(file, key.get(), nullptr, nullptr, 0, nullptr, nullptr);
  fclose(file);
  bags.write("cadmor.bag.toml", "version = '1'\n[release]\n");
  ServerProcess server(state.path(), {"--bags", bags.path().string(), "--sign-key", keyFile});
  ASSERT_TRUE(server.isReady());
  const Response response = server.https("/bags/tolvar/cadmor");
  ASSERT_EQ(response.status, 200) << response.body;
  const std::string bag = fromBase64(elementAfter("bag", response.body));
  const std::string signature = fromBase64(elementAfter("signature", response.body));
  EXPECT_NE(bag.find("<key>release</key>"), std::string::npos) << bag;
  const std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  ASSERT_EQ(EVP_DigestVerifyInit(context.get(), nullptr, EVP_sha1(), nullptr, key.get()), 1);
  EXPECT_EQ(
      EVP_DigestVerify(context.get(), reinterpret_cast<const unsigned char*>(signature.data()),
                       signature.size(), reinterpret_cast<const unsigned char*>(bag.data()), bag.size()),
      1);
  bags.write("cadmor.bag.toml", "version = ");
  EXPECT_EQ(server.https("/bags/tolvar/cadmor").status, 500);
  EXPECT_TRUE(server.https("/bags/tolvar/cadmor").body.starts_with("cadmor.bag.toml: "));
  bags.write("cadmor.plist", "signed already");
  EXPECT_EQ(server.https("/bags/tolvar/cadmor").body, "signed already");
}

TEST_F(StorebagsTest, WithoutAKeyUnsignedBagsAreNotServed) {
  bags_.write("other.bag.toml", "version = '1'\n");
  EXPECT_EQ(fetch("/bags/tolvar/other").status, 404);
  EXPECT_EQ(fetch("/bags/tolvar/other.bag").status, 404);
}

TEST_F(StorebagsTest, FetchesAreLogged) {
  const std::string lastModified = fetch("/storebags/tolvar/cadmor?version=8.0").header("last-modified");
  EXPECT_EQ(fetch("/bags/tolvar/cadmor", lastModified).status, 304);
  EXPECT_EQ(fetch("/bags/tolvar/none").status, 404);
  const auto log = server_->get("/api/storebags?since=0");
  const auto& fetches = log["fetches"];
  ASSERT_EQ(fetches.Size(), 3U);
  EXPECT_STREQ(fetches[0]["name"].GetString(), "cadmor");
  EXPECT_STREQ(fetches[0]["version"].GetString(), "8.0");
  EXPECT_EQ(fetches[0]["status"].GetInt(), 200);
  EXPECT_EQ(fetches[1]["status"].GetInt(), 304);
  EXPECT_EQ(fetches[1]["ifModifiedSince"].GetString(), lastModified);
  EXPECT_EQ(fetches[2]["status"].GetInt(), 404);
  EXPECT_EQ(server_->get("/api/totals")["fetches"].GetInt(), 3);
}

}  // namespace
}  // namespace kyt::devserver::test
