#include "tools/demo/Trickle.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/linux/base/Descriptors.h"
#include "tools/demo/DemoBag.h"
#include "tools/demo/Stage.h"

namespace kyt::tools {

namespace {

constexpr int kFlushAfter = 5;  // events of a client

}  // namespace

std::optional<std::string> Trickle::start(Stage& stage) {
  int sessionID = 7003;
  for (const DemoClient& each : demoClients()) {
    // A pipe with a name, since the process may be another user's: it is opened before the change. Open for reading here
    // too, so that nobody waits for the other side.
    const std::string pipe = stage.folder() + "/" + each.name + ".steps";
    if (mkfifo(pipe.c_str(), 0600) != 0) return pipe + ": " + std::strerror(errno);
    Client client;
    client.steps = ownDescriptor(open(pipe.c_str(), O_RDWR | O_CLOEXEC | O_NONBLOCK));
    if (!client.steps) return pipe + ": " + std::strerror(errno);
    ChildProcess::Options how;
    how.outputFile = stage.folder() + "/" + each.name + "-trickle.log";
    how.inputFile = pipe;
    how.user = stage.clientUser();
    auto process =
        ChildProcess::start(stage.program("kytctl"), {"session", "--socket", stage.socketPath(), "-"}, how);
    if (!process) return "kytctl cannot be started";
    client.process = std::move(*process);
    tell(client, openingSteps(each, sessionID++));
    clients_.push_back(std::move(client));
  }
  return std::nullopt;
}

// A client whose process has ended, or that does not read, misses it.
void Trickle::tell(const Client& client, const std::string& step) {
  (void)!write(client.steps.get(), step.data(), step.size());
}

void Trickle::step() {
  Client& client = clients_[static_cast<size_t>(number(0, static_cast<int>(clients_.size()) - 1))];
  tell(client, R"({"do":"send","category":)" + std::to_string(number(10, 12)) + R"(,"type":)" +
                   std::to_string(number(1, 3)) + R"(,"payload":{"duration":0.)" +
                   std::to_string(number(1, 9)) + R"(,"count":)" + std::to_string(number(1, 50)) +
                   R"(,"secret":"never leaves","account":"person@example.org"}})" + "\n");
  if (++client.sent % kFlushAfter == 0) tell(client, "{\"do\":\"flush\"}\n");
}

std::chrono::milliseconds Trickle::pause() {
  return std::chrono::milliseconds(number(100, 900));
}

void Trickle::finish() {
  for (const Client& client : clients_) tell(client, "{\"do\":\"finish\"}\n");
  for (Client& client : clients_) {
    client.steps = Descriptor();
    (void)client.process.wait(std::chrono::seconds(10));
  }
  clients_.clear();
}

}  // namespace kyt::tools
