#include "platform/linux/url/WaitingRequests.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>

#include <string>
#include <vector>

#include "platform/base/Books.h"
#include "platform/base/Limits.h"
#include "platform/base/UserBudget.h"
#include "platform/fake/MemoryLogSink.h"
#include "platform/linux/url/URLNetwork.h"

namespace kyt {
namespace {

// The requests are real, but nothing is sent: no command reaches the network, so its thread never starts.
class WaitingRequestsTest : public testing::Test {
 protected:
  URLTransfer& transfer(const std::string& name, size_t bodyBytes = 0,
                        const std::shared_ptr<UserAccount>& account = nullptr) {
    return transferOf(session_, name, bodyBytes, account);
  }
  URLTransfer& transferOf(const std::shared_ptr<URLSessionState>& session, const std::string& name,
                          size_t bodyBytes, const std::shared_ptr<UserAccount>& account) {
    URLRequest request;
    request.url = name;
    request.body = Data(std::string(bodyBytes, 'x'));
    auto made = std::make_shared<URLTransfer>(session, session->outstanding.user(account), std::move(request),
                                              nullptr, URLTransfer::Refusal::none);
    session->transfers.append(*made);
    transfers_.push_back(made);
    return *made;
  }
  static void leadsTo(URLTransfer& transfer, const char* address) {
    sockaddr_storage storage{};
    storage.ss_family = AF_INET;
    inet_pton(AF_INET, address, &reinterpret_cast<sockaddr_in&>(storage).sin_addr);
    transfer.attempt.addresses.push_back(storage);
  }
  void take(std::vector<std::string>& names, URLTransfer& transfer) {
    names.push_back(transfer.request.url);
    waiting_.remove(transfer);
    transfer.phase = URLTransfer::Phase::active;
  }
  URLFigures figures() { return network_->figures(); }

  MemoryLogSink sink_;
  Log log_{sink_, LogLevel::debug};
  Counters counters_;
  const std::shared_ptr<URLNetwork> network_ =
      std::make_shared<URLNetwork>(CurlURLSessionOptions(), log_, counters_);
  const std::shared_ptr<URLSessionState> session_ =
      std::make_shared<URLSessionState>(network_, URLSessionConfiguration());
  std::vector<std::shared_ptr<URLTransfer>> transfers_;
  LinkedList<URLSessionState> sessions_;

