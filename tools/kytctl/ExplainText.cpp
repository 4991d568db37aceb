#include "tools/kytctl/ExplainText.h"

#include <algorithm>
#include <string_view>
#include <vector>

#include "platform/base/TextEscape.h"
#include "platform/objects/Description.h"

namespace kyt::tools {

namespace {

constexpr size_t kColumns = 100;

std::string textIn(const Dictionary& dictionary, std::string_view key) {
  const Value* value = dictionary.find(key);
  return value != nullptr && !value->isNull() ? description(*value) : std::string();
}

const Dictionary& partOf(const Dictionary& report, std::string_view key) {
  static const Dictionary none;
  const Dictionary* part = report.dictionary(key);
  return part != nullptr ? *part : none;
}

const Array& listIn(const Dictionary& report, std::string_view key) {
  static const Array none;
  const Array* list = report.array(key);
  return list != nullptr ? *list : none;
}

// Counts characters, cuts between them.
std::string cut(std::string_view text, size_t columns) {
  size_t count = 0, bytes = 0, atLimit = 0;
  while (bytes < text.size()) {
    if (count == columns - 3) atLimit = bytes;
    bytes += std::max<size_t>(utf8SequenceLength(text.substr(bytes)), 1);
    if (++count > columns) return std::string(text.substr(0, atLimit)) + "...";
  }
  return std::string(text);
}

class Page {
 public:
  void line(const std::string& text) { out_ += cut(escapedText(text), kColumns) + "\n"; }
  void row(const std::string& name, const std::string& text) {
    line(name + std::string(name.size() < 20 ? 20 - name.size() : 1, ' ') + text);
  }
  // Between words, with the following lines indented.
  void wrapped(const std::string& first, const std::string& text) {
    std::string current = first;
    const std::string indentation(first.size(), ' ');
    for (size_t at = 0; at < text.size();) {
      const size_t end = std::min(text.find(' ', at), text.size());
      const std::string word = text.substr(at, end - at);
      if (current.size() > indentation.size() && current.size() + 1 + word.size() > kColumns) {
        line(current);
        current = indentation;
      }
      current += (current.size() > indentation.size() ? " " : "") + word;
      at = end + 1;
    }
    line(current);
  }
  [[nodiscard]] std::string take() { return std::move(out_); }

