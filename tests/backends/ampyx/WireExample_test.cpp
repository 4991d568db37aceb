// Records the event of the worked example in docs/WIRE-POWERLOG.md, and compares what reaches the power log with the
// document. That its fields become those of the journal's entry is tested beside the journal.
#include <gtest/gtest.h>

#include "backends/ampyx/AmpyxBackend.h"
#include "platform/objects/Keys.h"
#include "tests/support/DocumentBlock.h"
#include "tests/support/TestPlatform.h"

namespace kyt {
namespace {

TEST(PowerLogWireExample, IsWhatIsRecorded) {
  TestPlatform platform;
  const auto backend = AmpyxBackend::initWithName(platform.configuration, kKYTReportingBackendAmpyx,
                                                  Dictionary{}, std::make_shared<SessionFacts>());
  const auto message = platform.json.parse(documentBlock("WIRE-POWERLOG.md", "json message"));
  ASSERT_TRUE(std::holds_alternative<Value>(message));
  backend->sendMessage(*std::get<Value>(message).dictionary(), TimeValue{1769860800, 0}, 2, 3, EventID{4});
  ASSERT_EQ(platform.powerLog.events.size(), 1U);
  const auto& event = platform.powerLog.events[0];
  const std::string entry = documentBlock("WIRE-POWERLOG.md", "text entry") + "\n";
  for (const std::string& field : {"KYT_AGENT=" + std::to_string(event.agent), "KYT_EVENT=" + event.name,
                                   "KYT_DICTIONARY=" + description(Value(event.dictionary))})
    EXPECT_NE(entry.find("\n" + field + "\n"), std::string::npos) << field;
}

}  // namespace
}  // namespace kyt
