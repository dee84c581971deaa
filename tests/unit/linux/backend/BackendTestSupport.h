#pragma once

// Helpers shared by the tests of the reporting back-ends: a temporary directory, queries over a
// real SQLite file through a second connection, and waiting for a flush answer.

#include <sqlite3.h>
#include <stdlib.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "base/Error.h"
#include "platform/linux/backend/ReportingBackend.h"

namespace tavrin::testing {

// Generous: the machine is shared with compilers; a healthy answer takes milliseconds.
inline constexpr std::chrono::seconds kAnswerTimeout{20};

class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tavrin-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) ADD_FAILURE() << "mkdtemp failed";
    path_ = pattern;
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
};

inline std::string ReadBytes(const std::filesystem::path& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

inline void WriteBytes(const std::filesystem::path& path, const std::string& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << bytes;
}

// A second connection to a store file, as tavrinctl or sqlite3 would open it.
class Reader {
 public:
  explicit Reader(const std::filesystem::path& path) {
    if (sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE, nullptr) != SQLITE_OK) {
      ADD_FAILURE() << "cannot open " << path << ": " << sqlite3_errmsg(db_);
    }
    sqlite3_busy_timeout(db_, 5000);
  }
  ~Reader() { sqlite3_close_v2(db_); }
  Reader(const Reader&) = delete;
  Reader& operator=(const Reader&) = delete;

  // Every row of `sql`, each column as text ("NULL" for null).
  std::vector<std::vector<std::string>> Rows(const std::string& sql) {
    std::vector<std::vector<std::string>> rows;
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db_, sql.c_str(), -1, &statement, nullptr) != SQLITE_OK) {
      ADD_FAILURE() << sql << ": " << sqlite3_errmsg(db_);
      return rows;
    }
    int rc;
    while ((rc = sqlite3_step(statement)) == SQLITE_ROW) {
      std::vector<std::string> row;
      for (int i = 0; i < sqlite3_column_count(statement); ++i) {
        const auto* text = sqlite3_column_text(statement, i);
        row.push_back(text ? reinterpret_cast<const char*>(text) : "NULL");
      }
      rows.push_back(std::move(row));
    }
    if (rc != SQLITE_DONE) ADD_FAILURE() << sql << ": " << sqlite3_errmsg(db_);
    sqlite3_finalize(statement);
    return rows;
  }
  // The first column of the first row as a number.
  int64_t Number(const std::string& sql) {
    const auto rows = Rows(sql);
    if (rows.empty() || rows[0].empty()) {
      ADD_FAILURE() << sql << ": no rows";
      return -1;
    }
    return std::stoll(rows[0][0]);
  }
  int Exec(const std::string& sql) {
    const int rc = sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, nullptr);
    return rc;
  }

 private:
  sqlite3* db_ = nullptr;
};

// Asks `backend` for a flush and waits for its answer. Fails the test when none comes.
struct FlushAnswer {
  bool answered = false;
  OptionalError error;
};
inline FlushAnswer FlushAndWait(ReportingBackend& backend) {
  auto promise = std::make_shared<std::promise<OptionalError>>();
  auto future = promise->get_future();
  backend.Flush([promise](const OptionalError& error) { promise->set_value(error); });
  if (future.wait_for(kAnswerTimeout) != std::future_status::ready) {
    ADD_FAILURE() << "no flush answer from " << backend.Name();
    return {};
  }
  return {true, future.get()};
}

}  // namespace tavrin::testing
