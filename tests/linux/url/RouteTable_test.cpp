#include "platform/linux/url/RouteTable.h"

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>

#include <filesystem>
#include <fstream>

#include "tests/linux/url/CurlURLSessionFixture.h"
#include "tests/support/NetworkNamespace.h"

namespace kyt {
namespace {

class RouteTableTest : public testing::Test {
 protected:
  void SetUp() override {
    if (!NetworkNamespace::isPermitted()) GTEST_SKIP() << "network namespaces need root";
    here_.emplace();
    there_.emplace();
    ASSERT_TRUE(here_->connect("eth7", "10.77.0.2/24", *there_, "eth8", "10.77.0.1/24"));
    ASSERT_TRUE(here_->connect("cell0", "10.80.0.2/24", *there_, "cell8", "10.80.0.1/24"));
    entered_.emplace(*here_);
    folder_ = std::filesystem::temp_directory_path() / "kyt-routes-XXXXXX";
    ASSERT_NE(mkdtemp(folder_.data()), nullptr);
    routes_.emplace(std::vector<std::string>{"nothing", "cell*"}, folder_, folder_ + "/resolv.conf");
  }
  void TearDown() override {
    entered_.reset();
    if (!folder_.empty()) std::filesystem::remove_all(folder_);
  }
  bool reachable(const char* text, bool avoidCellular = false) {
    return routes_->isReachable(reinterpret_cast<const sockaddr&>(address(text)), avoidCellular);
  }
  std::optional<std::string> interface(const char* text) {
    return routes_->interfaceAvoidingCellular(reinterpret_cast<const sockaddr&>(address(text)));
  }
  void resolver(const std::string& text) { std::ofstream(folder_ + "/resolv.conf") << text; }
  const sockaddr_storage& address(const char* text) {
    storage_ = {};
    if (inet_pton(AF_INET, text, &reinterpret_cast<sockaddr_in&>(storage_).sin_addr) == 1) {
      storage_.ss_family = AF_INET;
    } else {
      storage_.ss_family = AF_INET6;
      EXPECT_EQ(inet_pton(AF_INET6, text, &reinterpret_cast<sockaddr_in6&>(storage_).sin6_addr), 1);
    }
    return storage_;
  }

