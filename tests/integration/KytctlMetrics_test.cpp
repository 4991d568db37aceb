// kytctl metrics against the built daemon: both text formats, read strictly here and by promtool where it is installed, and
// the example of a timer that writes them for a collector.
#include <gtest/gtest.h>

#include <filesystem>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

std::vector<std::string> linesOf(const std::string& text) {
  std::vector<std::string> lines;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}

// What a strict reader finds: families in order, each with its type before its samples, none twice.
struct Figures {
  std::set<std::string> families, samples;
  std::map<std::string, std::string> values;  // by name, of the last sample
};

class KytctlMetrics : public StageTest {
 protected:
  // A daemon with events of a name that needs quotes, delivered ones and lost ones.
  void startWithEvents() {
    lay();
    putBag("cadmor", {entry("a")});
    startDaemon();
    for (const char* name : {"a \"quoted\" \\ name\n", "a \"quoted\" \\ name\\n", "a"}) {
      TestClient client(socket(), 7, name);
      EXPECT_NE(client.configure(), "none");
      EXPECT_TRUE(client.send(5, 1, {}));
      EXPECT_TRUE(client.finish());
    }
  }
  // `ending`: of a counter's name in its comments; `unit`: whether comments tell units.
  static Figures read(const std::vector<std::string>& lines, const std::string& ending, bool units) {
    const std::regex help("# HELP ([a-z_]+) [^\\n]+\\."), type("# TYPE ([a-z_]+) (counter|gauge)"),
        unit("# UNIT ([a-z_]+) ([a-z]+)"),
        sample(
            R"(([a-z_]+)(\{[a-z_]+="(?:[^"\\]|\\[\\"n])*"(?:,[a-z_]+="(?:[^"\\]|\\[\\"n])*")*\})? ([0-9]+))");
    Figures figures;
    std::string family, kind;
    for (const std::string& line : lines) {
      std::smatch found;
      if (std::regex_match(line, found, help)) {
        family = found[1];
        kind.clear();
        EXPECT_TRUE(figures.families.insert(family).second) << "twice: " << family;
      } else if (std::regex_match(line, found, type)) {
        EXPECT_EQ(found[1], family);
        kind = found[2];
        EXPECT_EQ(kind == "counter" && !ending.empty(), family.ends_with("_total")) << line;
      } else if (units && std::regex_match(line, found, unit)) {
        EXPECT_EQ(found[1], family);
        EXPECT_TRUE(family.ends_with("_" + found[2].str())) << family;
      } else if (std::regex_match(line, found, sample)) {
        EXPECT_EQ(found[1], kind == "counter" && ending.empty() ? family + "_total" : family) << line;
        EXPECT_TRUE(figures.samples.insert(found[1].str() + found[2].str()).second) << "twice: " << line;
        figures.values[found[1]] = found[3];
      } else {
        ADD_FAILURE() << line;
      }
    }
    return figures;
  }
};

