// The same steps of a program against the daemon for tests and the real one: what the program sees is the same.
#include <gtest/gtest.h>

#include <filesystem>
#include <future>
#include <sstream>

#include "kytreporting/FakeDaemon.h"
#include "kytreporting/KYTReporting.h"
#include "tests/integration/StageFixture.h"
#include "tests/support/Eventually.h"

namespace kyt {
namespace {

using States = std::optional<std::vector<std::string>>;

std::string shown(const States& states, const std::optional<Error>& error) {
  if (error) return "error " + std::to_string(error->code) + ": " + error->localizedDescription;
  if (!states) return "no storebag";
  std::string names = "live:";
  for (const std::string& name : *states) names += " " + name;
  return names;
}

std::string shown(const std::optional<Error>& error) {
  return error ? error->domain + " " + std::to_string(error->code) + ": " + error->localizedDescription
               : "done";
}

// One program's session, each answer as a line.
class Program {
 public:
  Program(const std::string& socket, SessionInfo info,
          std::chrono::milliseconds deadline = std::chrono::seconds(30)) {
    KYTReporting::Options options;
    options.callDeadline = deadline;
    options.socketPath = socket;
    options.sessionInfo = std::move(info);
    options.userInfo = Dictionary{{"ClientName", "person"}, {"ServiceName", "demo"}};
    session_ = KYTReporting::open(std::move(options));
  }
  void configure() {
    ask("configure", [this](auto say) {
      session_->startConfiguration(
          [say](States states, std::optional<Error> error) { say(shown(states, error)); });
    });
    said_ << "state " << static_cast<int>(session_->state()) << '\n';
  }
  void states() {
    ask("states", [this](auto say) {
      session_->fetchStates(std::nullopt,
                            [say](States states, std::optional<Error> error) { say(shown(states, error)); });
    });
  }
  void flush() {
    ask("flush", [this](auto say) {
      session_->flush([say](const Value&, std::optional<Error> error) { say(shown(error)); });
    });
  }
  void send(uint32_t flag = 0) {
    ask("send", [this, flag](auto say) {
      session_->sendMessage(10, 1, Dictionary{{"step", 1}}, flag,
                            [say](const Value&, std::optional<Error> error) { say(shown(error)); });
    });
  }
  void uploadFile(const std::string& path) {
    ask("file", [this, &path](auto say) {
      session_->uploadFile(path, [say](bool done, std::optional<Error> error) {
        say((done ? "taken, " : "not taken, ") + shown(error));
      });
    });
  }
  void uploadLogData() {
    ask("log data", [this](auto say) {
      session_->uploadLogData(Array{"line"}, [say](bool done, std::optional<Error> error) {
        say((done ? "taken, " : "not taken, ") + shown(error));
      });
    });
  }
  void finish() {
    said_ << "finish " << session_->finish(std::chrono::seconds(30)) << '\n';
    const auto figures = session_->statistics();
    said_ << "accepted " << figures.accepted << " sent " << figures.sent << " unconfigured "
          << figures.sentUnconfigured << '\n';
  }
  void waitUntilRefused() {
    EXPECT_TRUE(eventually([this] { return session_->state() == KYTReporting::State::refused; }));
    said_ << session_->stateReason() << '\n';
  }
  [[nodiscard]] std::string said() const { return said_.str(); }

