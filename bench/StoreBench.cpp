// Records per second through the embedded store, against the limit: the same inserts in one
// plain SQLite transaction on the calling thread. Both write 200-byte payloads to a WAL database
// with synchronous=NORMAL in a fresh directory under $TMPDIR (default /tmp).
//
//   build/<dir>/bench/StoreBench --benchmark_repetitions=5 --benchmark_report_aggregates_only=true

#include <benchmark/benchmark.h>
#include <sqlite3.h>
#include <stdlib.h>

#include <filesystem>
#include <future>
#include <string>

#include "base/Dictionary.h"
#include "platform/linux/store/SqliteStore.h"

namespace tavrin {
namespace {

// Records per measured iteration: well below the store's queue bound, so nothing is dropped.
constexpr int kRecordsPerIteration = 20000;

class ScratchDir {
 public:
  ScratchDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tavrin-bench-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path_ = pattern;
  }
  ~ScratchDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  const std::filesystem::path& path() const { return path_; }

 private:
  std::filesystem::path path_;
};

// A message as clients send them, 200 bytes of JSON.
Dictionary Payload() {
  Dictionary payload = {{"engine_on_time", 12.75},
                        {"ruvoreporting_timestamp", 1794806865123ll},
                        {"device_name", "alsa_output.pci-0000_00_1f.3.analog-stereo"},
                        {"route", "Speaker"},
                        {"underruns", 3},
                        {"note", ""}};
  const size_t size = JsonText(payload).size();
  payload["note"] = std::string(size < 200 ? 200 - size : 0, 'x');
  return payload;
}

void BM_StoreBatchedWal(benchmark::State& state) {
  ScratchDir dir;
  SqliteStoreOptions options;
  options.stateDirectory = dir.path().string();
  SqliteStore store(options);
  if (!store.IsUp()) {
    state.SkipWithError(store.DownReason().c_str());
    return;
  }
  const Dictionary payload = Payload();
  if (JsonText(payload).size() != 200) state.SkipWithError("payload is not 200 bytes");
  const auto record = std::make_shared<const ReportRecord>(
      SessionMessageRecord{1, 42, 2, 7, std::make_shared<const Dictionary>(payload), 1794806865.5});
  for (auto _ : state) {
    for (int i = 0; i < kRecordsPerIteration; ++i) store.Append(record);
    std::promise<void> committed;
    store.Flush([&](const OptionalError&) { committed.set_value(); });
    committed.get_future().wait();
  }
  state.SetItemsProcessed(state.iterations() * kRecordsPerIteration);
  state.counters["dropped"] = static_cast<double>(store.DroppedRecords());
}
BENCHMARK(BM_StoreBatchedWal)->Unit(benchmark::kMillisecond)->UseRealTime();

void BM_PlainSqliteOneTransaction(benchmark::State& state) {
  ScratchDir dir;
  sqlite3* db = nullptr;
  const std::string path = (dir.path() / "plain.db").string();
  sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  sqlite3_exec(db,
               "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL;"
               "CREATE TABLE session_messages(row INTEGER PRIMARY KEY, session_row INTEGER, "
               "reporter_id INTEGER, category INTEGER, type INTEGER, payload TEXT, "
               "received_at REAL)",
               nullptr, nullptr, nullptr);
  sqlite3_stmt* insert = nullptr;
  sqlite3_prepare_v2(db,
                     "INSERT INTO session_messages(session_row, reporter_id, category, type, "
                     "payload, received_at) VALUES(?1, ?2, ?3, ?4, ?5, ?6)",
                     -1, &insert, nullptr);
  const Dictionary payload = Payload();
  for (auto _ : state) {
    sqlite3_exec(db, "BEGIN", nullptr, nullptr, nullptr);
    for (int i = 0; i < kRecordsPerIteration; ++i) {
      // The same work per record as the store's writer: the payload's JSON text, then the insert.
      const std::string text = JsonText(payload);
      sqlite3_bind_int64(insert, 1, 1);
      sqlite3_bind_int64(insert, 2, 42);
      sqlite3_bind_int(insert, 3, 2);
      sqlite3_bind_int(insert, 4, 7);
      sqlite3_bind_text(insert, 5, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
      sqlite3_bind_double(insert, 6, 1794806865.5);
      if (sqlite3_step(insert) != SQLITE_DONE) state.SkipWithError(sqlite3_errmsg(db));
      sqlite3_reset(insert);
    }
    sqlite3_exec(db, "COMMIT", nullptr, nullptr, nullptr);
  }
  state.SetItemsProcessed(state.iterations() * kRecordsPerIteration);
  sqlite3_finalize(insert);
  sqlite3_close_v2(db);
}
BENCHMARK(BM_PlainSqliteOneTransaction)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace
}  // namespace tavrin

BENCHMARK_MAIN();
