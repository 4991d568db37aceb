#include "tools/events/EventsCheck.h"

#include <algorithm>
#include <optional>
#include <string_view>
#include <utility>

#include "backend/KYTReportingBackend.h"
#include "backends/https/ClientRules.h"
#include "backends/https/EventFilters.h"
#include "backends/https/RecordMaker.h"
#include "platform/base/TextEscape.h"
#include "platform/objects/Keys.h"
#include "tools/StorebagDiff.h"

namespace kyt::tools {

namespace {

constexpr char kHashed[] = "hashed";

std::string quoted(std::string_view name) {
  return "\"" + std::string(name) + "\"";
}

// A client entry that may govern the program's sessions.
struct Place {
  std::string name;  // "release, httppost, client "a""
  const Array* whitelist = nullptr;
  const Array* blacklist = nullptr;
  EventFilters filters;

  // Why it takes no event of the category; null: it does.
  [[nodiscard]] const char* refusal(uint16_t category) const {
    if (whitelist != nullptr && !holdsCategory(*whitelist, category)) return "event_whitelist";
    return blacklist != nullptr && holdsCategory(*blacklist, category) ? "event_blacklist" : nullptr;
  }
};

struct Section {
  std::string name;
  bool hasEntries = false;  // of anybody
  std::vector<Place> places;
};

// What a session of the program calls itself; null where the file does not say, so that any entry may fit.
class Program {
 public:
  explicit Program(const EventsFile& file) {
    if (!file.client.empty()) client_ = String(file.client);
    if (!file.service.empty()) service_ = String(file.service);
  }
  [[nodiscard]] bool mayFit(const Dictionary& entry) const {
    Dictionary rules = entry;
    if (!client_) rules.remove("client");
    if (!service_) rules.remove("service");
    return ClientRules::matchClientNameAndServiceID(rules, client(), service());
  }
  // Whatever is not known of it: so none of the entries behind this one governs.
  [[nodiscard]] bool fitsAlways(const Dictionary& entry) const {
    return !entry.contains("enabledSince") &&
           ClientRules::matchClientNameAndServiceID(entry, client(), service());
  }
  [[nodiscard]] std::string text() const {
    std::string text = client_ ? "client " + quoted(client_->view()) : std::string();
    if (service_) text += std::string(text.empty() ? "" : ", ") + "service " + quoted(service_->view());
    return text.empty() ? "any program" : text;
  }

 private:
  [[nodiscard]] const String* client() const { return client_ ? &*client_ : nullptr; }
  [[nodiscard]] const String* service() const { return service_ ? &*service_ : nullptr; }
  std::optional<String> client_, service_;
};

void addPlaces(const std::string& where, const Array& clients, const Program& program, Section& section) {
  for (const Value& element : clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr) continue;
    section.hasEntries = true;
    if (!program.mayFit(*entry)) continue;
    Place place;
    place.name = where + storebagEntryName(*entry);
    place.whitelist = entry->array("event_whitelist");
    place.blacklist = entry->array("event_blacklist");
    if (const Array* filters = entry->array("filters")) place.filters.createFiltersFromArray(*filters);
    section.places.push_back(std::move(place));
    if (program.fitsAlways(*entry)) return;
  }
}

std::vector<Section> sectionsOf(const Dictionary& bag, const Program& program) {
  std::vector<Section> sections;
  for (const char* name : {"development", "vantu_internal", "seed", "release"}) {
    const Dictionary* table = bag.dictionary(name);
    if (table == nullptr) continue;
    Section section;
    section.name = name;
    for (const char* backend :
         {kKYTReportingBackendHTTPPost, kKYTReportingBackendHTTPPost2, kKYTReportingBackendQRS}) {
      const Dictionary* profile = table->dictionary(backend);
      const Array* clients = profile != nullptr ? profile->array("clients") : nullptr;
      if (clients != nullptr) addPlaces(section.name + ", " + backend + ", ", *clients, program, section);
    }
    if (section.hasEntries) sections.push_back(std::move(section));
  }
  return sections;
}

// Something that a field of the type may hold.
Value sampleOf(FieldType type) {
  switch (type) {
    case FieldType::string:
      return "text";
    case FieldType::integer:
      return 1;
    case FieldType::unsignedInteger:
      return 1U;
    case FieldType::number:
      return 0.5;
    case FieldType::boolean:
      return true;
    case FieldType::date:
      return Date{1};
    case FieldType::data:
      return Data(std::string_view("data"));
    case FieldType::array:
      return Array{1};
    case FieldType::dictionary:
      return Dictionary{{"a", 1}};
  }
  return {};
}

bool canBePosted(const Value& value) {
  return value.kind() != Value::Kind::data && !value.isArray() && !value.isDictionary();
}

class Check {
 public:
  Check(const EventsFile& file, const Dictionary& bag)
      : file_(file), program_(file), sections_(sectionsOf(bag, program_)) {}

