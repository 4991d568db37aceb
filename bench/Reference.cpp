#include "bench/Reference.h"

#include <rapidjson/document.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>
#include <time.h>
#include <zlib.h>

#include <array>
#include <memory>

namespace kyt::bench {

namespace {

double threadSeconds() {
  timespec spent{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &spent);
  return static_cast<double>(spent.tv_sec) + static_cast<double>(spent.tv_nsec) / 1e9;
}

std::string inflated(const std::string& body) {
  if (body.size() < 2 || static_cast<unsigned char>(body[0]) != 0x1f) return body;
  z_stream stream{};
  inflateInit2(&stream, 31);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(body.data()));
  stream.avail_in = static_cast<uInt>(body.size());
  std::string out;
  std::array<char, 65536> bytes;
  int result = Z_OK;
  while (result == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(bytes.data());
    stream.avail_out = bytes.size();
    result = inflate(&stream, Z_NO_FLUSH);
    out.append(bytes.data(), bytes.size() - stream.avail_out);
  }
  inflateEnd(&stream);
  return out;
}

size_t deflated(const char* text, size_t length) {
  z_stream stream{};
  deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, 31, 8, Z_DEFAULT_STRATEGY);
  const auto bound = deflateBound(&stream, static_cast<uLong>(length));
  const std::unique_ptr<Bytef[]> out(new Bytef[bound]);
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text));
  stream.avail_in = static_cast<uInt>(length);
  stream.next_out = out.get();
  stream.avail_out = static_cast<uInt>(bound);
  deflate(&stream, Z_FINISH);
  const size_t produced = stream.total_out;
  deflateEnd(&stream);
  return produced;
}

}  // namespace

ReferenceFigures measureReference(const std::vector<std::string>& bodies) {
  ReferenceFigures figures;
  std::vector<std::unique_ptr<rapidjson::Document>> documents;
  for (const std::string& body : bodies) {
    auto document = std::make_unique<rapidjson::Document>();
    document->Parse(inflated(body).c_str());
    if (document->HasParseError() || !document->IsObject() || !document->HasMember("events")) continue;
    const auto& events = (*document)["events"];
    figures.records += events.Size();
    if (events.Size() > 0) figures.keysPerRecord = events[events.Size() - 1].MemberCount();
    documents.push_back(std::move(document));
  }
  figures.batches = documents.size();
  if (figures.records == 0) return figures;
  size_t rounds = 0, json = 0, compressed = 0;
  const double begin = threadSeconds();
  while (rounds == 0 || threadSeconds() - begin < 1.0) {
    for (const auto& document : documents) {
      rapidjson::StringBuffer buffer;
      rapidjson::Writer<rapidjson::StringBuffer> writer(buffer);
      document->Accept(writer);
      json += buffer.GetSize();
      compressed += deflated(buffer.GetString(), buffer.GetSize());
    }
    ++rounds;
  }
  const double all = static_cast<double>(rounds) * static_cast<double>(figures.records);
  figures.secondsPerRecord = (threadSeconds() - begin) / all;
  figures.jsonBytesPerRecord = static_cast<double>(json) / all;
  figures.ratio = static_cast<double>(json) / static_cast<double>(compressed);
  return figures;
}

}  // namespace kyt::bench
