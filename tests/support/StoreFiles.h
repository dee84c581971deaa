#pragma once

// Reading the store and writing the settings the way users and editors do, for end-to-end tests.

#include <sqlite3.h>

#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

namespace tavrin::testing {

// Every row of `sql` as text columns ("" for NULL), read through a read-only connection of its
// own, as another program reads the live store. No rows when the file or the query fails.
inline std::vector<std::vector<std::string>> QueryStore(const std::string& database,
                                                        const std::string& sql) {
  std::vector<std::vector<std::string>> rows;
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(database.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db, sql.c_str(), -1, &statement, nullptr) == SQLITE_OK) {
      while (sqlite3_step(statement) == SQLITE_ROW) {
        std::vector<std::string> row;
        for (int i = 0; i < sqlite3_column_count(statement); ++i) {
          const auto* text = sqlite3_column_text(statement, i);
          row.emplace_back(text ? reinterpret_cast<const char*>(text) : "");
        }
        rows.push_back(std::move(row));
      }
    }
    sqlite3_finalize(statement);
  }
  sqlite3_close(db);
  return rows;
}

// The first column of every row of `sql`.
inline std::vector<std::string> QueryStoreColumn(const std::string& database,
                                                 const std::string& sql) {
  std::vector<std::string> values;
  for (auto& row : QueryStore(database, sql)) values.push_back(row.empty() ? "" : row[0]);
  return values;
}

// The row count of `from` (a table, with a WHERE clause when it has one); -1 when the query fails.
inline int64_t StoreCount(const std::string& database, const std::string& from) {
  const auto counts = QueryStoreColumn(database, "SELECT count(*) FROM " + from);
  return counts.empty() ? -1 : std::stoll(counts[0]);
}

// Replaces `path` with `text` through a temporary file and a rename, as an editor saves.
inline void WriteFileAtomically(const std::string& path, const std::string& text) {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  const std::string temporary = path + ".new";
  std::ofstream(temporary) << text;
  std::filesystem::rename(temporary, path);
}

}  // namespace tavrin::testing
