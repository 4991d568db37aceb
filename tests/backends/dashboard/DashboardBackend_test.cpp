// The making of the dashboard back end, the datagram byte for byte, and the local log line.
#include "backends/dashboard/DashboardBackend.h"

#include <chrono>
#include <cstdlib>
#include <new>
#include <thread>

#include "tests/backends/dashboard/DashboardFixture.h"

namespace {
bool failNextAllocation = false;
}

// The thread sanitizer has an operator of its own that cannot be replaced.
#if defined(__has_feature)
#if __has_feature(thread_sanitizer)
#define KYT_FIXED_OPERATOR_NEW
#endif
#endif

#ifndef KYT_FIXED_OPERATOR_NEW
// Only what may fail allocates without throwing.
void* operator new(size_t size, const std::nothrow_t&) noexcept {
  if (std::exchange(failNextAllocation, false)) return nullptr;
  try {
    return ::operator new(size);
  } catch (const std::bad_alloc&) {
    return nullptr;
  }
}
#endif

namespace kyt {
namespace {

using Dashboard = DashboardFixture;

std::string bytes(std::initializer_list<int> values) {
  std::string out;
  for (const int value : values) out += static_cast<char>(value);
  return out;
}

TEST_F(Dashboard, ConnectsToTheServerOfItsProfile) {
  ASSERT_NE(
      make(profile({{"display_url", "https://show.example.org"}, {"post_url", "https://logs.example.org"}})),
      nullptr);
  EXPECT_EQ(backend_->name(), "dashboard");
  EXPECT_EQ(backend_->facts().productFamily, String("Phone"));
  EXPECT_EQ(backend_->profile(),
            profile({{"display_url", "https://show.example.org"}, {"post_url", "https://logs.example.org"}}));
  EXPECT_EQ(backend_->displayURL(), String("https://show.example.org"));
  EXPECT_EQ(backend_->postURL(), String("https://logs.example.org"));
  EXPECT_TRUE(backend_->usingProfile());
  EXPECT_FALSE(backend_->reliableUDP());
  EXPECT_EQ(backend_->socketDescriptor(), socket().descriptor);
  EXPECT_EQ(backend_->networkProcQueue().label(), std::string("com.vantu.KYTReporting.networkProc"));
  EXPECT_EQ(socket().address, 0xC0000207u);
  EXPECT_EQ(socket().port, 4000);
  EXPECT_TRUE(socket().brokenPipeSuppressed);
  EXPECT_FALSE(socket().bound);
  EXPECT_EQ(platform_.timers.pending(), 1u);
}

TEST_F(Dashboard, WithReliableInItsProfileBindsAndListens) {
  ASSERT_NE(make(reliable()), nullptr);
  EXPECT_TRUE(backend_->reliableUDP());
  EXPECT_TRUE(socket().bound);
  EXPECT_EQ(platform_.reactor.waitsFor(socket().descriptor), ready::readable);
}

TEST_F(Dashboard, ItsTimerMayBe100MillisecondsLate) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(platform_.timers.leeway, std::chrono::milliseconds(100));
  // A short period has less, or ticks would be lost.
  ASSERT_NE(make(profile({{"reliable", 50}})), nullptr);
  EXPECT_EQ(platform_.timers.leeway, std::chrono::milliseconds(25));
}

// One that a stranger sends before the socket is connected is read when everything is in place, and the next
// ones after it.
TEST_F(Dashboard, ListensOnAfterADatagramThatCameWhileItWasMade) {
  platform_.reactor.whenWatched = [this](int descriptor) {
    std::thread([this, descriptor] {
      EXPECT_TRUE(platform_.reactor.report(descriptor, ready::readable));
      platform_.executor.runAll();
    }).join();
  };
  ASSERT_NE(make(reliable()), nullptr);
  platform_.executor.runAll();
  send(7);
  EXPECT_TRUE(acknowledge(7));
  EXPECT_TRUE(queued().empty());
}

TEST_F(Dashboard, ForgetsWhatCameBeforeItWasConnected) {
  platform_.reactor.whenWatched = [this](int) {
    platform_.udpSockets.last().arriving.assign(3, std::string(61, '\0') + '\7');
  };
  ASSERT_NE(make(reliable()), nullptr);
  EXPECT_TRUE(socket().arriving.empty());
  send(7);
  EXPECT_EQ(queued().size(), 1u);
  EXPECT_TRUE(acknowledge(7));
  EXPECT_TRUE(queued().empty());
}

TEST_F(Dashboard, TakesThePortFromTextAndKeepsItsLow16Bits) {
  ASSERT_NE(make(Dictionary{{"ip", "192.0.2.7"}, {"port", "4001"}}), nullptr);
  EXPECT_EQ(socket().port, 4001);
  ASSERT_NE(make(Dictionary{{"ip", "192.0.2.7"}, {"port", 65536 + 80}}), nullptr);
  EXPECT_EQ(socket().port, 80);
}

TEST_F(Dashboard, WithoutAnAddressOrAPortInItsProfileIsNotMade) {
  EXPECT_EQ(make(Dictionary{{"port", 4000}}), nullptr);
  EXPECT_EQ(make(Dictionary{{"ip", 7}, {"port", 4000}}), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): can't resolve server IP"), 2u);
  EXPECT_EQ(make(Dictionary{{"ip", "192.0.2.7"}}), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): can't resolve server port"), 1u);
  EXPECT_EQ(platform_.sink.lines().size(), 3u);
  EXPECT_EQ(make(Dictionary{}), nullptr);  // the address is looked for first
  EXPECT_EQ(errors("DashboardBackend(initWithName): can't resolve server IP"), 3u);
  EXPECT_EQ(platform_.sink.lines().size(), 4u);
  EXPECT_EQ(platform_.udpSockets.made(), 0u);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

TEST_F(Dashboard, WithoutAProfileIsAlwaysReliable) {
  ASSERT_NE(makeWithoutProfile(String("192.0.2.8"), 5000), nullptr);
  EXPECT_FALSE(backend_->usingProfile());
  EXPECT_TRUE(backend_->reliableUDP());
  EXPECT_EQ(socket().address, 0xC0000208u);
  EXPECT_EQ(socket().port, 5000);
  EXPECT_TRUE(backend_->profile().empty());
  send(1);
  EXPECT_EQ(socket().sent.back().substr(62, 2), bytes({0, 3}));
  tick(2);
  EXPECT_EQ(socket().sent.size(), 2u);  // after two periods of 500 ms
}

TEST_F(Dashboard, WithoutAnythingIsNotMade) {
  EXPECT_EQ(makeWithoutProfile(std::nullopt, 5000), nullptr);
  EXPECT_TRUE(platform_.sink.lines().empty());
  EXPECT_EQ(platform_.udpSockets.made(), 0u);
  EXPECT_EQ(make(std::nullopt), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): initWitName with all null params."), 1u);
  EXPECT_EQ(platform_.udpSockets.made(), 1u);
  EXPECT_EQ(platform_.udpSockets.openSockets(), 0u);
}

TEST_F(Dashboard, WithoutASocketIsNotMade) {
  platform_.udpSockets.faults.open = 24;
  EXPECT_EQ(make(profile()), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): socket() failed (24)"), 1u);
  EXPECT_EQ(platform_.timers.pending(), 0u);
}

TEST_F(Dashboard, WithoutAConnectionIsNotMadeAndLeavesNothing) {
  platform_.udpSockets.faults.connect = 101;
  EXPECT_EQ(make(reliable()), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): socket connect() failed."), 1u);
  EXPECT_EQ(platform_.udpSockets.openSockets(), 0u);
  EXPECT_EQ(platform_.reactor.waitsFor(socket().descriptor), 0u);
  EXPECT_EQ(platform_.timers.pending(), 0u);
  EXPECT_EQ(platform_.executor.pending(), 0u);
}

TEST_F(Dashboard, WithoutATimerIsNotMadeAndLeavesNothing) {
  platform_.timers.refuses = true;
  EXPECT_EQ(make(reliable()), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): can't create timer source."), 1u);
  EXPECT_EQ(platform_.udpSockets.openSockets(), 0u);
  EXPECT_EQ(platform_.reactor.waitsFor(socket().descriptor), 0u);
  ASSERT_EQ(platform_.timers.queues.size(), 1u);
  EXPECT_TRUE(platform_.timers.queues[0].expired());  // the network queue is gone
}

TEST_F(Dashboard, ThatCannotBindStaysUnreliable) {
  platform_.udpSockets.faults.bind = 98;
  ASSERT_NE(make(reliable()), nullptr);
  EXPECT_EQ(errors("DashboardBackend(useReliableUDP): can't bind socket, 98"), 1u);
  EXPECT_FALSE(backend_->reliableUDP());
  EXPECT_EQ(platform_.reactor.waitsFor(socket().descriptor), 0u);
  send(1);
  EXPECT_EQ(socket().sent.back().substr(62, 2), bytes({0, 0}));
  EXPECT_TRUE(queued().empty());
}

TEST_F(Dashboard, ThatCannotBindTicksAtThePeriodOfItsProfile) {
  platform_.udpSockets.faults.bind = 98;
  ASSERT_NE(make(profile({{"reliable", 40}})), nullptr);
  platform_.udpSockets.faults.send = 105;
  send(1);
  tick(1, std::chrono::milliseconds(39));
  EXPECT_EQ(socket().attempts, 1u);
  tick(1, std::chrono::milliseconds(1));
  EXPECT_EQ(socket().attempts, 2u);
}

TEST_F(Dashboard, ThatCannotListenIsReliableAllTheSame) {
  platform_.reactor.refuses = true;
  ASSERT_NE(make(reliable()), nullptr);
  EXPECT_EQ(errors("DashboardBackend(useReliableUDP): can't create read source"), 1u);
  EXPECT_TRUE(backend_->reliableUDP());
  send(1);
  tick(20);
  EXPECT_EQ(socket().sent.size(), 5u);
}

TEST_F(Dashboard, TakesTheFirst16CharactersOfAnAddress) {
  ASSERT_NE(make(profile({{"ip", "255.255.255.250 "}})), nullptr);  // 16 of them
  EXPECT_EQ(socket().address, 0xFFFFFFFAu);
  ASSERT_NE(make(profile({{"ip", "192.168.100.200 is the server"}})), nullptr);
  EXPECT_EQ(socket().address, 0xC0A864C8u);
  ASSERT_NE(make(profile({{"ip", "10.0.0.0000000012"}})), nullptr);  // the seventeenth is cut
  EXPECT_EQ(socket().address, 0x0A000001u);
  EXPECT_EQ(make(profile({{"ip", "192.168.100.200x"}})), nullptr);
}

TEST_F(Dashboard, CannotConnectToWhatIsNoAddress) {
  for (const char* ip : {"dashboard.example.org", "", "300.1.1.1"})
    EXPECT_EQ(make(profile({{"ip", ip}})), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): socket connect() failed."), 3u);
  EXPECT_EQ(makeWithoutProfile(String("no address"), 1), nullptr);
  EXPECT_EQ(errors("DashboardBackend(initWithName): socket connect() failed."), 4u);
  EXPECT_EQ(platform_.udpSockets.openSockets(), 0u);
}

TEST_F(Dashboard, EveryFieldOfTheHeaderIsInItsPlace) {
  facts_.setSelfVersion("9.1.2");
  facts_.compType = 0x114;  // its low byte counts
  facts_.sessionID = 0x01020304;
  facts_.clientVersion = 0x0506;
  ASSERT_NE(make(reliable()), nullptr);
  send(0xABCD, {{"k", "v"}}, {0x1122334455, 999999}, 0x0708, 0x090A);
  const std::string device(kTestDevice);
  EXPECT_EQ(socket().sent.at(0), bytes({9, 0x14, 1, 249, 0x22, 0x33, 0x44, 0x55}) +  // versions, time
                                     bytes({0xFE, 0xFD, 0xFC, 0xFB, 0xFA, 0xF9, 0xFF, 0xBB}) +  // complements
                                     bytes({7, 8, 9, 10}) + device + bytes({0xAB, 0xCD, 0, 1}) + " k=v");
}

TEST_F(Dashboard, ASessionOf1IsCarriedComplemented) {
  ASSERT_NE(make(profile()), nullptr);
  send(1);
  EXPECT_EQ(socket().sent.at(0).size(), 64u);
  EXPECT_EQ(socket().sent.at(0).substr(8, 4), bytes({0xFF, 0xFF, 0xFF, 0xFE}));
  EXPECT_EQ(socket().sent.at(0).substr(14, 2), bytes({0xFF, 0xBF}));
  EXPECT_EQ(socket().sent.at(0).substr(62, 2), bytes({0, 0}));
}

TEST_F(Dashboard, ATimeIsCarriedInUnitsOf4Milliseconds) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(send(1, {}, {5, 123456}).substr(0, 6), "5.120 ");
  EXPECT_EQ(socket().sent.at(0).substr(3, 5), bytes({30, 0, 0, 0, 5}));
  EXPECT_EQ(send(1, {}, {5, 3999}).substr(0, 6), "5.000 ");
  EXPECT_EQ(send(1, {}, {5, 4000}).substr(0, 6), "5.004 ");
}

TEST_F(Dashboard, ADeviceIdentifierIsCutAt40AndFilledUpWithZeros) {
  const auto of = [this](std::optional<String> udid) {
    facts_.udid = std::move(udid);
    make(profile());
    return send(1);
  };
  of(String(std::string(kTestDevice) + "tail"));
  EXPECT_EQ(socket().sent.back().substr(20, 40), kTestDevice);
  EXPECT_EQ(socket().sent.back().substr(60, 2), bytes({0, 1}));
  EXPECT_NE(of(String("short")).find(" short 127.0.0.1 "), std::string::npos);
  EXPECT_EQ(socket().sent.back().substr(20, 40), "short" + std::string(35, '\0'));
  EXPECT_NE(of(String("")).find("5.120  127.0.0.1 "), std::string::npos);
  EXPECT_NE(of(std::nullopt).find("5.120  127.0.0.1 "), std::string::npos);
}

TEST_F(Dashboard, PutsShorterValuesFirst) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(textOf({{"k1", "abc"}, {"k2", 12345}}), " k1=abc k2=12345");
  EXPECT_EQ(textOf({{"k2", 12345}, {"k1", "abc"}}), " k1=abc k2=12345");
}

