// kytctl watch against the built daemon, in both forms, and a watcher that reads nothing.
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/base/Limits.h"
#include "platform/base/TextEscape.h"
#include "platform/ipc/Handshake.h"
#include "platform/ipc/MessageWriter.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/data/RapidJSON.h"
#include "tests/integration/StageFixture.h"

namespace kyt {
namespace {

class KytctlWatch : public StageTest {
 protected:
  // A kytctl watch that runs until the daemon ends, or it is destroyed.
  class Running {
   public:
    Running(const std::string& root, std::vector<std::string> arguments) {
      tools::ChildProcess::Options how;
      how.outputFile = folder_ / "output";
      arguments.insert(arguments.begin(), {"--root", root, "watch"});
      child_ = tools::ChildProcess::start(std::string(KYT_PROGRAMS) + "/kytctl", arguments, how);
      EXPECT_TRUE(child_);
    }
    [[nodiscard]] std::string text() const { return folder_.read("output"); }
    [[nodiscard]] std::vector<std::string> lines() const {
      std::vector<std::string> lines;
      std::istringstream in(text());
      for (std::string line; std::getline(in, line);) lines.push_back(line);
      return lines;
    }
    bool shows(const std::string& wanted) const {
      return eventually([&] { return text().find(wanted) != std::string::npos; });
    }
    void signal(int number) const { child_->signal(number); }
    int wait() { return child_->wait(std::chrono::seconds(30)).value_or(-1); }

