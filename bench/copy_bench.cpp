// copy_bench.cpp - copying a persistent table of 100,000 rows to another
// persistent path: by name, from its file with no one holding it open here,
// and through an open handle, written from memory. Beside them SQLite's
// VACUUM INTO of the same rows, and the floor: the table file's bytes
// copied once in the kernel (copy_file_range) and flushed. Each rate counts
// rows carried to the new file per second of a caller's wait, flushes
// included. Files go to $QV_BENCH_DIR (default /var/tmp), which should be
// a real disk.

#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <sqlite3.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>

#include "bench_tables.h"
#include "qv_sr.h"

namespace {

using namespace bench;

// Ours, by name: the source file is copied as it is.
void copy_by_name_ours(benchmark::State &state) {
  scratch_directory directory("copy");
  sr_opaque_handle_t tree = tree_with_table(directory.path());
  if (tree == nullptr) {
    state.SkipWithError("the table was not made");
    return;
  }
  for (auto _ : state) {
    if (sr_copy_table_by_name_1(tree, "/disk/t", "/disk/u", 1) != 0) {
      state.SkipWithError("sr_copy_table_by_name_1 failed");
      break;
    }
  }
  state.counters["file_bytes"] =
      static_cast<double>(std::filesystem::file_size(directory.path() + "/u"));
  state.SetItemsProcessed(state.iterations() * Rows);
  sr_close_tree_1(tree);
}

// Ours, by handle: the open table is written from memory.
void copy_by_handle_ours(benchmark::State &state) {
  scratch_directory directory("copy");
  sr_opaque_handle_t tree = tree_with_table(directory.path());
  sr_opaque_handle_t table = nullptr;
  if (tree == nullptr || sr_open_table_1(tree, "/disk/t", SR_MODE_READ, &table) != 0) {
    state.SkipWithError("the table was not made");
    sr_close_tree_1(tree);
    return;
  }
  for (auto _ : state) {
    if (sr_copy_table_by_handle_1(table, "/disk/u", 1) != 0) {
      state.SkipWithError("sr_copy_table_by_handle_1 failed");
      break;
    }
  }
  state.counters["file_bytes"] =
      static_cast<double>(std::filesystem::file_size(directory.path() + "/u"));
  state.SetItemsProcessed(state.iterations() * Rows);
  sr_close_tree_1(tree);
}

// SQLite: the same rows, VACUUM INTO a new database file (synchronous=FULL,
// so the copy is flushed). VACUUM INTO refuses a file that exists, so the
// last copy is removed between iterations, outside the timing.
void vacuum_into_sqlite(benchmark::State &state) {
  scratch_directory directory("copy");
  const std::string path = directory.path() + "/t.db";
  const std::string copy = directory.path() + "/u.db";
  sqlite3 *p_database = database_with_table(path);
  if (p_database == nullptr) {
    state.SkipWithError("no database");
    return;
  }
  const std::string vacuum = "VACUUM INTO '" + copy + "'";
  for (auto _ : state) {
    if (!run_sql(p_database, vacuum.c_str())) {
      state.SkipWithError(sqlite3_errmsg(p_database));
      break;
    }
    state.PauseTiming();
    state.counters["file_bytes"] = static_cast<double>(std::filesystem::file_size(copy));
    std::filesystem::remove(copy);
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * Rows);
  sqlite3_close(p_database);
}

// The floor: our table file copied to a new file by copy_file_range and
// flushed once.
void copy_file_floor(benchmark::State &state) {
  scratch_directory directory("copy");
  sr_opaque_handle_t tree = tree_with_table(directory.path());
  if (tree == nullptr) {
    state.SkipWithError("the table was not made");
    return;
  }
  sr_close_tree_1(tree);
  const std::string source = directory.path() + "/t";
  const std::string target = directory.path() + "/floor";
  const auto file_bytes = static_cast<size_t>(std::filesystem::file_size(source));
  for (auto _ : state) {
    const int in = open(source.c_str(), O_RDONLY | O_CLOEXEC);
    const int out = open(target.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    size_t copied = 0;
    while (in >= 0 && out >= 0 && copied < file_bytes) {
      const ssize_t got = copy_file_range(in, nullptr, out, nullptr, file_bytes - copied, 0);
      if (got <= 0) {
        break;
      }
      copied += static_cast<size_t>(got);
    }
    const bool flushed = out >= 0 && fdatasync(out) == 0;
    if (in >= 0) {
      close(in);
    }
    if (out >= 0) {
      close(out);
    }
    if (!flushed || copied != file_bytes) {
      state.SkipWithError("the floor's copy was not made");
      break;
    }
  }
  state.counters["file_bytes"] = static_cast<double>(file_bytes);
  state.SetItemsProcessed(state.iterations() * Rows);
}

BENCHMARK(copy_by_name_ours)
    ->Name("copy_table_100k_rows/ours_by_name")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(copy_by_handle_ours)
    ->Name("copy_table_100k_rows/ours_by_handle")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(vacuum_into_sqlite)
    ->Name("copy_table_100k_rows/sqlite_vacuum_into")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);
BENCHMARK(copy_file_floor)
    ->Name("copy_table_100k_rows/floor")
    ->UseRealTime()
    ->Unit(benchmark::kMillisecond);

}  // namespace

BENCHMARK_MAIN();