TEST_F(Dashboard, KeepsTheOrderOfValuesOfOneLength) {
  ASSERT_NE(make(profile()), nullptr);
  Dictionary message;
  std::string expected;
  for (int i = 30; i > 0; --i) {
    message.set("k" + std::to_string(i), "v");
    expected += " k" + std::to_string(i) + "=v";
  }
  EXPECT_EQ(textOf(message), expected);
}

// Length is that of the description in UTF-16 code units, before sanitising.
TEST_F(Dashboard, MeasuresValuesInCharacters) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(textOf({{"b", "abc"}, {"a", "\u00fc\u00fc"}}), " a=\u00fc\u00fc b=abc");
  EXPECT_EQ(textOf({{"b", "abc"}, {"a", "=="}, {"c", ""}}), " c=empty a=\\=\\= b=abc");
  EXPECT_EQ(textOf({{"b", "abc"}, {"a", "\U0001F600\U0001F600"}}), " b=abc a=\U0001F600\U0001F600");
}

TEST_F(Dashboard, DescribesStringsAndNumbersAndNothingElse) {
  EXPECT_EQ(DashboardBackend::descriptionForObject("text"), "text");
  EXPECT_EQ(DashboardBackend::descriptionForObject(-7), "-7");
  EXPECT_EQ(DashboardBackend::descriptionForObject(0.1), "0.1");
  EXPECT_EQ(DashboardBackend::descriptionForObject(18446744073709551615U), "18446744073709551615");
  EXPECT_EQ(DashboardBackend::descriptionForObject(true), "1");
  EXPECT_EQ(DashboardBackend::descriptionForObject(nullptr), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Dictionary{{"a", 1}}), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Array{1}), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Date{1}), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Data(std::string_view("x"))), "null");
}

