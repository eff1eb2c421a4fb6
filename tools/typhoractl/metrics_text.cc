#include "metrics_text.h"

#include <cstdio>
#include <sstream>

namespace typhora::ctl {
namespace {

struct Metric {
  const char* name;
  const char* type;
  const char* help;
};

std::string formatted(const Value& value) {
  const std::optional<double> number = value.asBool() != std::nullopt
                                           ? std::optional<double>(*value.asBool() ? 1 : 0)
                                           : value.asDouble();
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%.17g", number.value_or(0));
  return buffer;
}

// Label values escape backslash, double quote and line feed.
std::string labelValue(const std::string& text) {
  std::string escaped;
  for (char c : text) {
    if (c == '\\' || c == '"') escaped += '\\';
    escaped += c == '\n' ? std::string("\\n") : std::string(1, c);
  }
  return escaped;
}

void header(std::ostringstream& out, const Metric& metric) {
  out << "# HELP " << metric.name << " " << metric.help << "\n"
      << "# TYPE " << metric.name << " " << metric.type << "\n";
}

void sample(std::ostringstream& out, const Metric& metric, const Value& value) {
  header(out, metric);
  out << metric.name << " " << formatted(value) << "\n";
}

std::size_t sizeOf(const Value& value) {
  const ValueArray* array = value.asArray();
  return array != nullptr ? array->size() : 0;
}

}  // namespace

std::string MetricsText::fromStatus(const Value& status) {
  std::ostringstream out;
  sample(out, {"typhora_uptime_seconds", "gauge", "Seconds since the daemon started."},
         status.get("uptimeSeconds"));
  sample(out, {"typhora_connections", "gauge", "Open client connections."},
         Value(static_cast<std::int64_t>(sizeOf(status.get("connections")))));
  sample(out, {"typhora_checked_in_clients", "gauge", "Connections whose client checked in."},
         status.get("checkedInClients"));
  sample(out, {"typhora_web_content_connections", "gauge", "Connections to web-content processes."},
         status.get("webContentConnections"));
  sample(out,
         {"typhora_font_requests_waiting", "gauge",
          "Font requests holding or waiting for the request gate."},
         status.get("requestGate").get("waiting"));
  sample(out,
         {"typhora_user_fonts_cache_loaded", "gauge", "1 when the user-fonts cache is loaded."},
         status.get("userFontsCache").get("loaded"));
  sample(out,
         {"typhora_user_fonts_cache_invalidations_total", "counter",
          "Times the user-fonts cache was dropped after a font change."},
         status.get("userFontsCache").get("generation"));
  sample(out, {"typhora_pending_deletions", "gauge", "Font files scheduled for deletion."},
         Value(static_cast<std::int64_t>(sizeOf(status.get("pendingDeletions")))));
  sample(out, {"typhora_block_list_entries", "gauge", "Entries of the font-access block list."},
         status.get("blockListEntries"));
  const Metric depth{"typhora_queue_depth", "gauge", "Jobs queued and not yet started."};
  header(out, depth);
  if (const ValueArray* queues = status.get("queues").asArray()) {
    for (const Value& queue : *queues) {
      const std::string* label = queue.get("label").asString();
      out << depth.name << "{queue=\"" << labelValue(label != nullptr ? *label : "") << "\"} "
          << formatted(queue.get("depth")) << "\n";
    }
  }
  return out.str();
}

}  // namespace typhora::ctl
