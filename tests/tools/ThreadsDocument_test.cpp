// The page about threads names each queue and each thread of the daemon and of the receiver, and none that is not there.
#include <gtest/gtest.h>

#include <filesystem>

#include "tests/tools/ManualText.h"

namespace kyt {
namespace {

// The first group of every match in the sources of these folders: the daemon's own.
Names inSources(const char* expression,
                const std::vector<const char*>& folders = {"platform", "config", "backend", "backends",
                                                           "session", "outbox", "daemon"}) {
  Names found;
  for (const char* folder : folders)
    for (const auto& entry :
         std::filesystem::recursive_directory_iterator(KYT_SOURCE_DIR "/" + std::string(folder))) {
      const std::string path = entry.path().string();
      if (!entry.is_regular_file() || path.find("/fake/") != path.npos) continue;
      found.merge(matchesIn(textOf(path.substr(sizeof KYT_SOURCE_DIR)), expression));
    }
  return found;
}

// The names in the first column of the table beneath that heading.
Names inTable(const std::string& heading) {
  Names names;
  bool inside = false;
  for (const std::string& line : linesOf(textOf("docs/THREADS.md"))) {
    if (line.starts_with("## ")) inside = line == "## " + heading;
    if (inside && line.starts_with("| `"))
      names.merge(matchesIn(line.substr(0, line.find('|', 1)), "`([^`]+)`"));
  }
  return names;
}

TEST(ThreadsDocument, NamesEveryQueue) {
  const Names queues = inSources("SerialQueue::create\\(\"([^\"]+)\"");
  EXPECT_GE(queues.size(), 8U);
  EXPECT_EQ(inTable("Queues"), queues);
}

TEST(ThreadsDocument, NamesEveryThread) {
  Names threads = inSources(
      "(?:beginServiceThread\\(|EpollReactor::create\\(|[. ]name = |Implementation>\\()\"(kyt-[a-z]+)\"");
  threads.merge(inSources("const char\\* (?:thread)?[nN]ame = \"(kyt-[a-z]+)\""));
  Names documented;
  for (const std::string& name : inTable("Threads of the daemon"))
    if (name.starts_with("kyt-"))
      documented.insert(name.ends_with("-N") ? name.substr(0, name.size() - 2) : name);
  EXPECT_EQ(documented, threads);
}

TEST(ThreadsDocument, NamesEveryThreadOfTheReceiver) {
  const Names threads =
      inSources("(?:beginServiceThread\\(|pthread_self\\(\\), )\"(kyt-[a-z]+)\"", {"http", "receiver"});
  EXPECT_GE(threads.size(), 6U);
  Names documented;
  for (const std::string& name : inTable("Threads of the receiver"))
    if (name.starts_with("kyt-")) documented.insert(name);
  EXPECT_EQ(documented, threads);
}

}  // namespace
}  // namespace kyt