   private:
    TemporaryFolder folder_;
    std::optional<tools::ChildProcess> child_;
  };
  static bool eventually(const std::function<bool()>& condition) {
    const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(30);
    while (!condition()) {
      if (std::chrono::steady_clock::now() > end) return false;
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
  }
  [[nodiscard]] std::string root() const { return stage_->folder(); }
  static void report(TestClient& client, uint16_t category) {
    EXPECT_TRUE(client.send(category, 1, Dictionary{{"a", "value-of-the-event"}}));
    EXPECT_EQ(client.flush(), "flushed");
  }
  static Dictionary object(const std::string& line) {
    auto parsed = RapidJSON().parse(line);
    const auto* value = std::get_if<Value>(&parsed);
    if (value == nullptr || value->dictionary() == nullptr) {
      ADD_FAILURE() << "no JSON object: " << line;
      return {};
    }
    return *value->dictionary();
  }
};

TEST_F(KytctlWatch, ShowsEachEventsFateAndTheRuleThatDroppedIt) {
  lay();
  Dictionary listed = entry("listed");
  listed.set("event_blacklist", Array{9});
  putBag("cadmor", {entry("a"), listed, entry("broken", "/no-such-path")});
  startDaemon();
  Running watch(root(), {});
  ASSERT_TRUE(watch.shows("FATE")) << watch.text();
  TestClient client(socket(), 7, "a");
  ASSERT_EQ(client.configure(), "live: httppost");
  report(client, 5);
  EXPECT_TRUE(watch.shows(" 5/1          delivered: 200")) << watch.text();
  TestClient unlisted(socket(), 7, "unlisted");
  EXPECT_EQ(unlisted.configure(), "live:");
  EXPECT_TRUE(unlisted.send(6, 1, {}));
  EXPECT_TRUE(watch.shows(" 6/1          event-dropped-by-state: client")) << watch.text();
  TestClient broken(socket(), 7, "broken");
  ASSERT_EQ(broken.configure(), "live: httppost");
  report(broken, 7);
  EXPECT_TRUE(watch.shows(" 7/1          post-refused: 404")) << watch.text();
  TestClient withList(socket(), 7, "listed");
  ASSERT_EQ(withList.configure(), "live: httppost");
  EXPECT_TRUE(withList.send(9, 1, {}));
  EXPECT_TRUE(watch.shows(" 9/1          event-filtered: black-list")) << watch.text();
  for (const std::string& line : watch.lines()) EXPECT_LE(line.size(), 100U) << line;
  EXPECT_EQ(watch.text().find("value-of-the-event"), std::string::npos);
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  EXPECT_EQ(watch.wait(), 1);
  EXPECT_TRUE(watch.shows("the daemon has ended the connection"));
}

TEST_F(KytctlWatch, ShowsBodiesInBothForms) {
  lay();
  putBag("cadmor", {entry("a"), entry("b")});
  startDaemon();
  Running forPeople(root(), {"--bodies"}), forPrograms(root(), {"--bodies", "--json", "--client", "b"});
  ASSERT_TRUE(forPeople.shows("FATE")) << forPeople.text();
  TestClient a(socket(), 7, "a"), b(socket(), 7, "b");
  ASSERT_EQ(a.configure(), "live: httppost");
  ASSERT_EQ(b.configure(), "live: httppost");
  report(a, 5);
  ASSERT_TRUE(forPeople.shows("value-of-the-event")) << forPeople.text();
  EXPECT_TRUE(forPeople.shows("    post 1 to https://")) << forPeople.text();
  // The other may come later.
  EXPECT_TRUE(eventually([&] {
    report(b, 6);
    return !forPrograms.lines().empty();
  }));
  const Dictionary passed = object(forPrograms.lines().at(0));
  EXPECT_EQ(passed.string("client")->str(), "b");
  EXPECT_EQ(passed.string("fate")->str(), "delivered");
  EXPECT_EQ(passed.integer("status"), 200);
  bool bodySeen = false;
  for (const std::string& line : forPrograms.lines()) {
    const Dictionary event = object(line);
    EXPECT_EQ(event.string("client")->str(), "b");
    if (const String* body = event.string("body")) {
      bodySeen = true;
      EXPECT_EQ(event.integer("bodyBytes"), static_cast<int>(body->size()));
      static_cast<void>(object(body->str()));
    }
  }
  EXPECT_TRUE(bodySeen);
}

TEST_F(KytctlWatch, ShowsTheBodyOfAPostThatBeginsWithAnotherCategory) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  Running watch(root(), {"--bodies", "--category", "6"});
  ASSERT_TRUE(watch.shows("FATE")) << watch.text();
  TestClient client(socket(), 7, "a");
  ASSERT_EQ(client.configure(), "live: httppost");
  EXPECT_TRUE(client.send(5, 1, Dictionary{{"a", "first-of-the-post"}}));
  EXPECT_TRUE(client.send(6, 1, Dictionary{{"a", "second-of-the-post"}}));
  EXPECT_EQ(client.flush(), "flushed");
  EXPECT_TRUE(watch.shows("second-of-the-post")) << watch.text();
}

TEST_F(KytctlWatch, FiltersByCategoryAndUser) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  Running ofCategory(root(), {"--category", "6"}), ofNobody(root(), {"--user", "4242"}),
      ofUser(root(), {"--user", std::to_string(::getuid())});
  for (Running* watch : {&ofCategory, &ofNobody, &ofUser}) ASSERT_TRUE(watch->shows("FATE")) << watch->text();
  TestClient client(socket(), 7, "a");
  ASSERT_EQ(client.configure(), "live: httppost");
  report(client, 5);
  report(client, 6);
  EXPECT_TRUE(ofUser.shows(" 6/1 ")) << ofUser.text();
  EXPECT_TRUE(ofUser.shows(" 5/1 "));
  EXPECT_TRUE(ofCategory.shows(" 6/1 "));
  EXPECT_EQ(ofCategory.text().find(" 5/1 "), std::string::npos);
  EXPECT_EQ(ofNobody.lines().size(), 1U);
}

TEST_F(KytctlWatch, FiltersByTheEmptyClientNameAsByAnyOther) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  Running ofNameless(root(), {"--client", ""});
  ASSERT_TRUE(ofNameless.shows("FATE")) << ofNameless.text();
  TestClient named(socket(), 7, "a"), nameless(socket(), 7);
  ASSERT_EQ(named.configure(), "live: httppost");
  report(named, 5);
  ASSERT_EQ(nameless.configure(), "live: httppost");
  report(nameless, 6);
  EXPECT_TRUE(ofNameless.shows(" 6/1 ")) << ofNameless.text();
  EXPECT_EQ(ofNameless.text().find(" 5/1 "), std::string::npos) << ofNameless.text();
}

