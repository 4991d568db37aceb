#include "devserver/Datagram.h"

#include "devserver/JsonText.h"

namespace kyt::devserver {
namespace {

constexpr size_t kEventAt = 60;

uint32_t number(std::string_view bytes, size_t at, size_t width) {
  uint32_t value = 0;
  for (size_t i = 0; i < width; ++i) value = value << 8 | static_cast<uint8_t>(bytes[at + i]);
  return value;
}

uint16_t number16(std::string_view bytes, size_t at) {
  return static_cast<uint16_t>(number(bytes, at, 2));
}

// The places of equals signs that no backslash escapes.
std::vector<size_t> signsOf(std::string_view text) {
  std::vector<size_t> signs;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\')
      ++i;
    else if (text[i] == '=')
      signs.push_back(i);
  }
  return signs;
}

std::string withoutEscapes(std::string_view text) {
  std::string out;
  for (size_t i = 0; i < text.size(); ++i) {
    if (text[i] == '\\' && i + 1 < text.size()) ++i;
    out += text[i];
  }
  return out;
}

// A key is the last word before its sign; its value ends at the blank before the next key.
std::vector<std::pair<std::string, std::string>> pairsOf(std::string_view text) {
  std::vector<std::pair<std::string, std::string>> pairs;
  const std::vector<size_t> signs = signsOf(text);
  const auto keyBegin = [&](size_t sign, size_t after) {
    const size_t blank = sign == 0 ? std::string_view::npos : text.rfind(' ', sign - 1);
    return blank == std::string_view::npos || blank < after ? after : blank + 1;
  };
  for (size_t i = 0; i < signs.size(); ++i) {
    const size_t begin = keyBegin(signs[i], i == 0 ? 0 : signs[i - 1] + 1);
    size_t end = text.size();
    if (i + 1 < signs.size()) {
      end = keyBegin(signs[i + 1], signs[i] + 1);
      if (end > signs[i] + 1) --end;  // the blank
    }
    pairs.emplace_back(text.substr(begin, signs[i] - begin),
                       withoutEscapes(text.substr(signs[i] + 1, end - signs[i] - 1)));
  }
  return pairs;
}

}  // namespace

std::variant<Datagram, std::string> readDatagram(std::string_view bytes) {
  if (bytes.size() < Datagram::kHeaderSize)
    return "it has " + std::to_string(bytes.size()) + " bytes, fewer than a header";
  if (bytes.size() > Datagram::kMaxSize)
    return "it has " + std::to_string(bytes.size()) + " bytes, more than are sent";
  const auto length = static_cast<uint16_t>(~number16(bytes, 14));
  if (length != bytes.size())
    return "its length field says " + std::to_string(length) + ", it has " + std::to_string(bytes.size()) +
           " bytes";
  if (bytes[2] != 1) return std::string("its third byte is not 1");
  const auto fraction = static_cast<uint8_t>(bytes[3]);
  if (fraction > 249) return std::string("its fraction of a second is over 249");

  Datagram datagram;
  datagram.selfVersionMajor = static_cast<uint8_t>(bytes[0]);
  datagram.clientType = static_cast<uint8_t>(bytes[1]);
  datagram.milliseconds = fraction * 4U;
  datagram.seconds = number(bytes, 4, 4);
  datagram.session = ~number(bytes, 8, 4);
  datagram.clientVersion = static_cast<uint16_t>(~number16(bytes, 12));
  datagram.method = number16(bytes, 16);
  datagram.respCode = number16(bytes, 18);
  const std::string_view device = bytes.substr(20, 40);
  datagram.device = device.substr(0, device.find('\0'));
  datagram.event = number16(bytes, kEventAt);
  datagram.flags = number16(bytes, 62);
  datagram.text = bytes.substr(Datagram::kHeaderSize);
  datagram.pairs = pairsOf(datagram.text);
  return datagram;
}

std::string acknowledgement(std::string_view bytes, uint16_t event) {
  std::string out(bytes.substr(0, Datagram::kHeaderSize));
  out[kEventAt] = static_cast<char>(event >> 8);
  out[kEventAt + 1] = static_cast<char>(event);
  return out;
}

std::string datagramAsJson(const Datagram& datagram, std::string_view sender, std::string_view acknowledged) {
  JsonText out;
  out.object().member("sender", sender).member("acknowledged", acknowledged);
  out.member("selfVersionMajor", datagram.selfVersionMajor).member("clientType", datagram.clientType);
  out.member("seconds", datagram.seconds).member("milliseconds", datagram.milliseconds);
  out.member("session", datagram.session).member("clientVersion", datagram.clientVersion);
  out.member("method", datagram.method).member("respCode", datagram.respCode);
  out.member("event", datagram.event).member("flags", datagram.flags).member("device", datagram.device);
  out.member("text", datagram.text).key("pairs").array();
  for (const auto& [key, value] : datagram.pairs) out.array().value(key).value(value).endArray();
  return out.endArray().endObject().text();
}

}  // namespace kyt::devserver
