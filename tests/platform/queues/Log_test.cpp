#include "platform/queues/Log.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/base/Limits.h"
#include "platform/fake/MemoryLogSink.h"

namespace kyt {
namespace {

using Line = MemoryLogSink::Line;

TEST(Log, FormatsLinesOfEachLevel) {
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  log.debug("storebagForSession: found for client type %d", 7);
  log.normal("%s and %s", "one", "two");
  log.error("plain");
  EXPECT_EQ(sink.lines(), (std::vector<Line>{{LogLevel::debug, "storebagForSession: found for client type 7"},
                                             {LogLevel::normal, "one and two"},
                                             {LogLevel::error, "plain"}}));
}

TEST(Log, WritesNothingBelowItsLevel) {
  MemoryLogSink sink;
  Log log(sink, LogLevel::error);
  log.debug("d");
  log.normal("n");
  log.debugObjects("%@", {1});
  EXPECT_TRUE(sink.lines().empty());
  log.setLevel(LogLevel::normal);
  log.debug("d");
  log.normal("n");
  EXPECT_EQ(sink.lines(), (std::vector<Line>{{LogLevel::normal, "n"}}));
  EXPECT_FALSE(log.debugEnabled());
}

TEST(Log, KeepsLinesUpToTheLimitWhole) {
  MemoryLogSink sink;
  Log log(sink);
  for (const size_t size :
       {size_t{1022}, size_t{1023}, size_t{1024}, size_t{1025}, Limits::maxLogLineBytes - 1}) {
    sink.clear();
    const std::string text(size, 'x');
    log.error("%s%d", text.c_str(), 4);
    ASSERT_EQ(sink.lines().size(), 1U);
    EXPECT_EQ(sink.lines()[0].line, text + "4");
  }
}

TEST(Log, CutsALineOverTheLimitAndSaysSo) {
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  const std::string text(4u << 20, 'x');  // a server's whole reply
  log.normal("%s", text.c_str());
  log.debugObjects("%@", {String(text)});
  ASSERT_EQ(sink.lines().size(), 2U);
  const std::string cut = text.substr(0, Limits::maxLogLineBytes) + " (cut, 4194304 bytes in all)";
  EXPECT_EQ(sink.lines()[0].line, cut);
  EXPECT_EQ(sink.lines()[1].line, cut);
}

TEST(Log, CutsBetweenCharacters) {
  MemoryLogSink sink;
  Log log(sink);
  const std::string before(Limits::maxLogLineBytes - 2, 'x');
  log.normal("%s\xE2\x82\xAC and so on", before.c_str());  // a character of three bytes
  ASSERT_EQ(sink.lines().size(), 1U);
  EXPECT_EQ(sink.lines()[0].line, before + " (cut, 16395 bytes in all)");
}

TEST(Log, CutsByWhatItsSinksMakeOfALine) {
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  const std::string breaks(10000, '\n');  // shown as two characters each
  log.normal("%s", breaks.c_str());
  log.debugObjects("%@", {String(std::string(5000, '\x01'))});  // four each
  ASSERT_EQ(sink.lines().size(), 2U);
  EXPECT_EQ(sink.lines()[0].line,
            breaks.substr(0, Limits::maxLogLineBytes / 2) + " (cut, 10000 bytes in all)");
  EXPECT_EQ(sink.lines()[1].line,
            std::string(Limits::maxLogLineBytes / 4, '\x01') + " (cut, 5000 bytes in all)");
}

TEST(Log, PrintsAMissingTextAsNull) {
  MemoryLogSink sink;
  Log log(sink);
  const char* volatile missing = nullptr;
  log.error("address %s", missing);
  EXPECT_EQ(sink.lines()[0].line, "address (null)");
}

TEST(Log, ShowsObjectsByTheirDescription) {
  MemoryLogSink sink;
  Log log(sink, LogLevel::debug);
  log.debugObjects("post %@ to %s", {Dictionary{{"a", 1}}, "here"});
  EXPECT_TRUE(sink.contains(LogLevel::debug, "post {\"a\":1} to here"));
  EXPECT_FALSE(sink.contains(LogLevel::error, "post"));
  EXPECT_EQ(sink.count("post"), 1U);
}

}  // namespace
}  // namespace kyt