TEST_F(KytctlWatch, WritesNothingThatATerminalObeys) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  const std::string name = "a\u009b31m\u202e\x7f";
  Running forPeople(root(), {"--client", name}), forPrograms(root(), {"--client", name, "--json"});
  ASSERT_TRUE(forPeople.shows("FATE")) << forPeople.text();
  TestClient client(socket(), 7, name);
  EXPECT_EQ(client.configure(), "live:");
  // The other may come later.
  EXPECT_TRUE(eventually([&] {
    EXPECT_TRUE(client.send(6, 1, {}));
    return !forPrograms.lines().empty();
  }));
  EXPECT_TRUE(forPeople.shows(" 6/1 ")) << forPeople.text();
  for (const Running* watch : {&forPeople, &forPrograms})
    for (const std::string& line : watch->lines()) EXPECT_TRUE(isPlainText(line)) << escapedText(line);
  EXPECT_EQ(object(forPrograms.lines().at(0)).string("client")->str(), name);
}

// Who may watch may not see what is before the host of a post_url.
TEST_F(KytctlWatch, TellsNoPasswordOfAServer) {
  lay();
  Dictionary client = entry("a");
  std::string address = stage_->httpsBase() + "/events";
  client.set("post_url", address.insert(address.find("://") + 3, "name:secret@"));
  putBag("cadmor", {client});
  startDaemon();
  Running forPeople(root(), {"--bodies"}), forPrograms(root(), {"--json"});
  ASSERT_TRUE(forPeople.shows("FATE")) << forPeople.text();
  TestClient reporting(socket(), 7, "a");
  ASSERT_EQ(reporting.configure(), "live: httppost");
  // The other may come later.
  EXPECT_TRUE(eventually([&] {
    report(reporting, 5);
    return !forPrograms.lines().empty();
  }));
  EXPECT_EQ(object(forPrograms.lines().at(0)).string("server")->str(), stage_->httpsBase());
  EXPECT_TRUE(forPeople.shows(" to " + stage_->httpsBase())) << forPeople.text();
  EXPECT_EQ(kytctl({"status", "--json"}).text.find("secret"), std::string::npos);
  EXPECT_EQ(stage_->stopDaemon(std::chrono::seconds(30)).value_or(-1), 0);
  const std::string owner = kytctl({"owner", "show", "--json"}).text;
  EXPECT_NE(owner.find(stage_->httpsBase()), std::string::npos) << owner;
  EXPECT_EQ(owner.find("secret"), std::string::npos) << owner;
}

TEST_F(KytctlWatch, LetsFourWatchAndTakesAnotherWhereOneHasGone) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  std::vector<std::unique_ptr<Running>> all;
  for (size_t i = 0; i < Limits::maxWatchers; ++i) {
    all.push_back(std::make_unique<Running>(root(), std::vector<std::string>{}));
    ASSERT_TRUE(all.back()->shows("FATE")) << all.back()->text();
  }
  const ProgramRun refused = kytctl({"watch"});
  EXPECT_EQ(refused.status, 1);
  EXPECT_NE(refused.text.find("4 watch already"), std::string::npos) << refused.text;
  all.pop_back();
  EXPECT_TRUE(eventually([&] {
    Running next(root(), {});
    return eventually([&] { return !next.text().empty(); }) && next.text().find("FATE") != std::string::npos;
  }));
}

