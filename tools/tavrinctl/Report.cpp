#include "Report.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdio>
#include <filesystem>
#include <limits>
#include <map>
#include <utility>

#include <fmt/format.h>

#include "Statistics/RuvoReportingUtility.h"
#include "Store.h"
#include "platform/TelvoroSession.h"
#include "platform/linux/files/PosixFileSystem.h"

namespace tavrin::ctl {
namespace {

using Json = nlohmann::ordered_json;

// The store keeps categories in 16 bits, so the summary event's category reads 65535 there.
constexpr uint16_t kStoreSummaryCategory = uint16_t(kSummaryEventCategory);

// One horizontal geometry for every drawing, so plots line up under the timeline.
constexpr double kWidth = 960;
constexpr double kLeft = 230;  // labels to the left of this
constexpr double kRight = 940;
constexpr double kRowHeight = 18;
constexpr size_t kLabelBytes = 36;
// A payload with hundreds of numeric keys would bury the rest of the page.
constexpr size_t kMaxPlots = 40;

constexpr const char* kPalette[] = {"#8ecae6", "#ffb703", "#90be6d", "#f28482",
                                    "#b8a1e3", "#f6bd60", "#84a59d", "#e5989b"};
constexpr const char* kOrientationKeys[][3] = {
    {"device_orientation", "device_orientation_time", "device orientation"},
    {"ui_orientation", "ui_orientation_time", "ui orientation"}};

// Payloads come from clients: every text from the store goes through here.
std::string Escape(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char c : text) {
    switch (c) {
      case '&':
        out += "&amp;";
        break;
      case '<':
        out += "&lt;";
        break;
      case '>':
        out += "&gt;";
        break;
      case '"':
        out += "&quot;";
        break;
      case '\'':
        out += "&#39;";
        break;
      default:
        // XML cannot carry most control characters, not even as references.
        if (uint8_t(c) < 0x20 && c != '\t' && c != '\n' && c != '\r') {
          out += "\xEF\xBF\xBD";
        } else {
          out += c;
        }
    }
  }
  return out;
}

std::string Text(const Json& value) {
  return value.is_string() ? value.get<std::string>()
                           : value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

// Escaped, and cut (on a character boundary) to fit the label column.
std::string Label(const std::string& text) {
  if (text.size() <= kLabelBytes) return Escape(text);
  size_t end = kLabelBytes - 1;
  while (end > 0 && (uint8_t(text[end]) & 0xC0) == 0x80) --end;
  return Escape(text.substr(0, end)) + "…";
}

std::string TextAt(double x, double y, std::string_view escaped, std::string_view extra = "") {
  return fmt::format(R"(<text x="{:.1f}" y="{:.1f}"{}>{}</text>)", x, y, extra, escaped);
}

std::string Svg(double height, std::string_view title, std::string_view body) {
  return fmt::format(R"(<svg xmlns="http://www.w3.org/2000/svg" width="{0}" height="{1:.0f}" )"
                     R"(viewBox="0 0 {0} {1:.0f}" font-family="sans-serif" font-size="11">)"
                     "<title>{2}</title>{3}</svg>\n",
                     kWidth, height, Escape(title), body);
}

// Indices of at most kReportCap of `count` items, evenly spread, first and last kept.
std::vector<size_t> EvenPick(size_t count) {
  std::vector<size_t> picked;
  for (size_t i = 0; i < std::min(count, kReportCap); ++i) {
    picked.push_back(count <= kReportCap ? i : i * (count - 1) / (kReportCap - 1));
  }
  return picked;
}

std::string ThinNote(size_t shown, size_t total, std::string_view what) {
  return fmt::format("{} of {} {} shown", shown, total, what);
}

std::optional<double> Number(const Json& fields, const char* name) {
  const auto found = fields.find(name);
  if (found == fields.end() || !found->is_number()) return std::nullopt;
  return found->get<double>();
}

bool IsSummary(const ReportMessage& m) {
  return m.category == kStoreSummaryCategory && m.type == kSummaryEventType;
}
bool IsDeltas(const ReportMessage& m) {
  return m.category == kDriverStatisticsCategory && m.type == kDriverStatisticsType;
}
bool IsOrientationRecord(const ReportMessage& m) {
  return m.payload.is_object() &&
         (m.payload.contains(kOrientationKeys[0][0]) || m.payload.contains(kOrientationKeys[1][0]));
}

// The last message of a kind: a session started again sends another at each stop.
const ReportMessage* Last(const ReportSession& session, bool (*kind)(const ReportMessage&)) {
  const auto found = std::find_if(session.messages.rbegin(), session.messages.rend(), kind);
  return found == session.messages.rend() ? nullptr : &*found;
}

struct Axis {
  double start, end;
  double X(double time) const { return kLeft + (time - start) / (end - start) * (kRight - kLeft); }
};

Axis SessionAxis(const ReportSession& session) {
  Axis axis{session.createdAt, session.flushedAt.value_or(session.createdAt)};
  for (const ReportMessage& m : session.messages) {
    axis.start = std::min(axis.start, m.time);
    axis.end = std::max(axis.end, m.time);
  }
  if (!(axis.end > axis.start)) axis.end = axis.start + 1;
  return axis;
}

std::vector<std::string> SplitCommas(const std::string& text) {
  std::vector<std::string> parts;
  size_t begin = 0;
  for (size_t comma; (comma = text.find(',', begin)) != std::string::npos; begin = comma + 1) {
    parts.push_back(text.substr(begin, comma - begin));
  }
  parts.push_back(text.substr(begin));
  return parts;
}

struct Band {
  double start, end;
  std::string name;
};

// Orientation records hold seconds since the session began, several joined with "," once the
// summary aggregated them; the store knows only created_at as the beginning.
std::vector<Band> OrientationBands(const ReportSession& session, const char* const keys[3],
                                   double end) {
  std::vector<std::pair<double, std::string>> changes;
  for (const ReportMessage& m : session.messages) {
    if (!m.payload.is_object() || !m.payload.contains(keys[0]) || !m.payload.contains(keys[1])) {
      continue;
    }
    const auto names = SplitCommas(Text(m.payload[keys[0]]));
    const auto times = SplitCommas(Text(m.payload[keys[1]]));
    for (size_t i = 0; i < std::min(names.size(), times.size()); ++i) {
      double offset = 0;
      const auto [at, error] =
          std::from_chars(times[i].data(), times[i].data() + times[i].size(), offset);
      if (error == std::errc() && at == times[i].data() + times[i].size() &&
          std::isfinite(offset)) {
        changes.emplace_back(session.createdAt + offset, names[i]);
      }
    }
  }
  // The summary repeats what the records said on their own.
  std::sort(changes.begin(), changes.end());
  changes.erase(std::unique(changes.begin(), changes.end()), changes.end());
  std::vector<Band> bands;
  for (size_t i = 0; i < changes.size(); ++i) {
    bands.push_back(
        {changes[i].first, i + 1 < changes.size() ? changes[i + 1].first : end, changes[i].second});
  }
  return bands;
}

std::string AxisTicks(const Axis& axis, double y) {
  std::string out = fmt::format(R"(<path stroke="#888" d="M{} {:.1f}H{}"/>)", kLeft, y, kRight);
  for (int i = 0; i <= 5; ++i) {
    const double offset = (axis.end - axis.start) * i / 5;
    out += TextAt(axis.X(axis.start + offset), y + 13,
                  fmt::format("+{:g} s", std::round(offset * 1000) / 1000),
                  R"( text-anchor="middle")");
  }
  return out;
}

std::string PlotSvg(const std::string& key, const std::vector<std::pair<double, double>>& points,
                    const Axis& axis) {
  const auto [low, high] =
      std::minmax_element(points.begin(), points.end(),
                          [](const auto& a, const auto& b) { return a.second < b.second; });
  const double lo = low->second, hi = high->second, top = 6, bottom = 58;
  auto y = [&](double v) { return hi > lo ? bottom - (v - lo) / (hi - lo) * (bottom - top) : 32; };
  const std::vector<size_t> picked = EvenPick(points.size());
  std::string body = TextAt(4, 16, Label(key), R"( font-weight="bold")") +
                     TextAt(4, 32, fmt::format("min {:g}, max {:g}", lo, hi));
  if (picked.size() < points.size()) {
    body += TextAt(4, 48, ThinNote(picked.size(), points.size(), "points"));
  }
  body += fmt::format(R"(<rect x="{}" y="{}" width="{}" height="{}" fill="#f6f6f6"/>)", kLeft, top,
                      kRight - kLeft, bottom - top);
  body += R"(<polyline fill="none" stroke="#1f5fa8" points=")";
  for (const size_t i : picked) {
    body += fmt::format("{:.1f},{:.1f} ", axis.X(points[i].first), y(points[i].second));
  }
  body += "\"/>";
  if (picked.size() == 1) {
    body += fmt::format(R"(<circle cx="{:.1f}" cy="{:.1f}" r="2" fill="#1f5fa8"/>)",
                        axis.X(points[0].first), y(points[0].second));
  }
  return Svg(bottom + 6, key, body);
}

std::string PlotsHtml(const ReportSession& session, const Axis& axis) {
  std::vector<std::pair<std::string, std::vector<std::pair<double, double>>>> series;
  std::map<std::string, size_t> index;
  for (const ReportMessage& m : session.messages) {
    if (!m.payload.is_object() || IsSummary(m) || IsDeltas(m) || IsOrientationRecord(m)) continue;
    for (const auto& [key, value] : m.payload.items()) {
      if (!value.is_number()) continue;
      const auto [at, added] = index.emplace(key, series.size());
      if (added) series.push_back({key, {}});
      series[at->second].second.emplace_back(m.time, value.get<double>());
    }
  }
  if (series.empty()) return "<p>No numeric values in the payloads.</p>\n";
  std::string out;
  for (size_t i = 0; i < std::min(series.size(), kMaxPlots); ++i) {
    out += PlotSvg(series[i].first, series[i].second, axis);
  }
  if (series.size() > kMaxPlots) {
    out += fmt::format("<p>{} of {} numeric keys plotted (the first to appear).</p>\n", kMaxPlots,
                       series.size());
  }
  return out;
}

std::string DeltasHtml(const ReportSession& session) {
  const ReportMessage* deltas = Last(session, IsDeltas);
  if (!deltas || !deltas->payload.is_object()) {
    return "<p>No driver counter deltas (category 9, type 0, sent at stop).</p>\n";
  }
  std::vector<std::pair<std::string, double>> counters;
  for (const auto& [name, value] : deltas->payload.items()) {
    if (value.is_number()) counters.emplace_back(name, value.get<double>());
  }
  if (counters.empty()) return "<p>No driver counter rose during the session.</p>\n";
  std::stable_sort(counters.begin(), counters.end(),
                   [](const auto& a, const auto& b) { return a.second > b.second; });
  const double largest = std::max(counters.front().second, 1.0);
  std::string body;
  double y = 4;
  for (const auto& [name, value] : counters) {
    const double width = std::max(0.0, value / largest) * (kRight - kLeft - 80);
    body += TextAt(4, y + 13, Label(name)) +
            fmt::format(R"(<rect x="{}" y="{:.1f}" width="{:.1f}" height="{}" fill="#e76f51"/>)",
                        kLeft, y + 2, width, kRowHeight - 4) +
            TextAt(kLeft + width + 4, y + 13, fmt::format("{:g}", value));
    y += kRowHeight;
  }
  return Svg(y + 4, "driver counter deltas", body);
}

std::string SummaryHtml(const ReportSession& session) {
  const ReportMessage* summary = Last(session, IsSummary);
  if (!summary || !summary->payload.is_object()) {
    return "<p>No summary event (category 65535, type 65535): the session has not stopped.</p>\n";
  }
  std::string out = "<table>\n<tr><th>key</th><th>value</th></tr>\n";
  for (const auto& [key, value] : summary->payload.items()) {
    out += fmt::format("<tr><td>{}</td><td>{}</td></tr>\n", Escape(key), Escape(Text(value)));
  }
  return out + "</table>\n";
}

std::string TimeText(double time) {
  return fmt::format("{} ({:.3f})", FormatLocalTime(time, true), time);
}

}  // namespace

SessionAnswer LoadReportSession(const std::string& databasePath, const SessionPick& pick) {
  SessionAnswer answer;
  EventQuery query;
  query.tables = {"sessions"};
  query.limit = 0;
  query.reporterID = pick.reporterID;
  EventsAnswer sessions = QueryEvents(databasePath, query);
  if (!sessions.ok) return {kExitFailed, sessions.error, {}};
  // Oldest first: the last match is the latest session.
  const EventRow* chosen = nullptr;
  for (const EventRow& row : sessions.rows) {
    const double flushed =
        Number(row.fields, "flushed_at").value_or(std::numeric_limits<double>::infinity());
    if (pick.row && row.row != *pick.row) continue;
    if (pick.at && !(row.time <= *pick.at && *pick.at <= flushed)) continue;
    chosen = &row;
  }
  if (!chosen) {
    std::string which;
    if (pick.row) which += fmt::format(" with row {}", *pick.row);
    if (pick.reporterID) which += fmt::format(" of reporter {}", *pick.reporterID);
    if (pick.at) which += fmt::format(" open at {}", TimeText(*pick.at));
    return {kExitFailed, fmt::format("no session{} in {}", which, databasePath), {}};
  }

  ReportSession& session = answer.session;
  const Json& fields = chosen->fields;
  session.row = chosen->row;
  session.createdAt = chosen->time;
  session.flushedAt = Number(fields, "flushed_at");
  if (const auto id = fields.find("reporter_id"); id != fields.end() && id->is_number_integer()) {
    session.reporterID = id->get<int64_t>();
  }
  // Stores made before recovery existed have no such column: nothing there was recovered.
  session.recovered = Number(fields, "recovered").value_or(0) == 1;
  for (const char* column : {"user_info", "session_info"}) {
    const auto info = fields.find(column);
    if (session.serviceName.empty() && info != fields.end() && info->is_object() &&
        info->contains(kTelvoroUserInfoServiceName)) {
      session.serviceName = Text(info->at(kTelvoroUserInfoServiceName));
    }
  }

  // Every message of a session carries its reporter ID, which narrows the read.
  query.tables = {"session_messages"};
  query.reporterID = session.reporterID;
  EventsAnswer messages = QueryEvents(databasePath, query);
  if (!messages.ok) return {kExitFailed, messages.error, {}};
  for (EventRow& row : messages.rows) {
    const std::optional<double> sessionRow = Number(row.fields, "session_row");
    if (!sessionRow || *sessionRow != double(session.row)) continue;
    session.messages.push_back({uint16_t(Number(row.fields, "category").value_or(0)),
                                uint16_t(Number(row.fields, "type").value_or(0)), row.time,
                                std::move(row.fields["payload"])});
  }
  return answer;
}

std::string RenderTimelineSvg(const ReportSession& session) {
  const Axis axis = SessionAxis(session);
  std::string body;
  double y = 4;
  std::map<std::string, size_t> colours;
  for (const auto& keys : kOrientationKeys) {
    const std::vector<Band> bands = OrientationBands(session, keys, axis.end);
    if (bands.empty()) continue;
    body += TextAt(4, y + 13, keys[2]);
    for (const Band& band : bands) {
      const double x0 = axis.X(std::max(band.start, axis.start));
      const double x1 = axis.X(std::min(band.end, axis.end));
      if (x1 < x0) continue;
      const size_t colour = colours.emplace(band.name, colours.size()).first->second;
      body += fmt::format(
          R"(<rect x="{:.1f}" y="{:.1f}" width="{:.1f}" height="{}" fill="{}"><title>{}</title></rect>)",
          x0, y + 1, x1 - x0, kRowHeight - 2, kPalette[colour % std::size(kPalette)],
          Escape(band.name));
      if (x1 - x0 > 7.0 * double(band.name.size())) {
        body += TextAt(x0 + 3, y + 13, Escape(band.name));
      }
    }
    y += kRowHeight;
  }

  std::map<std::pair<uint16_t, uint16_t>, std::vector<double>> lanes;
  for (const ReportMessage& m : session.messages) lanes[{m.category, m.type}].push_back(m.time);
  std::vector<std::string> notes;
  for (const auto& [lane, times] : lanes) {
    const std::string name = fmt::format("{}/{} {} · {}", lane.first, lane.second,
                                         CategoryName(lane.first), TypeName(lane.second));
    const std::vector<size_t> picked = EvenPick(times.size());
    body += TextAt(4, y + 13, Label(name));
    body += R"(<path class="marks" stroke="#1f5fa8" d=")";
    for (const size_t i : picked) {
      body += fmt::format("M{:.1f} {:.0f}v{:.0f}", axis.X(times[i]), y + 3, kRowHeight - 6);
    }
    body += "\"/>";
    if (picked.size() < times.size()) {
      notes.push_back(name + ": " + ThinNote(picked.size(), times.size(), "marks") +
                      ", evenly spaced in time order");
    }
    y += kRowHeight;
  }
  if (lanes.empty()) {
    body += TextAt(4, y + 13, "no messages");
    y += kRowHeight;
  }
  body += AxisTicks(axis, y + 2);
  y += 22;
  for (const std::string& note : notes) {
    y += 14;
    body += TextAt(4, y, Escape(note));
  }
  return Svg(y + 6, fmt::format("timeline of session row {}", session.row), body);
}

std::string RenderReportHtml(const ReportSession& session) {
  const std::string reporter =
      session.reporterID ? std::to_string(*session.reporterID) : std::string("none");
  std::string out = fmt::format(
      "<!DOCTYPE html>\n<html lang=\"en\"><head><meta charset=\"utf-8\">"
      "<title>tavrin session {0} (reporter {1})</title>\n<style>body{{font:14px sans-serif;"
      "margin:1em 2em}}table{{border-collapse:collapse}}td,th{{border:1px solid #ccc;"
      "padding:2px 6px;text-align:left;vertical-align:top}}td{{overflow-wrap:anywhere}}"
      // Long values must not squeeze the key column down to one character.
      "td:first-child{{min-width:16em}}"
      "svg{{display:block;margin:4px 0}}</style></head><body>\n"
      "<h1>Session {0} of reporter {1}</h1>\n<table>\n",
      session.row, reporter);
  const std::pair<const char*, std::string> header[] = {
      {"reporter ID", reporter},
      {"store row", std::to_string(session.row)},
      {"service", session.serviceName.empty() ? "not named" : session.serviceName},
      {"created", TimeText(session.createdAt)},
      {"flushed", session.flushedAt ? TimeText(*session.flushedAt) : "not flushed"},
      {"messages", std::to_string(session.messages.size())},
      {"recovered", session.recovered
                        ? "yes: its summary was rebuilt after the service ended with it open"
                        : "no"},
  };
  for (const auto& [name, value] : header) {
    out += fmt::format("<tr><th>{}</th><td>{}</td></tr>\n", name, Escape(value));
  }
  const Axis axis = SessionAxis(session);
  out += "</table>\n<h2>Timeline</h2>\n" + RenderTimelineSvg(session);
  out += "<h2>Values over time</h2>\n" + PlotsHtml(session, axis);
  out += "<h2>Driver counter deltas</h2>\n" + DeltasHtml(session);
  out += "<h2>Summary event</h2>\n" + SummaryHtml(session);
  return out + "</body></html>\n";
}

CLI::App* AddReportCommand(CLI::App& app, ReportOptions& options) {
  CLI::App* report = app.add_subcommand("report", "write one session of the store as an HTML page");
  CLI::Option* row =
      report->add_option("--row", options.row, "the session of this store row")->type_name("N");
  report->add_option("--reporter,-r", options.reporter, "the latest session of this reporter ID")
      ->type_name("ID")
      ->excludes(row);
  report
      ->add_option("--at", options.at,
                   "the session open then: seconds since the epoch, or how long ago (10m)")
      ->type_name("WHEN")
      ->excludes(row);
  report->add_option("--output,-o", options.output, "write here, not to stdout")->type_name("PATH");
  report->add_flag("--svg", options.svg, "only the timeline, as a standalone SVG");
  return report;
}

int RunReport(const ReportOptions& options, const Context& context) {
  SessionPick pick;
  if (!options.row.empty() && !(pick.row = ParseSigned(options.row))) {
    return Fail(kExitUsage, fmt::format("--row '{}' is not a row number", options.row));
  }
  if (!options.reporter.empty() && !(pick.reporterID = ParseSigned(options.reporter))) {
    return Fail(kExitUsage, fmt::format("--reporter '{}' is not a reporter ID", options.reporter));
  }
  std::string error;
  if (!options.at.empty() && !(pick.at = ParseTimeBound(options.at, WallNow(), &error))) {
    return Fail(kExitUsage, "--at " + error);
  }
  if (!pick.row && !pick.reporterID && !pick.at) {
    return Fail(kExitUsage, "which session? give --row N or --reporter ID (and --at TIME)");
  }

  const std::string database =
      (std::filesystem::path(context.paths.stateDir) / kStoreFileName).string();
  const SessionAnswer answer = LoadReportSession(database, pick);
  if (answer.status != kExitOk) return Fail(answer.status, answer.error);
  const std::string text =
      options.svg ? RenderTimelineSvg(answer.session) : RenderReportHtml(answer.session);
  if (options.output.empty() || options.output == "-") {
    if (std::fwrite(text.data(), 1, text.size(), stdout) != text.size() || std::fflush(stdout)) {
      return Fail(kExitFailed, "cannot write the report to stdout");
    }
  } else if (OptionalError failed = PosixFileSystem().WriteFileAtomically(options.output, text)) {
    return Fail(kExitFailed, failed->LocalizedDescription());
  }
  return kExitOk;
}

}  // namespace tavrin::ctl