 private:
  std::string out_;
};

std::string joined(const Array& list, const char* separator) {
  std::string text;
  for (const Value& element : list) text += (text.empty() ? "" : separator) + description(element);
  return text;
}

bool holds(const Array& list, std::string_view text) {
  return std::any_of(list.begin(), list.end(), [text](const Value& element) {
    return element.string() != nullptr && element.string()->view() == text;
  });
}

// "a:b" of each client entry, as the storebag names them.
std::string entriesOf(const Array& clients) {
  std::string text;
  for (const Value& element : clients) {
    const Dictionary* entry = element.dictionary();
    if (entry == nullptr) continue;
    const std::string client = textIn(*entry, "client"), service = textIn(*entry, "service");
    text += (text.empty() ? "" : "; ") + (client.empty() ? "any" : client) +
            (service.empty() ? "" : ", service " + service);
  }
  return text.empty() ? "there is none" : text;
}

std::string wantedText(const Dictionary& rule) {
  const Value* wanted = rule.find("wanted");
  if (wanted == nullptr || wanted->isNull()) return {};
  if (textIn(rule, "rule") == "client" && wanted->isArray()) return "entries: " + entriesOf(*wanted->array());
  return "storebag: " + description(*wanted);
}

void sayRules(Page& page, const Dictionary& report) {
  std::string backend;
  for (const Value& row : listIn(report, "rules")) {
    const Dictionary& rule = *row.dictionary();
    if (const std::string name = textIn(rule, "backend"); name != backend)
      page.line("back end " + (backend = name));
    const Value* value = rule.find("value");
    const bool known = value != nullptr && !value->isNull();
    const std::string wanted = wantedText(rule);
    page.row("  " + textIn(rule, "rule"), std::string(rule.boolean("passes") ? "passes   " : "FAILS    ") +
                                              (known ? description(*value) : "missing") +
                                              (wanted.empty() ? "" : "   (" + wanted + ")"));
  }
}

void sayRecord(Page& page, const Dictionary& change, const Dictionary* posted) {
  page.line("record of " + textIn(change, "backend"));
  const Dictionary& record = partOf(change, "record");
  for (const DictionaryEntry& entry : record) {
    const std::string_view key = entry.key.view();
    const Value* left = posted != nullptr ? posted->find(key) : nullptr;
    const char* mark = holds(listIn(change, "removed"), key)     ? "removed"
                       : holds(listIn(change, "notPosted"), key) ? "not posted"
                       : holds(listIn(change, "hashed"), key)    ? "hashed"
                       : holds(listIn(change, "replaced"), key)  ? "replaced"
                                                                 : "";
    page.line("  " + std::string(mark) + std::string(12 - std::string_view(mark).size(), ' ') +
              std::string(key) + " = " + description(left != nullptr ? *left : entry.value));
  }
}

const Dictionary* firstRecord(const Dictionary& post) {
  const Array& events = listIn(partOf(post, "message"), "events");
  return events.empty() ? nullptr : events[0].dictionary();
}

void sayPosts(Page& page, const Dictionary& report) {
  for (const Value& element : listIn(report, "posts")) {
    const Dictionary& post = *element.dictionary();
    page.line("POST " + textIn(post, "url"));
    for (const Value& header : listIn(post, "headers")) page.line("  " + description(header));
    page.line("  clientId " + textIn(partOf(post, "message"), "clientId") + ", " + textIn(post, "bytes") +
              " bytes" + (post.boolean("mayUseCellular") ? "" : ", not over cellular networks"));
  }
}

void sayWhatItIsAbout(Page& page, const Dictionary& report) {
  const Dictionary& entitlement = partOf(report, "entitlement");
  page.row("entitlement", textIn(entitlement, "verdict"));
  if (textIn(entitlement, "verdict") != "granted")
    for (const Value& line : listIn(entitlement, "lines")) page.line("  " + description(line));
  const Dictionary& session = partOf(report, "session");
  page.row("client type", textIn(session, "clientType") + " (" + textIn(session, "sender") + "), storebag " +
                              (textIn(session, "storebag").empty() ? "none: types 5 to 23 have one"
                                                                   : textIn(session, "storebag")));
  page.row("session", textIn(session, "information"));
  page.row("user info",
           textIn(session, "userInformation").empty() ? "none" : textIn(session, "userInformation"));
  const Dictionary& bag = partOf(report, "storebag");
  page.row("storebag",
           (textIn(bag, "version").empty() ? "" : "version " + textIn(bag, "version") + ", ") +
               (textIn(bag, "from").empty() ? "not asked for" : "from " + textIn(bag, "from")) +
               (textIn(bag, "signature") == "required" ? "" : ", signature " + textIn(bag, "signature")));
  if (!session.boolean("singleMessage"))
    page.row("back ends", listIn(session, "backends").empty()
                              ? "none"
                              : joined(listIn(session, "backends"), " ") +
                                    "; live: " + joined(listIn(session, "live"), " "));
}

}  // namespace

std::string explainText(const Dictionary& report) {
  Page page;
  sayWhatItIsAbout(page, report);
  sayRules(page, report);
  const Array& posts = listIn(report, "posts");
  const Array& records = listIn(report, "records");
  if (!posts.empty())
    for (const Value& change : records)
      sayRecord(page, *change.dictionary(),
                records.size() == 1 ? firstRecord(*posts[0].dictionary()) : nullptr);
  sayPosts(page, report);
  for (const Value& note : listIn(report, "notes")) page.wrapped("note: ", description(note));
  for (const Value& doubt : listIn(report, "doubts")) page.wrapped("doubt: ", description(doubt));
  page.row("fate", textIn(report, "fate"));
  const std::string reasons = joined(listIn(report, "reasons"), ", ");
  const std::string verdict = textIn(report, "verdict");
  page.wrapped("", verdict == "leaves" ? "the event leaves"
                   : verdict == "does-not-leave"
                       ? "the event does not leave: " + reasons
                       : "cannot be told whether the event leaves" + (reasons.empty() ? "" : ": " + reasons));
  return page.take();
}

}  // namespace kyt::tools
