// A private place where the daemon and the development server run together: a folder that stands for the file system's
// root, with keys, settings, entitlements, device properties, consent and signed storebags. The demonstration
// (`./kyt run`), the tests of the whole daemon and the benchmarks use it. One thread.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/base/Error.h"
#include "platform/objects/Value.h"
#include "tools/demo/ChildProcess.h"

namespace kyt::tools {

class Stage {
 public:
  struct Options {
    std::string programs;  // the folder of kytreportingd, kytdevserver and kytctl
    std::string share;     // bundles and the confinement profile, as installed in share/kytreporting's parent
    std::string folder;    // none: a new temporary one, removed at the end
    bool internalBuild = false;
    bool consent = true;
    std::string country = "DE";
    std::string logLevel = "default";          // empty: as the settings say
    std::string extraSettings;                 // appended to kytreportingd.toml
    std::vector<std::string> serverArguments;  // further ones for the development server
    bool keepFolder = false;
    // The users of the daemon and of its clients; none: this process's own. Another user needs root.
    std::optional<User> daemonUser, clientUser;
  };
  // The folder laid out, the development server running. The daemon is started by startDaemon().
  [[nodiscard]] static std::variant<std::unique_ptr<Stage>, Error> make(Options options);
  ~Stage();
  Stage(const Stage&) = delete;
  Stage& operator=(const Stage&) = delete;

  // Signs the bag and lets the server hand it out under that name.
  [[nodiscard]] std::optional<Error> putStorebag(const std::string& name, const Dictionary& bag);
  // Starts it, or another program in its place (which becomes it), and waits until its socket takes connections.
  [[nodiscard]] std::optional<Error> startDaemon(const std::string& insteadOfIt = {});
  // SIGTERM, then the exit status (none: it did not end within `timeout`).
  [[nodiscard]] std::optional<int> stopDaemon(std::chrono::milliseconds timeout = std::chrono::seconds(15));
  [[nodiscard]] ChildProcess* daemon() { return daemon_ ? &*daemon_ : nullptr; }
  [[nodiscard]] ChildProcess* server() { return server_ ? &*server_ : nullptr; }

  // The answer to a query of the development server ("/api/…"), or null.
  [[nodiscard]] Value query(const std::string& path) const;
  // Whether so many events have arrived within `seconds`.
  [[nodiscard]] bool waitForEvents(int64_t count, int seconds) const;
  [[nodiscard]] bool control(const std::string& path, const std::string& json) const;

  [[nodiscard]] const std::optional<User>& daemonUser() const { return options_.daemonUser; }
  [[nodiscard]] const std::optional<User>& clientUser() const { return options_.clientUser; }
  [[nodiscard]] const std::string& folder() const { return options_.folder; }
  [[nodiscard]] std::string program(const std::string& name) const { return options_.programs + "/" + name; }
  [[nodiscard]] std::string socketPath() const {
    return options_.folder + "/run/kytreportingd/com.vantu.kytreportingd";
  }
  [[nodiscard]] std::string daemonLog() const { return options_.folder + "/daemon.log"; }
  [[nodiscard]] std::string serverLog() const { return options_.folder + "/server.log"; }
  [[nodiscard]] std::string httpsBase() const { return "https://127.0.0.1:" + std::to_string(httpsPort_); }
  [[nodiscard]] std::string httpBase() const { return "http://127.0.0.1:" + std::to_string(httpPort_); }
  // Of the dashboard feed, when the server's arguments ask for it.
  [[nodiscard]] long udpPort() const { return udpPort_; }

 private:
  explicit Stage(Options options) : options_(std::move(options)) {}
  [[nodiscard]] std::optional<Error> layOut();
  [[nodiscard]] std::optional<Error> startServer();
  [[nodiscard]] std::optional<Error> writeConfiguration();
  [[nodiscard]] std::optional<Error> handOverFolders();

  Options options_;
  std::string privateKey_;
  long httpsPort_ = 0, httpPort_ = 0, udpPort_ = 0;
  std::optional<ChildProcess> server_, daemon_;
};

}  // namespace kyt::tools
