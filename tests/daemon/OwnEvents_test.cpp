// What the daemon's own events tell is what docs/WIRE-HTTPS.md says, and nothing more: a device's owner reads it there.
#include <fstream>
#include <regex>
#include <set>
#include <sstream>

#include "tests/daemon/AgentFixture.h"

namespace kyt {
namespace {

using Names = std::set<std::string>;

// The keys that the document's table names in the rows for that event, on builds of that kind.
Names documentedKeys(const std::string& event, bool internal) {
  std::ifstream file(KYT_DOCS_DIR "/WIRE-HTTPS.md");
  Names keys;
  bool inside = false;
  for (std::string line; std::getline(file, line);) {
    if (line.starts_with("## ")) inside = line == "## The daemon's own events";
    std::smatch row;
    if (!inside || !std::regex_match(line, row, std::regex(R"(\| ([^|]+) \| ([^|]+) \|.*)"))) continue;
    const std::string where = row[2];
    if (!where.starts_with(event) || (!internal && where.find("internal builds") != std::string::npos))
      continue;
    const std::string names = row[1];
    const std::regex name("`([^`]+)`");
    for (std::sregex_iterator at(names.begin(), names.end(), name), end; at != end; ++at)
      keys.insert(std::regex_replace((*at)[1].str(), std::regex("CODE"), "QH"));
  }
  return keys;
}

class OwnEvents : public AgentFixture {
 protected:
  // Of each of the session's events.
  std::vector<Names> keysOfASession() {
    const Dictionary backEnds = table({"httppost"});
    serve(Dictionary{{"version", "1.0"}, {"release", backEnds}, {"vantu_internal", backEnds}});
    Client client = clientWith(sessionInfo(7));
    EXPECT_TRUE(configure(client));
    client.connection->invalidateNow();
    std::vector<Names> all;
    for (const RecordingBackend::Sent& sent : factory_.latest("httppost")->sent) {
      Names keys;
      for (const auto& entry : *sent.message.find("ClientData")->dictionary()) keys.insert(entry.key.str());
      all.push_back(std::move(keys));
    }
    return all;
  }
};

TEST_F(OwnEvents, HaveTheKeysOfTheDocumentAndNoOthers) {
  EXPECT_EQ(keysOfASession(),
            (std::vector<Names>{documentedKeys("start", false), documentedKeys("end", false)}));
}

TEST_F(OwnEvents, HaveTheKeysOfTheDocumentAndNoOthersOnAnInternalBuild) {
  test_.deviceProperties.setProperty("ReleaseType", "Internal");
  const Names start = documentedKeys("start", true);
  EXPECT_TRUE(start.contains("SerialNum"));
  EXPECT_EQ(keysOfASession(), (std::vector<Names>{start, documentedKeys("end", true)}));
}

}  // namespace
}  // namespace kyt
