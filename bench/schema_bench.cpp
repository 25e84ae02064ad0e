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

#include "bench_tables.h"
#include "qv_sr.h"

namespace {

using namespace bench;

// The table "/disk/t" of a tree made by tree_with_table, open for writing.
sr_opaque_handle_t our_table(sr_opaque_handle_t tree) {
  sr_opaque_handle_t table = nullptr;
  return tree != nullptr && sr_open_table_1(tree, "/disk/t", SR_MODE_WRITE_EXPLICIT, &table) == 0
             ? table
             : nullptr;
}

void add_column_ours(benchmark::State &state) {
  scratch_directory directory("schema");
  sr_opaque_handle_t tree = tree_with_table(directory.path());
  sr_opaque_handle_t table = our_table(tree);
  if (table == nullptr) {
    state.SkipWithError("the table was not made");
    sr_close_tree_1(tree);
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

void add_column_sqlite(benchmark::State &state) {
  scratch_directory directory("schema");
  const std::string path = directory.path() + "/t.db";
  sqlite3 *p_database = database_with_table(path);
  if (p_database == nullptr) {
    state.SkipWithError("no database");
    return;
  }
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
    scratch_directory directory("schema");
    sr_opaque_handle_t tree = tree_with_table(directory.path());
    sr_opaque_handle_t table = our_table(tree);
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
  scratch_directory directory("schema");
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
