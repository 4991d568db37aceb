// The query interface's answers in JSON, straight from the store. Any thread; blocks on the database.
#pragma once

#include <string>

#include "devserver/Http.h"
#include "devserver/PostChecker.h"
#include "devserver/Store.h"

namespace kyt::devserver {

class Queries {
 public:
  Queries(Store& store, const PostChecker& checker) : store_(store), checker_(checker) {}

  // Paths below /api; unknown ones are answered 404, arguments that make no sense 400.
  [[nodiscard]] Reply answer(const Request& request);

  // How many events fit the request's filters (client, service, sender, method, status, session, post).
  [[nodiscard]] int64_t countEvents(const Request& request);
  [[nodiscard]] static bool hasFilters(const Request& request);

 private:
  [[nodiscard]] Reply posts(const Request& request);
  [[nodiscard]] Reply post(int64_t id);
  [[nodiscard]] Reply body(int64_t id);
  [[nodiscard]] Reply events(const Request& request);
  [[nodiscard]] Reply sessions(const Request& request);
  [[nodiscard]] Reply counts(const Request& request);
  [[nodiscard]] Reply storebags(const Request& request);
  [[nodiscard]] Reply arrivals(const Request& request, Arrival::Kind kind);

  Store& store_;
  const PostChecker& checker_;
};

}  // namespace kyt::devserver
