// schema_bench.cpp - adding a column to a persistent table of 100,000 rows,
// beside SQLite rebuilding the same table in one transaction (a new table,
// INSERT ... SELECT, DROP, RENAME, synchronous=FULL) and beside the floor:
// writing the bytes of the new table file once and flushing them. Each
// rate counts rows carried into the new schema per second of a caller's
// wait, flushes included. Files go to $QV_BENCH_DIR (default /var/tmp),
// which should be a real disk.

#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>
#include <vector>

#include "qv_sr.h"

namespace {

constexpr int64_t Rows = 100000;

// A directory of its own for one benchmark, removed afterwards.
class scratch_directory {
 public:
  scratch_directory() {
    const char *p_base = std::getenv("QV_BENCH_DIR");
    std::string pattern =
        std::string(p_base != nullptr ? p_base : "/var/tmp") + "/qv-schema-XXXXXX";
    if (mkdtemp(pattern.data()) == nullptr) {
      std::perror(pattern.c_str());
      std::exit(1);
    }
    path_ = pattern;
  }
  ~scratch_directory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  scratch_directory(const scratch_directory &) = delete;
  scratch_directory &operator=(const scratch_directory &) = delete;
  const std::string &path() const { return path_; }

 private:
  std::string path_;
};

// The note every row carries: about 20 bytes, different per row.
std::string note_of(int64_t id) {
  return "service-" + std::to_string(id * 7919 % 1000003);
}

// Our table: "id" key, "count", "note", filled in one transaction.
sr_opaque_handle_t make_our_table(sr_opaque_handle_t tree) {
  sr_column_t columns[3] = {};
  columns[0].name = const_cast<char *>("id");
  columns[0].type = QV_INT32;
  columns[0].qualifier = SR_PRIMARY_KEY_NOCHECK;
  columns[1].name = const_cast<char *>("count");
  columns[1].type = QV_INT32;
  columns[1].qualifier = SR_STANDARD;
  columns[2].name = const_cast<char *>("note");
  columns[2].type = QV_CHAR_PTR;
  columns[2].qualifier = SR_STANDARD;
  sr_opaque_handle_t table = nullptr;
  if (sr_create_table_1(tree, "/disk/t", columns, 3, SR_MODE_WRITE_EXPLICIT, &table) != 0) {
    return nullptr;
  }
  const char *names[3] = {"id", "count", "note"};
  for (int64_t id = 0; id < Rows; ++id) {
    const std::string note = note_of(id);
    qv_value_t values[3] = {};
    values[0].val_int32 = static_cast<int32_t>(id);
    values[1].val_int32 = static_cast<int32_t>(id % 100);
    values[2].ptr_char = const_cast<char *>(note.c_str());
    qv_value_t *pointers[3] = {&values[0], &values[1], &values[2]};
    if (sr_add_row_1(table, names, pointers, 3) != 0) {
      return nullptr;
    }
  }
  return sr_apply_1(table, 0) == 0 && sr_commit_1(table) == 0 ? table : nullptr;
}

void add_column_ours(benchmark::State &state) {
  scratch_directory directory;
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0 ||
      sr_mount_local_tree_1(tree, "/disk", directory.path().c_str(), 0) != 0) {
    state.SkipWithError("no tree");
    return;
  }
  sr_opaque_handle_t table = make_our_table(tree);
  if (table == nullptr) {
    state.SkipWithError("the table was not made");
    return;
  }
  sr_column_t port = {};
  port.name = const_cast<char *>("port");
  port.type = QV_INT32;
  port.qualifier = SR_STANDARD;
  port.default_value.val_int32 = 80;
  const char *deleted[] = {"port"};
  for (auto _ : state) {
    if (sr_add_columns_1(table, &port, 1) != 0) {
      state.SkipWithError("sr_add_columns_1 failed");
      break;
    }
    state.PauseTiming();
    state.counters["file_bytes"] =
        static_cast<double>(std::filesystem::file_size(directory.path() + "/t"));
    const int32_t rc = sr_delete_columns_1(table, deleted, 1);
    state.ResumeTiming();
    if (rc != 0) {
      state.SkipWithError("sr_delete_columns_1 failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * Rows);
  sr_close_tree_1(tree);
}

bool run_sql(sqlite3 *p_database, const char *p_sql) {
  return sqlite3_exec(p_database, p_sql, nullptr, nullptr, nullptr) == SQLITE_OK;
}

void add_column_sqlite(benchmark::State &state) {
  scratch_directory directory;
  sqlite3 *p_database = nullptr;
  const std::string path = directory.path() + "/t.db";
  if (sqlite3_open(path.c_str(), &p_database) != SQLITE_OK ||
      !run_sql(p_database, "PRAGMA synchronous=FULL") ||
      !run_sql(p_database,
               "CREATE TABLE t(id INTEGER PRIMARY KEY, count INTEGER, note TEXT);BEGIN")) {
    state.SkipWithError("no database");
    sqlite3_close(p_database);
    return;
  }
  sqlite3_stmt *p_insert = nullptr;
  sqlite3_prepare_v2(p_database, "INSERT INTO t VALUES(?,?,?)", -1, &p_insert, nullptr);
  for (int64_t id = 0; id < Rows; ++id) {
    const std::string note = note_of(id);
    sqlite3_bind_int64(p_insert, 1, id);
    sqlite3_bind_int64(p_insert, 2, id % 100);
    sqlite3_bind_text(p_insert, 3, note.c_str(), -1, SQLITE_TRANSIENT);
    sqlite3_step(p_insert);
    sqlite3_reset(p_insert);
  }
  sqlite3_finalize(p_insert);
  run_sql(p_database, "COMMIT");
  // Each rebuild adds "port" to the three columns, so every iteration
  // carries the same table into a schema one column wider.
  const char *p_rebuild =
      "BEGIN;"
      "CREATE TABLE t_new(id INTEGER PRIMARY KEY, count INTEGER, note TEXT,"
      " port INTEGER DEFAULT 80);"
      "INSERT INTO t_new(id, count, note) SELECT id, count, note FROM t;"
      "DROP TABLE t;"
      "ALTER TABLE t_new RENAME TO t;"
      "COMMIT";
  for (auto _ : state) {
    if (!run_sql(p_database, p_rebuild)) {
      state.SkipWithError(sqlite3_errmsg(p_database));
      break;
    }
  }
  state.counters["file_bytes"] = static_cast<double>(std::filesystem::file_size(path));
  state.SetItemsProcessed(state.iterations() * Rows);
  sqlite3_close(p_database);
}

// The floor: the new table file's bytes (as large as ours after the add,
// measured once) written in one pass of 1 MiB writes and flushed.
void add_column_floor(benchmark::State &state) {
  uint64_t file_bytes = 0;
  {
    scratch_directory directory;
    sr_opaque_handle_t tree = nullptr;
    sr_open_tree_1(&tree, 0, 0);
    sr_mount_local_tree_1(tree, "/disk", directory.path().c_str(), 0);
    sr_opaque_handle_t table = make_our_table(tree);
    sr_column_t port = {};
    port.name = const_cast<char *>("port");
    port.type = QV_INT32;
    port.qualifier = SR_STANDARD;
    if (table == nullptr || sr_add_columns_1(table, &port, 1) != 0) {
      state.SkipWithError("the table was not made");
      sr_close_tree_1(tree);
      return;
    }
    file_bytes = std::filesystem::file_size(directory.path() + "/t");
    sr_close_tree_1(tree);
  }
  scratch_directory directory;
  const std::string path = directory.path() + "/floor";
  const std::vector<char> block(1 << 20, 'x');
  for (auto _ : state) {
    const int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    uint64_t written = 0;
    while (fd >= 0 && written < file_bytes) {
      const size_t length = std::min<uint64_t>(block.size(), file_bytes - written);
      if (write(fd, block.data(), length) != static_cast<ssize_t>(length)) {
        break;
      }
      written += length;
    }
    const bool flushed = fd >= 0 && fdatasync(fd) == 0;
    if (fd >= 0) {
      close(fd);
    }
    if (!flushed || written != file_bytes) {
      state.SkipWithError("the floor's file was not written");
      break;
    }
  }
  state.counters["file_bytes"] = static_cast<double>(file_bytes);
  state.SetItemsProcessed(state.iterations() * Rows);
}

BENCHMARK(add_column_ours)
    ->Name("add_column_100k_rows/ours")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(add_column_sqlite)
    ->Name("add_column_100k_rows/sqlite")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(add_column_floor)
    ->Name("add_column_100k_rows/floor")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
