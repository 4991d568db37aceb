// What `kytctl storebag simulate` tells of a bag that nobody has signed yet, without a daemon and without a server.
#include <gtest/gtest.h>

#include "platform/linux/data/RapidJSON.h"
#include "platform/objects/Description.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

const std::string kEntry =
    "version = \"t\"\n[[release.httppost.clients]]\nclient = \"person\"\nlocale_whitelist = [\"DE\", \"US\"]\n"
    "filters = []\nevent_threshold = 49\npost_url = \"https://x.example.org/e\"\n";
const std::string kOpen =
    R"({"do":"open","sessionInfo":{"SessionID":1,"ClientType":20,"BatchEvent":true,"RequireUserInfo":true},)"
    R"("userInfo":{"ClientName":"person"}})"
    "\n{\"do\":\"configure\"}\n";
const std::string kSend = R"({"do":"send","category":3,"type":4,"payload":{"a":1},"repeat":10})"
                          "\n";

class KytctlSimulate : public ::testing::Test {
 protected:
  [[nodiscard]] ProgramRun run(const std::string& bag, const std::string& events,
                               std::vector<std::string> further = {}) const {
    further.insert(further.begin(),
                   {"--root", folder_.path(), "storebag", "simulate", folder_.write("bag.toml", bag),
                    "--events", folder_.write("events.jsonl", events)});
    return runProgram(KYT_PROGRAMS "/kytctl", further);
  }
  [[nodiscard]] Dictionary report(const std::string& bag, const std::string& events,
                                  const std::string& devices = "500", const std::string& seed = "1") const {
    const ProgramRun ran = run(bag, events, {"--devices", devices, "--seed", seed, "--json"});
    EXPECT_EQ(ran.status, 0);
    RapidJSON json;
    const auto parsed = json.parse(ran.text);
    const Value* value = std::get_if<Value>(&parsed);
    if (value != nullptr && value->isDictionary()) return *value->dictionary();
    ADD_FAILURE() << ran.text;
    return {};
  }
  static double share(const Dictionary& row) {
    return row.find("share") != nullptr ? row.find("share")->doubleValue() : -1;
  }
  static double shareOf(const Dictionary& report, const char* list, const char* key,
                        const std::string& name) {
    for (const Value& row : *report.array(list))
      if (*row.dictionary()->string(key) == name) return share(*row.dictionary());
    return -1;
  }
  static std::string lost(const Dictionary& report) {
    return description(*(*report.array("events"))[0].dictionary()->find("lostBy"));
  }

  TemporaryFolder folder_;
};

TEST_F(KytctlSimulate, TellsTheShareOfSessionsByCountryAndDevice) {
  const Dictionary told =
      report(kEntry + "sampling_threshold = 1.0\ndevice_blacklist = [\"Old\"]\n",
             R"({"do":"devices","countries":{"DE":1,"FR":1,"unknown":1},"models":{"Old":1,"New":1}})"
             "\n" +
                 kOpen + kSend);
  EXPECT_EQ(shareOf(told, "byCountry", "country", "FR"), 0);
  EXPECT_NEAR(shareOf(told, "byCountry", "country", "DE"), 0.5, 0.15);
  EXPECT_NEAR(shareOf(told, "byCountry", "country", "unknown"), 0.5, 0.15) << "servers count on these";
  EXPECT_EQ(shareOf(told, "byDevice", "model", "Old"), 0);
  EXPECT_NEAR(shareOf(told, "byDevice", "model", "New"), 0.67, 0.15);
  EXPECT_EQ(told.dictionary("sessions")->integer("sessions"), 500);
}

TEST_F(KytctlSimulate, TellsByWhichRuleEventsAreLost) {
  const std::string everywhere = R"({"do":"devices","countries":{"DE":1}})"
                                 "\n";
  const Dictionary sampled =
      report(kEntry + "sampling_threshold = 0.3\n", everywhere + kOpen + kSend, "2000");
  EXPECT_NEAR(share(*sampled.dictionary("sessions")), 31.0 / 101, 0.04);
  const Dictionary row = *(*sampled.array("events"))[0].dictionary();
  EXPECT_EQ(row.integer("sent"), 20000);
  EXPECT_EQ(row.integer("leave"), 10 * sampled.dictionary("sessions")->integer("reporting"));
  EXPECT_EQ(lost(sampled), "{\"sampling\":" + std::to_string(20000 - row.integer("leave")) + "}");

  const std::string all = kEntry + "sampling_threshold = 1.0\n";
  EXPECT_EQ(lost(report(all, R"({"do":"devices","countries":{"DE":1},"consent":0})"
                             "\n" +
                                 kOpen + kSend)),
            R"({"consent":5000})");
  EXPECT_EQ(lost(report(all, R"({"do":"devices","countries":{"FR":1}})"
                             "\n" +
                                 kOpen + kSend)),
            R"({"country":5000})");
  EXPECT_EQ(lost(report(all + "event_blacklist = [3]\n", everywhere + kOpen + kSend)),
            R"({"event-filtered":5000})");
  EXPECT_EQ(lost(report(all, everywhere + std::regex_replace(kOpen, std::regex("person"), "else") + kSend)),
            R"({"client":5000})");
}

