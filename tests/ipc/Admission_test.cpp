#include "platform/ipc/Admission.h"

#include <gtest/gtest.h>

namespace kyt {
namespace {

class OneGrant final : public Entitlements {
 public:
  Value valueFor(const PeerCredentials& peer, std::string_view key) override {
    return peer.uid == 1000 && key == "granted" ? Value(true) : Value();
  }
  std::string executableOf(const PeerCredentials&) override { return executable; }
  std::string executable;
};

PeerCredentials peer() {
  PeerCredentials known;
  known.pid = 77;
  known.uid = 1000;
  return known;
}

TEST(Admission, RemembersWhetherWhatWasAskedForWasGranted) {
  OneGrant entitlements;
  Admission admission(entitlements, peer());
  EXPECT_FALSE(admission.refused()) << "nobody asked";
  EXPECT_TRUE(admission.entitlementValue("other").isNull());
  EXPECT_TRUE(admission.refused());
  EXPECT_TRUE(admission.entitlementValue("granted").boolValue());
  EXPECT_FALSE(admission.refused());
}

TEST(Admission, AdvisesWithTheProgramWhereThatIsKnown) {
  OneGrant entitlements;
  const Admission admission(entitlements, peer());
  EXPECT_EQ(admission.advice(), ", see \"kytctl entitlements check --pid 77\",");
  entitlements.executable = "/usr/bin/program";
  EXPECT_EQ(admission.advice(), " (/usr/bin/program), see \"kytctl entitlements check --pid 77\",");
}

TEST(Admission, TellsWhetherTheDelegateWantsCalls) {
  OneGrant entitlements;
  Admission admission(entitlements, peer());
  EXPECT_FALSE(admission.resumed());
  admission.resume();
  EXPECT_TRUE(admission.resumed());
}

}  // namespace
}  // namespace kyt
