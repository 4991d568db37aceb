#include <gtest/gtest.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cstddef>
#include <cstring>
#include <future>
#include <string>
#include <utility>
#include <vector>

#include "kytreporting/kytreporting.h"
#include "tests/client/AnswerOf.h"
#include "tests/client/TestDaemon.h"
#include "tests/support/Eventually.h"
#include "tests/support/TemporaryFolder.h"

namespace kyt {
namespace {

TEST(CInterface, RunsAWholeSession) {
  TemporaryFolder folder;
  const std::string socket = folder / "socket";
  TestDaemon daemon(socket);
  ASSERT_TRUE(daemon.start());
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_uint(info, "SessionID", 5);
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket.c_str();
  options.session_info = info;
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  ASSERT_NE(session, nullptr);

  std::promise<std::string> states;
  kyt_session_configure(
      session,
      [](const char* const* names, size_t count, int, const char* error, void* context) {
        std::string text = error != nullptr ? error : "";
        for (size_t i = 0; i < count; ++i) text += std::string(names[i]) + " ";
        static_cast<std::promise<std::string>*>(context)->set_value(text);
      },
      &states);
  EXPECT_EQ(answerOf(states), "httppost qrs ");

  kyt_dictionary* payload = kyt_dictionary_new();
  kyt_dictionary_set_string(payload, "text", "value");
  kyt_dictionary_set_double(payload, "real", 0.5);
  EXPECT_EQ(kyt_session_send(session, 1, 2, payload, 3), 1);
  kyt_dictionary_free(payload);
  EXPECT_EQ(kyt_session_send(session, 1, 3, nullptr, 0), 1);
  kyt_session_set_digest_key(session, "abc", 3, 0);

  std::promise<std::string> flushed;
  kyt_session_flush(
      session,
      [](const char*, const char* error, void* context) {
        static_cast<std::promise<std::string>*>(context)->set_value(error != nullptr ? error : "");
      },
      &flushed);
  EXPECT_EQ(answerOf(flushed), "Nothing to flush");
  EXPECT_EQ(kyt_session_finish(session, 20000), 1);
  kyt_statistics figures{};
  kyt_session_statistics(session, &figures);
  EXPECT_EQ(figures.sent, 2u);
  kyt_session_close(session);
  EXPECT_EQ(daemon.calls(), (std::vector<std::string>{"SetSessionInfo 5", "StartConfig", "Send 1 2 3",
                                                      "Send 1 3 -", "DigestKey abc 0", "Flush", "Finish"}));
}

TEST(CInterface, AsksForAnswersUploadsAndLogData) {
  TemporaryFolder folder;
  const std::string socket = folder / "socket";
  TestDaemon daemon(socket);
  ASSERT_TRUE(daemon.start());
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket.c_str();
  kyt_session* session = kyt_session_open(&options);

  const kyt_text_callback keepText = [](const char* text, const char* error, void* context) {
    static_cast<std::promise<std::string>*>(context)->set_value(error != nullptr  ? error
                                                                : text != nullptr ? text
                                                                                  : "");
  };
  std::promise<std::string> posted, url;
  kyt_session_send_with_reply(session, 1, 2, nullptr, 0, keepText, &posted);
  EXPECT_EQ(answerOf(posted), "posted");
  kyt_session_fetch_display_url(session, keepText, &url);
  EXPECT_EQ(answerOf(url), "https://display");

  const kyt_success_callback keepSuccess = [](int success, const char*, void* context) {
    static_cast<std::promise<int>*>(context)->set_value(success);
  };
  std::promise<int> uploaded, missing, logged;
  kyt_session_upload_file(session, folder.write("report.log", "content").c_str(), keepSuccess, &uploaded);
  EXPECT_EQ(answerOf(uploaded), 1);
  kyt_session_upload_file(session, (folder / "missing").c_str(), keepSuccess, &missing);
  EXPECT_EQ(answerOf(missing), 0);
  kyt_array* entries = kyt_array_new();
  kyt_array_append_string(entries, "line");
  kyt_array_append_int(entries, 2);
  kyt_array_append_double(entries, 0.5);
  kyt_array_append_data(entries, "ab", 2);
  EXPECT_EQ(kyt_array_count(entries), 4u);
  kyt_session_upload_log_data(session, entries, keepSuccess, &logged);
  kyt_array_free(entries);
  EXPECT_EQ(answerOf(logged), 0);
  EXPECT_EQ(daemon.count("LogData 4"), 1u);
  EXPECT_EQ(daemon.count("Upload file://"), 1u);
  kyt_session_close(session);
}

TEST(CInterface, CallsBackWhateverElseIsNull) {
  kyt_options options{};
  options.size = sizeof options;
  kyt_session* session = kyt_session_open(&options);
  const kyt_success_callback keep = [](int success, const char* error, void* context) {
    *static_cast<std::string*>(context) = success != 0 ? "success" : error != nullptr ? error : "";
  };
  std::string file, log, single;
  kyt_session_upload_file(session, nullptr, keep, &file);
  EXPECT_EQ(file, "the path is null");
  kyt_session_upload_log_data(session, nullptr, keep, &log);
  EXPECT_EQ(log, "the array is null");
  kyt_session_upload_file(session, nullptr, nullptr, nullptr);
  const kyt_text_callback keepError = [](const char* text, const char* error, void* context) {
    if (text == nullptr && error != nullptr) *static_cast<std::string*>(context) = error;
  };
  kyt_send_single_message(nullptr, 1, 2, nullptr, keepError, &single);
  EXPECT_EQ(single, "the options are missing");
  kyt_send_single_message(nullptr, 1, 2, nullptr, nullptr, nullptr);
  kyt_session_upload_file(nullptr, "x", keep, &(file = "nothing"));
  EXPECT_EQ(file, "nothing") << "without a session nobody is called";
  kyt_session_close(session);
}

TEST(CInterface, NamesStatesAndNothingElse) {
  const std::vector<std::string> names = {"no-daemon",   "refused",          "connected",
                                          "no-storebag", "no-live-back-end", "live"};
  for (unsigned i = 0; i < names.size(); ++i) EXPECT_EQ(kyt_state_name(static_cast<kyt_state>(i)), names[i]);
  for (const unsigned none : {6U, 255U, 256U, 261U, 65536U, ~0U})
    EXPECT_EQ(kyt_state_name(static_cast<kyt_state>(none)), nullptr) << none;
}

TEST(CInterface, ReceivesAggregatedMessages) {
  TemporaryFolder folder;
  const std::string socket = folder / "socket";
  TestDaemon daemon(socket);
  ASSERT_TRUE(daemon.start());
  std::promise<std::string> received;
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket.c_str();
  options.aggregation = [](const kyt_dictionary* info, double timestamp, uint16_t category, uint16_t type,
                           const kyt_dictionary* payload, void* context) {
    static_cast<std::promise<std::string>*>(context)->set_value(
        std::to_string(kyt_dictionary_get_int(info, "SessionID", 0)) + " " + std::to_string(timestamp) + " " +
        std::to_string(category) + " " + std::to_string(type) + " " +
        kyt_dictionary_get_string(payload, "k"));
  };
  options.aggregation_context = &received;
  kyt_session* session = kyt_session_open(&options);
  ASSERT_TRUE(eventually([&] { return daemon.count("SetSessionInfo") == 1; }));
  daemon.sendToClient(Dictionary{{"SessionID", 7}}, 12.5, 3, 4, Dictionary{{"k", "v"}});
  EXPECT_EQ(answerOf(received), "7 12.500000 3 4 v");
  kyt_session_close(session);
}

TEST(CInterface, ReadsBackWhatWasSetInADictionary) {
  kyt_dictionary* dictionary = kyt_dictionary_new();
  kyt_dictionary_set_string(dictionary, "s", "text");
  kyt_dictionary_set_int(dictionary, "i", -3);
  kyt_dictionary_set_bool(dictionary, "b", 1);
  kyt_dictionary_set_data(dictionary, "d", "xy", 2);
  kyt_dictionary_set_date(dictionary, "t", 1.5);
  kyt_dictionary_set_dictionary(dictionary, "n", dictionary);
  EXPECT_EQ(kyt_dictionary_count(dictionary), 6u);
  EXPECT_STREQ(kyt_dictionary_get_string(dictionary, "s"), "text");
  EXPECT_EQ(kyt_dictionary_get_string(dictionary, "i"), nullptr);
  EXPECT_EQ(kyt_dictionary_get_int(dictionary, "i", 0), -3);
  EXPECT_EQ(kyt_dictionary_get_int(dictionary, "missing", 9), 9);
  EXPECT_EQ(kyt_dictionary_get_double(dictionary, "i", 0), -3.0);
  kyt_dictionary_remove(dictionary, "s");
  EXPECT_EQ(kyt_dictionary_get_string(dictionary, "s"), nullptr);
  kyt_dictionary_free(dictionary);
}

std::string textOf(const kyt_value* value) {
  size_t length = 0;
  const char* bytes = kyt_value_bytes(value, &length);
  return bytes != nullptr ? std::string(bytes, length) : "none";
}

TEST(CInterface, ReadsAnyDictionaryEntryByEntry) {
  kyt_array* array = kyt_array_new();
  kyt_array_append_string(array, "first");
  kyt_array_append_data(array, "", 0);
  kyt_dictionary* dictionary = kyt_dictionary_new();
  kyt_dictionary_set_string(dictionary, "s", "a text longer than sixteen bytes");
  kyt_dictionary_set_int(dictionary, "i", INT64_MIN);
  kyt_dictionary_set_uint(dictionary, "u", UINT64_MAX);
  kyt_dictionary_set_bool(dictionary, "b", 1);
  kyt_dictionary_set_double(dictionary, "r", 0.5);
  kyt_dictionary_set_date(dictionary, "t", 1.5);
  kyt_dictionary_set_data(dictionary, "d", "x\0y", 3);
  kyt_dictionary_set_array(dictionary, "a", array);
  kyt_dictionary_set_dictionary(dictionary, "n", dictionary);
  kyt_array_free(array);

  std::string keys;
  std::vector<int> kinds;
  std::vector<const kyt_value*> values;
  const char* key = nullptr;
  for (size_t i = 0; i < kyt_dictionary_count(dictionary); ++i) {
    values.push_back(kyt_dictionary_at(dictionary, i, &key));
    keys += key;
    kinds.push_back(kyt_value_kind(values.back()));
  }
  EXPECT_EQ(keys, "siubrtdan");
  EXPECT_EQ(kinds,
            (std::vector<int>{KYT_KIND_STRING, KYT_KIND_INT, KYT_KIND_UINT, KYT_KIND_BOOL, KYT_KIND_DOUBLE,
                              KYT_KIND_DATE, KYT_KIND_DATA, KYT_KIND_ARRAY, KYT_KIND_DICTIONARY}));
  EXPECT_EQ(textOf(values[0]), "a text longer than sixteen bytes");
  EXPECT_EQ(kyt_value_int(values[1]), INT64_MIN);
  EXPECT_EQ(kyt_value_uint(values[2]), UINT64_MAX);
  EXPECT_EQ(kyt_value_int(values[3]), 1);
  EXPECT_EQ(kyt_value_double(values[4]), 0.5);
  EXPECT_EQ(kyt_value_double(values[5]), 1.5);
  EXPECT_EQ(textOf(values[6]), std::string("x\0y", 3));
  ASSERT_EQ(kyt_value_count(values[7]), 2U);
  EXPECT_EQ(textOf(kyt_value_at(values[7], 0, &key)), "first");
  EXPECT_EQ(key, nullptr);
  EXPECT_EQ(textOf(kyt_value_at(values[7], 1, nullptr)), "");
  ASSERT_EQ(kyt_value_count(values[8]), 8U);
  EXPECT_EQ(kyt_value_int(kyt_value_at(values[8], 3, &key)), 1);
  EXPECT_STREQ(key, "b");
  kyt_dictionary_free(dictionary);
}

TEST(CInterface, ReadsNothingWhereNothingIs) {
  kyt_dictionary* dictionary = kyt_dictionary_new();
  kyt_dictionary_set_int(dictionary, "i", 5);
  const char* key = "";
  for (const kyt_dictionary* none : std::vector<const kyt_dictionary*>{nullptr, dictionary}) {
    EXPECT_EQ(kyt_dictionary_at(none, 1, &key), nullptr);
    EXPECT_EQ(std::exchange(key, ""), nullptr);
  }
  for (const kyt_value* value :
       {static_cast<const kyt_value*>(nullptr), kyt_dictionary_at(dictionary, 0, nullptr)}) {
    EXPECT_EQ(textOf(value), "none");
    EXPECT_EQ(kyt_value_count(value), 0U);
    EXPECT_EQ(kyt_value_at(value, 0, &key), nullptr);
    EXPECT_EQ(std::exchange(key, ""), nullptr);
  }
  EXPECT_EQ(kyt_value_kind(nullptr), KYT_KIND_NULL);
  EXPECT_EQ(kyt_value_int(nullptr), 0);
  EXPECT_EQ(kyt_value_uint(nullptr), 0U);
  EXPECT_EQ(kyt_value_double(nullptr), 0);
  kyt_dictionary_free(dictionary);
}

TEST(CInterface, SendsArraysWithValuesOfEachKind) {
  TemporaryFolder folder;
  const std::string socket = folder / "socket";
  TestDaemon daemon(socket);
  ASSERT_TRUE(daemon.start());
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket.c_str();
  kyt_session* session = kyt_session_open(&options);
  kyt_array* inner = kyt_array_new();
  kyt_array_append_bool(inner, 1);
  kyt_array_append_uint(inner, UINT64_MAX);
  kyt_array_append_date(inner, 1.5);
  kyt_array* array = kyt_array_new();
  kyt_array_append_array(array, inner);
  kyt_array_append_array(array, nullptr);
  kyt_array_append_string(array, "text");
  kyt_dictionary* payload = kyt_dictionary_new();
  kyt_dictionary_set_array(payload, "list", array);
  kyt_array_append_int(array, 1);  // of the caller's alone
  EXPECT_EQ(kyt_session_send(session, 1, 2, payload, 0), 1);
  kyt_dictionary_free(payload);
  kyt_array_free(array);
  kyt_array_free(inner);
  EXPECT_EQ(kyt_session_finish(session, 20000), 1);
  kyt_session_close(session);
  EXPECT_EQ(daemon.lastPayload(), (Dictionary{{"list", Array{Array{true, UINT64_MAX, Date{1.5}}, "text"}}}));
}

TEST(CInterface, SaysWhyAMessageWasNotTaken) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = "/nonexistent";
  options.max_queued_messages = 64;
  kyt_session* session = kyt_session_open(&options);
  char text[128] = "?";
  EXPECT_EQ(kyt_session_try_send(session, 1, 1, nullptr, 0, text, sizeof text), KYT_ERROR_NONE);
  EXPECT_STREQ(text, "");
  EXPECT_EQ(kyt_session_try_send(session, 70000, 1, nullptr, 0, text, sizeof text), KYT_ERROR_INVALID);
  EXPECT_STREQ(text, "category 70000, type 1: both are whole numbers from 0 to 65535");
  kyt_error last = KYT_ERROR_NONE;
  for (int i = 0; i < 64; ++i) last = kyt_session_try_send(session, 1, 1, nullptr, 0, text, sizeof text);
  EXPECT_EQ(last, KYT_ERROR_QUEUE_FULL);
  EXPECT_STREQ(text, "the queue is full");
  kyt_session_end(session);
  EXPECT_EQ(kyt_session_try_send(session, 1, 1, nullptr, 0, text, sizeof text), KYT_ERROR_CLOSED);
  EXPECT_STREQ(text, "the session is closed");
  EXPECT_EQ(kyt_session_try_send(session, 1, 1, nullptr, 0, nullptr, 0), KYT_ERROR_CLOSED);
  kyt_statistics figures{};
  kyt_session_statistics(session, &figures);
  EXPECT_EQ(figures.accepted, figures.lost_in_queue);
  EXPECT_EQ(figures.dropped_closed, 2U);
  kyt_session_end(session);
  kyt_session_close(session);
  EXPECT_EQ(kyt_session_try_send(nullptr, 1, 1, nullptr, 0, nullptr, 0), KYT_ERROR_INVALID);
  kyt_session_end(nullptr);
}

TEST(CInterface, NumbersTheErrorOfACallbackWhileItRuns) {
  TemporaryFolder folder;
  const std::string socket = folder / "socket";
  TestDaemon daemon(socket);
  ASSERT_TRUE(daemon.start());
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = socket.c_str();
  kyt_session* session = kyt_session_open(&options);
  const kyt_text_callback keep = [](const char*, const char*, void* context) {
    static_cast<std::promise<kyt_error>*>(context)->set_value(kyt_callback_error());
  };
  std::promise<kyt_error> flushed, sent, wrong;
  kyt_session_flush(session, keep, &flushed);
  EXPECT_EQ(answerOf(flushed), KYT_ERROR_BACK_END);
  kyt_session_send_with_reply(session, 1, 1, nullptr, 0, keep, &sent);
  EXPECT_EQ(answerOf(sent), KYT_ERROR_NONE);
  kyt_session_send_with_reply(session, 70000, 1, nullptr, 0, keep, &wrong);
  EXPECT_EQ(answerOf(wrong), KYT_ERROR_INVALID);
  EXPECT_EQ(kyt_callback_error(), KYT_ERROR_NONE);
  kyt_session_close(session);
}

TEST(CInterface, NoCallbackRunsOnceAllIsClosed) {
  std::atomic<int> called{0};
  const kyt_text_callback count = [](const char*, const char*, void* context) {
    ++*static_cast<std::atomic<int>*>(context);
  };
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = "/nonexistent";
  options.call_deadline_milliseconds = -1;
  kyt_session* session = kyt_session_open(&options);
  for (int i = 0; i < 10; ++i) kyt_session_flush(session, count, &called);
  kyt_close_all();
  EXPECT_EQ(called, 10);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 0);
  kyt_close_all();
  kyt_session_close(session);
  session = kyt_session_open(&options);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 1) << "one that is opened later works";
  kyt_session_close(session);
}

