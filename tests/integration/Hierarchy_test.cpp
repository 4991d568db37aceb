// Hierarchies over several client processes, seen by what arrives at the server.
#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

constexpr double kBelowEveryDraw = -0.5;  // of a factor for sampling, which may be 0

class Hierarchy : public HierarchyTest {
 protected:
  void SetUp() override {
    tools::Stage::Options options;
    options.logLevel = "debug";
    lay(std::move(options));
  }
  void start(const Array& entries) {
    putBag("cadmor", entries);
    startDaemon();
  }
  // The one identifier that all records of the client have, or what there is instead.
  std::string sessionIDOf(const std::string& client) const {
    std::string id;
    for (const Dictionary& record : records(client)) {
      const std::string found = textOf(record, "_sessionID");
      if (!id.empty() && found != id) return "both " + id + " and " + found;
      id = found;
    }
    return id;
  }
  static size_t dots(const std::string& text) {
    return static_cast<size_t>(std::count(text.begin(), text.end(), '.'));
  }
  Dictionary entryWith(const std::string& name, std::initializer_list<DictionaryEntry> more) const {
    Dictionary changed = entry(name);
    for (const DictionaryEntry& item : more) changed.set(item.key, item.value);
    return changed;
  }
};

TEST_F(Hierarchy, JoinsTheIdentifiersOfThreeProcesses) {
  start({entry("top"), entry("middle"), entry("deep")});
  const Process top = open("top", 0, 1), middle = open("middle", 1, 2), deep = open("deep", 2, 3);
  for (const Process* client : {&deep, &middle, &top}) {
    sendAndSettle(**client, 10);
    flush(**client);
  }
  for (const char* client : {"top", "middle", "deep"})
    ASSERT_TRUE(arrive(std::string("method=10&client=") + client, 1)) << daemonLog();
  const std::string topID = sessionIDOf("top"), middleID = sessionIDOf("middle"),
                    deepID = sessionIDOf("deep");
  EXPECT_EQ(topID.size(), 24U) << "an identifier is 16 bytes in base64: " << topID;
  EXPECT_EQ(middleID.substr(0, 25), topID + ".");
  EXPECT_EQ(middleID.size(), 49U) << middleID;
  EXPECT_EQ(deepID.substr(0, 50), middleID + ".");
  EXPECT_EQ(deepID.size(), 74U) << deepID;
}

TEST_F(Hierarchy, AGapLeavesADeeperSessionAloneUntilItIsFilled) {
  start({entry("top"), entry("middle"), entry("deep")});
  const Process top = open("top", 0, 1), deep = open("deep", 2, 3);
  EXPECT_TRUE(
      logged("parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): "
             "incomplete parentSessionID is '(null)'"));
  EXPECT_TRUE(
      logged("parentSessionForChild: Unable to find session with hierarchy of 1 for hierarchyToken '4f1c'"));
  EXPECT_TRUE(logged(
      "syncReportingStates: child session 3 (backend httppost) with hierarchy 2 is missing its parent"));
  sendAndSettle(*deep, 10);
  flush(*deep);
  ASSERT_TRUE(arrive("client=deep", 2)) << daemonLog();
  EXPECT_EQ(dots(sessionIDOf("deep")), 0U) << "no part of the identifier is known";

  // What is still in the batch when the gap is filled gets the whole identifier.
  sendAndSettle(*deep, 11);
  const Process middle = open("middle", 1, 2);
  flush(*deep);
  ASSERT_TRUE(arrive("client=deep&method=11", 1)) << daemonLog();
  EXPECT_EQ(dots(textOf(records("deep", 11).at(0), "_sessionID")), 2U);
}

TEST_F(Hierarchy, WithoutATopTheIdentifierBeginsBelowTheGap) {
  start({entry("middle"), entry("deep")});
  const Process middle = open("middle", 1, 2), deep = open("deep", 2, 3);
  for (const Process* client : {&middle, &deep}) {
    sendAndSettle(**client, 10);
    flush(**client);
  }
  ASSERT_TRUE(arrive("client=middle", 2));
  ASSERT_TRUE(arrive("client=deep", 2)) << daemonLog();
  EXPECT_EQ(dots(sessionIDOf("middle")), 0U);
  EXPECT_EQ(dots(sessionIDOf("deep")), 1U);
  EXPECT_EQ(sessionIDOf("deep").substr(0, 25), sessionIDOf("middle") + ".");
}

