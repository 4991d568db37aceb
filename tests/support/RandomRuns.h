// Random runs of a test, each from a seed that a failure names. How many, and from which seed on, may be said by the
// environment: NAME_RUNS and NAME_SEED.
#pragma once

#include <gtest/gtest.h>

#include <cstdlib>
#include <random>
#include <string>

namespace kyt {

class RandomRuns {
 public:
  RandomRuns(std::string name, unsigned otherwise)
      : count(number(name + "_RUNS", otherwise)),
        first(number(name + "_SEED", std::random_device()())),
        name_(std::move(name)) {
    testing::Test::RecordProperty("first seed", std::to_string(first));
  }
  // Calls `run` with each seed, until the first failure.
  template <typename Run>
  void each(Run&& run) const {
    for (unsigned i = 0; i < count && !testing::Test::HasFailure(); ++i) {
      SCOPED_TRACE(name_ + "_SEED=" + std::to_string(first + i) + " " + name_ + "_RUNS=1");
      run(first + i);
    }
  }
  const unsigned count, first;

 private:
  static unsigned number(const std::string& variable, unsigned otherwise) {
    const char* text = std::getenv(variable.c_str());
    return text != nullptr ? static_cast<unsigned>(std::strtoul(text, nullptr, 10)) : otherwise;
  }
  const std::string name_;
};

}  // namespace kyt
