// Uploaded files: where they go, what the answer says, and what is refused.
#include <gtest/gtest.h>
#include <zlib.h>

#include <filesystem>
#include <string>

#include "tests/devserver/ServerProcess.h"

namespace kyt::devserver::test {
namespace {

std::string gzip(const std::string& text) {
  z_stream stream = {};
  deflateInit2(&stream, -1, Z_DEFLATED, 31, 8, Z_DEFAULT_STRATEGY);
  std::string out(deflateBound(&stream, text.size()), '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  EXPECT_EQ(deflate(&stream, Z_FINISH), Z_STREAM_END);
  out.resize(stream.total_out);
  deflateEnd(&stream);
  return out;
}

class UploadsTest : public testing::Test {
 protected:
  Response upload(const std::string& query, const std::string& body = gzip("contents"),
                  const std::string& encoding = "Content-Encoding: gzip") const {
    return server_.post("/upload?" + query, body, {encoding});
  }
  TemporaryFolder state_;
  ServerProcess server_{state_.path()};
};

TEST_F(UploadsTest, AreKeptByDeviceSessionAndName) {
  const Response answer = upload("uuid=0a1b&sequence=77&description=x&filename=a%20b.log.gz&raw=true");
  EXPECT_EQ(answer.status, 200);
  EXPECT_EQ(answer.body, R"({"result":"success"})");
  EXPECT_EQ(state_.read("uploads/0a1b/77/a b.log"), "contents");
  const auto posts = server_.get("/api/posts");
  ASSERT_EQ(posts["posts"].Size(), 1u);
  EXPECT_STREQ(posts["posts"][0]["sender"].GetString(), "upload");
  EXPECT_STREQ(posts["posts"][0]["client"].GetString(), "a b.log.gz");
  EXPECT_STREQ(posts["posts"][0]["service"].GetString(), "0a1b");
  EXPECT_TRUE(posts["posts"][0]["good"].GetBool());
}

TEST_F(UploadsTest, AnswerWithoutTheWordWhenTold) {
  Call rule;
  rule.method = "PUT";
  rule.body = R"({"path":"/upload","body":"{\"result\":\"kept\"}"})";
  ASSERT_EQ(server_.http("/control/reply", rule).status, 200);
  EXPECT_EQ(upload("uuid=a&sequence=1&filename=f.gz").body, R"({"result":"kept"})");
  EXPECT_EQ(upload("uuid=a&sequence=1&filename=f.gz").body, R"({"result":"success"})");
  EXPECT_EQ(state_.read("uploads/a/1/f"), "contents");
}

TEST_F(UploadsTest, StayInTheirFolder) {
  for (const char* query :
       {"sequence=1&filename=f.gz", "uuid=a&filename=f.gz", "uuid=a&sequence=1",
        "uuid=a&sequence=1&filename=.gz", "uuid=..&sequence=1&filename=f.gz",
        "uuid=a&sequence=1&filename=..%2f..%2ff.gz", "uuid=a&sequence=%2ftmp&filename=f.gz",
        "uuid=a&sequence=1&filename=...gz", "uuid=a&sequence=1&filename=a%0ab.gz"}) {
    const Response answer = upload(query);
    EXPECT_EQ(answer.status, 400) << query;
    EXPECT_NE(answer.body.find("is missing or names no file"), std::string::npos) << answer.body;
  }
  EXPECT_FALSE(std::filesystem::exists(state_.path() / "uploads"));
}

TEST_F(UploadsTest, AreRefusedWhenTheyAreNoGzip) {
  EXPECT_EQ(upload("uuid=a&sequence=1&filename=f.gz", "contents").status, 400);
  EXPECT_EQ(upload("uuid=a&sequence=1&filename=f.gz", gzip("contents"), "X-Nothing: 1").status, 400);
  EXPECT_EQ(server_.https("/upload?uuid=a&sequence=1&filename=f.gz").status, 405);
  EXPECT_FALSE(std::filesystem::exists(state_.path() / "uploads"));
}

}  // namespace
}  // namespace kyt::devserver::test
