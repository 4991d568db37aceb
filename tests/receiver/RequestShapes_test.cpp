// Requests whose end can be read in two ways, as somebody writes them who wants a proxy in front to see others than we do.
#include <string>
#include <vector>

#include "tests/receiver/ReceiverTest.h"

namespace kyt::receiver {
namespace {

using RequestShapes = ReceiverTest;

constexpr const char* kFirst = "POST /v1/events HTTP/1.1\r\nHost: t\r\n";
constexpr const char* kSecond = "POST /v1/events HTTP/1.1\r\nHost: t\r\nContent-Length: 6\r\n\r\nsecond";

TEST_F(RequestShapes, AreRefusedAndEndTheirConnectionWhereTheyCanBeReadInTwoWays) {
  start();
  for (const std::string& rest :
       std::vector<std::string>{"Content-Length: 5\r\nContent-Length: 9\r\n\r\nhello",
                                "Content-Length: 5\r\nContent-Length: 5\r\n\r\nhello",
                                "Content-Length: 5\r\nTransfer-Encoding: chunked\r\n\r\n0\r\n\r\n",
                                "Transfer-Encoding: chunked\r\nContent-Length: 5\r\n\r\n0\r\n\r\n",
                                "Transfer-Encoding : chunked\r\nContent-Length: 5\r\n\r\n0\r\n\r\n",
                                "Content-Length : 5\r\nContent-Length: 0\r\n\r\nhello",
                                "Transfer-Encoding: xchunked\r\nContent-Length: 5\r\n\r\nhello",
                                "Transfer-Encoding: gzip, chunked\r\n\r\n5\r\nhello\r\n0\r\n\r\n",
                                "Transfer-Encoding: chunked\r\nTransfer-Encoding: chunked\r\n\r\n0\r\n\r\n",
                                "X-A: b\r\n Content-Length: 5\r\nContent-Length : 5\r\n\r\nhello"}) {
    HttpConnection connection(receiver_->port());
    connection.send(kFirst + rest + kSecond);
    EXPECT_EQ(connection.receive(std::chrono::seconds(5)).status, 400) << rest;
    // What follows is not looked at: nobody can say where it begins.
    EXPECT_TRUE(connection.isClosed()) << rest;
  }
  EXPECT_EQ(view_->messages(), 0U);
  EXPECT_EQ(receiver_->metric("kyt_refused_total{reason=\"ambiguous\"}"), 10);
}

TEST_F(RequestShapes, AreRefusedWithTwoEncodingsOfTheBody) {
  start();
  EXPECT_EQ(receiver_->post("{}", {"Content-Encoding: gzip", "Content-Encoding: br"}).status, 415);
  EXPECT_EQ(receiver_->post("{}", {"Content-Encoding: identity", "content-encoding: gzip"}).status, 415);
}

TEST_F(RequestShapes, AreAnsweredAtOnceWhereTheirLengthIsBeyondAllNumbers) {
  start();
  for (const char* length : {"9223372036854775808", "18446744073709551615"}) {
    HttpConnection connection(receiver_->port());
    connection.send(std::string(kFirst) + "Content-Length: " + length + "\r\n\r\nhello");
    EXPECT_EQ(connection.receive(std::chrono::seconds(5)).status, 413) << length;
    EXPECT_TRUE(connection.isClosed()) << length;
  }
}

TEST_F(RequestShapes, HaveNoPathWithAZeroByte) {
  start();
  EXPECT_EQ(HttpConnection(receiver_->port()).post("/v1/events%00", "{}").status, 404);
  EXPECT_EQ(HttpConnection(receiver_->port()).post("/v1/%65vents", "{}").status, 200);
}

TEST_F(RequestShapes, FollowEachOtherInOneWriteAndEachIsAnsweredInOrder) {
  start();
  HttpConnection connection(receiver_->port());
  std::string all;
  for (uint64_t i = 0; i < 50; ++i) {
    const std::string body = postText(i);
    all += i % 5 == 4 ? "POST /elsewhere" : "POST /v1/events";
    all += " HTTP/1.1\r\nHost: t\r\nContent-Length: " + std::to_string(body.size()) + "\r\n\r\n" + body;
  }
  ASSERT_TRUE(connection.send(all));
  for (uint64_t i = 0; i < 50; ++i) EXPECT_EQ(connection.receive().status, i % 5 == 4 ? 404 : 200) << i;
  EXPECT_EQ(view_->messages(), 40U);
}

}  // namespace
}  // namespace kyt::receiver