  EventsVerdict run() {
    checkClient();
    for (const DeclaredEvent& event : file_.events) checkEvent(event);
    std::stable_sort(verdict_.findings.begin(), verdict_.findings.end(),
                     [](const auto& a, const auto& b) { return a.line < b.line; });
    return std::move(verdict_);
  }

 private:
  void add(uint32_t line, const char* kind, const std::string& event, const std::string& field,
           const std::string& text) {
    if (verdict_.findings.size() == kMostFindings)
      ++verdict_.further;
    else
      verdict_.findings.push_back({line, event, field, kind, escapedText(text)});
  }

  void checkClient() {
    if (sections_.empty())
      add(file_.clientLine, "client-not-listed", "", "",
          "the bag has no client entry of posts: no event leaves by it");
    for (const Section& section : sections_)
      if (section.places.empty())
        add(file_.clientLine, "client-not-listed", "", "",
            "no entry of " + section.name + " is for " + program_.text() + ": no event leaves there");
  }

  void checkEvent(const DeclaredEvent& event) {
    if (event.category == 0)
      add(event.line, "category-0", event.name, "",
          quoted(event.name) +
              " has category 0, which is the daemon's own: type 0 is a session's start, type 1 its end");
    for (const EventField& field : event.fields)
      if (isRecordKey(field.name))
        add(field.line, "replaced", event.name, field.name,
            quoted(field.name) + " of " + quoted(event.name) +
                " is a key of every record: the record's own value takes its place");
      else if (field.name == kKYTReportingUserInfoClientName ||
               field.name == kKYTReportingUserInfoServiceName)
        add(field.line, "replaced", event.name, field.name,
            quoted(field.name) + " of " + quoted(event.name) +
                " is a key of the user information, which takes its place");
    for (const Section& section : sections_) checkSection(event, section);
  }

  void checkSection(const DeclaredEvent& event, const Section& section) {
    std::string refusals;
    bool isTaken = false;
    for (const Place& place : section.places) {
      if (const char* list = place.refusal(event.category)) {
        refusals += (refusals.empty() ? "" : "; ") + place.name + ", " + list;
        continue;
      }
      isTaken = true;
      checkFields(event, place);
    }
    if (!isTaken && !section.places.empty())
      add(event.line, "category-refused", event.name, "",
          "category " + std::to_string(event.category) + " of " + quoted(event.name) +
              " is refused: " + refusals);
  }

  // Which the daemon's own filters are applied to.
  void checkFields(const DeclaredEvent& event, const Place& place) {
    Dictionary record;
    for (const EventField& field : event.fields) record.set(field.name, sampleOf(field.type));
    record.set("_method", unsigned{event.category});
    record.set("_status", unsigned{event.type});
    EventFilters::Digest digest = [](const String&) { return String(kHashed); };
    place.filters.filterEvent(record, digest);
    for (const EventField& field : event.fields) {
      const Value* left = record.find(field.name);
      if (left == nullptr) continue;  // removed
      const bool isHashed = left->isString() && left->string()->view() == kHashed;
      if (!isHashed && !canBePosted(*left))
        add(field.line, "not-posted", event.name, field.name,
            quoted(field.name) + " of " + quoted(event.name) + " is of the type " +
                fieldTypeName(field.type) +
                ", which is not posted: the record leaves without it, with a line in the log: " + place.name);
      else if (field.personal && !isHashed)
        add(field.line, "personal-unfiltered", event.name, field.name,
            quoted(field.name) + " of " + quoted(event.name) +
                " is personal, and no filter removes or hashes it: " + place.name);
    }
  }

  const EventsFile& file_;
  const Program program_;
  const std::vector<Section> sections_;
  EventsVerdict verdict_;
};

}  // namespace

EventsVerdict checkEvents(const EventsFile& file, const Dictionary& bag) {
  return Check(file, bag).run();
}

}  // namespace kyt::tools