TEST_F(Dashboard, SanitizesValues) {
  EXPECT_EQ(DashboardBackend::sanitize("a=b"), "a\\=b");
  EXPECT_EQ(DashboardBackend::sanitize("a\nb\n"), "ab");
  EXPECT_EQ(DashboardBackend::sanitize("a\\b"), "a\\\\b");
  EXPECT_EQ(DashboardBackend::sanitize("\\=\n="), "\\\\\\=\\=");
  EXPECT_EQ(DashboardBackend::sanitize(""), "empty");
  EXPECT_EQ(DashboardBackend::sanitize("\n\n"), "empty");
  EXPECT_EQ(DashboardBackend::sanitize("a\r\tb c"), "a\r\tb c");
}

TEST_F(Dashboard, SanitizesWhatItSends) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(textOf({{"a", "a=b"}}), " a=a\\=b");
  EXPECT_EQ(textOf({{"a", "x\ny"}}), " a=xy");
  EXPECT_EQ(textOf({{"a", ""}}), " a=empty");
  EXPECT_EQ(textOf({{"a", Dictionary{}}}), " a=null");
}

TEST_F(Dashboard, SendsKeysAsTheyAre) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(textOf({{"a=\\b %s", "v"}}), " a=\\b %s=v");
  EXPECT_EQ(textOf({{"", "v"}}), " =v");
}

