// The daemon's calls on its client: messages of an aggregation, for the program's block. The library's thread only.
#pragma once

#include <utility>

#include "client/ProgramBlock.h"
#include "kytreporting/KYTReporting.h"

namespace kyt {
struct Message;
}

namespace kyt::client {

class Aggregation {
 public:
  // Without a block the messages are taken, and nobody gets them.
  explicit Aggregation(Function<void(const AggregatedMessage&)> block) : block_(std::move(block)) {}

  // False: the call is none that clients take. The block may close the session.
  [[nodiscard]] bool handle(const Message& call);
  void end() { block_.drop(); }

 private:
  ProgramBlock<const AggregatedMessage&> block_;
};

}  // namespace kyt::client
