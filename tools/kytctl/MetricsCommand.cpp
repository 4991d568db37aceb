// kytctl metrics: the daemon's figures in the OpenMetrics text format, or in the older format that it came from.
#include <algorithm>
#include <cstdio>
#include <string>
#include <string_view>

#include "tools/kytctl/Commands.h"
#include "tools/kytctl/JSONText.h"
#include "tools/kytctl/WindowClient.h"

namespace kyt::tools {

namespace {

constexpr std::string_view kHelp = "# HELP ", kType = "# TYPE ", kUnit = "# UNIT ", kEnd = "# EOF";

// The older format knows no units and no end, and its comments have the name of the samples, "_total" included. The help of
// a metric stands before its type here.
std::string textFormat(std::string_view openMetrics) {
  std::string text;
  std::string_view help;
  while (!openMetrics.empty()) {
    const std::string_view line = openMetrics.substr(0, openMetrics.find('\n'));
    openMetrics.remove_prefix(std::min(line.size() + 1, openMetrics.size()));
    if (line.starts_with(kHelp)) {
      help = line;
    } else if (line.starts_with(kType)) {
      const size_t nameEnd = std::min(line.find(' ', kType.size()), line.size());
      const std::string name(line.substr(kType.size(), nameEnd - kType.size()));
      const std::string ending = line.ends_with(" counter") ? "_total" : "";
      if (help.starts_with(std::string(kHelp) + name + " "))
        text.append(kHelp).append(name).append(ending).append(help.substr(nameEnd)).append("\n");
      text.append(kType).append(name).append(ending).append(line.substr(nameEnd)).append("\n");
    } else if (!line.starts_with(kUnit) && line != kEnd) {
      text.append(line).append("\n");
    }
  }
  return text;
}

}  // namespace

int metricsCommand(const std::string& root, const MetricsOptions& options) {
  auto client = WindowClient::connect(root);
  if (const auto* error = std::get_if<Error>(&client)) return failedAtWindow(*error);
  auto answer = std::get<WindowClient>(client).text("Metrics");
  if (const auto* error = std::get_if<Error>(&answer)) return failedAtWindow(*error);
  auto& text = std::get<std::string>(answer);
  if (options.textFormat) text = textFormat(text);
  if (options.json) text = compactJSON(Dictionary{{"openmetrics", text}}) + "\n";
  std::fputs(text.c_str(), stdout);
  return 0;
}

}  // namespace kyt::tools
