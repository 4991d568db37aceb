// What kytctl events generate writes is compiled and run, and what it sends arrives.
#include <gtest/gtest.h>

#include <chrono>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "kytreporting/FakeDaemon.h"
#include "platform/objects/Description.h"
#include "tests/support/Programs.h"
#include "tests/support/Sanitizers.h"
#include "tests/support/TemporaryFolder.h"
#include "tests/tools/EventsText.h"

namespace kyt::tools {
namespace {

constexpr std::chrono::seconds kPatience{240};

// An event with a field of each type, and one without any.
std::string everyType() {
  std::string text = eventText("everything", 10, 1), further;
  for (const std::string& type : eventKeys().types) text += fieldText("of_" + type, type);
  for (const std::string& type : eventKeys().types)
    text += "fields.maybe_" + type + " = { type = \"" + type +
            "\", personal = true, optional = true, description = \"Perhaps.\" }\n";
  return text + eventText("nothing", 11, 2);
}

constexpr size_t kHostileFields = 50;

// Names and texts that would break out of comments, literals and identifiers.
std::string hostile() {
  const std::string description =
      "description = \"\"\"\nends */ here /* and \\\\\nint x = ; ?\?/\n\\\\N{BULLET} \\\"\\\"\\\" # ''' ?\?\?\?\?\?/\n"
      "/* ends with \\\\\"\"\"\n";
  std::string text;
  int type = 0;
  for (const std::string name :
       {"\"*/ evil\"", "\"a-b\"", "\"a_b\"", "\"A b\"", "\"int\"", "\"None\"", "\"EOF\"", "\"class\"",
        "\"2fa\"", "\"größe 日本\"", "\"%s \\\\n \\\"quoted\\\"\"", "\"a_send\"", "\"typing\"", "\"*/\"",
        "\"__init__\""})
    text += std::string("[[event]]\nevent = ") + name + "\ncategory = 20\ntype = " + std::to_string(++type) +
            "\n" + description;
  text += "[[event]]\nevent = \"names\"\ncategory = 21\ntype = 1\n" + description;
  for (const std::string name :
       {"class",   "def",      "int",   "int64_t",  "self",   "send",        "payload",  "session",
        "flag",    "entries",  "event", "EOF",      "NULL",   "errno",       "stdin",    "linux",
        "std",     "kyt",      "Names", "names",    "typing", "dataclasses", "datetime", "None",
        "TYPE",    "CATEGORY", "kType", "__init__", "_Upper", "a-b",         "a_b",      "a b",
        "has_a_b", "2nd",      "größe", "*/",       "\"",     "\\",          "?\?/",     "%s%n",
        "'''",     "\"\"\"",   "{x}",   "#define",  "not",    "str",         "print",    "co_await",
        "match",   "true"})
    text += "fields." + tomlKey(name) +
            " = { type = \"integer\", personal = true, description = " + R"("Ends */ here \"\"\" and \\" })" +
            "\n";
  return text;
}

