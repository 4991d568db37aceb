// kytctl events, as people run it.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "platform/linux/data/RapidJSON.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/tools/EventsText.h"

namespace kyt::tools {
namespace {

const std::string kBag =
    "version = \"1\"\n[[release.httppost.clients]]\nclient = \"shop\"\nlocale_whitelist = [\"DE\"]\n"
    "filters = [{ key = \"email\", action = \"sha256\" }]\nsampling_threshold = 1.0\n"
    "post_url = \"https://posts.example.org\"\n";

class KytctlEvents : public ::testing::Test {
 protected:
  [[nodiscard]] static ProgramRun run(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), "events");
    return runProgram(KYT_PROGRAMS "/kytctl", arguments);
  }
  TemporaryFolder folder_;
  const std::string bag_ = folder_.write("bag.toml", kBag);
};

TEST_F(KytctlEvents, CheckExitsWithZeroWithoutFindings) {
  const std::string file =
      folder_.write("events.toml", eventText("login", 10, 1, fieldText("email", "string", true)));
  const ProgramRun checked = run({"check", file, bag_});
  EXPECT_EQ(checked.status, 0);
  EXPECT_EQ(checked.text, file + ": nothing found; events: 1, fields: 1\n");
}

TEST_F(KytctlEvents, CheckPrintsFindingsWithFileAndLineAndExitsWithOne) {
  const std::string file =
      folder_.write("events.toml", eventText("login", 10, 1, fieldText("name", "string", true)));
  const ProgramRun checked = run({"check", file, bag_});
  EXPECT_EQ(checked.status, 1);
  EXPECT_EQ(checked.text,
            file +
                ":6: personal-unfiltered: \"name\" of \"login\" is personal, and no filter removes or "
                "hashes it: release, httppost, client \"shop\"\n");
}

TEST_F(KytctlEvents, CheckPrintsOneJSONObject) {
  const std::string file =
      folder_.write("events.toml", eventText("login", 0, 1, fieldText("name", "string", true)));
  const ProgramRun checked = run({"check", "--json", file, bag_});
  EXPECT_EQ(checked.status, 1);
  RapidJSON json;
  const auto parsed = json.parse(checked.text);
  ASSERT_TRUE(std::holds_alternative<Value>(parsed)) << checked.text;
  const Dictionary* report = std::get<Value>(parsed).dictionary();
  ASSERT_NE(report, nullptr);
  EXPECT_EQ(report->string("file")->str(), file);
  EXPECT_EQ(report->string("storebag")->str(), bag_);
  EXPECT_EQ(report->integer("events"), 1);
  EXPECT_EQ(report->integer("fields"), 1);
  EXPECT_EQ(report->integer("further", -1), 0);
  const Array* findings = report->array("findings");
  ASSERT_NE(findings, nullptr);
  ASSERT_EQ(findings->size(), 2U);
  const Dictionary* second = (*findings)[1].dictionary();
  EXPECT_EQ(second->integer("line"), 6);
  EXPECT_EQ(second->string("kind")->str(), "personal-unfiltered");
  EXPECT_EQ(second->string("event")->str(), "login");
  EXPECT_EQ(second->string("field")->str(), "name");
  EXPECT_TRUE(second->contains("text"));
}

TEST_F(KytctlEvents, WhatIsMadeOfAFileDoesNotTakeItsPlace) {
  const std::string text = eventText("login", 10, 1, fieldText("email", "string", true));
  const std::string file = folder_.write("events.toml", text);
  for (const std::string& output : {file, file.substr(0, file.rfind('/')) + "/./events.toml"}) {
    for (const ProgramRun& made :
         {run({"generate", file, "--lang", "c", "-o", output}), run({"document", file, "-o", output})}) {
      EXPECT_EQ(made.status, 1);
      EXPECT_EQ(made.text, "kytctl: " + output + ": is the file that describes the events\n");
    }
  }
  EXPECT_EQ(run({"check", file, bag_}).status, 0);
}

TEST_F(KytctlEvents, CheckExitsWithTwoWhereItCannotTell) {
  const std::string good = folder_.write("events.toml", eventText("login", 10, 1));
  const std::string wrong = folder_.write("wrong.toml", eventText("login", 10, 1, "catgory = 1\nkind = 2\n"));
  const ProgramRun unreadable = run({"check", wrong, bag_});
  EXPECT_EQ(unreadable.status, 2);
  EXPECT_EQ(unreadable.text,
            "kytctl: " + wrong +
                ":6: unknown key \"catgory\"; the nearest known one is \"category\"\nkytctl: " + wrong +
                ":7: unknown key \"kind\"\n");
  EXPECT_EQ(run({"check", folder_ / "nowhere.toml", bag_}).status, 2);
  EXPECT_EQ(run({"check", good, folder_ / "nowhere.toml"}).status, 2);
  EXPECT_EQ(run({"check", good, folder_.write("bag.txt", kBag)}).status, 2);
}

TEST_F(KytctlEvents, CheckTakesASignedBagToo) {
  ASSERT_EQ(runProgram(KYT_PROGRAMS "/kytctl", {"keys", "make", folder_ / "keys"}).status, 0);
  ASSERT_EQ(runProgram(KYT_PROGRAMS "/kytctl", {"storebag", "sign", bag_, "--key",
                                                folder_ / "keys/private.pem", "-o", folder_ / "document"})
                .status,
            0);
  const std::string file = folder_.write("events.toml", eventText("login", 10, 1));
  EXPECT_EQ(run({"check", file, folder_ / "document"}).status, 0);
}

TEST_F(KytctlEvents, CheckEscapesWhatATerminalWouldObey) {
  const std::string file = folder_.write("ev\033ents.toml", eventText("login", 10, 1));
  EXPECT_EQ(run({"check", file, bag_}).text.find('\033'), std::string::npos);
}

// Each ready-made source by the storebag that it comes with.
class KytctlEventsOfSource : public ::testing::TestWithParam<const char*> {};

TEST_P(KytctlEventsOfSource, FitTheStorebagBesideThem) {
  const std::string folder = std::string(KYT_SOURCE_DIR "/sources/") + GetParam();
  const auto read = readEvents(folder + "/events.toml");
  ASSERT_TRUE(std::holds_alternative<EventsFile>(read)) << std::get<EventsProblems>(read).at(0).text;
  EXPECT_EQ(std::get<EventsFile>(read).client, std::string("kytsource-") + GetParam());
  EXPECT_EQ(std::get<EventsFile>(read).service, "kytsource");
  const ProgramRun checked = runProgram(
      KYT_PROGRAMS "/kytctl", {"events", "check", folder + "/events.toml", folder + "/storebag.toml"});
  EXPECT_EQ(checked.status, 0) << checked.text;
}

INSTANTIATE_TEST_SUITE_P(Sources, KytctlEventsOfSource,
                         ::testing::Values("units", "boots", "crashes", "resources"),
                         [](const auto& test) { return std::string(test.param); });

}  // namespace
}  // namespace kyt::tools