// The text with its terminator has 1024 bytes.
TEST_F(Dashboard, CutsTheTextAt1023Bytes) {
  ASSERT_NE(make(profile()), nullptr);
  for (const size_t length : {1022u, 1023u, 1024u, 1025u, 5000u}) {
    const std::string value(length - 3, 'x');
    const std::string line = send(1, {{"k", value}});
    const std::string& datagram = socket().sent.back();
    const size_t sent = std::min<size_t>(length, 1023);
    EXPECT_EQ(datagram.substr(64), (" k=" + value).substr(0, sent)) << length;
    const auto field = static_cast<uint16_t>(~(64 + sent));
    EXPECT_EQ(datagram.substr(14, 2), bytes({field >> 8, field & 0xFF})) << length;
    EXPECT_TRUE(line.ends_with((" k=" + value).substr(0, sent))) << length;
  }
}

TEST_F(Dashboard, CutsAPairThatHasNoRoomAndAllThatFollow) {
  ASSERT_NE(make(profile()), nullptr);
  const std::string first(1015, 'x'), second(1016, 'y'), third(1017, 'z');
  EXPECT_EQ(textOf({{"c", third}, {"b", second}, {"a", first}}), " a=" + first + " b=yy");
}

TEST_F(Dashboard, TheLocalLogLineShowsEveryFieldPlain) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(send(4, {{"k1", "abc"}, {"k2", 12345}}, {1769860800, 987654}, 2, 3),
            std::string("1769860800.984 ") + kTestDevice +
                " 127.0.0.1 QG     3     1     4     2     3  k1=abc k2=12345");
  facts_.sessionID = 4294967295U;
  facts_.clientVersion = 65535;
  facts_.compType = 23;
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_EQ(send(65535, {}, {-1, 0}, 65535, 65535), std::string("4294967295.000 ") + kTestDevice +
                                                        " 127.0.0.1 QV 65535 4294967295 65535 65535 65535 ");
}

