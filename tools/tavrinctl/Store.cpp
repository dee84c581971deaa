#include "Store.h"

#include <sqlite3.h>

#include <algorithm>
#include <filesystem>
#include <memory>

#include <fmt/format.h>

#include "Operations.h"

namespace tavrin::ctl {
namespace {

// A writer holds the lock for one batch at most; waiting this long rides over it.
constexpr int kBusyTimeoutMilliseconds = 2000;

bool IsJsonColumn(std::string_view name) {
  return name == "payload" || name == "session_info" || name == "user_info";
}

bool HasReporterColumn(std::string_view table) {
  return table == "sessions" || table == "session_messages";
}

std::string_view TimeColumn(std::string_view table) {
  return table == "sessions" ? "created_at" : "received_at";
}

struct DatabaseCloser {
  void operator()(sqlite3* db) const { sqlite3_close(db); }
};
struct StatementFinalizer {
  void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
};

Json ColumnValue(sqlite3_stmt* statement, int column, std::string_view name) {
  switch (sqlite3_column_type(statement, column)) {
    case SQLITE_INTEGER:
      return sqlite3_column_int64(statement, column);
    case SQLITE_FLOAT:
      return sqlite3_column_double(statement, column);
    case SQLITE_TEXT: {
      const auto* bytes = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
      std::string text(bytes, size_t(sqlite3_column_bytes(statement, column)));
      if (IsJsonColumn(name)) {
        Json parsed = Json::parse(text, nullptr, false);
        if (!parsed.is_discarded()) return parsed;
      }
      return text;
    }
    case SQLITE_BLOB:
      return fmt::format("({} bytes)", sqlite3_column_bytes(statement, column));
    default:
      return nullptr;
  }
}

}  // namespace

EventsAnswer QueryEvents(const std::string& databasePath, const EventQuery& query) {
  EventsAnswer answer;
  std::vector<std::string> tables = query.tables;
  const bool explicitTables = !tables.empty();
  for (const std::string& table : tables) {
    if (std::find(kStoreTables.begin(), kStoreTables.end(), table) == kStoreTables.end()) {
      answer.usageError = true;
      answer.error = fmt::format("'{}' is not a table of the store; use {}", table,
                                 fmt::join(kStoreTables, ", "));
      return answer;
    }
  }
  if (!explicitTables) tables.assign(kStoreTables.begin(), kStoreTables.end());
  if (query.reporterID) {
    if (explicitTables) {
      for (const std::string& table : tables) {
        if (!HasReporterColumn(table)) {
          answer.usageError = true;
          answer.error = fmt::format(
              "{} has no reporter ID; --reporter goes with sessions and "
              "session_messages",
              table);
          return answer;
        }
      }
    } else {
      std::erase_if(tables, [](const std::string& table) { return !HasReporterColumn(table); });
    }
  }

  std::error_code ignored;
  if (!std::filesystem::exists(databasePath, ignored)) {
    answer.error = fmt::format(
        "no store at {}: the service creates it when it starts with the sqlite back-end. Point "
        "--state-dir (or --root/TAVRIN_ROOT) at the service's state directory.",
        databasePath);
    return answer;
  }
  sqlite3* raw = nullptr;
  const int opened = sqlite3_open_v2(databasePath.c_str(), &raw, SQLITE_OPEN_READONLY, nullptr);
  std::unique_ptr<sqlite3, DatabaseCloser> db(raw);
  if (opened != SQLITE_OK) {
    answer.error = fmt::format("cannot open the store {}: {}", databasePath,
                               raw ? sqlite3_errmsg(raw) : sqlite3_errstr(opened));
    return answer;
  }
  sqlite3_busy_timeout(db.get(), kBusyTimeoutMilliseconds);

  for (const std::string& table : tables) {
    const std::string_view timeColumn = TimeColumn(table);
    std::string sql = fmt::format("SELECT * FROM {} WHERE 1", table);
    if (query.since) sql += fmt::format(" AND {} >= ?1", timeColumn);
    if (query.until) sql += fmt::format(" AND {} <= ?2", timeColumn);
    if (query.reporterID) sql += " AND reporter_id = ?3";
    sql += fmt::format(" ORDER BY {} DESC, row DESC", timeColumn);
    if (query.limit > 0) sql += " LIMIT ?4";

    sqlite3_stmt* rawStatement = nullptr;
    if (sqlite3_prepare_v2(db.get(), sql.c_str(), -1, &rawStatement, nullptr) != SQLITE_OK) {
      const std::string message = sqlite3_errmsg(db.get());
      sqlite3_finalize(rawStatement);
      // A store written by another version may lack a table nobody asked for by name.
      if (!explicitTables && message.rfind("no such table", 0) == 0) continue;
      answer.error = fmt::format("cannot read {} from {}: {}", table, databasePath, message);
      return answer;
    }
    std::unique_ptr<sqlite3_stmt, StatementFinalizer> statement(rawStatement);
    if (query.since) sqlite3_bind_double(statement.get(), 1, *query.since);
    if (query.until) sqlite3_bind_double(statement.get(), 2, *query.until);
    if (query.reporterID) sqlite3_bind_int64(statement.get(), 3, *query.reporterID);
    if (query.limit > 0) sqlite3_bind_int64(statement.get(), 4, int64_t(query.limit));

    const int columns = sqlite3_column_count(statement.get());
    int step;
    while ((step = sqlite3_step(statement.get())) == SQLITE_ROW) {
      EventRow row;
      row.table = table;
      row.fields = Json::object();
      row.fields["table"] = table;
      for (int column = 0; column < columns; ++column) {
        const std::string name = sqlite3_column_name(statement.get(), column);
        Json value = ColumnValue(statement.get(), column, name);
        if (name == timeColumn && value.is_number()) row.time = value.get<double>();
        if (name == "row" && value.is_number_integer()) row.row = value.get<int64_t>();
        row.fields[name] = std::move(value);
      }
      answer.rows.push_back(std::move(row));
    }
    if (step != SQLITE_DONE) {
      answer.error =
          fmt::format("cannot read {} from {}: {}", table, databasePath, sqlite3_errmsg(db.get()));
      return answer;
    }
  }

  auto tableIndex = [](const std::string& table) {
    return std::find(kStoreTables.begin(), kStoreTables.end(), table) - kStoreTables.begin();
  };
  // Newest first to cut at the limit; rows of one time keep their table order and row order.
  std::sort(answer.rows.begin(), answer.rows.end(), [&](const EventRow& a, const EventRow& b) {
    if (a.time != b.time) return a.time > b.time;
    if (a.table != b.table) return tableIndex(a.table) > tableIndex(b.table);
    return a.row > b.row;
  });
  if (query.limit > 0 && answer.rows.size() > query.limit) answer.rows.resize(query.limit);
  std::reverse(answer.rows.begin(), answer.rows.end());
  answer.ok = true;
  return answer;
}

std::string FormatEventRow(const EventRow& row) {
  std::string line = fmt::format("{} {}", FormatLocalTime(row.time, true), row.table);
  const std::string_view timeColumn = TimeColumn(row.table);
  for (const auto& [name, value] : row.fields.items()) {
    if (name == "table" || name == timeColumn) continue;
    line +=
        fmt::format(" {}={}", name,
                    value.is_string() ? value.get<std::string>()
                                      : value.dump(-1, ' ', false, Json::error_handler_t::replace));
  }
  return line;
}

CLI::App* AddEventsCommand(CLI::App& app, EventsOptions& options) {
  CLI::App* events = app.add_subcommand("events", "print recent rows of the store, oldest first");
  events
      ->add_option("--table", options.tables,
                   "sessions, session_messages, single_messages, analytics_events or "
                   "power_events (repeat or separate with commas; default: all, merged by time)")
      ->delimiter(',');
  events->add_option("--reporter,-r", options.reporter, "only rows of this reporter ID");
  events->add_option("--since", options.since,
                     "from this time: seconds since the epoch, or how long ago (10m, 2h, 1d)");
  events->add_option("--until", options.until, "up to this time, in the same forms");
  events->add_option(
      "--limit,-n", options.limit,
      fmt::format("the most recent N rows (default {}; 0: all)", kDefaultEventLimit));
  events->footer(
      "With --json, one JSON object per row: {\"table\": ..., then the columns}, with payload, "
      "session_info and user_info as JSON values.");
  return events;
}

int RunEvents(const EventsOptions& options, const Context& context) {
  EventQuery query;
  query.tables = options.tables;
  std::string error;
  if (!options.reporter.empty()) {
    query.reporterID = ParseSigned(options.reporter);
    if (!query.reporterID) {
      return Fail(kExitUsage,
                  fmt::format("--reporter '{}' is not a reporter ID", options.reporter));
    }
  }
  const double now = WallNow();
  if (!options.since.empty()) {
    query.since = ParseTimeBound(options.since, now, &error);
    if (!query.since) return Fail(kExitUsage, "--since " + error);
  }
  if (!options.until.empty()) {
    query.until = ParseTimeBound(options.until, now, &error);
    if (!query.until) return Fail(kExitUsage, "--until " + error);
  }
  if (!options.limit.empty()) {
    const auto limit = ParseUnsigned(options.limit, SIZE_MAX);
    if (!limit) return Fail(kExitUsage, fmt::format("--limit '{}' is not a count", options.limit));
    query.limit = size_t(*limit);
  }

  const std::string database =
      (std::filesystem::path(context.paths.stateDir) / kStoreFileName).string();
  EventsAnswer answer = QueryEvents(database, query);
  if (!answer.ok) return Fail(answer.usageError ? kExitUsage : kExitFailed, answer.error);
  for (const EventRow& row : answer.rows) {
    if (context.json) {
      PrintJsonLine(row.fields);
    } else {
      std::printf("%s\n", FormatEventRow(row).c_str());
    }
  }
  return kExitOk;
}

}  // namespace tavrin::ctl
