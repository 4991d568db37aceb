#include "platform/linux/base/StopSignals.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <csignal>
#include <string>

#include "tests/support/ChildProcess.h"

namespace kyt {
namespace {

TEST(StopSignals, TellsASignalThatWasSeenBefore) {
  const auto seen = [](StopSignals& signals) { return std::string(signals.isEndAsked() ? "end " : "no "); };
  const std::string text = inChildProcess([&] {
    StopSignals signals;
    std::string all = seen(signals);
    ::kill(::getpid(), SIGHUP);
    all += seen(signals);
    all += std::to_string(signals.wait()) + " " + seen(signals);
    ::kill(::getpid(), SIGHUP);
    ::kill(::getpid(), SIGTERM);
    all += seen(signals) + seen(signals);
    // A reload is no matter of a program that ends.
    return all + std::to_string(signals.wait());
  });
  EXPECT_EQ(text, "no no " + std::to_string(SIGHUP) + " no end end " + std::to_string(SIGTERM));
}

TEST(StopSignals, TellsARequestThatWasSeenBefore) {
  const std::string text = inChildProcess([]() -> std::string {
    StopSignals signals;
    signals.request();
    const bool isSeen = signals.isEndAsked();
    return std::to_string(static_cast<int>(isSeen)) + " " + std::to_string(signals.wait());
  });
  EXPECT_EQ(text, "1 0");
}

}  // namespace
}  // namespace kyt