class GeneratedEvents : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(daemon_.start(), std::nullopt); }
  // Into NAME in the folder.
  void generate(const std::string& text, const std::string& language, const std::string& name) {
    const ProgramRun run = runProgram(
        KYT_PROGRAMS "/kytctl",
        {"events", "generate", folder_.write("events.toml", text), "--lang", language, "-o", folder_ / name});
    ASSERT_EQ(run.status, 0) << run.text;
    ASSERT_EQ(run.text, "");
  }
  // The compiler, the flags and the library of this build; what it says.
  [[nodiscard]] std::string compile(const std::string& language, const std::string& source,
                                    bool link = true) const {
    const std::string command =
        std::string(KYT_CXX " " KYT_USER_FLAGS " -Wall -Wextra -Wpedantic -Wshadow -Werror -x ") + language +
        (language == "c" ? " -std=c11" : " -std=c++20") +
        " -I" KYT_SOURCE_DIR "/client/include -I" KYT_SOURCE_DIR " -I'" + folder_.path() + "' '" + source +
        "'" +
        (link ? " -x none -L" KYT_LIBRARIES " -lkytreporting -Wl,-rpath," KYT_LIBRARIES " -o '" +
                    (folder_ / "program") + "'"
              : std::string(" -fsyntax-only"));
    return runProgram("sh", {"-c", command}, {}, kPatience).text;
  }
  [[nodiscard]] ProgramRun runAgainstTheDaemon(const std::string& command) const {
    return runProgram(
        "env",
        {"KYTREPORTING_SOCKET=" + daemon_.socketPath(), "PYTHONPATH=" KYT_SOURCE_DIR "/bindings/python",
         "PYTHONDONTWRITEBYTECODE=1", "LD_LIBRARY_PATH=" KYT_LIBRARIES, "sh", "-c",
         "cd '" + folder_.path() + "' && " + command},
        {}, kPatience);
  }
  [[nodiscard]] std::vector<testing::Event> messages(size_t count) const {
    EXPECT_TRUE(daemon_.waitFor(testing::Kind::message, count));
    return daemon_.events(testing::Kind::message);
  }
  // What every language's program below sends.
  void expectEverything() const {
    const auto sent = messages(2);
    ASSERT_EQ(sent.size(), 2U);
    EXPECT_EQ(sent[0].category, 10);
    EXPECT_EQ(sent[0].type, 1);
    EXPECT_EQ(sent[0].flag, 1U);
    const Dictionary expected{{"of_string", "é\"x"},
                              {"of_integer", -5},
                              {"of_unsigned", UINT64_MAX},
                              {"of_number", 0.5},
                              {"of_boolean", true},
                              {"of_date", Date{86400}},
                              {"of_data", Data(std::string_view("ab"))},
                              {"of_array", Array{1, "two"}},
                              {"of_dictionary", Dictionary{{"k", 1}}},
                              {"maybe_string", "there"},
                              {"maybe_boolean", false}};
    EXPECT_EQ(sent[0].payload, expected) << description(sent[0].payload);
    EXPECT_EQ(sent[1].category, 11);
    EXPECT_EQ(sent[1].type, 2);
    EXPECT_TRUE(sent[1].payload.empty());
  }

  // Each field under its own key, whatever it is called in the language.
  void expectNames() const {
    const auto sent = messages(7);
    ASSERT_EQ(sent.size(), 7U);
    const Dictionary& payload = sent[6].payload;
    EXPECT_EQ(sent[6].category, 21);
    EXPECT_EQ(payload.size(), kHostileFields);
    int value = 0;
    for (const char* key : {"class", "int", "EOF", "a-b", "a_b", "a b", "*/", "größe"})
      EXPECT_EQ(payload.integer(key, -1), ++value) << key;
  }

  TemporaryFolder folder_;
  testing::FakeDaemon daemon_;
};

TEST_F(GeneratedEvents, ArriveFromC) {
  generate(everyType(), "c", "events.h");
  const std::string source = folder_.write("program.c", R"(#include "events.h"
int main(void) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", 20);
  kyt_options options = {0};
  options.size = sizeof options;
  options.session_info = info;
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  kyt_array* array = kyt_array_new();
  kyt_array_append_int(array, 1);
  kyt_array_append_string(array, "two");
  kyt_dictionary* dictionary = kyt_dictionary_new();
  kyt_dictionary_set_int(dictionary, "k", 1);
  kyt_event_everything event = {.of_string = "\303\251\"x", .of_integer = -5, .of_unsigned = UINT64_MAX,
    .of_number = 0.5, .of_boolean = 1, .of_date = 86400, .of_data = "ab", .of_data_size = 2, .of_array = array,
    .of_dictionary = dictionary, .maybe_string = "there", .maybe_boolean = 0, .has_maybe_boolean = 1};
  int wrong = kyt_send_event_everything(session, &event, 1) != KYT_ERROR_NONE;
  wrong |= kyt_send_event_nothing(session, 0) != KYT_ERROR_NONE;
  event.of_string = NULL;
  wrong |= kyt_send_event_everything(session, &event, 0) != KYT_ERROR_INVALID;
  wrong |= kyt_send_event_everything(session, NULL, 0) != KYT_ERROR_INVALID;
  wrong |= !kyt_session_finish(session, 60000);
  kyt_session_close(session);
  kyt_array_free(array);
  kyt_dictionary_free(dictionary);
  return wrong;
}
)");
  ASSERT_EQ(compile("c", source), "");
  const ProgramRun run = runAgainstTheDaemon("./program");
  EXPECT_EQ(run.status, 0) << run.text;
  expectEverything();
}

TEST_F(GeneratedEvents, ArriveFromCxx) {
  generate(everyType(), "c++", "events.h");
  const std::string source = folder_.write("program.cpp", R"(#include "events.h"
int main() {
  kyt::KYTReporting::Options options;
  options.sessionInfo = kyt::SessionInfo{.clientType = 20};
  const auto session = kyt::KYTReporting::open(std::move(options));
  const kyt::events::Everything event{.of_string = "\303\251\"x", .of_integer = -5, .of_unsigned = UINT64_MAX,
    .of_number = 0.5, .of_boolean = true, .of_date = kyt::Date{86400}, .of_data = kyt::Data(std::string_view("ab")),
    .of_array = kyt::Array{1, "two"}, .of_dictionary = kyt::Dictionary{{"k", 1}}, .maybe_string = "there",
    .maybe_boolean = false};
  const bool sent = event.send(*session, 1) && kyt::events::Nothing{}.send(*session);
  return sent && session->finish(std::chrono::minutes(1)) ? 0 : 1;
}
)");
  ASSERT_EQ(compile("c++", source), "");
  const ProgramRun run = runAgainstTheDaemon("./program");
  EXPECT_EQ(run.status, 0) << run.text;
  expectEverything();
}

