#include "receiver/Metrics.h"

#include <cstdio>
#include <string_view>
#include <utility>

namespace kyt::receiver {
namespace {

using http::Reply;
using http::textReply;

// Lines of the format. Labels are words of ours, never texts from outside.
class Text {
 public:
  void counter(const char* name, const char* help) { begin(name, "counter", help, "_total"); }
  void gauge(const char* name, const char* help) { begin(name, "gauge", help, ""); }
  void sample(uint64_t number, const char* label = nullptr, const char* value = "") {
    text_.append(name_).append(suffix_);
    if (label != nullptr) text_.append("{").append(label).append("=\"").append(value).append("\"}");
    text_.append(" ").append(std::to_string(number)).append("\n");
  }
  void histogram(const char* name, const char* help, const Histogram& histogram) {
    begin(name, "histogram", help, "");
    uint64_t all = 0;
    for (size_t i = 0; i <= Histogram::kBounds.size(); ++i) {
      char bound[32] = "+Inf";
      if (i < Histogram::kBounds.size()) std::snprintf(bound, sizeof bound, "%g", Histogram::kBounds.at(i));
      all = histogram.upTo(i);
      text_.append(name_).append("_bucket{le=\"").append(bound).append("\"} ").append(std::to_string(all));
      text_ += '\n';
    }
    char sum[64];
    std::snprintf(sum, sizeof sum, "%.9g", histogram.sum());
    text_.append(name_).append("_sum ").append(sum).append("\n");
    text_.append(name_).append("_count ").append(std::to_string(all)).append("\n");
  }
  [[nodiscard]] std::string finish() && { return std::move(text_.append("# EOF\n")); }

 private:
  void begin(const char* name, const char* type, const char* help, const char* suffix) {
    name_ = name;
    suffix_ = suffix;
    text_.append("# TYPE ").append(name_).append(" ").append(type).append("\n");
    const std::string_view whole = name_;
    for (const char* unit : {"seconds", "bytes"})
      if (whole.ends_with(std::string("_") + unit))
        text_.append("# UNIT ").append(name_).append(" ").append(unit).append("\n");
    text_.append("# HELP ").append(name_).append(" ").append(help).append("\n");
  }

  std::string text_, name_;
  const char* suffix_ = "";
};

void writePosts(Text& out, const Figures& figures) {
  out.counter("kyt_posts", "Posts that were answered with 200, by who has them.");
  out.sample(figures.stored, "result", "stored");
  out.sample(figures.spooled, "result", "spooled");
  out.counter("kyt_post_bytes", "Bytes of the bodies of these.");
  out.sample(figures.bodyBytes);
  out.counter("kyt_refused", "Posts that were not taken, by reason.");
  for (size_t i = 0; i < figures.refused.size(); ++i)
    out.sample(figures.refused.at(i), "reason", refusalName(static_cast<Refusal>(i)));
  out.counter("kyt_digest", "Posts that were taken, by what was found of their digest.");
  out.sample(figures.digestsValid, "verdict", "valid");
  out.sample(figures.digestsAbsent, "verdict", "absent");
}

void writeLog(Text& out, const Figures& figures, Delivery& delivery) {
  out.gauge("kyt_log_up",
            "Whether the log takes messages: it is there, and not all partitions with posts failed last.");
  out.sample(delivery.takesMessages() ? 1 : 0);
  out.gauge("kyt_log_pending", "Messages that the log has not acknowledged yet.");
  out.sample(delivery.pending());
  out.gauge("kyt_log_failing",
            "Partitions that failed and have taken nothing since: their posts go to the spool.");
  out.sample(delivery.failing());
  out.counter("kyt_duplicates", "Messages that the log had already.");
  out.sample(figures.duplicates);
  out.counter("kyt_log_timeouts", "Messages that the log did not acknowledge in time.");
  out.sample(figures.logTimeouts);
  out.counter("kyt_log_refusals", "Messages that the log refused: for now, for want of room, or for good.");
  out.sample(figures.logRefusals, "kind", "now");
  out.sample(figures.logRefusalsFull, "kind", "full");
  out.sample(figures.logRefusalsForGood, "kind", "for-good");
  out.histogram("kyt_publish_seconds", "Until the log acknowledged a message.", figures.publishTime);
}

void writeSpool(Text& out, const Figures& figures, const Spool& spool) {
  out.gauge("kyt_spool_posts", "Posts in the spool.");
  out.sample(spool.posts());
  out.gauge("kyt_spool_bytes", "Bytes of these, and of those that wait for the disk.");
  out.sample(spool.bytes());
  out.gauge("kyt_spool_max_bytes", "Bytes that the spool may have.");
  out.sample(spool.maxBytes());
  out.gauge("kyt_spool_oldest_seconds", "How long ago the oldest was kept that the log may take.");
  out.sample(spool.oldestSeconds());
  out.counter("kyt_spool_replayed", "Posts of the spool that the log has taken.");
  out.sample(figures.replayed);
  out.counter("kyt_spool_stuck", "Posts of the spool that the log never takes or the disk no longer gives.");
  out.sample(figures.stuck);
  out.counter("kyt_spool_failures", "Changes of the spool's file, and readings of a post, that failed.");
  out.sample(figures.spoolFailures);
  out.gauge("kyt_spool_damaged_files",
            "Files of the spool that were damaged and lie beside it, with posts that were answered.");
  out.sample(spool.damagedFiles());
}

}  // namespace

std::string metricsText(const MetricsSources& sources) {
  Text out;
  const Figures& figures = sources.figures;
  writePosts(out, figures);
  writeLog(out, figures, sources.delivery);
  writeSpool(out, figures, sources.spool);
  out.counter("kyt_dead_letters",
              "Posts that can never be taken of which the dead-letter stream has a copy.");
  out.sample(figures.deadLetters);
  out.counter("kyt_dead_letters_left_out",
              "Those that were too many a second for that, or whose copy the log did not take.");
  out.sample(figures.deadLettersLeftOut);
  http::HttpServer* const server = sources.server;
  out.gauge("kyt_connections", "Connections of the port of posts.");
  out.sample(server != nullptr ? server->connections() : 0);
  out.gauge("kyt_bodies_bytes", "Bytes of the bodies of posts that are not yet answered.");
  out.sample(server != nullptr ? server->bodiesBytes() : 0);
  return std::move(out).finish();
}

const char* MetricsHandler::unreadiness() const {
  if (!isOpen_) return "the port of posts is not open";
  if (!sources_.delivery.wasUp()) return "the log has not been there yet";
  if (sources_.spool.bytes() >= sources_.spool.maxBytes() / 10 * 9) return "the spool is nearly full";
  if (!sources_.spool.mayKeep() && !sources_.delivery.takesMessages())
    return "neither log nor spool takes posts";
  return nullptr;
}

http::Answer MetricsHandler::answer(http::Request& request) {
  if (request.method != "GET" && request.method != "HEAD")
    return textReply(405, "only GET is answered here\n");
  if (request.path == "/livez") return textReply(200, "alive\n");
  if (request.path == "/readyz") {
    const char* why = unreadiness();
    return why == nullptr ? textReply(200, "ready\n") : textReply(503, std::string(why) + "\n");
  }
  if (request.path == "/metrics") {
    Reply reply = textReply(200, metricsText(sources_));
    reply.type = "application/openmetrics-text; version=1.0.0; charset=utf-8";
    return reply;
  }
  return textReply(404, "there are /metrics, /livez and /readyz\n");
}

}  // namespace kyt::receiver
