// The figures of the window in the OpenMetrics text format, version 1.0. Labels have few values: programs are the books'
// rows, whose number and names have limits, and servers are those that are remembered.
#include <charconv>
#include <initializer_list>
#include <string>
#include <string_view>
#include <utility>

#include "config/ClientTypes.h"
#include "daemon/Administration.h"
#include "daemon/StorebagStandings.h"
#include "platform/Platform.h"
#include "platform/URLSession.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "session/SessionStanding.h"

namespace kyt {

namespace {

using Labels = std::initializer_list<std::pair<const char*, std::string>>;

void appendQuoted(std::string& value, std::string_view text) {
  for (const char c : escapedText(text)) {
    if (c == '"' || c == '\\') value += '\\';
    value += c;
  }
}

// Text in one line of valid UTF-8, as a label's value is written. A backslash of its own is written as its number, so that
// no two texts are written alike: a sample that stood twice would have all of them refused.
std::string labelValue(std::string_view text) {
  std::string value;
  for (size_t next = 0; (next = text.find('\\')) != text.npos; text.remove_prefix(next + 1)) {
    appendQuoted(value, text.substr(0, next));
    value += "\\\\x5c";
  }
  appendQuoted(value, text);
  return value;
}

class MetricsText {
 public:
  enum class Kind { counter, gauge };
  // The samples that follow are of this metric. The unit, if there is one, is the end of the name.
  void metric(std::string_view name, Kind kind, std::string_view unit, std::string_view help) {
    name_ = "kytreportingd_" + std::string(name);
    isCounter_ = kind == Kind::counter;
    text_.append("# HELP ").append(name_).append(" ").append(help).append("\n");
    text_.append("# TYPE ").append(name_).append(isCounter_ ? " counter\n" : " gauge\n");
    if (!unit.empty()) text_.append("# UNIT ").append(name_).append(" ").append(unit).append("\n");
  }
  void sample(uint64_t number, Labels labels = {}) {
    text_.append(name_).append(isCounter_ ? "_total" : "");
    char before = '{';
    for (const auto& [name, value] : labels) {
      text_ += before;
      text_.append(name).append("=\"").append(labelValue(value)).append("\"");
      before = ',';
    }
    if (before == ',') text_ += '}';
    text_.append(" ").append(std::to_string(number)).append("\n");
  }
  [[nodiscard]] std::string finish() && { return std::move(text_.append("# EOF\n")); }

