// The endpoints: storebags and event posts for devices, and on the plain port the page, the queries and the
// controls for tests. Owns nothing that outlives it; called on the HTTP servers' threads, several at a time.
#pragma once

#include <string>

#include "devserver/AcknowledgementRules.h"
#include "devserver/EventStream.h"
#include "devserver/Http.h"
#include "devserver/Options.h"
#include "devserver/PostChecker.h"
#include "devserver/Queries.h"
#include "devserver/ReplyRules.h"
#include "devserver/Store.h"
#include "devserver/Storebags.h"
#include "devserver/Uploads.h"
#include "http/Suspensions.h"

namespace kyt::devserver {

using http::Suspensions;

class Router final : public HttpHandler {
 public:
  Router(const Options& options, Store& store, const PostChecker& checker, EventStream& stream,
         Suspensions& suspensions, AcknowledgementRules& acknowledgements, std::optional<BagSigner> signer);

  [[nodiscard]] uint64_t bodyLimit(const Request& request) const override;
  [[nodiscard]] Answer answer(Request& request) override;
  void broken(Request& request) override;

 private:
  [[nodiscard]] bool takesPosts(const Request& request) const;
  [[nodiscard]] bool takesUploads(const Request& request) const;
  [[nodiscard]] bool comesFromThisPlace(const Request& request) const;
  [[nodiscard]] bool takesLogData(const Request& request) const;
  [[nodiscard]] Answer answerLogData(Request& request);
  // Keeps a post that `judge` looks at when it is whole; a good one is answered with that JSON.
  template <typename Judge>
  [[nodiscard]] Answer answerPost(Request& request, const char* goodAnswer, Judge judge);
  [[nodiscard]] Answer answerStorebag(const Request& request);
  [[nodiscard]] Answer answerControl(const Request& request);
  [[nodiscard]] Answer answerAcknowledgements(const Request& request);
  [[nodiscard]] Answer answerWait(const Request& request);
  [[nodiscard]] Answer answerStream();
  [[nodiscard]] Reply page() const;
  // The reply as a rule changes it.
  [[nodiscard]] Answer applyRule(const std::optional<ReplyRule>& rule, Reply reply);

  const Options& options_;
  Store& store_;
  const PostChecker& checker_;
  EventStream& stream_;
  Suspensions& suspensions_;
  AcknowledgementRules& acknowledgements_;
  Queries queries_;
  ReplyRules rules_;
  Storebags storebags_;
  const Uploads uploads_;
  const std::string pagePolicy_;
};

}  // namespace kyt::devserver
