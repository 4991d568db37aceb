#include "platform/ipc/SocketWatch.h"

#include <gtest/gtest.h>

#include <vector>

#include "platform/fake/MemoryStream.h"

namespace kyt {
namespace {

class SocketWatchTest : public ::testing::Test {
 protected:
  bool arm(unsigned events) {
    return watch_.arm(events, [this] {
      ++handlers_;
      return [this](unsigned happened) { again_.push_back(watch_.reported(happened)); };
    });
  }
  ManualReactor reactor_;
  SocketWatch watch_{reactor_, 7};
  int handlers_ = 0;
  std::vector<unsigned> again_;
};

TEST_F(SocketWatchTest, AsksTogetherForWhatIsWaitedFor) {
  EXPECT_TRUE(arm(ready::readable));
  EXPECT_TRUE(arm(ready::writable));
  EXPECT_EQ(reactor_.waitsFor(7), ready::readable | ready::writable);
  EXPECT_EQ(handlers_, 1);
}

TEST_F(SocketWatchTest, TellsWhatAReportLeftToBeAskedForAgain) {
  EXPECT_TRUE(arm(ready::readable | ready::writable));
  EXPECT_TRUE(reactor_.report(7, ready::writable));
  EXPECT_EQ(again_, std::vector<unsigned>{ready::readable});
  EXPECT_EQ(reactor_.waitsFor(7), 0u) << "each report is for one time";
  EXPECT_TRUE(arm(ready::readable));
  EXPECT_TRUE(reactor_.report(7, ready::readable));
  EXPECT_EQ(again_, (std::vector<unsigned>{ready::readable, 0}));
}

TEST_F(SocketWatchTest, SaysThatTheSystemRefuses) {
  reactor_.refuses = true;
  EXPECT_FALSE(arm(ready::readable));
}

TEST_F(SocketWatchTest, AsksForNothingOnceItIsClosed) {
  EXPECT_TRUE(arm(ready::readable));
  watch_.close();
  EXPECT_EQ(reactor_.waitsFor(7), 0u);
  EXPECT_TRUE(arm(ready::writable)) << "that is no refusal";
  EXPECT_EQ(reactor_.waitsFor(7), 0u);
  EXPECT_EQ(handlers_, 1);
}

}  // namespace
}  // namespace kyt
