#pragma once

// `tavrinctl events`: the rows of the service's store (<state-dir>/tavrin.db), read-only.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>
#include <nlohmann/json.hpp>

#include "Common.h"

namespace tavrin::ctl {

// The store's tables, in the order rows of the same time are shown.
inline constexpr std::array<std::string_view, 5> kStoreTables = {
    "sessions", "session_messages", "single_messages", "analytics_events", "power_events"};

// How many rows `events` shows unless told otherwise: a screenful or two of the most recent.
inline constexpr size_t kDefaultEventLimit = 100;

struct EventQuery {
  std::vector<std::string> tables;  // empty: all of kStoreTables
  std::optional<int64_t> reporterID;
  std::optional<double> since;        // seconds since the epoch, inclusive
  std::optional<double> until;        // inclusive
  size_t limit = kDefaultEventLimit;  // the most recent this many; 0: all
};

struct EventRow {
  std::string table;
  double time = 0;  // received_at, or created_at for sessions
  int64_t row = 0;
  // {"table": ..., then every column by name}; JSON columns (payload, session_info, user_info)
  // hold their parsed value, not their text.
  nlohmann::ordered_json fields;
};

struct EventsAnswer {
  bool ok = false;
  bool usageError = false;  // the query itself is wrong (an unknown table, ...)
  std::string error;
  std::vector<EventRow> rows;  // oldest first
};

// Reads the rows that match `query` from the store at `databasePath`.
EventsAnswer QueryEvents(const std::string& databasePath, const EventQuery& query);

// One row for people: local time, table, then column=value pairs.
std::string FormatEventRow(const EventRow& row);

struct EventsOptions {
  std::vector<std::string> tables;
  std::string reporter;
  std::string since;
  std::string until;
  std::string limit;
};

CLI::App* AddEventsCommand(CLI::App& app, EventsOptions& options);
int RunEvents(const EventsOptions& options, const Context& context);

}  // namespace tavrin::ctl