// Stopped while far more passes than its ring and its socket hold, then let go on.
TEST_F(KytctlWatch, SaysHowManyPassedWhileItDidNotReadAndAddsUp) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  Running stopped(root(), {}), quick(root(), {});
  ASSERT_TRUE(stopped.shows("FATE")) << stopped.text();
  ASSERT_TRUE(quick.shows("FATE")) << quick.text();
  stopped.signal(SIGSTOP);
  TestClient client(socket(), 7, "unlisted");
  EXPECT_EQ(client.configure(), "live:");
  constexpr int kEvents = 12000;
  for (int i = 0; i < kEvents; ++i) {
    ASSERT_TRUE(client.send(5, 1, {}));
    if (i % 500 == 499) {
      ASSERT_EQ(client.displayURL(), "https://display.example.org/");
    }
  }
  stopped.signal(SIGCONT);
  const auto told = [](const Running& watch) {
    long long sum = 0;
    for (const std::string& line : watch.lines()) {
      const bool isLoss = line.find(" were not told: more passed than was read here") != std::string::npos;
      sum += isLoss ? std::atoll(line.c_str()) : line.find("/1 ") != std::string::npos ? 1 : 0;
    }
    return sum;
  };
  // What is lost is told with what is told next: now and then one more event.
  int all = kEvents, looks = 0;
  EXPECT_TRUE(eventually([&] {
    if (told(stopped) == all && told(quick) == all) return true;
    if (looks++ % 50 == 49 && client.send(6, 1, {})) ++all;
    return false;
  })) << told(stopped)
      << " and " << told(quick) << " of " << all;
  EXPECT_NE(stopped.text().find(" were not told"), std::string::npos);
}

// A peer of the administration socket that asks to watch and never reads.
class DeafWatcher {
 public:
  explicit DeafWatcher(const std::string& path)
      : socket_(ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0))) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::connect(socket_.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    std::string bytes = ClientHandshake::opening(::geteuid());
    EXPECT_EQ(::send(socket_.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(bytes.size()));
    std::string heard = hear();
    while (heard.find("\r\n") == std::string::npos || heard.find("OK ") == std::string::npos) heard += hear();
    size_t consumed = 0;
    ClientHandshake handshake;
    while (handshake.feed(std::as_bytes(std::span(heard)), consumed) != ClientHandshake::Status::done)
      heard += hear();
    std::string call;
    MessageWriter writer(call);
    writer.beginCall(1,
                     {.interface = wire::kAdministrationInterface, .member = "Watch", .signature = "a{sv}"});
    writer.writeDictionary(Dictionary());
    EXPECT_TRUE(writer.end());
    EXPECT_EQ(::send(socket_.get(), call.data(), call.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(call.size()));
    EXPECT_FALSE(hear().empty());  // the answer
  }
  std::string hear() const {
    char buffer[65536];
    const ssize_t count = ::recv(socket_.get(), buffer, sizeof buffer, 0);
    return std::string(buffer, count > 0 ? static_cast<size_t>(count) : 0);
  }

 private:
  Descriptor socket_;
};

TEST_F(KytctlWatch, IsNotHeldUpByAWatcherThatReadsNothing) {
  lay();
  putBag("cadmor", {entry("a")});
  startDaemon();
  const DeafWatcher deaf(root() + "/run/kytreportingd/admin");
  TestClient client(socket(), 7, "unlisted");
  EXPECT_EQ(client.configure(), "live:");
  constexpr int kEvents = 20000;
  for (int i = 0; i < kEvents; ++i) {
    ASSERT_TRUE(client.send(5, 1, {}));
    if (i % 500 == 499) {
      ASSERT_EQ(client.displayURL(), "https://display.example.org/");
    }
  }
  TestClient other(socket(), 7, "a");
  ASSERT_EQ(other.configure(), "live: httppost");
  report(other, 6);
  const ProgramRun books = kytctl({"books", "--json"});
  EXPECT_NE(books.text.find("\"event-dropped-by-state\":20000"), std::string::npos) << books.text;
  // What it then reads says how many it missed: far more than the ring and the socket hold.
  std::string heard;
  EXPECT_TRUE(eventually([&] {
    heard += deaf.hear();
    return heard.find("lost") != std::string::npos;
  }));
}

}  // namespace
}  // namespace kyt
