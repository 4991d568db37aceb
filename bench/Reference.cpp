#include "bench/Reference.h"

#include <libdeflate.h>
#include <time.h>
#include <zlib.h>

#include <array>
#include <memory>
#include <utility>

#include "platform/linux/data/RapidJSON.h"

namespace kyt::bench {

namespace {

// As small: a body of so much more than the daemon's counts as equal.
constexpr double kEqual = 1.01;

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

// A library at a level, its state kept between bodies.
class Compressor {
 public:
  virtual ~Compressor() = default;
  virtual size_t compress(const std::string& text) = 0;  // the size of the gzip stream
  [[nodiscard]] virtual std::string name() const = 0;
};

class Zlib final : public Compressor {
 public:
  explicit Zlib(int level) : level_(level) {
    deflateInit2(&stream_, level, Z_DEFLATED, 31, 8, Z_DEFAULT_STRATEGY);
  }
  ~Zlib() override { deflateEnd(&stream_); }
  size_t compress(const std::string& text) override {
    deflateReset(&stream_);
    out_.resize(deflateBound(&stream_, static_cast<uLong>(text.size())));
    stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
    stream_.avail_in = static_cast<uInt>(text.size());
    stream_.next_out = reinterpret_cast<Bytef*>(out_.data());
    stream_.avail_out = static_cast<uInt>(out_.size());
    deflate(&stream_, Z_FINISH);
    return stream_.total_out;
  }
  [[nodiscard]] std::string name() const override { return "zlib " + std::to_string(level_); }

 private:
  int level_;
  z_stream stream_{};
  std::string out_;
};

class Libdeflate final : public Compressor {
 public:
  explicit Libdeflate(int level) : level_(level), state_(libdeflate_alloc_compressor(level)) {}
  ~Libdeflate() override { libdeflate_free_compressor(state_); }
  size_t compress(const std::string& text) override {
    out_.resize(libdeflate_gzip_compress_bound(state_, text.size()));
    return libdeflate_gzip_compress(state_, text.data(), text.size(), out_.data(), out_.size());
  }
  [[nodiscard]] std::string name() const override { return "libdeflate " + std::to_string(level_); }

 private:
  int level_;
  libdeflate_compressor* state_;
  std::string out_;
};

struct Written {
  double seconds = 0;  // of one round
  size_t json = 0, compressed = 0;
};

// Rounds over all messages until `least` seconds are spent.
Written write(const std::vector<Value>& messages, Compressor& compressor, double least) {
  RapidJSON writer;
  std::string json;
  Written all;
  size_t rounds = 0;
  const double begin = threadSeconds();
  for (; rounds == 0 || threadSeconds() - begin < least; ++rounds) {
    for (const Value& message : messages) {
      json.clear();
      writer.writeCompact(message, json);
      all.json += json.size();
      all.compressed += compressor.compress(json);
    }
  }
  return {(threadSeconds() - begin) / static_cast<double>(rounds), all.json / rounds,
          all.compressed / rounds};
}

}  // namespace

ReferenceFigures measureReference(const std::vector<std::string>& bodies, double seconds) {
  ReferenceFigures figures;
  RapidJSON reader;
  std::vector<Value> messages;
  size_t arrived = 0;
  for (const std::string& body : bodies) {
    auto parsed = reader.parse(inflated(body));
    if (!std::holds_alternative<Value>(parsed)) continue;
    const Dictionary* message = std::get<Value>(parsed).dictionary();
    const Value* list = message != nullptr ? message->find("events") : nullptr;
    const Array* events = list != nullptr ? list->array() : nullptr;
    if (events == nullptr || events->empty()) continue;
    figures.records += events->size();
    figures.keysPerRecord =
        (*events)[events->size() / 2].dictionary()->size();  // the first and last may be of the session
    arrived += body.size();
    messages.push_back(std::get<Value>(std::move(parsed)));
  }
  if (figures.records == 0) return figures;
  std::vector<std::unique_ptr<Compressor>> compressors;
  for (int level = 1; level <= 6; ++level) {
    compressors.push_back(std::make_unique<Libdeflate>(level));
    compressors.push_back(std::make_unique<Zlib>(level));
  }
  Compressor* quickest = nullptr;
  double least = 0;
  for (const auto& compressor : compressors) {
    const Written tried = write(messages, *compressor, seconds / 14);
    if (static_cast<double>(tried.compressed) > kEqual * static_cast<double>(arrived)) continue;
    if (quickest != nullptr && tried.seconds >= least) continue;
    quickest = compressor.get();
    least = tried.seconds;
  }
  if (quickest == nullptr) quickest = compressors.back().get();
  Zlib zlib(6);
  const Written withZlib = write(messages, zlib, seconds / 2);
  const Written written = write(messages, *quickest, seconds);
  const auto records = static_cast<double>(figures.records);
  figures.secondsPerRecord = written.seconds / records;
  figures.secondsWithZlib = withZlib.seconds / records;
  figures.compressor = quickest->name();
  figures.jsonBytesPerRecord = static_cast<double>(written.json) / records;
  figures.bytesPerRecord = static_cast<double>(arrived) / records;
  figures.floorBytesPerRecord = static_cast<double>(written.compressed) / records;
  return figures;
}

}  // namespace kyt::bench
