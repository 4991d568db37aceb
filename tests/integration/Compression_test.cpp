// Which library compresses what the daemon posts and uploads. Compressors differ in their bytes, so the bodies tell.
#include <gtest/gtest.h>
#include <zlib.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/linux/toml/TomlSettings.h"
#include "tests/integration/DaemonProcess.h"
#include "tests/integration/StageFixture.h"
#include "tests/integration/TestClient.h"
#include "tests/support/DeflateLibraries.h"
#include "tests/support/TestHTTPServer.h"

namespace kyt {
namespace {

constexpr int kCadmor = 20, kEvents = 40, kGzip = 31;

std::string unzipped(const std::string& body) {
  z_stream stream = {};
  if (inflateInit2(&stream, kGzip) != Z_OK) return "(broken)";
  std::string out(1 << 22, '\0');
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  stream.next_out = reinterpret_cast<Bytef*>(out.data());
  stream.avail_out = static_cast<uInt>(out.size());
  const int status = inflate(&stream, Z_FINISH);
  out.resize(stream.total_out);
  const bool whole = status == Z_STREAM_END && stream.avail_in == 0;
  inflateEnd(&stream);
  return whole ? out : "(broken)";
}

std::string zipped(Deflate& library, const std::string& text) {
  const auto stream = library.newStream();
  EXPECT_EQ(stream->initialize(kDeflateDefaultLevel, kGzip, 8), DeflateCode::ok);
  std::string out(stream->bound(text.size()), '\0');
  std::span<const std::byte> input = std::as_bytes(std::span(text));
  std::span<std::byte> room = std::as_writable_bytes(std::span(out));
  EXPECT_EQ(stream->finish(input, room), DeflateCode::streamEnd);
  out.resize(out.size() - room.size());
  return out;
}

class CompressedBodies : public testing::Test {
 protected:
  void SetUp() override {
    const Array entries{Dictionary{{"client", "program"},
                                   {"locale_whitelist", Array{"DE"}},
                                   {"filters", Array{}},
                                   {"sampling_threshold", 1.0},
                                   {"override_dnu", 1},
                                   {"event_threshold", 1000},
                                   {"post_url", server_.url("/events")}}};
    const Dictionary bag{
        {"version", "1"},
        {"vantu_internal", Dictionary{{"httppost", Dictionary{{"clients", entries}}},
                                      {"uploadserver", Dictionary{{"post_url", server_.url("/upload")}}}}}};
    server_.setHandler([document = signedBag(bag, propertyLists_)](const TestHTTPServer::Request& request) {
      TestHTTPServer::Reply reply;
      reply.body = request.method == "GET" ? document : "success";
      return reply;
    });
    daemon_.root().write("etc/kytreportingd/device.toml", "ReleaseType = \"Internal\"\ncountry = \"DE\"\n");
  }
  void TearDown() override {
    daemon_.terminate();
    EXPECT_EQ(daemon_.exitStatus(), 0) << daemon_.log();
  }
  // The bodies of one post of a batch and of one uploaded file, of which each must be whole.
  std::vector<std::string> bodies() {
    EXPECT_TRUE(daemon_.startAndWait()) << daemon_.log();
    TestClient client(daemon_.socketPath(), kCadmor, "program");
    EXPECT_EQ(client.configure(), "live: httppost uploadserver") << daemon_.log();
    for (int i = 0; i < kEvents; ++i)
      EXPECT_TRUE(
          client.send(9, 1, Dictionary{{"number", i}, {"name", "event " + std::to_string(i * 7919)}}));
    EXPECT_EQ(client.flush(), "flushed") << daemon_.log();
    std::string lines;
    for (int i = 0; i < 10000; ++i) lines += "line " + std::to_string(i * 7919 % 1000) + " of the file\n";
    const std::string file = files_.write("log", lines);
    auto answer = std::make_shared<std::promise<std::string>>();
    client->uploadFile(file, [answer](bool success, const std::optional<Error>& error) {
      answer->set_value(error ? error->localizedDescription : success ? "yes" : "no");
    });
    EXPECT_EQ(TestClient::waitFor(answer), "yes") << daemon_.log();
    std::vector<std::string> found;
    for (const TestHTTPServer::Request& request : server_.requests()) {
      if (request.method != "POST" || found.size() == 2) continue;
      EXPECT_EQ(request.header("Content-Encoding"), "gzip");
      found.push_back(request.body);
    }
    EXPECT_TRUE(client.finish());
    if (found.size() != 2) return {};
    EXPECT_EQ(unzipped(found[0]).find("{\"postTime\":"), 0u);
    EXPECT_NE(unzipped(found[0]).find("\"name\":\"event " + std::to_string((kEvents - 1) * 7919)),
              std::string::npos);
    EXPECT_EQ(unzipped(found[1]), lines);
    return found;
  }
  static void expectMadeBy(Deflate& library, const std::vector<std::string>& bodies) {
    ASSERT_EQ(bodies.size(), 2u);
    for (const std::string& body : bodies) EXPECT_TRUE(zipped(library, unzipped(body)) == body);
  }

  PugixmlPropertyLists propertyLists_;
  TestHTTPServer server_;
  DaemonProcess daemon_{server_.url("")};
  const TemporaryFolder files_;
};

TEST_F(CompressedBodies, AreZlibsAtItsUsualLevelWithoutASetting) {
  expectMadeBy(*makeZlib(6), bodies());
}

TEST_F(CompressedBodies, AreOfTheLevelInTheSettings) {
  daemon_.addSettings("[compression]\nlevel = 1\n");
  expectMadeBy(*makeZlib(1), bodies());
}

TEST_F(CompressedBodies, AreLibdeflatesWhereTheSettingsChooseIt) {
  daemon_.addSettings("[compression]\nlibrary = \"libdeflate\"\nlevel = 5\n");
  expectMadeBy(*makeLibdeflate(5), bodies());
  EXPECT_FALSE(daemon_.logged("instead of libdeflate"));
}

TEST_F(CompressedBodies, AreZlibsWithALineInTheLogWhereLibdeflateCannotBeLoaded) {
  daemon_.addSettings("[compression]\nlibrary = \"libdeflate\"\nlevel = 5\n");
  const TemporaryFolder libraries;
  libraries.write(LibdeflateDeflate::kFile, "no library");
  daemon_.setBeforeExecution([&] { ::setenv("LD_LIBRARY_PATH", libraries.path().c_str(), 1); });
  expectMadeBy(*makeZlib(5), bodies());
  const std::string log = daemon_.log();
  const size_t line = log.find("main: Compressing with zlib instead of libdeflate: ");
  ASSERT_NE(line, std::string::npos) << log;
  EXPECT_EQ(log.find("instead of libdeflate", line + 50), std::string::npos) << "said once";
}

class DemonstrationsStage : public StageTest {};

TEST_F(DemonstrationsStage, HasTheCompressionOfThePackages) {
  lay();
  const auto settings = readSettings(stage_->folder() + "/etc/kytreportingd/kytreportingd.toml");
  ASSERT_TRUE(std::holds_alternative<Settings>(settings)) << std::get<TomlError>(settings).text;
  EXPECT_EQ(std::get<Settings>(settings).compression,
            (CompressionSettings{CompressionLibrary::libdeflate, 5}));
}

}  // namespace
}  // namespace kyt
