// Feeds bytes from the network to the readers of the dashboard feed's datagrams and of log data's archives.
// Whatever the bytes, they are read or refused; what was read can be shown, and an archive that was read can
// be written so that it reads back the same.
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "devserver/Datagram.h"
#include "platform/objects/KeyedArchive.h"

namespace {

void check(bool condition) {
  if (!condition) std::abort();
}

void readDatagram(std::string_view bytes) {
  using kyt::devserver::Datagram;
  const auto read = kyt::devserver::readDatagram(bytes);
  const auto* datagram = std::get_if<Datagram>(&read);
  if (datagram == nullptr) return;
  check(bytes.size() >= Datagram::kHeaderSize && datagram->milliseconds < 1000);
  size_t size = 0;
  for (const auto& [key, value] : datagram->pairs) size += key.size() + 1 + value.size();
  check(size <= datagram->text.size());
  check(!kyt::devserver::datagramAsJson(*datagram, "sender", "yes").empty());
  check(kyt::devserver::acknowledgement(bytes, datagram->event) == bytes.substr(0, Datagram::kHeaderSize));
}

void readArchive(std::string_view bytes) {
  const auto read = kyt::unarchivedObject(bytes);
  const auto* value = std::get_if<kyt::Value>(&read);
  if (value == nullptr) return;
  const auto written = kyt::archivedData(*value);
  check(written.has_value());
  const auto again = kyt::unarchivedObject(written->view());
  check(std::holds_alternative<kyt::Value>(again));
  const auto rewritten = kyt::archivedData(std::get<kyt::Value>(again));
  check(rewritten.has_value() && *rewritten == *written);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* bytes, size_t size) {
  if (size == 0) return 0;
  const std::string_view input(reinterpret_cast<const char*>(bytes) + 1, size - 1);
  if ((bytes[0] & 1) == 0)
    readDatagram(input);
  else
    readArchive(input);
  return 0;
}
