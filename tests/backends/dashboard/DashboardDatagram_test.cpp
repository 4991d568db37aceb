#include "backends/dashboard/DashboardDatagram.h"

#include <gtest/gtest.h>

#include <string>

namespace kyt {
namespace {

DashboardDatagram::Header someHeader() {
  DashboardDatagram::Header header;
  header.selfVersionMajor = 3;
  header.clientType = 20;
  header.time = {1700000000, 123999};
  header.sessionID = 0x01020304;
  header.clientVersion = 517;
  header.method = 10;
  header.respCode = 404;
  header.eventID = 65535;
  header.flags = DashboardDatagram::kFlagReliable;
  header.udid = "00d33";
  return header;
}

TEST(DashboardDatagram, SaysWhatItWasFilledWith) {
  DashboardDatagram datagram;
  datagram.fill(someHeader());
  datagram.appendPair("key", "value");
  datagram.finish();
  const DashboardDatagram::Header header = datagram.header();
  EXPECT_EQ(header.selfVersionMajor, 3);
  EXPECT_EQ(header.clientType, 20);
  EXPECT_EQ(header.time, (TimeValue{1700000000, 120000})) << "in steps of four milliseconds";
  EXPECT_EQ(header.sessionID, 0x01020304u);
  EXPECT_EQ(header.clientVersion, 517);
  EXPECT_EQ(header.method, 10);
  EXPECT_EQ(header.respCode, 404);
  EXPECT_EQ(header.eventID, 65535);
  EXPECT_EQ(header.flags, DashboardDatagram::kFlagReliable);
  EXPECT_EQ(header.udid, "00d33");
  EXPECT_STREQ(datagram.text(), " key=value");
}

TEST(DashboardDatagram, SendsFortyBytesOfADevicesIdentifier) {
  const std::string identifier(41, 'd');
  DashboardDatagram::Header header = someHeader();
  header.udid = identifier;
  DashboardDatagram datagram;
  datagram.fill(header);
  EXPECT_EQ(datagram.header().udid, std::string(40, 'd'));
  EXPECT_EQ(datagram.header().eventID, 65535) << "which stands behind it";
}

TEST(DashboardDatagram, AnAcknowledgementIsItsNumber) {
  DashboardDatagram datagram;
  datagram.fill(someHeader());
  const std::span<const std::byte> bytes(datagram.bytes(), DashboardDatagram::kHeaderSize);
  EXPECT_EQ(DashboardDatagram::acknowledgedEvent(bytes), 65535);
  EXPECT_EQ(DashboardDatagram::acknowledgedEvent(bytes.first(62)), 65535) << "nothing else is looked at";
  EXPECT_FALSE(DashboardDatagram::acknowledgedEvent(bytes.first(61)));
}

}  // namespace
}  // namespace kyt