TEST_F(GeneratedEvents, ArriveFromPython) {
  if (kSanitized) GTEST_SKIP() << "the interpreter is built without the sanitizer";
  generate(everyType(), "python", "events.py");
  folder_.write("program.py", R"(import datetime
import kytreporting as kyt
import events

with kyt.Session(client_type=20) as session:
    event = events.Everything(of_string='é"x', of_integer=-5, of_unsigned=2**64 - 1, of_number=0.5, of_boolean=True,
        of_date=datetime.datetime.fromtimestamp(86400, datetime.timezone.utc), of_data=b"ab", of_array=[1, "two"],
        of_dictionary={"k": 1}, maybe_string="there", maybe_boolean=False)
    assert event.send(session, flag=kyt.Flag.REALTIME)
    assert events.Nothing().send(session)
    assert "Personal. Perhaps." in events.Everything.__doc__
    try:
        events.Everything(of_string="")
    except TypeError:
        pass
    else:
        raise AssertionError("fields are missing")
)");
  const ProgramRun run = runAgainstTheDaemon("/usr/bin/python3 -W error program.py");
  EXPECT_EQ(run.status, 0) << run.text;
  expectEverything();
}

TEST_F(GeneratedEvents, BearAnyNamesAndTextsInC) {
  generate(hostile(), "c", "events.h");
  const std::string source = folder_.write("program.c",
                                           "#include <errno.h>\n#include <stdio.h>\n#include \"events.h\"\n"
                                           R"(
int main(void) {
  kyt_event_names event = {.class_ = 1, .int_ = 2, .EOF_ = 3, .a_b = 4, .a_b_ = 5, .a_b_2 = 6, .x2A2F = 7, .gruF6uDFe = 8};
  kyt_options options = {0};
  options.size = sizeof options;
  kyt_session* session = kyt_session_open(&options);
  int wrong = kyt_send_event_evil(session, 0) + kyt_send_event_a_b(session, 0) + kyt_send_event_a_b_(session, 0) +
    kyt_send_event_A_b(session, 0) + kyt_send_event_n2fa(session, 0) + kyt_send_event_a_send(session, 0);
  wrong += kyt_send_event_names(session, &event, 0);
  wrong += !kyt_session_finish(session, 60000);
  kyt_session_close(session);
  return wrong;
}
)");
  ASSERT_EQ(compile("c", source), "");
  const ProgramRun run = runAgainstTheDaemon("./program");
  EXPECT_EQ(run.status, 0) << run.text;
  expectNames();
  EXPECT_EQ(compile("c++", folder_.write("other.cpp", "#include \"events.h\"\n"), false), "")
      << "C++ takes the header for C too";
}

TEST_F(GeneratedEvents, BearAnyNamesAndTextsInCxx) {
  generate(hostile(), "c++", "events.h");
  const std::string source = folder_.write("program.cpp",
                                           "#include <cerrno>\n#include <cstdio>\n#include \"events.h\"\n"
                                           R"(
int main() {
  using namespace kyt::events;
  Names event{};
  event.class_ = 1, event.int_ = 2, event.EOF_ = 3, event.a_b = 4, event.a_b_ = 5, event.a_b_2 = 6, event.x2A2F = 7;
  event.gruF6uDFe = 8;
  const auto session = kyt::KYTReporting::open({});
  const bool sent = Evil{}.send(*session) && AB_{}.send(*session) && AB_2{}.send(*session) && AB_3{}.send(*session) &&
    N2fa{}.send(*session) && ASend{}.send(*session) && event.send(*session);
  return sent && session->finish(std::chrono::minutes(1)) ? 0 : 1;
}
)");
  ASSERT_EQ(compile("c++", source), "");
  const ProgramRun run = runAgainstTheDaemon("./program");
  EXPECT_EQ(run.status, 0) << run.text;
  expectNames();
}

