// Data that the sessions of a hierarchy share, over several client processes, seen in the records.
#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

class SharedData : public HierarchyTest {
 protected:
  void SetUp() override {
    lay();
    putBag("cadmor", {entry("top"), entry("middle"), entry("deep"), entry("other")});
    startDaemon();
  }
  // Sends an event of that category and gives back its record.
  Dictionary recordOf(ScriptedClient& client, const std::string& name, int category) {
    sendAndSettle(client, category);
    flush(client);
    if (!arrive("client=" + name + "&method=" + std::to_string(category), 1)) return {};
    return records(name, category).at(0);
  }
  static void share(ScriptedClient& client, const std::string& entries) {
    client.step("{\"do\":\"sharedData\",\"entries\":" + entries + "}");
    EXPECT_EQ(client.ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  }
};

TEST_F(SharedData, IsInTheRecordsOfAllProcessesOfTheHierarchyAndOfNoOther) {
  const Process top = open("top", 0, 1), middle = open("middle", 1, 2), deep = open("deep", 2, 3);
  const Process other = open("other", -1, 4);
  share(*middle, R"({"call":"c-17","tries":1})");
  share(*deep, R"({"tries":2})");
  for (const auto& [client, name] : {std::pair(&top, "top"), {&middle, "middle"}, {&deep, "deep"}}) {
    const Dictionary record = recordOf(**client, name, 10);
    EXPECT_EQ(textOf(record, "call"), "c-17") << name;
    EXPECT_EQ(textOf(record, "tries"), "2") << name << ": the later value stays";
  }
  const Dictionary apart = recordOf(*other, "other", 10);
  EXPECT_FALSE(apart.empty());
  EXPECT_FALSE(apart.contains("call"));
}

TEST_F(SharedData, IsGoneWhenAnyOfThemRemovesIt) {
  const Process top = open("top", 0, 1), deep = open("deep", 2, 3);
  share(*top, R"({"call":"c-17","kept":true})");
  share(*deep, R"({"call":null,"absent":null})");
  const Dictionary record = recordOf(*top, "top", 10);
  EXPECT_FALSE(record.contains("call"));
  EXPECT_TRUE(record.contains("kept"));
}

TEST_F(SharedData, OutlivesTheSessionThatSharedIt) {
  {
    const Process middle = open("middle", 1, 2);
    share(*middle, R"({"call":"c-17"})");
    finish(*middle);
  }
  const Process deep = open("deep", 2, 3);
  EXPECT_EQ(textOf(recordOf(*deep, "deep", 10), "call"), "c-17");
}

TEST_F(SharedData, WinsOverThePayloadAndTheUserInformation) {
  const Process top = open("top", 0, 1);
  share(*top, R"({"both":"shared"})");
  sendAndSettle(*top, 10, R"({"both":"payload"})");
  flush(*top);
  ASSERT_TRUE(arrive("client=top&method=10", 1));
  EXPECT_EQ(textOf(records("top", 10).at(0), "both"), "shared");
}

}  // namespace
}  // namespace kyt
