// What the window shows, as dictionaries. docs/com.vantu.kytreportingd.Administration.xml has the keys.
#include <algorithm>
#include <array>
#include <map>
#include <tuple>

#include "config/ClientTypes.h"
#include "daemon/Administration.h"
#include "daemon/StorebagStandings.h"
#include "platform/Platform.h"
#include "platform/base/BookRows.h"
#include "platform/base/Books.h"
#include "platform/base/Clock.h"
#include "platform/base/Limits.h"
#include "platform/queues/Log.h"
#include "session/SessionStanding.h"

namespace kyt {

namespace {

// Programs that are looked up for one answer: each is a question to another process.
constexpr size_t kMostPrograms = 256;

int64_t secondsNow(const Platform& platform) {
  return platform.clock.timeOfDay().seconds;
}

const char* logLevelName(const Log& log) {
  if (log.enabled(LogLevel::debug)) return "debug";
  return log.enabled(LogLevel::normal) ? "default" : "error";
}

Dictionary byReason(const std::array<uint64_t, kFates.size()>& dropped) {
  Dictionary reasons;
  for (size_t i = 0; i < kFates.size(); ++i)
    if (dropped.at(i) != 0) reasons.set(reasonName(kFates.at(i)), dropped.at(i));
  return reasons;
}

struct Totals {
  uint64_t taken = 0, pending = 0;
  FateFigures fates;
};

// Of the programs' events.
Totals totalsOf(const std::vector<BookRow>& rows) {
  Totals totals;
  for (const BookRow& row : rows) {
    if (row.isInternal) continue;
    totals.taken += row.taken;
    totals.pending += row.pending();
    totals.fates.delivered += row.delivered;
    for (size_t i = 0; i < kFates.size(); ++i) totals.fates.dropped.at(i) += row.dropped.at(i);
  }
  return totals;
}

void writeFates(Dictionary& out, const FateFigures& fates) {
  out.set("delivered", fates.delivered);
  out.set("dropped", fates.droppedInAll());
  out.set("droppedBy", byReason(fates.dropped));
}

Array serversOf(const ServerRecords& records) {
  Array servers;
  for (const ServerRecord& record : records.all())
    servers.append(Dictionary{{"address", record.address},
                              {"answers", record.answers},
                              {"lastAnswer", record.lastAnswer},
                              {"lastStatus", record.lastStatus},
                              {"errors", record.errors},
                              {"lastError", record.lastError},
                              {"lastErrorAt", record.lastErrorAt}});
  return servers;
}

void writeState(Dictionary& out, const BackEndStanding::State& state) {
  out.set("state", backEndStateName(state.state));
  out.set("rule", stateRuleName(state.rule));
  out.set("status", static_cast<int64_t>(state.status));
  out.set("decided", static_cast<int64_t>(state.decided));
}

struct Group {
  uint64_t sessions = 0;
  BackEndStanding::State latest;
};
// Short code of the client type, back end, state, rule, status.
using GroupKey = std::tuple<std::string, std::string, int, int, int>;

// Client types are told by their short codes, of which there are a few: clients choose the numbers.
Array backEndsOf(const SessionStandings& sessions, uint64_t& count) {
  std::map<GroupKey, Group> groups;
  sessions.forEach([&](const SessionView& session) {
    ++count;
    for (const auto& backEnd : session.backEnds) {
      const BackEndStanding::State state = backEnd->state();
      Group& group = groups[{clientTypeShortCode(session.clientType), backEnd->name(), state.state,
                             static_cast<int>(state.rule), state.status}];
      ++group.sessions;
      if (state.decided >= group.latest.decided) group.latest = state;
    }
  });
  Array backEnds;
  for (const auto& [key, group] : groups) {
    Dictionary entry{{"family", std::get<0>(key)}, {"name", std::get<1>(key)}, {"sessions", group.sessions}};
    writeState(entry, group.latest);
    backEnds.append(std::move(entry));
  }
  return backEnds;
}

Dictionary backEndView(const BackEndStanding& backEnd) {
  Dictionary view{{"name", backEnd.name()}};
  writeState(view, backEnd.state());
  view.set("batchedEvents", backEnd.batchedEvents());
  view.set("batchedBytes", backEnd.batchedBytes());
  view.set("inFlight", backEnd.inFlight());
  const auto [when, status] = backEnd.lastPost();
  view.set("lastPost", static_cast<int64_t>(when));
  view.set("lastStatus", status);
  return view;
}

Dictionary sessionView(const SessionView& session, const std::string& program) {
  Dictionary view{{"pid", session.process},
                  {"user", session.user},
                  {"program", program},
                  {"session", session.identifier},
                  {"sessionID", session.sessionID},
                  {"clientType", session.clientType},
                  {"family", clientTypeShortCode(session.clientType)},
                  {"client", session.clientName},
                  {"service", session.service},
                  {"token", session.token},
                  {"level", session.level},
                  {"since", session.since},
                  {"storebagVersion", session.storebagVersion}};
  Array backEnds;
  for (const auto& backEnd : session.backEnds) backEnds.append(backEndView(*backEnd));
  view.set("backEnds", std::move(backEnds));
  return view;
}

Dictionary bookView(const BookRow& row) {
  return Dictionary{{"user", row.program.user},
                    {"clientType", row.program.clientType},
                    {"family", clientTypeShortCode(row.program.clientType)},
                    {"client", row.program.clientName},
                    {"service", row.program.service},
                    {"backEnd", row.backEnd},
                    {"internal", row.isInternal},
                    {"programsMerged", row.programsMerged},
                    {"taken", row.taken},
                    {"queued", row.queued},
                    {"batched", row.batched},
                    {"inFlight", row.inFlight},
                    {"waiting", row.waiting},
                    {"outbox", row.outbox},
                    {"delivered", row.delivered},
                    {"dropped", row.droppedInAll()},
                    {"droppedBy", byReason(row.dropped)}};
}

const char* storebagStateName(StorebagView::State state) {
  switch (state) {
    case StorebagView::State::good:
      return "good";
    case StorebagView::State::fallback:
      return "fallback";
    case StorebagView::State::failed:
      break;
  }
  return "failed";
}

Dictionary shown(const StorebagView& view) {
  return {{"name", view.name},           {"version", view.version},
          {"address", view.address},     {"fetched", view.fetched},
          {"expires", view.expires},     {"state", storebagStateName(view.state)},
          {"lastError", view.lastError}, {"lastErrorAt", view.lastErrorAt}};
}

}  // namespace

Dictionary Administration::status() const {
  const Platform& platform = sources_.platform;
  const ProcessFigures process = sources_.process();
  const Totals totals = totalsOf(platform.books.snapshot());
  Dictionary status{{"version", sources_.version},
                    {"pid", process.pid},
                    {"now", secondsNow(platform)},
                    {"since", sources_.since},
                    {"logLevel", logLevelName(platform.log)},
                    {"outbox", hasOutbox()},
                    {"connections", static_cast<uint64_t>(sources_.connections())},
                    {"threads", process.threads},
                    {"memoryBytes", process.residentBytes},
                    {"anonymousBytes", process.anonymousBytes},
                    {"taken", totals.taken},
                    {"pending", totals.pending}};
  writeFates(status, totals.fates);
  Dictionary lastHour;
  writeFates(lastHour, platform.books.lastHour());
  status.set("lastHour", std::move(lastHour));
  uint64_t sessions = 0;
  status.set("backEnds", backEndsOf(sources_.sessions, sessions));
  status.set("sessions", sessions);
  status.set("servers", serversOf(sources_.servers));
  return status;
}

std::vector<Dictionary> Administration::sessions(size_t most) const {
  std::map<int32_t, std::string> programs;
  std::vector<Dictionary> views;
  for (const SessionView& session : sources_.sessions.views(most)) {
    if (session.process > 0 && programs.size() < kMostPrograms && programs.count(session.process) == 0)
      programs.emplace(session.process, sources_.programOf(session.process));
    const auto program = programs.find(session.process);
    views.push_back(sessionView(session, program != programs.end() ? program->second : std::string()));
  }
  return views;
}

std::vector<Dictionary> Administration::books(size_t mostRowsOfUser) const {
  std::vector<Dictionary> rows;
  for (const BookRow& row : withFewerRows(sources_.platform.books.snapshot(), mostRowsOfUser))
    rows.push_back(bookView(row));
  return rows;
}

std::vector<Dictionary> Administration::storebags() const {
  std::vector<Dictionary> views;
  for (const StorebagView& view : sources_.storebags.views()) views.push_back(shown(view));
  return views;
}

std::optional<Dictionary> Administration::storebag(std::string_view name) const {
  const std::optional<StorebagView> view = sources_.storebags.view(std::string(name));
  if (!view || view->version.empty()) return std::nullopt;
  Dictionary bag = shown(*view);
  bag.set("section", view->section);
  return bag;
}

}  // namespace kyt