TEST(CInterface, TakesMissingArgumentsWithoutHarm) {
  EXPECT_EQ(kyt_session_open(nullptr), nullptr);
  EXPECT_EQ(kyt_session_send(nullptr, 1, 1, nullptr, 0), 0);
  kyt_session_close(nullptr);
  kyt_dictionary_free(nullptr);
  kyt_dictionary_set_string(nullptr, "k", "v");
  kyt_dictionary* dictionary = kyt_dictionary_new();
  kyt_dictionary_set_string(dictionary, nullptr, "v");
  EXPECT_EQ(kyt_dictionary_count(dictionary), 0u);
  kyt_dictionary_free(dictionary);
}

TEST(CInterface, NamesTheKeyThatIsWrongInASessionsInformation) {
  kyt_dictionary* info = kyt_dictionary_new();
  kyt_dictionary_set_int(info, "ClientType", 20);
  char text[256] = "?";
  EXPECT_EQ(kyt_session_info_check(info, text, sizeof text), 1);
  EXPECT_STREQ(text, "");
  kyt_dictionary_set_bool(info, "RequireUserinfo", 1);
  EXPECT_EQ(kyt_session_info_check(info, text, sizeof text), 0);
  EXPECT_NE(std::string(text).find("there is no key \"RequireUserinfo\""), std::string::npos);
  EXPECT_EQ(kyt_session_info_check(info, text, 8), 0);
  EXPECT_STREQ(text, "session");
  EXPECT_EQ(kyt_session_info_check(info, nullptr, 0), 0);
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = "/nonexistent";
  options.session_info = info;
  kyt_session* session = kyt_session_open(&options);
  kyt_dictionary_free(info);
  ASSERT_NE(session, nullptr);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 0);
  std::promise<std::string> configured;
  kyt_session_configure(
      session,
      [](const char* const*, size_t, int, const char* error, void* context) {
        static_cast<std::promise<std::string>*>(context)->set_value(error != nullptr ? error : "");
      },
      &configured);
  EXPECT_NE(answerOf(configured).find("RequireUserinfo"), std::string::npos);
  kyt_session_close(session);
}