TEST_F(Dashboard, AClientTypeOutsideTheTableHasAName) {
  for (const int32_t type : {24, -1}) {
    facts_.compType = type;
    ASSERT_NE(make(profile()), nullptr);
    EXPECT_NE(send(1).find(" 127.0.0.1 Unknown "), std::string::npos);
  }
}

TEST_F(Dashboard, TheLongestLineIsWhole) {
  facts_.sessionID = 4294967295U;
  facts_.clientVersion = 65535;
  facts_.compType = 99;
  ASSERT_NE(make(profile()), nullptr);
  const std::string line = send(65535, {{"k", std::string(2000, 'x')}}, {4294967295, 999999}, 65535, 65535);
  EXPECT_TRUE(line.ends_with(" k=" + std::string(1020, 'x')));
}

TEST_F(Dashboard, WithoutMemorySendsNothing) {
#ifdef KYT_FIXED_OPERATOR_NEW
  GTEST_SKIP() << "no allocation can be made to fail under this sanitizer";
#endif
  ASSERT_NE(make(profile()), nullptr);
  failNextAllocation = true;
  EXPECT_EQ(send(1), "null");
  EXPECT_FALSE(failNextAllocation);
  EXPECT_EQ(errors("DashboardBackend(sendMessage): can't malloc."), 1u);
  EXPECT_TRUE(socket().sent.empty());
  EXPECT_NE(send(1), "null");
}

// Deliberately: the operation by which sessions deliver is the base's, which does nothing.
TEST_F(Dashboard, RoutedEventsDoNotReachIt) {
  ASSERT_NE(make(profile()), nullptr);
  EXPECT_TRUE(backend_->sendMessage({{"k", 1}}, {1, 0}, 2, 3, EventID{4}, MessageFlag{1}).isNull());
  EXPECT_TRUE(backend_->sendMessage({{"k", 1}}, {1, 0}, 2, 3, MessageFlag{1}).isNull());
  platform_.executor.runAll();
  EXPECT_EQ(socket().attempts, 0u);
  KYTReportingBackend& asBase = *backend_;
  EXPECT_FALSE(asBase.sendMessage({{"k", 1}}, {1, 0}, 2, 3, EventID{4}).isNull());
  platform_.executor.runAll();
  EXPECT_EQ(socket().sent.size(), 1u);
}

TEST_F(Dashboard, SendsOnTheNetworkQueue) {
  ASSERT_NE(make(profile()), nullptr);
  backend_->sendMessage({}, {1, 0}, 2, 3, EventID{4});
  EXPECT_EQ(socket().attempts, 0u);
  platform_.executor.runAll();
  EXPECT_EQ(socket().attempts, 1u);
}

}  // namespace
}  // namespace kyt
