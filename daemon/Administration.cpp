#include "daemon/Administration.h"

#include <memory>
#include <utility>

#include "platform/Platform.h"
#include "platform/queues/Log.h"

namespace kyt {

namespace {

std::string refusalOf(const AdministrationAccess& access) {
  std::string text = "Only root, the daemon's own user";
  text += access.group ? " and members of the group " + access.groupName : std::string();
  return text + " may look at the daemon (admin.group in kytreportingd.toml)";
}

}  // namespace

// One connection's.
class Administration::Window final : public AdministrationInterface {
 public:
  Window(const Administration& all, bool mayLook) : all_(all), mayLook_(mayLook) {}
  [[nodiscard]] const char* refusal() const override { return mayLook_ ? nullptr : all_.refusal_.c_str(); }
  [[nodiscard]] Dictionary status() override { return all_.status(); }
  [[nodiscard]] std::vector<Dictionary> sessions() override { return all_.sessions(); }
  [[nodiscard]] std::vector<Dictionary> books() override { return all_.books(); }
  [[nodiscard]] std::vector<Dictionary> storebags() override { return all_.storebags(); }
  [[nodiscard]] std::string metrics() override { return all_.metrics(); }
  [[nodiscard]] std::optional<std::string> setLogLevel(std::string_view level) override {
    return all_.setLogLevel(level);
  }
  [[nodiscard]] std::optional<std::string> reload(std::vector<std::string>& lines) override {
    return all_.reload(lines);
  }

 private:
  const Administration& all_;
  const bool mayLook_;
};

Administration::Administration(AdministrationSources sources, AdministrationAccess access)
    : sources_(std::move(sources)), access_(std::move(access)), refusal_(refusalOf(access_)) {}

bool Administration::listenerShouldAcceptNewConnection(Listener& /*listener*/,
                                                       const std::shared_ptr<Connection>& connection) {
  const uint32_t user = connection->peerUser();
  const bool mayLook =
      user == 0 || user == access_.user || (access_.group && connection->isPeerInGroup(*access_.group));
  if (!mayLook)
    sources_.platform.log.debug("administration: Connection %s may not look",
                                connection->description().c_str());
  connection->setExportedObject(std::make_shared<Window>(*this, mayLook));
  connection->resume();
  return true;
}

std::optional<std::string> Administration::setLogLevel(std::string_view level) const {
  Log& log = sources_.platform.log;
  if (level != "debug" && level != "default" && level != "error")
    return "the level must be \"debug\", \"default\" or \"error\"";
  log.normal("administration: Lines are logged from the level %s on", std::string(level).c_str());
  log.setLevel(level == "debug" ? LogLevel::debug : level == "error" ? LogLevel::error : LogLevel::normal);
  return std::nullopt;
}

}  // namespace kyt