// Figures as an older or a newer library knows them, with a guard behind.
struct GuardedFigures {
  kyt_statistics figures;
  uint64_t later[2];
  uint64_t guard;
};

TEST(CInterface, WritesTheFiguresThatTheProgramsLibraryKnowsAndNothingBehind) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = "/nonexistent";
  kyt_session* session = kyt_session_open(&options);
  for (int i = 0; i < 3; ++i) EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 1);

  GuardedFigures newer{};
  std::memset(&newer, 0xFF, sizeof newer);
  kyt_session_read_statistics(session, &newer.figures, offsetof(GuardedFigures, guard));
  EXPECT_EQ(newer.figures.accepted, 3U);
  EXPECT_EQ(newer.later[0] + newer.later[1], 0U) << "figures that the library does not have are 0";
  EXPECT_EQ(newer.guard, UINT64_MAX);

  GuardedFigures older{};
  std::memset(&older, 0xFF, sizeof older);
  kyt_session_read_statistics(session, &older.figures, offsetof(kyt_statistics, accepted));
  EXPECT_EQ(older.figures.sent, 0U);
  EXPECT_EQ(older.figures.accepted, UINT64_MAX) << "behind the size that was given";
  kyt_total_read_statistics(&older.figures, offsetof(kyt_statistics, lost_in_queue));
  EXPECT_GE(older.figures.accepted, 3U);
  EXPECT_EQ(older.figures.lost_in_queue, UINT64_MAX);
  kyt_session_read_statistics(nullptr, &older.figures, sizeof older.figures);
  EXPECT_EQ(older.figures.accepted, 0U);
  kyt_session_read_statistics(session, nullptr, sizeof older.figures);
  kyt_session_close(session);
}

