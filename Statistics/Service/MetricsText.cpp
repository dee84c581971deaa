#include "Statistics/Service/MetricsText.h"

#include <algorithm>
#include <vector>

#include <fmt/format.h>

namespace tavrin {
namespace {

// A label value with backslash, quote and newline escaped.
std::string LabelValue(const std::string& text) {
  std::string escaped;
  for (char c : text) {
    if (c == '\\' || c == '"') escaped += '\\';
    if (c == '\n') {
      escaped += "\\n";
      continue;
    }
    escaped += c;
  }
  return escaped;
}

double Number(const Value& object, const char* key) {
  if (!object.is_object()) return 0;
  const auto found = object.find(key);
  return found != object.end() && found->is_number() ? found->get<double>() : 0;
}

class Writer {
 public:
  void Family(const char* name, const char* type, const char* help) {
    text_ += fmt::format("# TYPE tavrin_{} {}\n# HELP tavrin_{} {}\n", name, type, name, help);
  }
  void Sample(const std::string& name, const std::string& labels, double value) {
    text_ += labels.empty() ? fmt::format("tavrin_{} {}\n", name, value)
                            : fmt::format("tavrin_{}{{{}}} {}\n", name, labels, value);
  }
  std::string Finish() { return std::move(text_) + "# EOF\n"; }

 private:
  std::string text_;
};

}  // namespace

std::string MetricsText(const Dictionary& status, size_t maxClients) {
  Writer out;
  out.Family("uptime_seconds", "gauge", "Seconds since the service started.");
  out.Sample("uptime_seconds", "", Number(status, "uptime_s"));
  out.Family("resident_memory_bytes", "gauge", "Resident memory of the service.");
  out.Sample("resident_memory_bytes", "", Number(status, "rss_bytes"));
  out.Family("sessions", "gauge", "Sessions held by connected clients.");
  out.Sample("sessions", "", Number(status, "sessions"));
  out.Family("backend_backlog_records", "gauge",
             "Records handed to the back-ends and not yet committed or acknowledged.");
  out.Sample("backend_backlog_records", "", Number(status, "store_backlog"));

  // Clients beyond the bound are summed into one series.
  std::vector<Value> clients;
  if (const auto found = status.find("clients"); found != status.end() && found->is_array()) {
    clients.assign(found->begin(), found->end());
  }
  std::stable_sort(clients.begin(), clients.end(), [](const Value& a, const Value& b) {
    return Number(a, "received") > Number(b, "received");
  });
  struct Series {
    std::string labels;
    Value counts;
  };
  std::vector<Series> series;
  Value other{{"received", 0}, {"delivered", 0}, {"in_flight", 0}, {"dropped", MakeDictionary()}};
  for (size_t i = 0; i < clients.size(); ++i) {
    const Value& client = clients[i];
    if (i < maxClients) {
      series.push_back({fmt::format("pid=\"{}\",name=\"{}\"", Number(client, "pid"),
                                    LabelValue(client.value("name", std::string()))),
                        client});
      continue;
    }
    for (const char* key : {"received", "delivered", "in_flight"}) {
      other[key] = Number(other, key) + Number(client, key);
    }
    if (const auto dropped = client.find("dropped"); dropped != client.end()) {
      for (const auto& [reason, n] : dropped->items()) {
        other["dropped"][reason] =
            Number(other["dropped"], reason.c_str()) + Number(client["dropped"], reason.c_str());
      }
    }
  }
  if (clients.size() > maxClients) series.push_back({"pid=\"0\",name=\"(other)\"", other});
  const Value totals = status.contains("totals") ? status["totals"] : Value::object();

  out.Family("messages_received_total", "counter", "Client messages received, per path they took.");
  out.Sample("messages_received_total", "", Number(totals, "received"));
  for (const Series& s : series) {
    out.Sample("messages_received_total", s.labels, Number(s.counts, "received"));
  }
  out.Family("messages_delivered_total", "counter",
             "Client messages committed by the store or acknowledged by Kafka.");
  out.Sample("messages_delivered_total", "", Number(totals, "delivered"));
  for (const Series& s : series) {
    out.Sample("messages_delivered_total", s.labels, Number(s.counts, "delivered"));
  }
  out.Family("messages_in_flight", "gauge", "Client messages neither delivered nor dropped yet.");
  out.Sample("messages_in_flight", "", Number(totals, "in_flight"));
  out.Family("messages_dropped_total", "counter", "Client messages dropped, by reason.");
  auto dropped = [&](const Value& counts, const std::string& labels) {
    if (!counts.is_object() || !counts.contains("dropped")) return;
    for (const auto& [reason, n] : counts["dropped"].items()) {
      if (!n.is_number()) continue;
      out.Sample("messages_dropped_total",
                 (labels.empty() ? "" : labels + ",") + fmt::format("reason=\"{}\"", reason),
                 n.get<double>());
    }
  };
  dropped(totals, "");
  for (const Series& s : series) dropped(s.counts, s.labels);
  out.Family("refusals_total", "counter", "Requests and connections refused, by limit.");
  if (const auto refusals = status.find("refusals"); refusals != status.end()) {
    for (const auto& [limit, n] : refusals->items()) {
      if (n.is_number())
        out.Sample("refusals_total", fmt::format("limit=\"{}\"", limit), n.get<double>());
    }
  }
  return out.Finish();
}

}  // namespace tavrin
