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

#include "qv_sr.h"

namespace {

constexpr int64_t Rows = 100000;

// A directory of its own for one benchmark, removed afterwards.
class scratch_directory {
 public:
  scratch_directory() {
    const char *p_base = std::getenv("QV_BENCH_DIR");
    std::string pattern = std::string(p_base != nullptr ? p_base : "/var/tmp") + "/qv-copy-XXXXXX";
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

// A tree with "/disk" mounted on `directory` and our table "/disk/t" of
// "id" key, "count" and "note", filled in one transaction and closed
// again; null when any of it fails.
sr_opaque_handle_t tree_with_table(const std::string &directory) {
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0 ||
      sr_mount_local_tree_1(tree, "/disk", directory.c_str(), 0) != 0) {
    return nullptr;
  }
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
  bool made = sr_create_table_1(tree, "/disk/t", columns, 3, SR_MODE_WRITE_EXPLICIT, &table) == 0;
  const char *names[3] = {"id", "count", "note"};
  for (int64_t id = 0; made && id < Rows; ++id) {
    const std::string note = note_of(id);
    qv_value_t values[3] = {};
    values[0].val_int32 = static_cast<int32_t>(id);
    values[1].val_int32 = static_cast<int32_t>(id % 100);
    values[2].ptr_char = const_cast<char *>(note.c_str());
    qv_value_t *pointers[3] = {&values[0], &values[1], &values[2]};
    made = sr_add_row_1(table, names, pointers, 3) == 0;
  }
  made =
      made && sr_apply_1(table, 0) == 0 && sr_commit_1(table) == 0 && sr_close_table_1(table) == 0;
  if (!made) {
    sr_close_tree_1(tree);
    return nullptr;
  }
  return tree;
}

// Ours, by name: the source file is copied as it is.
void copy_by_name_ours(benchmark::State &state) {
  scratch_directory directory;
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
  scratch_directory directory;
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

bool run_sql(sqlite3 *p_database, const char *p_sql) {
  return sqlite3_exec(p_database, p_sql, nullptr, nullptr, nullptr) == SQLITE_OK;
}

// SQLite: the same rows, VACUUM INTO a new database file (synchronous=FULL,
// so the copy is flushed). VACUUM INTO refuses a file that exists, so the
// last copy is removed between iterations, outside the timing.
void vacuum_into_sqlite(benchmark::State &state) {
  scratch_directory directory;
  sqlite3 *p_database = nullptr;
  const std::string path = directory.path() + "/t.db";
  const std::string copy = directory.path() + "/u.db";
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
  scratch_directory directory;
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