  std::optional<NetworkNamespace> here_, there_;
  std::optional<NetworkNamespace::Entered> entered_;
  std::optional<RouteTable> routes_;
  std::string folder_;
  sockaddr_storage storage_{};
};

TEST_F(RouteTableTest, KnowsWhatHasARoute) {
  EXPECT_TRUE(reachable("127.0.0.1"));
  EXPECT_TRUE(reachable("::1"));
  EXPECT_TRUE(reachable("10.77.0.1"));
  EXPECT_FALSE(reachable("10.99.0.1"));
  EXPECT_FALSE(reachable("2001:db8:9::1"));
  ASSERT_TRUE(here_->run("ip route add 10.99.0.0/16 via 10.77.0.1"));
  ASSERT_TRUE(here_->run("ip -6 route add 2001:db8:9::/48 dev eth7"));
  EXPECT_TRUE(reachable("10.99.0.1"));
  EXPECT_TRUE(reachable("2001:db8:9::1"));
}

TEST_F(RouteTableTest, TakesRoutesThatRefuseForNone) {
  ASSERT_TRUE(here_->run("ip route add default via 10.77.0.1"));
  for (const char* kind : {"unreachable", "blackhole", "prohibit"}) {
    ASSERT_TRUE(here_->run(std::string("ip route add ") + kind + " 10.99.0.0/16"));
    EXPECT_FALSE(reachable("10.99.0.1")) << kind;
    ASSERT_TRUE(here_->run("ip route del 10.99.0.0/16"));
  }
  EXPECT_TRUE(reachable("10.99.0.1"));
}

TEST_F(RouteTableTest, TakesARouteOverALinkWithoutCarrierForNone) {
  EXPECT_TRUE(reachable("10.77.0.1"));
  ASSERT_TRUE(there_->run("ip link set eth8 down"));
  // The kernel tells a little later.
  EXPECT_TRUE(eventually([&] { return !reachable("10.77.0.1"); }));
  ASSERT_TRUE(there_->run("ip link set eth8 up"));
  EXPECT_TRUE(eventually([&] { return reachable("10.77.0.1"); }));
}

TEST_F(RouteTableTest, AvoidsCellularInterfaces) {
  EXPECT_EQ(interface("10.77.0.1"), "eth7");
  EXPECT_EQ(interface("127.0.0.1"), "lo");
  EXPECT_TRUE(reachable("10.80.0.1"));
  EXPECT_FALSE(reachable("10.80.0.1", true));
  EXPECT_EQ(interface("10.80.0.1"), std::nullopt);
  ASSERT_TRUE(here_->run("ip route add default via 10.80.0.1 metric 1"));
  EXPECT_EQ(interface("10.99.0.1"), std::nullopt);
  ASSERT_TRUE(here_->run("ip route add default via 10.77.0.1 metric 600"));
  EXPECT_EQ(interface("10.99.0.1"), "eth7");
  ASSERT_TRUE(here_->run("ip -6 route add default dev cell0 metric 1"));
  EXPECT_EQ(interface("2001:db8::1"), std::nullopt);
  ASSERT_TRUE(here_->run("ip -6 route add default dev eth7 metric 600"));
  EXPECT_EQ(interface("2001:db8::1"), "eth7");
}

TEST_F(RouteTableTest, KnowsCellularInterfacesByPatternAndByTheKernelsMark) {
  EXPECT_TRUE(routes_->isCellular("cell0"));
  EXPECT_TRUE(routes_->isCellular("nothing"));
  EXPECT_FALSE(routes_->isCellular("eth7"));
  EXPECT_FALSE(routes_->isCellular(""));
  std::filesystem::create_directory(folder_ + "/eth7");
  std::ofstream(folder_ + "/eth7/uevent") << "DEVTYPE=wlan\n";
  EXPECT_FALSE(routes_->isCellular("eth7"));
  std::ofstream(folder_ + "/eth7/uevent") << "INTERFACE=eth7\nDEVTYPE=wwan\nIFINDEX=4\n";
  EXPECT_TRUE(routes_->isCellular("eth7"));
}

TEST_F(RouteTableTest, KnowsWhetherAConnectionWouldLeaveAnotherWay) {
  using Way = RouteTable::Way;
  const auto way = [&](const char* local, const char* interface, bool avoidCellular) {
    const sockaddr_storage from = address(local), to = address("10.78.0.1");
    return routes_->wayOf(reinterpret_cast<const sockaddr&>(from), reinterpret_cast<const sockaddr&>(to),
                          interface, avoidCellular);
  };
  EXPECT_EQ(way("10.77.0.2", "", false), Way::none);
  ASSERT_TRUE(here_->run("ip route add 10.78.0.0/24 via 10.80.0.1 metric 600"));
  EXPECT_EQ(way("10.80.0.2", "", false), Way::same);
  EXPECT_EQ(way("10.77.0.2", "", false), Way::other);
  EXPECT_EQ(way("10.77.0.2", "eth7", true), Way::none);
  ASSERT_TRUE(here_->run("ip route add 10.78.0.0/24 via 10.77.0.1"));
  EXPECT_EQ(way("10.80.0.2", "", false), Way::other);
  EXPECT_EQ(way("10.77.0.2", "", false), Way::same);
  EXPECT_EQ(way("10.77.0.2", "eth7", true), Way::same);
  EXPECT_EQ(way("10.77.0.2", "eth9", true), Way::other);
}

TEST_F(RouteTableTest, CanResolveWhereANameServerHasARoute) {
  EXPECT_FALSE(routes_->canResolve());  // no file, no default route
  resolver("# nothing\nsearch example\nnameserver 10.99.0.1\nnameserver 10.77.0.1 # the second\n");
  EXPECT_TRUE(routes_->canResolve());
  resolver("nameserver 10.99.0.1\nnameserver\nnameserver rubbish\n");
  EXPECT_FALSE(routes_->canResolve());
  // One on this machine knows no more than the network lets it.
  resolver("nameserver 127.0.0.53\n");
  EXPECT_FALSE(routes_->canResolve());
  ASSERT_TRUE(here_->run("ip route add default via 10.77.0.1"));
  EXPECT_TRUE(routes_->canResolve());
  resolver("");
  EXPECT_TRUE(routes_->canResolve());
  resolver("nameserver 2001:db8::53%eth7\n");
  EXPECT_FALSE(routes_->canResolve());
}

}  // namespace
}  // namespace kyt
