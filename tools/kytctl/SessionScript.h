// A session by hand, step by step: each step is a JSON object whose "do" names it.
#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "kytreporting/KYTReporting.h"
#include "platform/objects/Value.h"
#include "tools/KeyRules.h"
#include "tools/kytctl/Answers.h"

namespace kyt::tools {

class SessionScript {
 public:
  // `connection` stays with the caller, who keeps it as long.
  explicit SessionScript(const ConnectionOptions& connection);

  // Runs one step and waits for its answer: 0, or 1 with a line on standard error.
  [[nodiscard]] int run(const Dictionary& step);
  // No more steps. Says so, where messages were sent and neither "finish" nor an answer came after them.
  void end() const;
  // After "finish": messages that were lost or dropped. Of the lost the daemon may have taken some.
  [[nodiscard]] uint64_t missing() const { return missing_; }

 private:
  class Aggregated;
  struct Step {
    int (SessionScript::*run)(const Dictionary&);
    std::vector<KeyRule> keys;  // besides "do"
  };

  [[nodiscard]] static std::map<std::string, Step> allSteps();

  int open(const Dictionary& step);
  int configure(const Dictionary& step);
  int states(const Dictionary& step);
  int send(const Dictionary& step);
  int sendWithReply(uint16_t category, uint16_t type, const Dictionary& payload, uint32_t flag);
  int flush(const Dictionary& step);
  int displayURL(const Dictionary& step);
  int sharedData(const Dictionary& step);
  int digestKey(const Dictionary& step);
  int wait(const Dictionary& step);
  int finish(const Dictionary& step);
  [[nodiscard]] bool waitForRoom();
  int reportCall(const std::shared_ptr<Answer>& answer, const std::string& what);

  const ConnectionOptions& connection_;
  const std::map<std::string, Step> steps_;
  const std::shared_ptr<Aggregated> aggregated_;  // also the library's thread's
  std::shared_ptr<Refusal> refusal_;              // of the session; likewise
  bool configured_ = false;                       // what is sent before is dropped by the daemon
  bool unfinished_ = false;                       // the daemon may not have taken what was sent
  uint64_t missing_ = 0;
  std::unique_ptr<KYTReporting> session_;
};

}  // namespace kyt::tools