TEST_F(KytctlSimulate, GivesTheSameReportForTheSameSeed) {
  const std::string bag = kEntry + "sampling_threshold = 0.5\n", events = kOpen + kSend;
  EXPECT_EQ(report(bag, events, "300", "7"), report(bag, events, "300", "7"));
  EXPECT_NE(lost(report(bag, events, "300", "7")), lost(report(bag, events, "300", "8")));
}

TEST_F(KytctlSimulate, CountsPostsAndBytesOfADay) {
  const std::string bag = kEntry + "sampling_threshold = 1.0\n";
  const std::string devices = R"({"do":"devices","countries":{"DE":1}})"
                              "\n";
  const Dictionary once = *report(bag, devices + kOpen + kSend, "10").dictionary("aDay");
  EXPECT_EQ(once.find("postsOfADevice")->doubleValue(), 1) << "one batch: start, events and stop";
  EXPECT_GT(once.find("bytesOfADevice")->doubleValue(), 300) << "headers and a compressed body";
  const Dictionary thrice =
      *report(bag, devices + std::regex_replace(kOpen, std::regex("\\}\\}\n"), "},\"perDay\":3}\n") + kSend,
              "10")
           .dictionary("aDay");
  EXPECT_EQ(thrice.find("bytes")->doubleValue(), 3 * once.find("bytes")->doubleValue());
  const Dictionary flushed =
      *report(bag, devices + kOpen + kSend + "{\"do\":\"flush\"}\n" + kSend, "10").dictionary("aDay");
  EXPECT_EQ(flushed.find("postsOfADevice")->doubleValue(), 2);
}

TEST_F(KytctlSimulate, TakesWhatTheBagNamesForTheDevicesThatNobodyDescribed) {
  const Dictionary told = report(kEntry + "sampling_threshold = 1.0\n", kOpen + kSend, "100");
  EXPECT_EQ(description(*told.dictionary("population")->find("countries")), R"({"DE":1,"US":1,"ZZ":1})");
  EXPECT_EQ(shareOf(told, "byCountry", "country", "ZZ"), 0);
  EXPECT_EQ(shareOf(told, "byCountry", "country", "US"), 1);
}

TEST_F(KytctlSimulate, PrintsAtMostAHundredColumnsForPeople) {
  const ProgramRun told =
      run(kEntry + "sampling_threshold = 1.0\ndevice_whitelist = [\"" + std::string(200, 'x') + "\"]\n",
          kOpen + kSend);
  EXPECT_EQ(told.status, 0);
  EXPECT_NE(told.text.find("lost by country"), std::string::npos) << told.text;
  for (const std::string& line : linesOf(told.text)) EXPECT_LE(line.size(), 100U) << line;
}

TEST_F(KytctlSimulate, NamesTheLineOfAMistake) {
  const std::string bag = kEntry + "sampling_threshold = 1.0\n";
  const auto problem = [&](const std::string& events) {
    const ProgramRun ran = run(bag, events);
    EXPECT_EQ(ran.status, 1);
    return ran.text.substr(ran.text.find("events.jsonl: ") + 14);
  };
  EXPECT_EQ(problem(kOpen + "{\"do\":\"send\",\"category\":70000,\"type\":1}\n"),
            "line 3: \"category\" must be a whole number from 0 to 65535\n");
  EXPECT_EQ(problem("# nothing\n{\"do\":\"devices\",\"countries\":{\"DE\":0}}\n"),
            "line 2: \"countries\": a weight is a number over 0\n");
  EXPECT_EQ(problem(kSend), "line 1: a session is opened first\n");
  EXPECT_EQ(problem(""), "no session is opened: there is no step \"open\"\n");
  EXPECT_NE(problem("{").find("line 1: "), std::string::npos);
  EXPECT_EQ(run("version = \"t\"\n", kOpen).status, 1) << "there is no section";
}

}  // namespace
}  // namespace kyt