TEST_F(GeneratedEvents, BearAnyNamesAndTextsInPython) {
  if (kSanitized) GTEST_SKIP() << "the interpreter is built without the sanitizer";
  generate(hostile(), "python", "events.py");
  folder_.write("program.py", R"(import dataclasses
import kytreporting as kyt
import events

with kyt.Session(client_type=20) as session:
    for event in (events.Evil, events.AB, events.AB_, events.AB_2, events.N2fa, events.None_):
        assert event().send(session)
    values = {field.name: 0 for field in dataclasses.fields(events.Names)}
    given = dict(class_=1, int_=2, EOF=3, a_b=4, a_b_=5, a_b_2=6, x2A2F=7, gruF6uDFe=8)
    assert given.keys() <= values.keys(), values
    assert events.Names(**{**values, **given}).send(session)
    assert r'\N{BULLET} """ # ' in events.Evil.__doc__, events.Evil.__doc__
)");
  const ProgramRun run = runAgainstTheDaemon("/usr/bin/python3 -W error program.py");
  EXPECT_EQ(run.status, 0) << run.text;
  expectNames();
}

// Names that are long and alike.
std::string manyEvents(size_t number) {
  std::string text;
  for (size_t i = 0; i < number; ++i)
    text += eventText(
        "event " + std::to_string(i % 7) + std::string(i / 7, '-').substr(0, 90) + std::to_string(i),
        static_cast<int>(1 + i), 1, fieldText("a", "string") + fieldText("b", "date"));
  return text;
}

TEST_F(GeneratedEvents, AreTenThousandIfSomebodyWantsThat) {
  generate(manyEvents(kMostEvents), "c", "events.h");
  EXPECT_EQ(compile("c", folder_.write("program.c", "#include \"events.h\"\nint main(void) { return 0; }\n"),
                    false),
            "");
  generate(manyEvents(kMostEvents), "python", "events.py");
  EXPECT_EQ(runProgram("/usr/bin/python3",
                       {"-c", "compile(open('" + (folder_ / "events.py") + "').read(), 'e', 'exec')"}, {},
                       kPatience)
                .status,
            0);
  generate(manyEvents(kMostEvents), "c++", "events.hpp");
  const std::string all = folder_.read("events.hpp");
  size_t structs = 0;
  for (size_t at = 0; (at = all.find("\nstruct ", at)) != std::string::npos; ++at) ++structs;
  EXPECT_EQ(structs, kMostEvents);
  generate(manyEvents(1000), "c++", "events.hpp");  // a compiler takes half a minute for all
  EXPECT_EQ(compile("c++", folder_.write("program.cpp", "#include \"events.hpp\"\n"), false), "");
}

TEST_F(GeneratedEvents, GoToStandardOutputWithoutAFile) {
  const std::string file = folder_.write("events.toml", everyType());
  const ProgramRun printed = runProgram(KYT_PROGRAMS "/kytctl", {"events", "generate", file, "--lang", "c"});
  EXPECT_EQ(printed.status, 0);
  generate(everyType(), "c", "events.h");
  EXPECT_EQ(printed.text, folder_.read("events.h"));
}

TEST_F(GeneratedEvents, AreRefusedForCategoryZeroAndAFileThatIsWrong) {
  const auto run = [this](const std::string& text) {
    return runProgram(KYT_PROGRAMS "/kytctl",
                      {"events", "generate", folder_.write("events.toml", text), "--lang", "python"});
  };
  const ProgramRun zero = run(eventText("a", 1, 1) + eventText("b", 0, 1));
  EXPECT_EQ(zero.status, 1);
  EXPECT_EQ(zero.text, "kytctl: " + (folder_ / "events.toml") + ":6: category 0 is the daemon's own\n");
  EXPECT_EQ(run("events = 1\n").status, 1);
  EXPECT_EQ(
      runProgram(KYT_PROGRAMS "/kytctl", {"events", "generate", folder_ / "events.toml", "--lang", "cobol"})
          .status,
      2);
}

// What a header for C++ needs of the sources' files, too.
TEST_F(GeneratedEvents, CompileForEachReadyMadeSource) {
  for (const char* source : {"units", "boots", "crashes", "resources"}) {
    const auto of = [&](const std::string& language, const std::string& name) {
      return runProgram(
                 KYT_PROGRAMS "/kytctl",
                 {"events", "generate", std::string(KYT_SOURCE_DIR "/sources/") + source + "/events.toml",
                  "--lang", language, "-o", folder_ / name})
          .status;
    };
    ASSERT_EQ(of("c", "events.h"), 0);
    EXPECT_EQ(
        compile("c", folder_.write("program.c", "#include \"events.h\"\nint main(void) { return 0; }\n"),
                false),
        "");
    ASSERT_EQ(of("c++", "events.hpp"), 0);
    EXPECT_EQ(compile("c++", folder_.write("program.cpp", "#include \"events.hpp\"\n"), false), "");
  }
}

}  // namespace
}  // namespace kyt::tools
