#include "tools/events/Generate.h"

#include <gtest/gtest.h>

#include <string>

#include "tests/tools/EventsText.h"

namespace kyt::tools {
namespace {

const std::string kText =
    "[[event]]\nevent = \"page_opened\"\ncategory = 10\ntype = 1\ndescription = \"Somebody opened a page.\"\n"
    "fields.page = { type = \"string\", personal = false, description = \"Its name.\" }\n"
    "fields.account = { type = \"string\", personal = true, optional = true, description = \"Whose.\" }\n"
    "fields.int = { type = \"integer\", personal = false, optional = true, description = \"How often.\" }\n";

// What stands behind the file's first lines.
std::string bodyOf(const std::string& text, const std::string& marker) {
  const size_t at = text.find(marker);
  return at == std::string::npos ? text : text.substr(at + marker.size());
}

TEST(EventsGenerate, WritesAStructAndAFunctionInC) {
  EXPECT_EQ(bodyOf(generateC(eventsOf(kText)), "#include <kytreporting/kytreporting.h>\n"), R"(
/* page_opened, category 10, type 1: Somebody opened a page. */
typedef struct kyt_event_page_opened {
  /* Its name. */
  const char* page;
  /* Personal. Whose. Left out where null. */
  const char* account;
  /* The field "int". How often. Left out where has_int_ is 0. */
  int64_t int_;
  int has_int_;
} kyt_event_page_opened;

static inline kyt_error kyt_send_event_page_opened(kyt_session* session, const kyt_event_page_opened* event, uint32_t flag) {
  if (event == NULL ||
      event->page == NULL) return KYT_ERROR_INVALID;
  kyt_dictionary* payload = kyt_dictionary_new();
  kyt_dictionary_set_string(payload, "page", event->page);
  if (event->account != NULL) kyt_dictionary_set_string(payload, "account", event->account);
  if (event->has_int_) kyt_dictionary_set_int(payload, "int", event->int_);
  kyt_error error = kyt_session_try_send(session, 10, 1, payload, flag, NULL, 0);
  kyt_dictionary_free(payload);
  return error;
}
)");
}

TEST(EventsGenerate, WritesAStructInCxx) {
  EXPECT_EQ(bodyOf(generateCxx(eventsOf(kText)), "#include <kytreporting/KYTReporting.h>\n"), R"(
namespace kyt::events {

// page_opened, category 10, type 1: Somebody opened a page.
struct PageOpened {
  static constexpr std::uint16_t kCategory = 10, kType = 1;
  // Its name.
  std::string page;
  // Personal. Whose. Left out where it has no value.
  std::optional<std::string> account = std::nullopt;
  // The field "int". How often. Left out where it has no value.
  std::optional<std::int64_t> int_ = std::nullopt;

  [[nodiscard]] ::kyt::Dictionary payload() const {
    ::kyt::Dictionary entries;
    entries.reserve(3);
    entries.set("page", ::kyt::Value(page));
    if (account) entries.set("account", ::kyt::Value(*account));
    if (int_) entries.set("int", ::kyt::Value(*int_));
    return entries;
  }
  bool send(::kyt::KYTReporting& session, std::uint32_t flag = 0) const {
    return session.sendMessage(kCategory, kType, payload(), flag);
  }
};

}  // namespace kyt::events
)");
}

TEST(EventsGenerate, WritesAClassInPython) {
  EXPECT_EQ(bodyOf(generatePython(eventsOf(kText)), "import kytreporting as kyt\n"), R"(

@dataclasses.dataclass(frozen=True, kw_only=True)
class PageOpened:
    """page_opened, category 10, type 1: Somebody opened a page.

    page: Its name.
    account: Personal. Whose. Left out where it is None.
    int_: The field "int". How often. Left out where it is None.
    """

    CATEGORY: typing.ClassVar[int] = 10
    TYPE: typing.ClassVar[int] = 1
    page: str
    account: typing.Optional[str] = None
    int_: typing.Optional[int] = None

    def payload(self) -> typing.Dict[str, typing.Any]:
        """What it has under its fields' keys."""
        return {
            "page": self.page,
            "account": self.account,
            "int": self.int_,
        }

    def send(self, session: kyt.Session, *, flag: int = kyt.Flag.NONE) -> bool:
        """Sends it; whether there was room for it."""
        return session.send(self.CATEGORY, self.TYPE, self.payload(), flag=flag)
)");
}

TEST(EventsGenerate, WritesTheSameForTheSameFileWhereverItLies) {
  for (const EventsLanguage language : {EventsLanguage::c, EventsLanguage::cxx, EventsLanguage::python}) {
    EventsFile one = eventsOf(kText), other = eventsOf(kText);
    one.name = "here/e.toml";
    other.name = "/some/where/else/e.toml";
    EXPECT_EQ(generateEvents(one, language), generateEvents(other, language));
    EXPECT_NE(generateEvents(one, language).find("e.toml, made by kytctl events generate --lang "),
              std::string::npos);
  }
}

}  // namespace
}  // namespace kyt::tools