TEST_F(Hierarchy, AParentThatDiesLeavesItsChildWithTheIdentifierThatItHad) {
  start({entry("top"), entry("middle"), entry("deep"), entry("late")});
  const Process top = open("top", 0, 1), middle = open("middle", 1, 2), deep = open("deep", 2, 3);
  middle->kill();
  ASSERT_TRUE(eventually([this] { return logged("dealloc: ReportingdSession dealloc: 2"); }));
  sendAndSettle(*deep, 10);
  flush(*deep);
  ASSERT_TRUE(arrive("client=deep", 2)) << daemonLog();
  EXPECT_EQ(dots(sessionIDOf("deep")), 2U);
  // The batch of the one that died was posted at its end, with its stop message.
  ASSERT_TRUE(arrive("client=middle", 2)) << daemonLog();
  EXPECT_EQ(textOf(records("middle", 0, 1).at(0), "GracefulTermination"), "0");

  const Process late = open("late", 2, 4);
  EXPECT_TRUE(logged("child session 4 (backend httppost) with hierarchy 2 is missing its parent"));
  flush(*late);
  ASSERT_TRUE(arrive("client=late", 1)) << daemonLog();
  EXPECT_EQ(dots(sessionIDOf("late")), 0U);
}

TEST_F(Hierarchy, AChildGetsItsParentsStateAndSamplingThreshold) {
  // Alone the child would be disabled: every factor is above the threshold and above the override.
  start({entryWith("top", {{"sampling_threshold", 1.5}}),
         entryWith("child",
                   {{"sampling_threshold", kBelowEveryDraw}, {"override_sampling", kBelowEveryDraw}})});
  {
    const Process alone = open("child", -1, 9, false, "live:");
    finish(*alone);
  }
  const Process top = open("top", 0, 1), child = open("child", 1, 2);
  EXPECT_TRUE(
      logged("HTTPSPostBackend(syncReportingStates): httppost: state and sampling rate updated to 2, 1.50%"));
  sendAndSettle(*child, 10);
  finish(*child);
  ASSERT_TRUE(arrive("client=child", 3)) << daemonLog();
  EXPECT_EQ(textOf(records("child", 0, 1).at(0), "SamplingThreshold"), "1.5");
}

TEST_F(Hierarchy, AParentThatIsDisabledDisablesItsDescendants) {
  start({entryWith("top", {{"locale_whitelist", Array{"FR"}}}), entry("middle"), entry("deep")});
  const Process top = open("top", 0, 1, false, "live:"), middle = open("middle", 1, 2, false, "live:"),
                deep = open("deep", 2, 3, false, "live:");
  sendAndSettle(*deep, 10);
  for (const Process* client : {&deep, &middle, &top}) finish(**client);
  EXPECT_TRUE(eventually(
      [this] { return logged("shutdownSessionAggregation: Disable aggregation module for session 1"); }));
  EXPECT_EQ(stage_->stopDaemon().value_or(-1), 0);
  EXPECT_EQ(total("events"), 0);
}

TEST_F(Hierarchy, ASessionHeldBackBySamplingIsNotOverwritten) {
  start({entry("top"), entryWith("held", {{"sampling_threshold", kBelowEveryDraw}})});
  const Process top = open("top", 0, 1), held = open("held", 1, 2);
  // Let go: what was held back comes, and the threshold is still its own.
  held->step(R"({"do":"send","category":10,"type":1,"flag":2,"payload":{}})");
  finish(*held);
  ASSERT_TRUE(arrive("client=held&method=0&status=1", 1)) << daemonLog();
  EXPECT_EQ(textOf(records("held", 0, 1).at(0), "SamplingThreshold"), "-0.5");
}

TEST_F(Hierarchy, AParentsNewStateReachesSessionsThatAreThere) {
  start({entryWith("absent", {{"locale_whitelist", Array{"FR"}}}), entry("top"), entry("child")});
  const Process top = open("absent", 0, 1, false, "live:"), child = open("child", 1, 2, false, "live:");
  EXPECT_EQ(top->ask(R"({"do":"states","userInfo":{"ClientName":"top","ServiceName":"test"}})"),
            "live: httppost");
  EXPECT_EQ(child->ask(R"({"do":"states"})"), "live: httppost");
}

}  // namespace
}  // namespace kyt
