// Who is told each rule of the storebag as it is applied, with what it looked at: for tools that tell people why. The
// daemon's own back ends have none, and then nothing is made for it.
#pragma once

#include "platform/objects/Value.h"

namespace kyt {

class RuleWitness {
 public:
  virtual ~RuleWitness() = default;
  // `rule`: a word with hyphens. `value`: what it looked at, null where that is missing; `wanted`: what it was compared
  // with, null where the entry has none. On the thread of the decision.
  virtual void judged(const char* rule, bool passes, const Value& value, const Value& wanted) = 0;
};

}  // namespace kyt
