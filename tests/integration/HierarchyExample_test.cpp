// The worked example of docs/PROGRAMS.md, as it stands there.
#include <algorithm>
#include <regex>
#include <sstream>

#include "tests/integration/HierarchyFixture.h"

namespace kyt {
namespace {

class HierarchyExample : public HierarchyTest {
 protected:
  // The lines of the block that begins with "```LANGUAGE example=NAME".
  static std::vector<std::string> example(const std::string& name, const std::string& language = "jsonl") {
    std::istringstream document(contents(std::string(KYT_DOCUMENTS) + "/PROGRAMS.md"));
    std::vector<std::string> lines;
    bool inside = false;
    for (std::string line; std::getline(document, line);) {
      if (inside && line == "```") break;
      if (inside) lines.push_back(line);
      if (line == "```" + language + " example=" + name) inside = true;
    }
    return lines;
  }
};

TEST_F(HierarchyExample, DoesWhatTheGuideSays) {
  lay();
  putBag("cadmor", {entry("call"), entry("stream")});
  startDaemon();
  const Process call = process(), stream = process();
  ASSERT_EQ(example("call").size(), 6U);
  ASSERT_EQ(example("stream").size(), 4U);
  const std::vector<std::string> steps = example("call");
  for (size_t i = 0; i < 3; ++i) call->step(steps[i]);
  const std::string own = call->line();
  EXPECT_NE(own.find("\"category\":0,\"type\":0"), std::string::npos) << own;
  EXPECT_EQ(call->line(), "live: httppost");
  // Answered after what the call shares was taken; then the other process may begin.
  EXPECT_EQ(call->ask(R"({"do":"displayURL"})"), "https://display.example.org/");
  for (size_t i = 3; i < steps.size(); ++i) call->step(steps[i]);

  for (const std::string& line : example("stream")) stream->step(line);
  EXPECT_EQ(stream->line(), "live: httppost");
  EXPECT_EQ(stream->line(), "sent 2, lost 0, dropped 0");
  EXPECT_EQ(stream->end(), std::vector<std::string>{"status 0"});
  const std::vector<std::string> rest = call->end();
  ASSERT_GE(rest.size(), 6U);
  EXPECT_EQ(rest.back(), "status 0");
  size_t frames = 0;
  for (const std::string& line : rest)
    frames +=
        line.find("\"ClientName\":\"stream\",\"ServiceName\":\"demo\"},\"payload\":{\"frames\":240}}}") !=
        std::string::npos;
  EXPECT_EQ(frames, 2U);
  // The line that the guide shows, but for its time.
  const std::regex time("\"timestamp\":[0-9]+(\\.[0-9]+)?,");
  const std::vector<std::string> shown = example("aggregated", "json");
  ASSERT_EQ(shown.size(), 1U);
  const std::string timeless = std::regex_replace(shown[0], time, "");
  EXPECT_NE(timeless, shown[0]);
  EXPECT_EQ(std::count_if(rest.begin(), rest.end(),
                          [&](const std::string& line) {
                            return line != timeless && std::regex_replace(line, time, "") == timeless;
                          }),
            2)
      << rest[0];

  ASSERT_TRUE(arrive("client=call&method=11", 1)) << daemonLog();
  ASSERT_TRUE(arrive("client=stream&method=12", 2)) << daemonLog();
  const std::string callID = textOf(records("call", 11).at(0), "_sessionID");
  for (const char* client : {"call", "stream"})
    for (const Dictionary& record : records(client)) {
      // The call's own start message is older than what the call shares.
      const bool older = textOf(record, "_method") == "0" && textOf(record, "_status") == "0" &&
                         std::string(client) == "call";
      EXPECT_EQ(textOf(record, "callKind"), older ? "(null)" : "video") << client << description(record);
      EXPECT_EQ(textOf(record, "_sessionID").substr(0, callID.size()), callID);
    }
  EXPECT_EQ(textOf(records("stream", 12).at(0), "_sessionID").size(), 2 * callID.size() + 1);
}

}  // namespace
}  // namespace kyt