 private:
  std::string text_, name_;
  bool isCounter_ = false;
};

using Kind = MetricsText::Kind;

struct Place {
  const char* name;
  uint64_t BookRow::*number;
};
constexpr Place kPlaces[] = {{"queued", &BookRow::queued},
                             {"batched", &BookRow::batched},
                             {"in-flight", &BookRow::inFlight},
                             {"waiting", &BookRow::waiting},
                             {"outbox", &BookRow::outbox}};

// One sample of a row; `more` is a label of its own.
void rowSample(MetricsText& out, const BookRow& row, uint64_t number, const char* more = nullptr,
               const char* value = "") {
  const std::string user = std::to_string(row.program.user), type = std::to_string(row.program.clientType);
  const char* origin = row.isInternal ? "daemon" : "program";
  if (more == nullptr)
    out.sample(number, {{"user", user},
                        {"client_type", type},
                        {"client", row.program.clientName},
                        {"service", row.program.service},
                        {"back_end", row.backEnd},
                        {"origin", origin}});
  else
    out.sample(number, {{"user", user},
                        {"client_type", type},
                        {"client", row.program.clientName},
                        {"service", row.program.service},
                        {"back_end", row.backEnd},
                        {"origin", origin},
                        {more, value}});
}

void writeBooks(MetricsText& out, const std::vector<BookRow>& rows) {
  out.metric("events_taken", Kind::counter, "", "Events that were taken, once for each back end.");
  for (const BookRow& row : rows) rowSample(out, row, row.taken);
  out.metric("events_delivered", Kind::counter, "", "Events that a server has answered with no error.");
  for (const BookRow& row : rows) rowSample(out, row, row.delivered);
  out.metric("events_dropped", Kind::counter, "", "Events that were lost or left out, by reason.");
  for (const BookRow& row : rows)
    for (size_t i = 0; i < kFates.size(); ++i)
      if (row.dropped.at(i) != 0) rowSample(out, row, row.dropped.at(i), "reason", reasonName(kFates.at(i)));
  out.metric("events_pending", Kind::gauge, "", "Events that wait, by place.");
  for (const BookRow& row : rows)
    for (const Place& place : kPlaces) rowSample(out, row, row.*place.number, "place", place.name);
}

void writeCounters(MetricsText& out, const Counters& counters) {
  out.metric("reasons", Kind::counter, "", "What was dropped, refused or found wrong, by reason.");
  for (size_t i = 0; i < static_cast<size_t>(Reason::numberOfReasons); ++i) {
    const auto reason = static_cast<Reason>(i);
    out.sample(counters.value(reason), {{"reason", reasonName(reason)}});
  }
}

void writeRequests(MetricsText& out, const URLFigures& figures, const std::vector<ServerRecord>& servers) {
  out.metric("requests_started", Kind::counter, "", "Requests to servers that were started.");
  out.sample(figures.started);
  out.metric("requests_completed", Kind::counter, "", "Requests that were answered.");
  out.sample(figures.completed);
  out.metric("requests_failed", Kind::counter, "", "Requests that ended without an answer.");
  out.sample(figures.failed);
  out.metric("requests_waiting", Kind::gauge, "", "Requests that wait for connectivity.");
  out.sample(figures.waiting);
  out.metric("server_answers", Kind::counter, "", "Answers of any status, by server.");
  for (const ServerRecord& server : servers) out.sample(server.answers, {{"server", server.address}});
  out.metric("server_errors", Kind::counter, "",
             "Answers of 400 to 599 and requests without one, by server.");
  for (const ServerRecord& server : servers) out.sample(server.errors, {{"server", server.address}});
  out.metric("server_last_error_time_seconds", Kind::gauge, "seconds", "When that was last, since 1970.");
  for (const ServerRecord& server : servers)
    out.sample(static_cast<uint64_t>(server.lastErrorAt), {{"server", server.address}});
}

void writeStorebags(MetricsText& out, const std::vector<StorebagView>& storebags) {
  out.metric("storebag_fetched_time_seconds", Kind::gauge, "seconds",
             "When the storebag was asked for last, since 1970.");
  for (const StorebagView& bag : storebags)
    out.sample(static_cast<uint64_t>(bag.fetched), {{"storebag", bag.name}});
  out.metric("storebag_good", Kind::gauge, "", "Whether that brought the server's storebag.");
  for (const StorebagView& bag : storebags)
    out.sample(bag.state == StorebagView::State::good ? 1 : 0, {{"storebag", bag.name}});
}

}  // namespace

std::string Administration::metrics() const {
  const Platform& platform = sources_.platform;
  const ProcessFigures process = sources_.process();
  uint64_t sessions = 0;
  sources_.sessions.forEach([&](const SessionView&) { ++sessions; });
  MetricsText out;
  out.metric("build", Kind::gauge, "", "The version that runs.");
  out.sample(1, {{"version", sources_.version}});
  out.metric("start_time_seconds", Kind::gauge, "seconds", "When the daemon started, since 1970.");
  out.sample(static_cast<uint64_t>(sources_.since));
  out.metric("resident_memory_bytes", Kind::gauge, "bytes", "Memory that the process has.");
  out.sample(process.residentBytes);
  out.metric("anonymous_memory_bytes", Kind::gauge, "bytes", "Memory that it has for itself alone.");
  out.sample(process.anonymousBytes);
  out.metric("threads", Kind::gauge, "", "Threads of the process.");
  out.sample(process.threads);
  out.metric("connections", Kind::gauge, "", "Clients' connections.");
  out.sample(sources_.connections());
  out.metric("sessions", Kind::gauge, "", "Sessions that live.");
  out.sample(sessions);
  writeBooks(out, platform.books.snapshot());
  writeCounters(out, platform.counters);
  writeRequests(out, platform.urlSessions.figures(), sources_.servers.all());
  writeStorebags(out, sources_.storebags.views());
  return std::move(out).finish();
}

}  // namespace kyt
