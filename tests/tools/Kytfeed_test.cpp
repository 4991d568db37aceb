// kytfeed as a person or a script runs it, against a bare socket that acknowledges nothing by itself.
#include <gtest/gtest.h>

#include <cstdlib>

#include "tests/support/Programs.h"
#include "tests/support/UDPPeer.h"

namespace kyt {
namespace {

constexpr char kEvent[] = "{\"method\":2,\"respCode\":3}\n";

class Kytfeed : public ::testing::Test {
 protected:
  [[nodiscard]] std::vector<std::string> command(const std::vector<std::string>& arguments) const {
    std::vector<std::string> all = {"--server", "127.0.0.1", "--port", std::to_string(server_.port())};
    all.insert(all.end(), arguments.begin(), arguments.end());
    return all;
  }
  [[nodiscard]] ProgramRun feed(const std::vector<std::string>& arguments, const std::string& events) const {
    return runProgram(KYT_PROGRAMS "/kytfeed", command(arguments), events);
  }
  // Through a shell, for redirections.
  [[nodiscard]] ProgramRun shell(const std::string& redirection) const {
    return runProgram("sh", {"-c", std::string("echo '") + kEvent + "' | " + KYT_PROGRAMS +
                                       "/kytfeed --server 127.0.0.1 --port " +
                                       std::to_string(server_.port()) + " " + redirection});
  }
  static bool has(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
  }
  // Of the event in a datagram, in seconds; to 4 milliseconds.
  static double timeOf(const std::string& datagram) {
    uint32_t seconds = 0;
    for (size_t i = 4; i < 8; ++i) seconds = seconds << 8 | static_cast<unsigned char>(datagram.at(i));
    return seconds + static_cast<unsigned char>(datagram.at(3)) * 0.004;
  }

  UDPPeer server_;
};

TEST_F(Kytfeed, SendsTheDeviceThatItIsGiven) {
  EXPECT_EQ(feed({"--device", "short"}, kEvent).status, 0);
  EXPECT_EQ(server_.receive().substr(20, 40), "short" + std::string(35, '\0'));
  EXPECT_EQ(feed({"--device", std::string(40, 'd') + "beyond"}, kEvent).status, 0);
  EXPECT_EQ(server_.receive().substr(20, 40), std::string(40, 'd'));
  EXPECT_EQ(feed({}, kEvent).status, 0);
  EXPECT_EQ(server_.receive().substr(20, 40), std::string(40, '0'));
}

TEST_F(Kytfeed, SendsTheMajorVersionThatItIsGiven) {
  EXPECT_EQ(feed({"--self-version", "11.2.3"}, kEvent).status, 0);
  EXPECT_EQ(server_.receive().at(0), 11);
  EXPECT_EQ(feed({}, kEvent).status, 0);
  EXPECT_EQ(server_.receive().at(0), 8);
}

TEST_F(Kytfeed, PausesAfterEachEvent) {
  EXPECT_EQ(feed({"--interval", "300"}, std::string(kEvent) + kEvent).status, 0);
  const double first = timeOf(server_.receive()), second = timeOf(server_.receive());
  EXPECT_GE(second - first, 0.3 - 0.008);
}

TEST_F(Kytfeed, APeriodBelowTenMillisecondsCountsAsTen) {
  for (const char* period : {"0", "-5", "9"}) {
    const ProgramRun run = feed({"--reliable", period}, kEvent);
    EXPECT_EQ(run.status, 1) << run.text;
    EXPECT_TRUE(has(run.text, "kytfeed: 1 of 1 events were never acknowledged\n")) << run.text;
    const std::string first = server_.receive();
    EXPECT_EQ(first.at(63) & 1, 1) << "it asks for an acknowledgement";
    for (int again = 0; again < 4; ++again) EXPECT_EQ(server_.receive(), first) << period;
  }
}

TEST_F(Kytfeed, CountsTheEventsThatTooManyOthersDisplaced) {
  std::string events;
  for (int i = 0; i < 60; ++i) events += kEvent;
  const ProgramRun run = feed({"--reliable", "100"}, events);
  EXPECT_EQ(run.status, 1);
  EXPECT_TRUE(has(run.text, "kytfeed: 60 of 60 events were never acknowledged\n")) << run.text;
}

// Its next tick comes after 22 seconds, and its last resort 9.5 later.
TEST_F(Kytfeed, WaitsAsLongAsTheBackEndDoes) {
  const ProgramRun run = feed({"--reliable", "22000"}, kEvent);
  EXPECT_EQ(run.status, 1) << run.text;
  EXPECT_TRUE(has(run.text, "scheduled last resort clean-up in 9500 ms.")) << run.text;
  EXPECT_TRUE(has(run.text, "kytfeed: 1 of 1 events were never acknowledged\n")) << run.text;
}

TEST_F(Kytfeed, EndsWithAnErrorWhenItCannotRead) {
  const ProgramRun missing = feed({"/nonexistent/file"}, {});
  EXPECT_EQ(missing.status, 1);
  EXPECT_EQ(missing.text, "kytfeed: can't read /nonexistent/file: No such file or directory\n");
  const ProgramRun folder = feed({"/"}, {});
  EXPECT_EQ(folder.status, 1);
  EXPECT_EQ(folder.text, "kytfeed: can't read /: Is a directory\n");
  const ProgramRun input = shell("</");
  EXPECT_EQ(input.status, 1);
  EXPECT_EQ(input.text, "kytfeed: can't read -: Is a directory\n");
  const ProgramRun closed = shell("<&-");
  EXPECT_EQ(closed.status, 1);
  EXPECT_TRUE(has(closed.text, "kytfeed: can't read -")) << closed.text;
}

TEST_F(Kytfeed, EndsWithAnErrorWhenItCannotWrite) {
  const ProgramRun full = shell(">/dev/full");
  EXPECT_EQ(full.status, 1);
  EXPECT_EQ(full.text, "kytfeed: can't write: No space left on device\n");
  const ProgramRun closed = shell(">&-");
  EXPECT_EQ(closed.status, 1);
  EXPECT_EQ(closed.text, "kytfeed: can't write: Bad file descriptor\n");
}

// Each would be read as 0, or left out.
TEST_F(Kytfeed, RefusesWhatIsNoEvent) {
  const std::pair<const char*, const char*> lines[] = {
      {R"({"method":"2","respCode":3})", R"("method" must be a whole number from 0 to 65535)"},
      {R"({"method":65536,"respCode":3})", R"("method" must be a whole number from 0 to 65535)"},
      {R"({"method":2,"respCode":true})", R"("respCode" must be a whole number from 0 to 65535)"},
      {R"({"method":2,"respcode":3})", R"(unknown key "respcode")"},
      {R"({"method":2})", R"("respCode" is missing)"},
      {R"({"method":2,"respCode":3,"event":"one"})", R"("event" must be a whole number from 0 to 65535)"},
      {R"({"method":2,"respCode":3,"time":"now"})", R"("time" must be a number)"},
      {R"({"method":2,"respCode":3,"time":true})", R"("time" must be a number)"},
      {R"({"method":2,"respCode":3,"message":"text"})", R"("message" must be an object)"},
      {"7", "it must be an object"}};
  for (const auto& [line, complaint] : lines) {
    const ProgramRun run = feed({}, std::string("\n") + line + "\n");
    EXPECT_EQ(run.status, 1) << line;
    EXPECT_TRUE(has(run.text, std::string("kytfeed: line 2 is no event: ") + complaint)) << run.text;
    EXPECT_TRUE(has(run.text, line)) << run.text;
  }
}

}  // namespace
}  // namespace kyt