  std::vector<std::string> displaced_, again_, asked_;
  bool canLeave_ = true;
  WaitingRequests waiting_{network_->tools(),
                           {[this](URLTransfer& oldest) { take(displaced_, oldest); },
                            [this](URLTransfer& transfer) { take(again_, transfer); },
                            [this](const URLTransfer& transfer) {
                              asked_.push_back(transfer.request.url);
                              return canLeave_;
                            }}};
};

using Names = std::vector<std::string>;

TEST_F(WaitingRequestsTest, CountsWhatWaitsAndItsBodies) {
  URLTransfer& one = transfer("one", 100);
  waiting_.add(one);
  waiting_.add(transfer("two", 3000));
  EXPECT_EQ(figures().waiting, 2u);
  EXPECT_EQ(figures().waitingBytes, 3100u);
  waiting_.remove(one);
  EXPECT_EQ(figures().waiting, 1u);
  EXPECT_EQ(figures().waitingBytes, 3000u);
  EXPECT_FALSE(waiting_.empty());
  EXPECT_TRUE(displaced_.empty());
}

TEST_F(WaitingRequestsTest, TellsTheBooksWhoseEventsWait) {
  Books books;
  const auto tally = books.open({1000, 7, "a", "s"}, "httppost", false);
  BookedEvents events;
  for (int i = 0; i < 3; ++i) {
    tally->take();
    events.add(tally.get());
  }
  const PostedEvents posted(std::move(events), counters_);
  URLTransfer& one = transfer("one", 100);
  one.request.events = posted.events();
  waiting_.add(one);
  EXPECT_EQ(books.snapshot().front().waiting, 3u);
  waiting_.remove(one);
  EXPECT_EQ(books.snapshot().front().waiting, 0u);
  EXPECT_EQ(books.snapshot().front().inFlight, 3u);
}

TEST_F(WaitingRequestsTest, TheOldestOfAUserGiveWayWhenTooMuchOfItsWaits) {
  constexpr size_t kThird = Limits::maxWaitingBytes / 3;
  for (const char* name : {"one", "two", "three", "four"}) waiting_.add(transfer(name, kThird));
  EXPECT_EQ(displaced_, Names{"one"});
  waiting_.add(transfer("five", 2 * kThird));
  EXPECT_EQ(displaced_, (Names{"one", "two", "three"}));
  EXPECT_EQ(figures().waiting, 2u);
}

TEST_F(WaitingRequestsTest, OneThatIsLargerThanTheLimitDisplacesAllAndItself) {
  waiting_.add(transfer("small", 10));
  waiting_.add(transfer("large", Limits::maxWaitingBytes + 1));
  EXPECT_EQ(displaced_, (Names{"small", "large"}));
  EXPECT_TRUE(waiting_.empty());
  EXPECT_TRUE(session_->waiting.empty());
}

TEST_F(WaitingRequestsTest, EvenSmallOnesCountSomething) {
  const size_t fit = Limits::maxWaitingBytes / 1024;
  for (size_t i = 0; i <= fit; ++i) waiting_.add(transfer(std::to_string(i)));
  EXPECT_EQ(displaced_, Names{"0"});
}

TEST_F(WaitingRequestsTest, OneUserDisplacesNothingOfAnothers) {
  UserShares shares;
  shares[Share::waitingBytes] = 10000;
  UserBudget budget(shares);
  const auto ann = budget.account(1001), bob = budget.account(1002);
  waiting_.add(transfer("bob's", 6000, bob));
  for (const char* name : {"ann's first", "ann's second"}) waiting_.add(transfer(name, 6000, ann));
  EXPECT_EQ(displaced_, Names{"ann's first"});
}

TEST_F(WaitingRequestsTest, LetsThoseGoAgainThatCanLeaveInTheOrderOfTheirStart) {
  sessions_.append(*session_);
  URLTransfer& one = transfer("one");
  URLTransfer& two = transfer("two");
  transfer("not waiting");
  waiting_.add(two);
  waiting_.add(one);
  canLeave_ = false;
  waiting_.retry(sessions_, false);
  EXPECT_TRUE(again_.empty());
  canLeave_ = true;
  waiting_.retry(sessions_, false);
  EXPECT_EQ(again_, (Names{"one", "two"}));
  EXPECT_TRUE(waiting_.empty());
}

TEST_F(WaitingRequestsTest, AsksOnceForEachServer) {
  sessions_.append(*session_);
  for (int i = 0; i < 5; ++i) {
    URLTransfer& here = transfer("here");
    leadsTo(here, "192.0.2.1");
    waiting_.add(here);
    URLTransfer& there = transfer("there");
    leadsTo(there, "192.0.2.2");
    waiting_.add(there);
    waiting_.add(transfer("unknown"));
  }
  canLeave_ = false;
  waiting_.retry(sessions_, false);
  EXPECT_EQ(asked_, (Names{"here", "there", "unknown"}));
}

TEST_F(WaitingRequestsTest, TriesThoseWhoseServersAddressIsUnknownEvenSoWhenAsked) {
  sessions_.append(*session_);
  URLTransfer& known = transfer("known");
  leadsTo(known, "192.0.2.1");
  waiting_.add(known);
  waiting_.add(transfer("unknown"));
  canLeave_ = false;
  waiting_.retry(sessions_, true);
  EXPECT_EQ(again_, Names{"unknown"});
}

}  // namespace
}  // namespace kyt
