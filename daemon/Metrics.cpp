// The figures of the window in the OpenMetrics text format, version 1.0. Labels have few values: programs are the books'
// rows, whose number and names have limits, and servers are those that are remembered.
#include <algorithm>
#include <initializer_list>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "config/ClientTypes.h"
#include "daemon/Administration.h"
#include "daemon/StorebagStandings.h"
#include "platform/Platform.h"
#include "platform/URLSession.h"
#include "platform/base/BookRows.h"
#include "platform/base/Books.h"
#include "platform/base/Counters.h"
#include "platform/base/TextEscape.h"
#include "session/SessionStanding.h"

namespace kyt {

namespace {

using Labels = std::initializer_list<std::pair<const char*, std::string>>;

// Bytes of a label's value that a client chose, since it stands in many samples of a row.
constexpr size_t kMostChosenBytes = 64;

// Text in one line of valid UTF-8, as a label's value is written: no two texts alike, but those that are cut, which end in
// what no other ends in.
std::string labelValue(std::string_view text, size_t most) {
  std::string value;
  while (!text.empty()) {
    const size_t length = std::max<size_t>(utf8SequenceLength(text), 1);
    const size_t before = value.size();
    for (const char c : escapedName(text.substr(0, length))) {
      if (c == '"' || c == '\\') value += '\\';
      value += c;
    }
    if (value.size() > most) {
      value.resize(before);
      return value += "\\\\...";
    }
    text.remove_prefix(length);
  }
  return value;
}

std::string written(Labels labels, size_t mostBytes = SIZE_MAX) {
  std::string text;
  for (const auto& [name, value] : labels)
    text.append(text.empty() ? "" : ",")
        .append(name)
        .append("=\"")
        .append(labelValue(value, mostBytes))
        .append("\"");
  return text;
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
  void sample(uint64_t number, Labels labels = {}) { sample(number, written(labels)); }
  // With labels that are written already, and perhaps one more.
  void sample(uint64_t number, const std::string& labels, Labels more = {}) {
    text_.append(name_).append(isCounter_ ? "_total" : "");
    const std::string last = written(more);
    if (!labels.empty() || !last.empty())
      text_.append("{")
          .append(labels)
          .append(labels.empty() || last.empty() ? "" : ",")
          .append(last)
          .append("}");
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

struct LabelledRow {
  std::string labels;
  BookRow figures;
};

// Rows whose labels are alike, since their names are cut, are added up: a sample that stood twice would have all of them
// refused.
std::vector<LabelledRow> labelled(const std::vector<BookRow>& rows) {
  std::vector<LabelledRow> all;
  std::unordered_map<std::string, size_t> places;
  for (const BookRow& row : rows) {
    std::string labels = written({{"user", std::to_string(row.program.user)},
                                  {"client_type", std::to_string(row.program.clientType)},
                                  {"client", row.program.clientName},
                                  {"service", row.program.service},
                                  {"back_end", row.backEnd},
                                  {"origin", row.isInternal ? "daemon" : "program"}},
                                 kMostChosenBytes);
    const auto [place, isNew] = places.try_emplace(labels, all.size());
    if (isNew)
      all.push_back({std::move(labels), row});
    else
      addFigures(all[place->second].figures, row);
  }
  return all;
}

void writeBooks(MetricsText& out, const std::vector<LabelledRow>& rows) {
  out.metric("events_taken", Kind::counter, "", "Events that were taken, once for each back end.");
  for (const auto& [labels, row] : rows) out.sample(row.taken, labels);
  out.metric("events_delivered", Kind::counter, "", "Events that a server has answered with no error.");
  for (const auto& [labels, row] : rows) out.sample(row.delivered, labels);
  out.metric("events_dropped", Kind::counter, "", "Events that were lost or left out, by reason.");
  for (const auto& [labels, row] : rows)
    for (size_t i = 0; i < kFates.size(); ++i)
      if (row.dropped.at(i) != 0)
        out.sample(row.dropped.at(i), labels, {{"reason", reasonName(kFates.at(i))}});
  out.metric("events_pending", Kind::gauge, "", "Events that wait, by place.");
  for (const auto& [labels, row] : rows)
    for (const Place& place : kPlaces) out.sample(row.*place.number, labels, {{"place", place.name}});
  out.metric("programs_merged", Kind::gauge, "", "Programs, at least, that share a row with others.");
  for (const auto& [labels, row] : rows)
    if (row.programsMerged != 0) out.sample(row.programsMerged, labels);
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

std::string Administration::metrics(size_t mostRowsOfUser) const {
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
  writeBooks(out, labelled(withFewerRows(platform.books.snapshot(), mostRowsOfUser)));
  writeCounters(out, platform.counters);
  writeRequests(out, platform.urlSessions.figures(), sources_.servers.all());
  writeStorebags(out, sources_.storebags.views());
  return std::move(out).finish();
}

}  // namespace kyt
