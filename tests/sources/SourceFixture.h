// A source as its unit starts it, in front of a daemon on a stage, and what arrives at the server.
#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "platform/linux/data/OpenSSLCryptography.h"
#include "platform/linux/data/PugixmlPropertyLists.h"
#include "platform/linux/data/RapidJSON.h"
#include "tests/sources/WrittenJournal.h"
#include "tests/support/Programs.h"
#include "tools/StorebagFile.h"
#include "tools/demo/Stage.h"

namespace kyt {

class SourceOnAStage : public ::testing::Test {
 protected:
  // `storebag` is the source's client type's; its own default bag is handed out under that name.
  void lay(const std::string& source, const std::string& storebag, bool consent = true) {
    source_ = source;
    tools::Stage::Options options;
    options.programs = KYT_PROGRAMS;
    options.share = KYT_SHARE;
    options.consent = consent;
    auto made = tools::Stage::make(std::move(options));
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<tools::Stage>>(made))
        << std::get<Error>(made).localizedDescription;
    stage_ = std::get<std::unique_ptr<tools::Stage>>(std::move(made));
    std::string text = contents("storebag.toml");
    const std::string example = "https://posts.example.org/v1";
    ASSERT_NE(text.find(example), std::string::npos);
    text.replace(text.find(example), example.size(), stage_->httpsBase());
    RapidJSON json;
    PugixmlPropertyLists lists;
    OpenSSLCryptography cryptography;
    const auto bag = tools::StorebagFile(lists, json, cryptography).read(text, "toml");
    ASSERT_TRUE(std::holds_alternative<Dictionary>(bag)) << std::get<Error>(bag).localizedDescription;
    ASSERT_FALSE(stage_->putStorebag(storebag, std::get<Dictionary>(bag)));
    ASSERT_FALSE(stage_->startDaemon());
  }
  void TearDown() override {
    if (stage_ == nullptr || stage_->daemon() == nullptr) return;
    EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  }
  [[nodiscard]] ProgramRun run(std::vector<std::string> arguments) const {
    arguments.insert(arguments.end(), {"--socket", stage_->socketPath(), "--once"});
    return runProgram(stage_->program("kytsource-" + source_), arguments);
  }
  [[nodiscard]] std::string contents(const std::string& file) const {
    auto text = tools::readFile(std::string(KYT_SOURCE_DIR) + "/sources/" + source_ + "/" + file);
    return std::holds_alternative<std::string>(text) ? std::get<std::string>(text) : std::string();
  }
  // Events of that category at the server, once there are so many (or half a minute is over).
  [[nodiscard]] std::vector<Dictionary> arrived(uint32_t category, int count) const {
    const std::string filter = "client=kytsource-" + source_ + "&method=" + std::to_string(category);
    static_cast<void>(stage_->query("/api/wait?timeout=30&events=" + std::to_string(count) + "&" + filter));
    const Value answer = stage_->query("/api/events?limit=1000&" + filter);
    std::vector<Dictionary> events;
    const Array* list = answer.dictionary() != nullptr ? answer.dictionary()->array("events") : nullptr;
    if (list == nullptr) return events;
    for (const Value& event : *list) events.push_back(*event.dictionary());
    return events;
  }
  std::string source_;
  std::unique_ptr<tools::Stage> stage_;
};

}  // namespace kyt
