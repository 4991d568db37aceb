// Turns the storebag's back-end table for one client type into live, configured back ends for one session.
#pragma once

#include <memory>
#include <optional>
#include <utility>
#include <vector>

#include "backend/KYTReportingBackend.h"

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
  [[nodiscard]] virtual std::shared_ptr<KYTReportingBackend> newBackendWithName(const String& name,
                                                                                const Dictionary& profile,
                                                                                std::optional<String> productFamily,
                                                                                int32_t clientType) = 0;
  // None when the table or the session information is missing; may be empty. `udid` is borrowed for the back ends'
  // life.
  [[nodiscard]] virtual std::optional<Backends> createBackends(const std::optional<Dictionary>& table,
                                                               const std::optional<Dictionary>& sessionInfo,
                                                               const std::optional<Dictionary>& userInfo,
                                                               const char* udid) = 0;
};

}  // namespace kyt
