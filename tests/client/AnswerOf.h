// What a completion gives to a promise of the test, with a deadline.
#pragma once

#include <cstdio>
#include <cstdlib>
#include <future>

#include "tests/support/Eventually.h"

namespace kyt {

// A completion that comes later would find the test's variables gone, so none in time ends the program.
template <typename T>
T answerOf(std::promise<T>& answer) {
  auto future = answer.get_future();
  if (future.wait_for(kTestDeadline) == std::future_status::ready) return future.get();
  std::fprintf(stderr, "no completion has run within half a minute\n");
  std::abort();
}

}  // namespace kyt