 private:
  template <typename Call>
  void ask(const char* what, Call call) {
    auto answer = std::make_shared<std::promise<std::string>>();
    call([answer](const std::string& text) { answer->set_value(text); });
    std::future<std::string> text = answer->get_future();
    const bool came = text.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
    said_ << what << ": " << (came ? text.get() : "no answer") << '\n';
  }
  std::unique_ptr<KYTReporting> session_;
  std::ostringstream said_;
};

std::string sentSingly(const std::string& socket, Dictionary info) {
  KYTReporting::Options options;
  options.socketPath = socket;
  options.sessionInfo = std::move(info);
  options.userInfo = Dictionary{{"ClientName", "person"}, {"ServiceName", "demo"}};
  auto answer = std::make_shared<std::promise<std::string>>();
  KYTReporting::sendSingleMessage(std::move(options), 10, 1, Dictionary{{"step", 1}},
                                  [answer](const std::string& text, const std::optional<Error>& error) {
                                    answer->set_value(error ? shown(error) : text);
                                  });
  return answer->get_future().get();
}

class FakeDaemonLikeness : public StageTest {
 protected:
  void SetUp() override {
    lay();
    putBag("cadmor", {entry("person")});
    startDaemon();
    ASSERT_EQ(fake_.start(), std::nullopt);
  }
  void putBackEnd(const std::string& storebag, const char* name) {
    const Dictionary backEnds{{name, Dictionary{{"post_url", stage_->httpsBase() + "/upload"}}}};
    ASSERT_EQ(stage_->putStorebag(storebag, Dictionary{{"version", "1"}, {"release", backEnds}}),
              std::nullopt);
  }
  // What the steps show with the fake, once it was compared with the real one.
  template <typename Steps>
  std::string compared(const SessionInfo& info, Steps steps) {
    Program real(socket(), info), fake(fake_.socketPath(), info);
    steps(real);
    steps(fake);
    EXPECT_EQ(real.said(), fake.said());
    return fake.said();
  }
  testing::FakeDaemon fake_;
};

TEST_F(FakeDaemonLikeness, ASessionThatBatches) {
  const std::string said =
      compared({.sessionID = 5, .clientType = 20, .batchEvent = true}, [](Program& program) {
        program.configure();
        program.flush();
        program.states();
        program.send();
        program.flush();
        program.flush();
        program.send(1);
        program.flush();
        program.send();
        program.finish();
      });
  EXPECT_NE(said.find("live: httppost"), std::string::npos) << said;
  EXPECT_NE(said.find("Nothing to flush"), std::string::npos) << said;
}

TEST_F(FakeDaemonLikeness, ASessionThatDoesNotBatchHasNothingToFlush) {
  compared({.sessionID = 5, .clientType = 20}, [](Program& program) {
    program.configure();
    program.send();
    program.flush();
    program.finish();
  });
}

TEST_F(FakeDaemonLikeness, ASessionWithoutConfiguration) {
  const std::string said =
      compared({.sessionID = 5, .clientType = 20, .batchEvent = true}, [](Program& program) {
        program.states();
        program.send();
        program.flush();
        program.uploadLogData();
        program.configure();
        program.flush();
        program.finish();
      });
  EXPECT_NE(said.find("No backends available to send message"), std::string::npos) << said;
  EXPECT_EQ(fake_.events(testing::Kind::message).size(), 1U);
  EXPECT_TRUE(fake_.events(testing::Kind::message)[0].dropped);
}

TEST_F(FakeDaemonLikeness, AClientTypeWithoutStorebag) {
  for (const int type : {0, 4})
    compared({.sessionID = 5, .clientType = static_cast<uint8_t>(type), .batchEvent = true},
             [](Program& program) {
               program.configure();
               program.states();
               program.send();
               program.flush();
               program.finish();
             });
}

TEST_F(FakeDaemonLikeness, UploadsThatNoBackEndTakes) {
  TemporaryFolder folder;
  const std::string file = folder.write("report.log", "x");
  compared({.sessionID = 5, .clientType = 20}, [&file](Program& program) {
    program.uploadFile(file);
    program.configure();
    program.uploadFile(file);
    program.uploadLogData();
    program.finish();
  });
}

TEST_F(FakeDaemonLikeness, AFlushOfBackEndsThatNeverBatch) {
  putBackEnd("dulvek", "uploadserver");
  testing::FakeDaemon::Options options;
  options.live = {"uploadserver"};
  testing::FakeDaemon fake(std::move(options));
  ASSERT_EQ(fake.start(), std::nullopt);
  for (const bool batch : {false, true}) {
    const SessionInfo info{.sessionID = 5, .clientType = 8, .batchEvent = batch};
    Program real(socket(), info), likeIt(fake.socketPath(), info);
    for (Program* program : {&real, &likeIt}) {
      program->configure();
      program->send();
      program->flush();
      program->flush();
      program->finish();
    }
    EXPECT_EQ(real.said(), likeIt.said());
    EXPECT_NE(real.said().find("live: uploadserver"), std::string::npos) << real.said() << daemonLog();
  }
}

TEST_F(FakeDaemonLikeness, SingleMessages) {
  for (const Dictionary& info : {Dictionary{{"SessionID", 5U}, {"ClientType", 20}, {"RequireUserInfo", true}},
                                 Dictionary{{"SessionID", 5U}, {"ClientType", 2}},
                                 Dictionary{{"SessionID", 5U}}, Dictionary{{"ClientType", 20}}, Dictionary()})
    EXPECT_EQ(sentSingly(socket(), info), sentSingly(fake_.socketPath(), info)) << description(info);
}

// A daemon without a grant for this program, and `kytctl listen --refuse`.
class RefusalLikeness : public StageTest {
 protected:
  void SetUp() override {
    lay();
    std::filesystem::remove(stage_->folder() + "/etc/kytreportingd/entitlements.d/stage.toml");
    startDaemon();
    tools::ChildProcess::Options how;
    how.outputFile = folder_ / "told";
    listener_ = tools::ChildProcess::start(stage_->program("kytctl"),
                                           {"listen", "--refuse", "--socket", folder_ / "s"}, how);
    ASSERT_TRUE(listener_);
    ASSERT_TRUE(eventually([this] { return folder_.read("told").ends_with("\n"); }));
  }
  // What `told` answers of each socket, once both were compared with the socket's path left out.
  template <typename Told>
  std::string compared(Told told) {
    const auto from = [&told](const std::string& path) {
      std::string text = told(path);
      for (size_t at = 0; (at = text.find(path, at)) != std::string::npos;)
        text.replace(at, path.size(), "SOCKET");
      return text;
    };
    const std::string fake = from(folder_ / "s");
    EXPECT_EQ(from(socket()), fake);
    return fake;
  }
  TemporaryFolder folder_;
  std::optional<tools::ChildProcess> listener_;
};

TEST_F(RefusalLikeness, ASession) {
  const std::string said = compared([](const std::string& path) {
    Program program(path, {.sessionID = 5, .clientType = 20, .batchEvent = true},
                    std::chrono::milliseconds(200));
    program.waitUntilRefused();
    program.configure();
    program.states();
    program.send();
    program.flush();
    program.uploadLogData();
    program.finish();
    program.waitUntilRefused();
    return program.said();
  });
  EXPECT_NE(said.find("configure: error 6: no daemon within 0.2 s: SOCKET: "), std::string::npos) << said;
}

TEST_F(RefusalLikeness, ASingleMessage) {
  const std::string said = compared([](const std::string& path) {
    return sentSingly(path, Dictionary{{"SessionID", 5U}, {"ClientType", 20}});
  });
  EXPECT_NE(said.find("SOCKET: the connection ended before the daemon answered: "), std::string::npos)
      << said;
}

TEST_F(RefusalLikeness, Programs) {
  const std::string script = folder_.write("script",
                                           "{\"do\":\"open\",\"sessionInfo\":{\"ClientType\":20}}\n"
                                           "{\"do\":\"configure\"}\n");
  const std::vector<std::vector<std::string>> commands = {
      {"send", "--client-type", "20", "--category", "1", "--type", "2"},
      {"session", "--timeout", "600", script}};
  for (const std::vector<std::string>& command : commands) {
    const std::string said = compared([&](const std::string& path) {
      std::vector<std::string> arguments = command;
      arguments.insert(arguments.begin() + 1, {"--socket", path});
      const ProgramRun run = kytctl(arguments);
      return std::to_string(run.status) + " " + run.text;
    });
    EXPECT_NE(said.find("the daemon refuses this user and program"), std::string::npos) << said;
  }
}

}  // namespace
}  // namespace kyt