// Programs that were built before a size was given have room for these, whatever comes later.
TEST(CInterface, WritesFourteenFiguresWhereNoSizeIsGiven) {
  kyt_options options{};
  options.size = sizeof options;
  options.socket_path = "/nonexistent";
  kyt_session* session = kyt_session_open(&options);
  EXPECT_EQ(kyt_session_send(session, 1, 1, nullptr, 0), 1);
  std::array<uint64_t, sizeof(kyt_statistics) / sizeof(uint64_t) + 16> room{};
  for (const bool total : {false, true}) {
    room.fill(UINT64_MAX);
    auto* figures = reinterpret_cast<kyt_statistics*>(room.data());
    total ? kyt_total_statistics(figures) : kyt_session_statistics(session, figures);
    EXPECT_EQ(std::count(room.begin(), room.begin() + 14, UINT64_MAX), 0);
    EXPECT_EQ(std::count(room.begin() + 14, room.end(), UINT64_MAX), static_cast<long>(room.size() - 14));
  }
  kyt_session_close(session);
}

TEST(CInterface, TakesOptionsOfAnOlderLibraryThatWereSmaller) {
  kyt_options options{};
  options.size = offsetof(kyt_options, user_info);
  options.socket_path = "/nonexistent";
  kyt_session* session = kyt_session_open(&options);
  ASSERT_NE(session, nullptr);
  kyt_session_close(session);
}

}  // namespace
}  // namespace kyt
