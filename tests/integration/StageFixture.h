// Tests on a stage: the daemon as it is deployed (no internal build, HTTPS alone), the development server as
// its back end, and what arrived there.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <memory>
#include <string>
#include <utility>
#include <variant>

#include "tests/integration/TestClient.h"
#include "tests/support/Programs.h"
#include "tests/support/TemporaryFolder.h"
#include "tools/StorebagFile.h"
#include "tools/demo/Stage.h"

namespace kyt {

class StageTest : public ::testing::Test {
 protected:
  void lay(tools::Stage::Options options = {}) {
    options.programs = KYT_PROGRAMS;
    options.share = KYT_SHARE;
    auto made = tools::Stage::make(std::move(options));
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<tools::Stage>>(made))
        << std::get<Error>(made).localizedDescription;
    stage_ = std::get<std::unique_ptr<tools::Stage>>(std::move(made));
  }
  void startDaemon() {
    const auto problem = stage_->startDaemon();
    ASSERT_FALSE(problem) << problem->localizedDescription << daemonLog();
  }
  // The daemon must end in order, whatever a test did to it; sanitizers speak up here too.
  void TearDown() override {
    if (stage_ == nullptr || stage_->daemon() == nullptr) return;
    EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0) << daemonLog();
  }

  // A client entry that batches, without filters.
  [[nodiscard]] Dictionary entry(const std::string& name, const std::string& path = "/events") const {
    return Dictionary{{"client", name},
                      {"locale_whitelist", Array{"DE"}},
                      {"filters", Array{}},
                      {"sampling_threshold", 1.0},
                      {"event_threshold", 100000},
                      {"post_url", stage_->httpsBase() + path}};
  }
  [[nodiscard]] static Dictionary section(const Array& entries) {
    return Dictionary{
        {"httppost", Dictionary{{"display_url", "https://display.example.org/"}, {"clients", entries}}}};
  }
  void putBag(const std::string& name, const Array& entries) {
    const auto problem =
        stage_->putStorebag(name, Dictionary{{"version", "1"}, {"release", section(entries)}});
    ASSERT_FALSE(problem) << problem->localizedDescription;
  }

  // A stage whose storebag "cadmor" has one client entry, "person", changed or without something.
  void layWithPerson(const Dictionary& changes = {}, tools::Stage::Options options = {},
                     const std::string& without = {}) {
    lay(std::move(options));
    Dictionary client = entry("person");
    for (const DictionaryEntry& change : changes) client.set(change.key, change.value);
    if (!without.empty()) client.remove(without);
    putBag("cadmor", {client});
  }

  [[nodiscard]] std::string socket() const { return stage_->socketPath(); }
  // Whether each thread of this process has taken a SIGSTOP: kill() returns before.
  static bool standsStill(int process) {
    std::error_code none;
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(process) + "/task", none))
      if (contents(task.path().string() + "/stat").find(") T ") == std::string::npos) return false;
    return !none;
  }
  [[nodiscard]] std::string daemonLog() const { return contents(stage_->daemonLog()); }
  [[nodiscard]] bool logged(std::string_view text) const {
    return daemonLog().find(text) != std::string::npos;
  }
  [[nodiscard]] static std::string contents(const std::string& path) {
    auto text = tools::readFile(path);
    return std::holds_alternative<std::string>(text) ? std::get<std::string>(text) : std::string();
  }
  [[nodiscard]] ProgramRun kytctl(std::vector<std::string> arguments, const std::string& input = {}) const {
    arguments.insert(arguments.begin(), {"--root", stage_->folder()});
    return runProgram(stage_->program("kytctl"), arguments, input);
  }

  // Of the events that arrived and fit the filter ("client=a&method=3").
  [[nodiscard]] long arrived(const std::string& filter) const {
    return number(stage_->query("/api/events?limit=1&" + filter), "total");
  }
  // Whether so many events that fit the filter arrive in time; not whether more do.
  [[nodiscard]] bool arrive(const std::string& filter, long count) const {
    const Value answer = stage_->query("/api/wait?timeout=30&events=" + std::to_string(count) + "&" + filter);
    const Dictionary* dictionary = answer.dictionary();
    const Value* reached = dictionary != nullptr ? dictionary->find("reached") : nullptr;
    return reached != nullptr && reached->boolValue();
  }
  [[nodiscard]] long total(const char* key) const { return number(stage_->query("/api/totals"), key); }

  std::unique_ptr<tools::Stage> stage_;

 private:
  static long number(const Value& answer, const char* key) {
    const Dictionary* dictionary = answer.dictionary();
    const Value* value = dictionary != nullptr ? dictionary->find(key) : nullptr;
    return value != nullptr ? static_cast<long>(value->longLongValue()) : -1;
  }
};

}  // namespace kyt
