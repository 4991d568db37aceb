#include <gtest/gtest.h>

#include <future>

#include "kytreporting/kytreporting.h"
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
  EXPECT_EQ(states.get_future().get(), "httppost qrs ");

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
  EXPECT_EQ(flushed.get_future().get(), "Nothing to flush");
  EXPECT_EQ(kyt_session_finish(session, 20000), 1);
  kyt_statistics figures{};
  kyt_session_statistics(session, &figures);
  EXPECT_EQ(figures.sent, 2u);
  kyt_session_close(session);
  EXPECT_EQ(daemon.calls(), (std::vector<std::string>{"SetSessionInfo 5", "StartConfig", "Send 1 2 3",
                                                      "Send 1 3 -", "DigestKey abc 0", "Flush", "Finish"}));
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
