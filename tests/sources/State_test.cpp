// The file that says how far a source has reported.
#include "sources/State.h"

#include <gtest/gtest.h>

#include "tests/support/TemporaryFolder.h"

namespace kyt::sources {
namespace {

TEST(SourceState, IsReadAsItWasWritten) {
  const TemporaryFolder folder;
  const State state{42, "s=12;i=3;t=5", ""};
  EXPECT_EQ(writeState(folder / "state", state), std::nullopt);
  EXPECT_EQ(readState(folder / "state"), state);
  EXPECT_EQ(writeState(folder / "state", State{43, "", ""}), std::nullopt);
  EXPECT_EQ(readState(folder / "state"), (State{43, "", ""}));
  const State begun{44, "@5", "s=12;i=4;t=6"};
  EXPECT_EQ(writeState(folder / "state", begun), std::nullopt);
  EXPECT_EQ(readState(folder / "state"), begun);
}

TEST(SourceState, IsNoneWhereTheFileHoldsSomethingElse) {
  const TemporaryFolder folder;
  EXPECT_EQ(readState(folder / "none"), std::nullopt);
  for (const char* text : {"", "1", "1\ncursor", "x\ncursor\n", "1x\ncursor\n", "1\na\nb", "1\na\nb\nc\n"}) {
    EXPECT_EQ(readState(folder.write("state", text)), std::nullopt) << text;
  }
}

TEST(SourceState, BeginsWithTheDaysNumberSoThatNoneComesTwiceWhereItWasLost) {
  const TemporaryFolder folder;
  constexpr std::chrono::seconds kDay{1'760'054'400}, kTime{1'760'054'400 + 50'000};
  std::string problem;
  const State first = stateAtStart(folder / "none", kTime, problem);
  EXPECT_EQ(first, (State{static_cast<uint64_t>(kDay.count()), "", ""}));
  EXPECT_EQ(problem, "");
  // As many reports as there can be: one a second, to the end of the day.
  State last = first;
  last.report += 86400 - 50'000;
  EXPECT_EQ(writeState(folder / "state", last), std::nullopt);
  EXPECT_EQ(stateAtStart(folder / "state", kTime, problem), last);
  EXPECT_EQ(problem, "");
  folder.write("state", "");
  EXPECT_GT(stateAtStart(folder / "state", kTime + std::chrono::days(1), problem).report, last.report);
  EXPECT_EQ(problem,
            (folder / "state") +
                " cannot be read as a state: what was told is not known, and reports are numbered anew");
  EXPECT_EQ(stateAtStart(folder / "none", std::chrono::seconds(5), problem).report, 1U)
      << "a device without a clock";
}

TEST(SourceState, SaysWhyItCannotBeWritten) {
  const TemporaryFolder folder;
  const auto problem = writeState(folder / "missing/state", {});
  ASSERT_TRUE(problem);
  EXPECT_EQ(*problem, "can't write " + (folder / "missing/state") + ": No such file or directory");
}

}  // namespace
}  // namespace kyt::sources
