// Turns the storebag's back-end table for one client type into live, configured back ends for one session.
// Sessions know the interface; the composition root builds the one DefaultBackendFactory from the list of the
// classes that there are (backends/BackendTable.h), so that this folder names none of them.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "backend/KYTReportingBackend.h"
#include "config/Configuration.h"

namespace kyt {

// A session's back ends in the table's own enumeration order. Few entries: a look-up is a walk.
class Backends {
 public:
  using Entry = std::pair<String, std::shared_ptr<KYTReportingBackend>>;
  void add(String name, std::shared_ptr<KYTReportingBackend> backend) {
    entries_.emplace_back(std::move(name), std::move(backend));
  }
  [[nodiscard]] KYTReportingBackend* find(std::string_view name) const {
    for (const Entry& entry : entries_)
      if (entry.first == name) return entry.second.get();
    return nullptr;
  }
  [[nodiscard]] bool empty() const { return entries_.empty(); }
  [[nodiscard]] size_t size() const { return entries_.size(); }
  [[nodiscard]] auto begin() const { return entries_.begin(); }
  [[nodiscard]] auto end() const { return entries_.end(); }

 private:
  std::vector<Entry> entries_;
};

class BackendFactory {
 public:
  virtual ~BackendFactory() = default;
  // The class that the name stands for, or null (unknown name, an initialiser that failed).
  [[nodiscard]] virtual std::shared_ptr<KYTReportingBackend> newBackendWithName(
      const String& name, const Dictionary& profile, const SharedSessionFacts& facts) = 0;
  // None when the table or the session information is missing; may be empty. `udid` is the device's identifier.
  [[nodiscard]] virtual std::optional<Backends> createBackends(const std::optional<Dictionary>& table,
                                                               const std::optional<Dictionary>& sessionInfo,
                                                               const std::optional<Dictionary>& userInfo,
                                                               const String& udid) = 0;
};

// One row: a back end's name and how its class is made. Null when the initialiser fails.
struct BackendCreator {
  using Create = std::function<std::shared_ptr<KYTReportingBackend>(
      const String& name, const Dictionary& profile, const SharedSessionFacts& facts)>;
  String name;
  Create create;
};

// Any thread; the creators are called on the caller's.
class DefaultBackendFactory final : public BackendFactory {
 public:
  // Names are compared in the order of `creators`; the first equal one decides.
  DefaultBackendFactory(Configuration& configuration, std::vector<BackendCreator> creators);

  [[nodiscard]] std::shared_ptr<KYTReportingBackend> newBackendWithName(
      const String& name, const Dictionary& profile, const SharedSessionFacts& facts) override;
  [[nodiscard]] std::optional<Backends> createBackends(const std::optional<Dictionary>& table,
                                                       const std::optional<Dictionary>& sessionInfo,
                                                       const std::optional<Dictionary>& userInfo,
                                                       const String& udid) override;

 private:
  [[nodiscard]] bool isExcludedOnThisDevice(const String& name) const;
  [[nodiscard]] SharedSessionFacts factsOf(const Dictionary& sessionInfo, const String& udid) const;
  Configuration configuration_;
  const std::vector<BackendCreator> creators_;
};

}  // namespace kyt
