#include "tools/explain/Explanation.h"

#include <algorithm>
#include <array>
#include <utility>

#include "config/ClientTypes.h"
#include "platform/objects/Description.h"
#include "platform/objects/Keys.h"

namespace kyt::tools {

namespace {

constexpr uint32_t kDraws = 101;  // 0.00, 0.01, … 1.00

// What the session's configuration counts of its own start message says nothing about the event.
bool isOfOneEvent(Reason reason) {
  constexpr std::array kOfOne{Reason::eventFiltered,      Reason::eventDroppedByState,
                              Reason::batchDiscarded,     Reason::batchedEventFiltered,
                              Reason::valueNotPostable,   Reason::postWithoutURL,
                              Reason::postWithoutClientID};
  return std::find(kOfOne.begin(), kOfOne.end(), reason) != kOfOne.end();
}

// These follow from another reason that is told beside them.
bool isConsequence(Reason reason) {
  return reason == Reason::eventDroppedByState || reason == Reason::batchDiscarded;
}

template <typename Texts>
Array arrayOf(const Texts& texts) {
  Array array;
  for (const auto& text : texts) array.append(Value(text));
  return array;
}

// One event of one session at one draw.
struct Course {
  SessionOutcome session;
  EventOutcome event;
  std::vector<JudgedRule> rules;
};

Course courseOf(const RehearsedDevice& device, const Rehearsal::StorebagServer& server,
                const ExplainFacts& facts, uint32_t draw) {
  Rehearsal rehearsal(device, server, facts.program, draw);
  Course course;
  course.session = rehearsal.configure();
  course.event = rehearsal.send(facts.message);
  course.rules = rehearsal.rules();
  return course;
}

bool dependsOnDraw(const Course& course) {
  return std::any_of(course.rules.begin(), course.rules.end(),
                     [](const JudgedRule& rule) { return rule.rule == "sampling"; });
}

Array rulesIn(const Course& course) {
  Array rows;
  for (const JudgedRule& rule : course.rules)
    rows.append(Dictionary{{"backend", rule.backend},
                           {"rule", rule.rule},
                           {"passes", rule.passes},
                           {"value", rule.value},
                           {"wanted", rule.wanted}});
  return rows;
}

Array reasonsIn(const Course& course) {
  std::vector<Reason> reasons = course.event.reasons;
  for (const Reason reason : course.session.reasons)
    if (!isOfOneEvent(reason) && std::find(reasons.begin(), reasons.end(), reason) == reasons.end())
      reasons.push_back(reason);
  std::stable_sort(reasons.begin(), reasons.end(),
                   [](Reason a, Reason b) { return isConsequence(a) < isConsequence(b); });
  Array names;
  for (const Reason reason : reasons) names.append(Value(reasonName(reason)));
  return names;
}

bool isMerelyInformation(const std::string& line) {
  return line.starts_with("userDefaultsEnvironment: Environment type ") ||
         line.starts_with("updateCorrelatedSessions: ") ||
         line.starts_with("fetchStorebagForEnvironmentAndClientType: Store bag override") ||
         line.starts_with("getPersistentIdentifierForCustomClientIDSuffix: ");
}

// The log's lines, each once, and what no line says.
Array notesIn(const Course& course, const ExplainFacts& facts) {
  std::vector<std::string> notes;
  for (const auto* lines : {&course.session.lines, &course.event.lines})
    for (const std::string& line : *lines)
      if (!isMerelyInformation(line) && std::find(notes.begin(), notes.end(), line) == notes.end())
        notes.push_back(line);
  const Value* category = facts.message.find(kKYTReportingMessageParametersCategory);
  if (category != nullptr && (category->unsignedIntValue() & 0xffffU) == 0)
    notes.emplace_back(
        "Category 0 is the daemon's own: servers take such an event for a session's start (Type 0) or stop (Type 1)");
  if (course.event.isNewDevice)
    notes.emplace_back(
        "The device has no such identifier (clientId) yet: the daemon will make another than the one shown");
  if (!facts.program.sessionInfo.boolean(kKYTReportingSessionInfoRequireUserInfo))
    notes.emplace_back(
        "The session does not require user information (RequireUserInfo): no rule of consent, country, device, filters "
        "and sampling applies to it");
  return arrayOf(notes);
}

// What became of a payload and of the record made of it.
Dictionary changesOf(const FilteredRecord& record, const ExplainFacts& facts, const Course& course) {
  Array removed, hashed, replaced, notPosted;
  for (const DictionaryEntry& entry : record.before) {
    const Value* after = record.after.find(entry.key.view());
    if (after == nullptr)
      removed.append(Value(entry.key));
    else if (!(*after == entry.value))
      hashed.append(Value(entry.key));
  }
  if (const Dictionary* payload = facts.message.dictionary(kKYTReportingMessageParametersPayload))
    for (const DictionaryEntry& entry : *payload) {
      const Value* before = record.before.find(entry.key.view());
      if (before != nullptr && !(*before == entry.value)) replaced.append(Value(entry.key));
    }
  for (const KeptPost& post : course.event.posts) {
    const Array* events = post.message.array("events");
    const Dictionary* posted = events != nullptr && !events->empty() ? (*events)[0].dictionary() : nullptr;
    if (posted == nullptr) continue;
    for (const DictionaryEntry& entry : record.after)
      if (posted->find(entry.key.view()) == nullptr) notPosted.append(Value(entry.key));
    break;
  }
  return Dictionary{{"backend", record.backend}, {"record", record.before}, {"removed", removed},
                    {"hashed", hashed},          {"replaced", replaced},    {"notPosted", notPosted}};
}

Array postsIn(const Course& course) {
  Array posts;
  for (const KeptPost& post : course.event.posts) {
    Array headers;
    for (const auto& [name, value] : post.request.headers) headers.append(Value(name + ": " + value));
    posts.append(Dictionary{{"url", post.request.url},
                            {"headers", headers},
                            {"mayUseCellular", post.request.allowsCellularAccess},
                            {"bytes", post.request.body.size()},
                            {"message", post.message}});
  }
  return posts;
}

std::string fateOf(const Course& course) {
  const EventOutcome& event = course.event;
  std::string fate;
  if (event.leaves() && !event.posts.empty())
    fate =
        event.atOnce ? "posted at once" : "batched, and posted with the next flush or at the session's end";
  if (event.datagrams != 0) fate += std::string(fate.empty() ? "" : "; ") + "sent to the dashboard";
  if (event.handedToAdaptor != 0)
    fate += std::string(fate.empty() ? "" : "; ") + "handed to the device's diagnostics adaptor";
  return fate.empty() ? "dropped" : fate;
}

Dictionary sessionIn(const Course& course, const ExplainFacts& facts) {
  const int32_t type = facts.program.sessionInfo.integer(kKYTReportingSessionInfoClientType);
  const std::optional<String> storebag = storebagNameForClientType(type);
  Dictionary session{{"clientType", type},
                     {"sender", clientTypeShortCode(type)},
                     {"storebag", storebag ? Value(*storebag) : Value()},
                     {"information", facts.program.sessionInfo},
                     {"userInformation", facts.program.userInfo ? Value(*facts.program.userInfo) : Value()},
                     {"singleMessage", facts.program.single}};
  if (!facts.program.single) {
    session.set("backends", arrayOf(course.session.backends));
    session.set("live", arrayOf(course.session.live));
  }
  return session;
}

const char* entitlementName(int verdict) {
  return verdict == 0 ? "granted" : verdict == 1 ? "refused" : "cannot-be-told";
}

// Why nothing certain can be said, for each; empty when it can.
std::vector<std::string> doubts(const ExplainFacts& facts, const std::string& problem, const Course& course,
                                uint32_t leavesAt, uint32_t tried) {
  std::vector<std::string> why;
  for (const std::string& file : facts.unreadable) why.push_back("cannot be read: " + file);
  if (!problem.empty())
    why.push_back("the storebag's server gave no answer: " + problem +
                  ". A daemon that runs may still have an earlier storebag");
  if (leavesAt != 0 && leavesAt != tried)
    why.push_back("it depends on the session's sampling draw: the event leaves at " +
                  std::to_string(leavesAt) + " of " + std::to_string(tried) + " (--draw chooses one)");
  if (leavesAt == 0 && course.event.handedToAdaptor != 0)
    why.emplace_back("what the device's diagnostics adaptor does with it is not known here");
  if (leavesAt != 0 && facts.entitlement == 2)
    why.emplace_back("whether the program holds the entitlement cannot be judged");
  return why;
}

}  // namespace

const char* verdictName(Verdict verdict) {
  switch (verdict) {
    case Verdict::leaves:
      return "leaves";
    case Verdict::doesNotLeave:
      return "does-not-leave";
    case Verdict::cannotBeTold:
      break;
  }
  return "cannot-be-told";
}

Explanation explain(const RehearsedDevice& device, const ExplainStorebag& storebag,
                    const ExplainFacts& facts) {
  const Rehearsal::StorebagServer& server = storebag.server;
  const Course course = courseOf(device, server, facts, facts.draw.value_or(0));
  uint32_t tried = 1, leavesAt = course.event.leaves() ? 1 : 0;
  if (!facts.draw && leavesAt != 0 && dependsOnDraw(course))
    for (uint32_t draw = 1; draw < kDraws; ++draw, ++tried)
      if (courseOf(device, server, facts, draw).event.leaves()) ++leavesAt;

  Array reasons = reasonsIn(course);
  std::vector<std::string> unsure = doubts(facts, storebag.problem, course, leavesAt, tried);
  Explanation explanation;
  explanation.verdict = leavesAt != 0 ? Verdict::leaves : Verdict::doesNotLeave;
  if (!unsure.empty()) explanation.verdict = Verdict::cannotBeTold;
  if (facts.entitlement == 1) {
    explanation.verdict = Verdict::doesNotLeave;
    Array first;
    first.append(Value(reasonName(Reason::unentitledConnection)));
    for (const Value& reason : reasons) first.append(reason);
    reasons = std::move(first);
    unsure.clear();
  }

  Array records;
  for (const FilteredRecord& record : course.event.records) records.append(changesOf(record, facts, course));
  explanation.report = Dictionary{
      {"verdict", verdictName(explanation.verdict)},
      {"reasons", reasons},
      {"doubts", arrayOf(unsure)},
      {"fate", fateOf(course)},
      {"entitlement", Dictionary{{"verdict", entitlementName(facts.entitlement)},
                                 {"lines", arrayOf(facts.entitlementLines)}}},
      {"session", sessionIn(course, facts)},
      {"storebag",
       Dictionary{{"from", storebag.from},
                  {"signature", facts.storebagSignature},
                  {"version", course.session.hasStorebag ? Value(course.session.storebagVersion) : Value()}}},
      {"rules", rulesIn(course)},
      {"sampling", Dictionary{{"leavesAt", leavesAt}, {"drawsTried", tried}}},
      {"records", records},
      {"posts", postsIn(course)},
      {"notes", notesIn(course, facts)}};
  return explanation;
}

}  // namespace kyt::tools
