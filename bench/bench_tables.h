// bench_tables.h - what the benchmarks of whole-table operations share: a
// scratch directory on a real disk ($QV_BENCH_DIR, default /var/tmp), and
// the same table of 100,000 rows ("id" key, "count", a note of about 20
// bytes) made in our library as the persistent table "/disk/t" and in
// SQLite as the table "t" with synchronous=FULL.

#ifndef BENCH_TABLES_H
#define BENCH_TABLES_H

#include <sqlite3.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <system_error>

#include "qv_sr.h"

namespace bench {

inline constexpr int64_t Rows = 100000;

// A directory of its own for one benchmark, removed afterwards.
class scratch_directory {
 public:
  explicit scratch_directory(const char *p_label) {
    const char *p_base = std::getenv("QV_BENCH_DIR");
    std::string pattern =
        std::string(p_base != nullptr ? p_base : "/var/tmp") + "/qv-" + p_label + "-XXXXXX";
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
inline std::string note_of(int64_t id) {
  return "service-" + std::to_string(id * 7919 % 1000003);
}

// A tree with "/disk" mounted on `directory` and the table "/disk/t",
// filled in one transaction and closed again; null when any of it fails.
inline sr_opaque_handle_t tree_with_table(const std::string &directory) {
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

inline bool run_sql(sqlite3 *p_database, const char *p_sql) {
  return sqlite3_exec(p_database, p_sql, nullptr, nullptr, nullptr) == SQLITE_OK;
}

// The SQLite database `path` with the table "t" of the same rows, filled
// in one transaction; null when any of it fails.
inline sqlite3 *database_with_table(const std::string &path) {
  sqlite3 *p_database = nullptr;
  if (sqlite3_open(path.c_str(), &p_database) != SQLITE_OK ||
      !run_sql(p_database, "PRAGMA synchronous=FULL") ||
      !run_sql(p_database,
               "CREATE TABLE t(id INTEGER PRIMARY KEY, count INTEGER, note TEXT);BEGIN")) {
    sqlite3_close(p_database);
    return nullptr;
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
  if (!run_sql(p_database, "COMMIT")) {
    sqlite3_close(p_database);
    return nullptr;
  }
  return p_database;
}

}  // namespace bench

#endif  // BENCH_TABLES_H
