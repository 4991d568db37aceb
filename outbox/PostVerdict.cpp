#include "outbox/PostVerdict.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <chrono>
#include <cstdio>

namespace kyt {
namespace {

constexpr std::chrono::seconds kLongestPause = std::chrono::hours(24);

// "Sun, 06 Nov 1994 08:49:37 GMT", the form that servers must send.
std::optional<int64_t> secondsOfDate(const std::string& text) {
  constexpr std::array<std::string_view, 12> kMonths{"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                                     "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  char month[4] = {}, zone[4] = {};
  int day = 0, year = 0, hour = 0, minute = 0, second = 0;
  constexpr int kFields = 7;
  if (std::sscanf(text.c_str(), "%*3[A-Za-z], %2d %3[A-Za-z] %4d %2d:%2d:%2d %3[A-Z]", &day, month, &year,
                  &hour, &minute, &second, zone) != kFields)
    return std::nullopt;
  const auto* known = std::find(kMonths.begin(), kMonths.end(), std::string_view(month));
  if (known == kMonths.end() || std::string_view(zone) != "GMT") return std::nullopt;
  const std::chrono::year_month_day date(
      std::chrono::year(year), std::chrono::month(static_cast<unsigned>(known - kMonths.begin()) + 1),
      std::chrono::day(static_cast<unsigned>(day)));
  if (!date.ok() || hour > 23 || minute > 59 || second > 60) return std::nullopt;
  const int64_t days = std::chrono::sys_days(date).time_since_epoch().count();
  return ((days * 24 + hour) * 60 + minute) * 60 + second;
}

}  // namespace

PostVerdict verdictOf(const URLResponse* response, const Error* error) {
  const int status = response != nullptr ? response->status : 0;
  switch (status) {
    case 408:
    case 425:
    case 429:
    case 500:
    case 502:
    case 503:
    case 504:
      return PostVerdict::sendAgain;
    default:
      break;
  }
  if (status >= 300 && status <= 399) return PostVerdict::redirected;
  if (status >= 400 && status <= 499) return PostVerdict::refused;
  if (status >= 500 && status <= 599) return PostVerdict::braked;
  const bool hasDecided = status >= 200;
  return error != nullptr && !hasDecided ? PostVerdict::sendAgain : PostVerdict::taken;
}

std::optional<Duration> retryAfter(const URLResponse* response, TimeValue now) {
  const std::optional<std::string> text =
      response != nullptr ? response->header("Retry-After") : std::nullopt;
  if (!text || text->empty()) return std::nullopt;
  int64_t seconds = 0;
  const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), seconds);
  if (text->front() == '-') return std::nullopt;
  const bool isNumber =
      end == text->data() + text->size() || (end != text->data() && *end == ',');  // of each line the first
  if (!isNumber) {
    const auto date = secondsOfDate(*text);
    if (!date) return std::nullopt;
    // By the server's clock, where it says what that shows: the device's may not be set.
    const auto shown = secondsOfDate(response->header("Date").value_or(""));
    seconds = *date - shown.value_or(now.seconds);
  } else if (error == std::errc::result_out_of_range) {
    seconds = kLongestPause.count();
  }
  return std::chrono::seconds(std::clamp<int64_t>(seconds, 0, kLongestPause.count()));
}

std::string serverOfLine(std::string_view url) {
  const size_t scheme = url.find("://");
  const size_t begin = scheme == std::string_view::npos ? 0 : scheme + 3;
  std::string server(url.substr(0, std::min(url.find_first_of("/?#", begin), url.size())));
  // What is before an "@" is no part of the server.
  if (const size_t at = server.rfind('@'); at != std::string::npos && at >= begin)
    server.erase(begin, at + 1 - begin);
  for (char& c : server)
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  return server;
}

}  // namespace kyt
