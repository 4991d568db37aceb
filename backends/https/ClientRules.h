// Which client entry of the storebag is the session's, and what follows from it. Used by HTTPSPostBackend on its
// session's queue.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "backend/BackEndStanding.h"
#include "backend/SessionFacts.h"
#include "backends/https/Decision.h"
#include "backends/https/RuleWitness.h"
#include "platform/base/Counters.h"
#include "platform/objects/Value.h"

namespace kyt {

struct Platform;

class ClientRules {
 public:
  // What does not change while the back end lives.
  struct Facts {
    String name;                   // the back end's
    std::optional<Array> clients;  // the storebag's entries
    SharedSessionFacts session;
    double samplingFactor = 0;  // the back end's draw
    bool dnuEnabled = false;    // the user's consent to diagnostics-and-usage upload
  };
  ClientRules(Platform& platform, Facts facts);

  // Null, as at first: nobody. It outlives this.
  void setWitness(RuleWitness* witness) { witness_ = witness; }

  // The new state; the rest goes into the decision. `userInfo` may be null. `owner` is the user who gets a new custom
  // identifier.
  [[nodiscard]] int32_t decide(Decision& decision, const Dictionary* userInfo, std::optional<uint32_t> owner);

  // What the latest decision came of.
  [[nodiscard]] StateRule rule() const { return rule_; }

  // The steps that are operations of their own. Whether "post_url" was taken from this client entry.
  bool updatePostLink(Decision& decision, const Dictionary& client) const;
  void resetBackendStateWithClient(Decision& decision, const Dictionary* client) const;
  [[nodiscard]] static bool matchClientNameAndServiceID(const Dictionary& client, const String* clientName,
                                                        const String* serviceID);
  [[nodiscard]] bool isFrameworkEnabledForClient(const Dictionary& client) const;

 private:
  struct Client {  // what the user information calls the client, null where it does not
    const String* name = nullptr;
    const String* service = nullptr;
  };

  void applyExpedite(Decision& decision, const Client& client) const;
  [[nodiscard]] int32_t enableWithoutUserInfo(Decision& decision) const;
  [[nodiscard]] const Dictionary* chosenEntry(const Client& client) const;
  // Whether consent, country, device and filters let the chosen entry report.
  [[nodiscard]] bool passesRules(Decision& decision, const Dictionary& entry, const Client& client,
                                 const String* country) const;
  [[nodiscard]] bool passesConsent(Decision& decision, const Dictionary& entry, const Client& client) const;
  [[nodiscard]] bool passesLists(const Dictionary& entry, const Client& client, const String* country) const;
  [[nodiscard]] int32_t decideBySampling(Decision& decision, const Dictionary& entry, const Client& client,
                                         const String* country) const;
  void takeSettings(Decision& decision, const Dictionary& entry, const Client& client, int32_t state,
                    std::optional<uint32_t> owner);
  // Returns `passes`.
  bool judged(const char* rule, bool passes, const Value& value, const Value& wanted = {}) const {
    if (witness_ != nullptr) witness_->judged(rule, passes, value, wanted);
    return passes;
  }
  void tellWhyNot(Reason reason, StateRule rule, const Client& client, const char* why) const;
  [[nodiscard]] String getPersistentIdentifierForCustomClientIDSuffix(const Client& client,
                                                                      std::optional<uint32_t> owner);

  Platform& platform_;
  const Facts facts_;
  RuleWitness* witness_ = nullptr;
  mutable StateRule rule_ = StateRule::none;
  // The custom identifiers that were made by their keys: one that cannot be stored must not change.
  std::vector<std::pair<std::string, String>> madeIdentifiers_;
};

}  // namespace kyt
