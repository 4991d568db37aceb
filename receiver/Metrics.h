// The figures of a receiver in the OpenMetrics text format, version 1.0, and what a load balancer asks: /livez, /readyz.
#pragma once

#include <atomic>
#include <string>

#include "http/Http.h"
#include "http/HttpServer.h"
#include "receiver/Delivery.h"
#include "receiver/Figures.h"
#include "receiver/Spool.h"

namespace kyt::receiver {

struct MetricsSources {
  Figures& figures;
  Delivery& delivery;
  Spool& spool;
  std::atomic<http::HttpServer*> server = nullptr;  // of the posts; null: not open yet
};

[[nodiscard]] std::string metricsText(const MetricsSources& sources);

class MetricsHandler final : public http::HttpHandler {
 public:
  explicit MetricsHandler(const MetricsSources& sources) : sources_(sources) {}  // which outlive this

  [[nodiscard]] uint64_t bodyLimit(const http::Request& /*request*/) const override { return 0; }
  [[nodiscard]] http::Answer answer(http::Request& request) override;
  void broken(http::Request& /*request*/) override {}
  // The port of posts is open; from drain() on it is about to end.
  void open() { isOpen_ = true; }
  void drain() { isOpen_ = false; }
  // Why no posts should be sent here; null: they should.
  [[nodiscard]] const char* unreadiness() const;

 private:
  const MetricsSources& sources_;
  std::atomic<bool> isOpen_{false};
};

}  // namespace kyt::receiver
