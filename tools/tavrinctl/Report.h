#pragma once

// `tavrinctl report`: one session of the store as a self-contained HTML page (header, timeline,
// value plots, driver counter deltas, summary event), or its timeline alone as an SVG. Drawn as
// text, with no script and nothing fetched, so the file can be mailed and opened anywhere.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "Common.h"

namespace tavrin::ctl {

// Marks per lane and points per plot beyond which they are thinned out evenly: past this a
// lane is solid ink anyway, and the page stays small.
inline constexpr size_t kReportCap = 2000;

// Which session: a store row, or the latest session of a reporter (optionally the one whose
// created_at..flushed_at covers `at`; an unflushed session covers everything after its start).
struct SessionPick {
  std::optional<int64_t> row;
  std::optional<int64_t> reporterID;
  std::optional<double> at;
};

struct ReportMessage {
  uint16_t category = 0;
  uint16_t type = 0;
  double time = 0;                 // received_at
  nlohmann::ordered_json payload;  // the text itself when it is not JSON
};

struct ReportSession {
  int64_t row = 0;
  std::optional<int64_t> reporterID;
  std::string serviceName;  // empty when neither user_info nor session_info names it
  double createdAt = 0;
  std::optional<double> flushedAt;
  bool recovered = false;
  std::vector<ReportMessage> messages;  // oldest first
};

struct SessionAnswer {
  int status = kExitOk;  // kExitFailed: no such session, or the store cannot be read
  std::string error;
  ReportSession session;
};

SessionAnswer LoadReportSession(const std::string& databasePath, const SessionPick& pick);

// The timeline alone: orientation bands, then one lane of marks per (category, type).
std::string RenderTimelineSvg(const ReportSession& session);
std::string RenderReportHtml(const ReportSession& session);

struct ReportOptions {
  std::string row;
  std::string reporter;
  std::string at;
  std::string output;
  bool svg = false;
};

CLI::App* AddReportCommand(CLI::App& app, ReportOptions& options);
int RunReport(const ReportOptions& options, const Context& context);

}  // namespace tavrin::ctl
