// The numbers of libcurl's sockets, which are other sockets' as soon as libcurl has closed them, told or not.
#include "platform/linux/url/WatchedSockets.h"

#include <curl/curl.h>
#include <gtest/gtest.h>
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstddef>
#include <utility>

namespace kyt {
namespace {

class WatchedSocketsTest : public testing::Test {
 protected:
  void SetUp() override {
    epoll_ = epoll_create1(EPOLL_CLOEXEC);
    sockets_.setEpoll(epoll_);
  }
  void TearDown() override {
    closeBoth();
    close(epoll_);
  }
  // A pair of connected sockets, the first of which is always the same number.
  int makePair() {
    closeBoth();
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends_.data()), 0);
    if (number_ < 0) number_ = ends_[0];
    EXPECT_EQ(ends_[0], number_);
    return number_;
  }
  void closeBoth() {
    for (int& end : ends_)
      if (end >= 0) close(std::exchange(end, -1));
  }
  void feed() { EXPECT_EQ(write(ends_[1], "x", 1), 1); }
  // How many events there are; the turn begins with them.
  int happened() {
    std::array<epoll_event, 4> events{};
    const int count = epoll_wait(epoll_, events.data(), events.size(), 0);
    sockets_.beginTurn();
    return count;
  }
  URLConnectionPool& pool() { return *reinterpret_cast<URLConnectionPool*>(&pool_); }  // only compared

  WatchedSockets sockets_;
  int epoll_ = -1, number_ = -1;
  std::array<int, 2> ends_{-1, -1};
  std::max_align_t pool_{};
};

TEST_F(WatchedSocketsTest, ASocketThatWasClosedWithoutAWordLeavesTheNextOneOfItsNumberAlone) {
  const int socket = makePair();
  sockets_.opened(socket);
  sockets_.watch(pool(), socket, CURL_POLL_OUT);
  EXPECT_EQ(happened(), 1);
  makePair();  // the number is a stranger's, which happens to be watched too
  epoll_event stranger{};
  stranger.events = EPOLLIN;
  ASSERT_EQ(epoll_ctl(epoll_, EPOLL_CTL_ADD, socket, &stranger), 0);
  feed();
  sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  EXPECT_EQ(sockets_.poolOf(socket), nullptr);  // for an event from before
  EXPECT_EQ(happened(), 1);
}

TEST_F(WatchedSocketsTest, TheResolversSocketsAreWatchedAnewWhateverHadTheirNumberBefore) {
  const int socket = makePair();
  sockets_.opened(socket);
  sockets_.watch(pool(), socket, CURL_POLL_OUT);
  closeBoth();
  sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  for (int i = 0; i < 3; ++i) {
    makePair();
    sockets_.watch(pool(), socket, CURL_POLL_IN);
    EXPECT_EQ(happened(), 0);
    feed();
    EXPECT_EQ(happened(), 1);
    EXPECT_EQ(sockets_.poolOf(socket), &pool());
    closeBoth();
    sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  }
}

TEST_F(WatchedSocketsTest, ASocketThatNobodyWaitsForIsReportedOnceMoreAtMost) {
  const int socket = makePair();
  sockets_.opened(socket);
  sockets_.watch(pool(), socket, CURL_POLL_INOUT);
  EXPECT_EQ(happened(), 1);
  sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  EXPECT_LE(happened(), 1);
  EXPECT_EQ(sockets_.poolOf(socket), nullptr);
  EXPECT_EQ(happened(), 0);
  sockets_.watch(pool(), socket, CURL_POLL_IN);
  feed();
  EXPECT_EQ(happened(), 1);
  EXPECT_EQ(sockets_.poolOf(socket), &pool());
}

TEST_F(WatchedSocketsTest, AnIdleConnectionStaysWatchedUntilItsServerSpeaks) {
  const int socket = makePair();
  sockets_.opened(socket);
  sockets_.watch(pool(), socket, CURL_POLL_IN);
  sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  EXPECT_EQ(happened(), 0);
  sockets_.watch(pool(), socket, CURL_POLL_IN);
  feed();
  EXPECT_EQ(happened(), 1);
  EXPECT_EQ(sockets_.poolOf(socket), &pool());
  sockets_.watch(pool(), socket, CURL_POLL_REMOVE);
  EXPECT_EQ(happened(), 1);
  EXPECT_EQ(sockets_.poolOf(socket), nullptr);
  EXPECT_EQ(happened(), 0);
}

}  // namespace
}  // namespace kyt