TEST_F(KytctlMetrics, AreInTheOpenMetricsFormat) {
  startWithEvents();
  const ProgramRun run = kytctl({"metrics"});
  ASSERT_EQ(run.status, 0) << run.text;
  std::vector<std::string> lines = linesOf(run.text);
  ASSERT_FALSE(lines.empty());
  EXPECT_EQ(lines.back(), "# EOF");
  lines.pop_back();
  const Figures figures = read(lines, "", true);
  EXPECT_NE(figures.values.at("kytreportingd_threads"), "0");
  EXPECT_TRUE(figures.values.count("kytreportingd_events_dropped_total")) << run.text;
  EXPECT_NE(run.text.find(R"(client="a \"quoted\" \\x5c name\\n")"), std::string::npos) << run.text;
}

TEST_F(KytctlMetrics, AreTheSameInTheOlderTextFormat) {
  startWithEvents();
  const ProgramRun older = kytctl({"metrics", "--text-format"}), newer = kytctl({"metrics"});
  ASSERT_EQ(older.status, 0) << older.text;
  EXPECT_TRUE(older.text.ends_with("\n"));
  const Figures figures = read(linesOf(older.text), "_total", false);
  std::vector<std::string> lines = linesOf(newer.text);
  lines.pop_back();
  EXPECT_EQ(figures.samples, read(lines, "", true).samples);
  EXPECT_TRUE(figures.families.count("kytreportingd_events_taken_total"));
  EXPECT_TRUE(figures.families.count("kytreportingd_sessions"));
  EXPECT_NE(kytctl({"metrics", "--text-format", "--json"}).status, 0);
}

TEST_F(KytctlMetrics, InTheOlderTextFormatPassPromtool) {
  if (!isInstalled("promtool")) GTEST_SKIP() << "promtool (package prometheus) is not installed";
  startWithEvents();
  const ProgramRun older = kytctl({"metrics", "--text-format"});
  ASSERT_EQ(older.status, 0) << older.text;
  const ProgramRun check = runProgram("promtool", {"check", "metrics"}, older.text);
  EXPECT_EQ(check.status, 0) << check.text;
  EXPECT_EQ(check.text, "");
}

class ExampleOfATimer : public KytctlMetrics {
 protected:
  static std::string unit(const std::string& name) {
    const std::string text = contents(std::string(KYT_EXAMPLES) + "/metrics/" + name);
    EXPECT_FALSE(text.empty()) << name;
    return text;
  }
};

TEST_F(ExampleOfATimer, IsUnderstoodBySystemd) {
  if (!isInstalled("systemd-analyze")) GTEST_SKIP() << "systemd-analyze is not installed";
  const TemporaryFolder folder;
  std::vector<std::string> arguments = {"verify", "--man=no", "--recursive-errors=one"};
  for (const char* name : {"kytreportingd-metrics.service", "kytreportingd-metrics.timer"})
    arguments.push_back(folder.write(name, unit(name)));
  const ProgramRun good = runProgram("systemd-analyze", arguments);
  EXPECT_EQ(good.status, 0) << good.text;
  EXPECT_EQ(good.text.find("kytreportingd-metrics"), std::string::npos) << good.text;
  // It would have said so.
  folder.write("kytreportingd-metrics.timer",
               unit("kytreportingd-metrics.timer") + "[Timer]\nOnCalendr=daily\n");
  EXPECT_NE(runProgram("systemd-analyze", arguments).text.find("OnCalendr"), std::string::npos);
}

TEST_F(ExampleOfATimer, WritesTheFiguresWholeAndTakesThemAwayWithTheDaemon) {
  startWithEvents();
  std::smatch found;
  const std::string service = unit("kytreportingd-metrics.service");
  ASSERT_TRUE(std::regex_search(service, found, std::regex("ExecStart=/bin/sh -c '([^'\n]+)'\n")));
  const std::string command = std::regex_replace(found[1].str(), std::regex("\\$\\$"), "$$");
  const TemporaryFolder folder;
  const std::string file = folder / "figures.prom";
  const std::string prelude = "FIGURES='" + file + "'; kytctl() { '" + stage_->program("kytctl") +
                              "' --root '" + stage_->folder() + "' \"$@\"; }; ";
  ASSERT_EQ(runProgram("sh", {"-c", prelude + command}).status, 0);
  EXPECT_TRUE(contents(file).starts_with("# HELP kytreportingd_build ")) << contents(file);
  EXPECT_FALSE(std::filesystem::exists(file + ".new"));
  ASSERT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  EXPECT_NE(service.find("\nSuccessExitStatus=3\n"), std::string::npos);
  EXPECT_EQ(runProgram("sh", {"-c", prelude + command}).status, 3);
  EXPECT_FALSE(std::filesystem::exists(file));
  EXPECT_FALSE(std::filesystem::exists(file + ".new"));
}

}  // namespace
}  // namespace kyt
