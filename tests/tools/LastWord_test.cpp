// What a program's last word says of itself, against the daemon: that it is taken only where it is.
#include <memory>

#include "kytreporting/kytreporting.h"
#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

class LastWord : public StageTest {
 protected:
  // What sending says of an event of such a session.
  [[nodiscard]] int send(std::optional<int> clientType, std::optional<unsigned> sessionID) const {
    const std::unique_ptr<kyt_dictionary, decltype(&kyt_dictionary_free)> info(kyt_dictionary_new(),
                                                                               &kyt_dictionary_free);
    if (clientType) kyt_dictionary_set_int(info.get(), "ClientType", *clientType);
    if (sessionID) kyt_dictionary_set_uint(info.get(), "SessionID", *sessionID);
    const std::string path = socket();
    kyt_options options{};
    options.size = sizeof options;
    options.socket_path = path.c_str();
    options.session_info = info.get();
    const std::unique_ptr<kyt_last_word, decltype(&kyt_last_word_free)> word(
        kyt_last_word_new(&options, 3, 4, nullptr), &kyt_last_word_free);
    EXPECT_NE(word, nullptr);
    return kyt_last_word_send(word.get(), 20000);
  }
};

TEST_F(LastWord, SaysThatItIsTakenOnlyWhereTheDaemonHasTakenIt) {
  layWithPerson();
  startDaemon();
  EXPECT_EQ(send(20, std::nullopt), 0) << "without a session ID the daemon drops it";
  EXPECT_EQ(send(std::nullopt, 7), 0);
  EXPECT_EQ(send(4, 7), 0) << "no storebag is there for internal types";
  EXPECT_EQ(send(20, 7), 1);
}

}  // namespace
}  // namespace kyt
