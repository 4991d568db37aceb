// The worked example of docs/WIRE-IPC.md is what the codec writes and reads.
#include <gtest/gtest.h>

#include <fstream>
#include <sstream>

#include "WireTestSupport.h"
#include "platform/ipc/BodyReader.h"

namespace kyt {
namespace {

const Dictionary kExample{
    {"Category", 3u}, {"Type", 4u}, {"Payload", Dictionary{{"name", "call"}, {"ok", true}}}};

// The bytes of the hexdump: on each line the offset, up to 16 bytes after two blanks, and the text after two
// more.
std::string exampleBytes() {
  std::ifstream file(KYT_DOCS_DIR "/WIRE-IPC.md");
  std::string line, bytes;
  while (std::getline(file, line) && line != "```hexdump") {
  }
  while (std::getline(file, line) && line != "```") {
    const std::string row = line.substr(6);
    bytes += test::fromHex(row.substr(0, row.find("  ")));
  }
  return bytes;
}

TEST(WireExample, IsWhatTheWriterWrites) {
  std::string bytes;
  MessageWriter writer(bytes);
  writer.beginCall(2, {.member = "SendMessageWithDictionary", .signature = "a{sv}", .expectsReply = false});
  writer.writeDictionary(kExample);
  ASSERT_TRUE(writer.end());
  EXPECT_EQ(bytes, exampleBytes());
}

TEST(WireExample, IsReadAsTheDocumentSays) {
  const std::string bytes = exampleBytes();
  Message message;
  ASSERT_EQ(test::frame(bytes, message).status, FrameStatus::complete);
  EXPECT_EQ(message.member, "SendMessageWithDictionary");
  EXPECT_EQ(message.serial, 2u);
  EXPECT_FALSE(message.expectsReply());
  BodyReader reader(message);
  Dictionary dictionary;
  ASSERT_TRUE(reader.readDictionary(dictionary));
  EXPECT_EQ(reader.finish(), BodyStatus::ok);
  EXPECT_EQ(dictionary, kExample);
}

TEST(WireExample, ItsTableNamesBytesThatAreThere) {
  const std::string bytes = exampleBytes();
  std::ifstream file(KYT_DOCS_DIR "/WIRE-IPC.md");
  std::string line;
  int rows = 0;
  while (std::getline(file, line)) {
    if (line.substr(0, 4) != "| 00" || line.size() < 10) continue;
    ++rows;
    const size_t at = std::stoul(line.substr(2, 4), nullptr, 16);
    std::string text = line.substr(line.find('`') + 1);
    text = text.substr(0, text.find('`'));
    const std::string first = test::fromHex(text.substr(0, text.find("\xE2\x80\xA6")));
    EXPECT_EQ(bytes.substr(at, first.size()), first) << line;
  }
  EXPECT_EQ(rows, 13);
}

}  // namespace
}  // namespace kyt
