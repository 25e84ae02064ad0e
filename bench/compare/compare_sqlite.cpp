// compare_sqlite.cpp - the SQLite side of the comparison: reads by key and by
// rowid from an in-memory database, bulk loads, durable changes and batches on
// disk in rollback-journal and WAL modes, a new reader scanning a table file,
// the memory an in-memory table holds per row, and selections from an
// in-memory table (the rowids criteria pick, and a temporary table of those
// rows).
//
// SQLite is used the way its documentation recommends for speed: statements
// prepared once and reset between runs, loads inside one transaction, and a
// WITHOUT ROWID table when rows are found by a text primary key.

#include <sqlite3.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "compare_workloads.h"

namespace compare {
namespace {

constexpr const char *Keyed_Table =
    "CREATE TABLE config(key TEXT PRIMARY KEY, count INTEGER, total INTEGER, ratio REAL, "
    "note TEXT) WITHOUT ROWID";
constexpr const char *Rowid_Table =
    "CREATE TABLE config(id INTEGER PRIMARY KEY, key TEXT UNIQUE, count INTEGER, total INTEGER, "
    "ratio REAL, note TEXT)";
// Works on both tables; in the rowid table row i gets rowid i + 1, as rows are
// added in order to an empty table.
constexpr const char *Insert_Row =
    "INSERT INTO config(key, count, total, ratio, note) VALUES(?1, ?2, ?3, ?4, ?5)";
constexpr const char *Select_By_Key =
    "SELECT key, count, total, ratio, note FROM config WHERE key = ?1";
constexpr const char *Select_By_Rowid =
    "SELECT key, count, total, ratio, note FROM config WHERE id = ?1";
constexpr const char *Update_Count = "UPDATE config SET count = ?2 WHERE key = ?1";
constexpr const char *Select_All = "SELECT * FROM config";
// The criteria of compare_workloads.h; no index covers count or note, so
// each is a scan of the whole table.
constexpr const char *Select_Integer = "SELECT rowid FROM config WHERE count > ?1";
constexpr const char *Select_Mixed =
    "SELECT rowid FROM config WHERE note != ?1 AND count >= ?2 AND count < ?3";
// Temporary tables are kept in memory (as our result table is) rather than
// in the temporary file this build uses by default.
constexpr const char *Temporary_Tables_In_Memory = "PRAGMA temp_store=MEMORY";
constexpr const char *Copy_Integer =
    "CREATE TEMP TABLE selected AS SELECT * FROM config WHERE count > ?1";
constexpr const char *Count_Copied = "SELECT count(*) FROM selected";
constexpr const char *Drop_Copy = "DROP TABLE selected";
// 256 MiB of page cache for a connection, more than any table here takes.
constexpr const char *Large_Page_Cache = "PRAGMA cache_size=-262144";

// Where a database lives and how its commits reach the disk.
struct storage {
  const char *system;
  const char *pragmas;
  bool on_disk;
};
constexpr storage Memory{"sqlite-memory", "", false};
constexpr storage Delete_File{"sqlite-file(delete,full)",
                              "PRAGMA journal_mode=DELETE; PRAGMA synchronous=FULL;", true};
constexpr storage Wal_File{"sqlite-file(wal,full)",
                           "PRAGMA journal_mode=WAL; PRAGMA synchronous=FULL;", true};

class connection {
 public:
  explicit connection(const std::string &path,
                      int flags = SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE) {
    opened_ = sqlite3_open_v2(path.c_str(), &db_, flags, nullptr) == SQLITE_OK;
  }
  // close_v2 waits for any statement still prepared, so the order in which
  // connections and statements go away does not matter.
  ~connection() { sqlite3_close_v2(db_); }
  connection(const connection &) = delete;
  connection &operator=(const connection &) = delete;

  bool opened() const { return opened_; }
  sqlite3 *handle() const { return db_; }
  bool execute(const char *sql) {
    return sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) == SQLITE_OK;
  }

 private:
  sqlite3 *db_ = nullptr;
  bool opened_ = false;
};

class statement {
 public:
  statement(const connection &db, const char *sql) {
    sqlite3_prepare_v2(db.handle(), sql, -1, &stmt_, nullptr);
  }
  ~statement() { sqlite3_finalize(stmt_); }
  statement(const statement &) = delete;
  statement &operator=(const statement &) = delete;

  bool prepared() const { return stmt_ != nullptr; }
  sqlite3_stmt *handle() const { return stmt_; }
  // Runs a statement that returns no row and readies it for the next run.
  bool run() {
    const int result = sqlite3_step(stmt_);
    sqlite3_reset(stmt_);
    return result == SQLITE_DONE;
  }

 private:
  sqlite3_stmt *stmt_ = nullptr;
};

bool bind_text(sqlite3_stmt *stmt, int parameter, const char *text) {
  return sqlite3_bind_text(stmt, parameter, text, -1, SQLITE_STATIC) == SQLITE_OK;
}

bool insert_row(statement &insert, const config_row &row) {
  sqlite3_stmt *stmt = insert.handle();
  return bind_text(stmt, 1, row.key) && sqlite3_bind_int(stmt, 2, row.count) == SQLITE_OK &&
         sqlite3_bind_int64(stmt, 3, row.total) == SQLITE_OK &&
         sqlite3_bind_double(stmt, 4, row.ratio) == SQLITE_OK && bind_text(stmt, 5, row.note) &&
         insert.run();
}

bool load_rows(connection &db, statement &insert, const std::vector<config_row> &rows) {
  if (!insert.prepared() || !db.execute("BEGIN")) {
    return false;
  }
  for (const config_row &row : rows) {
    if (!insert_row(insert, row)) {
      return false;
    }
  }
  return db.execute("COMMIT");
}

// Creates `schema` in `db`, with the journal and sync modes of `where`, and
// loads `rows`.
bool create_table(connection &db, const storage &where, const char *schema,
                  const std::vector<config_row> &rows) {
  if (!db.opened() || !db.execute(where.pragmas) || !db.execute(schema)) {
    return false;
  }
  statement insert(db, Insert_Row);
  return load_rows(db, insert, rows);
}

template <size_t Size>
void copy_text(sqlite3_stmt *stmt, int column, char (&out)[Size]) {
  // The text first, then its length: the order SQLite documents as safe.
  const unsigned char *text = sqlite3_column_text(stmt, column);
  const size_t length = std::min<size_t>(sqlite3_column_bytes(stmt, column), Size - 1);
  std::memcpy(out, text, length);
  out[length] = '\0';
}

// Copies the columns key, count, total, ratio, note starting at `first`.
void copy_columns(sqlite3_stmt *stmt, int first, config_row &row) {
  copy_text(stmt, first, row.key);
  row.count = sqlite3_column_int(stmt, first + 1);
  row.total = sqlite3_column_int64(stmt, first + 2);
  row.ratio = sqlite3_column_double(stmt, first + 3);
  copy_text(stmt, first + 4, row.note);
}

// Steps a one-row SELECT whose parameter is bound, copies the row out and
// readies the statement for the next read. False when no row came back.
bool read_one(sqlite3_stmt *stmt, config_row &row) {
  const bool found = sqlite3_step(stmt) == SQLITE_ROW;
  if (found) {
    copy_columns(stmt, 0, row);
  }
  sqlite3_reset(stmt);
  return found;
}

void read_by_key(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  connection db(":memory:");
  if (!check(state, create_table(db, Memory, Keyed_Table, make_rows(0, rows)), "load")) {
    return;
  }
  statement select(db, Select_By_Key);
  if (!check(state, select.prepared(), "prepare select")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(rows);
  config_row row{};
  size_t next = 0;
  for (auto _ : state) {
    const bool found =
        bind_text(select.handle(), 1, keys[next].c_str()) && read_one(select.handle(), row);
    if (!check(state, found, "select by key")) {
      return;
    }
    benchmark::DoNotOptimize(row);
    next = next + 1 == keys.size() ? 0 : next + 1;
  }
  state.SetItemsProcessed(state.iterations());
}

void read_by_rowid(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  connection db(":memory:");
  if (!check(state, create_table(db, Memory, Rowid_Table, make_rows(0, rows)), "load")) {
    return;
  }
  statement select(db, Select_By_Rowid);
  if (!check(state, select.prepared(), "prepare select")) {
    return;
  }
  config_row row{};
  uint64_t n = 0;
  for (auto _ : state) {
    const sqlite3_int64 rowid = lookup_row(n++, rows) + 1;
    const bool found = sqlite3_bind_int64(select.handle(), 1, rowid) == SQLITE_OK &&
                       read_one(select.handle(), row);
    if (!check(state, found, "select by rowid")) {
      return;
    }
    benchmark::DoNotOptimize(row);
  }
  state.SetItemsProcessed(state.iterations());
}

// Workload 11: a WAL table file of `rows` rows for each size, loaded before
// the threads start and kept for the whole run, with the connection that
// loaded it left open so that the WAL stays as the readers found it. The
// threads only look it up.
struct wal_file {
  scratch_directory directory{"sqlite-threads"};
  std::string path = directory.file("table.db");
  connection loader{path};
};

std::map<int64_t, std::unique_ptr<wal_file>> &wal_files() {
  static std::map<int64_t, std::unique_ptr<wal_file>> files;
  return files;
}

void load_wal_file(const benchmark::State &state) {
  std::unique_ptr<wal_file> &file = wal_files()[state.range(0)];
  if (file == nullptr) {
    auto loaded = std::make_unique<wal_file>();
    if (create_table(loaded->loader, Wal_File, Keyed_Table,
                     make_rows(0, static_cast<uint64_t>(state.range(0))))) {
      file = std::move(loaded);
    }
  }
}

// Each thread opens a connection of its own (without SQLite's mutex, as the
// connection is used by that thread alone), with a page cache large enough
// for the table, and prepares its SELECT; each read is its own autocommit
// read transaction.
void concurrent_read_by_key(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const wal_file *p_file = wal_files().at(rows).get();
  if (!check(state, p_file != nullptr, "load")) {
    return;
  }
  connection db(p_file->path, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX);
  if (!check(state, db.opened() && db.execute(Large_Page_Cache), "open")) {
    return;
  }
  statement select(db, Select_By_Key);
  if (!check(state, select.prepared(), "prepare select")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(rows);
  config_row row{};
  size_t next = first_read_of_thread(state, rows);
  for (auto _ : state) {
    const bool found =
        bind_text(select.handle(), 1, keys[next].c_str()) && read_one(select.handle(), row);
    if (!check(state, found, "select by key")) {
      return;
    }
    benchmark::DoNotOptimize(row);
    next = next + 1 == keys.size() ? 0 : next + 1;
  }
  state.SetItemsProcessed(state.iterations());
}

// Each run loads into a new empty database: a new connection, and on disk a
// new file. Making and dropping it is not part of the load, so the timer is
// paused for both.
template <const storage &Where>
void bulk_load(benchmark::State &state) {
  const std::vector<config_row> rows = make_rows(0, state.range(0));
  scratch_directory directory("sqlite-load");
  int run = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const std::string path = Where.on_disk
                                 ? directory.file(("load-" + std::to_string(run++) + ".db").c_str())
                                 : ":memory:";
    auto db = std::make_unique<connection>(path);
    const bool created = db->opened() && db->execute(Where.pragmas) && db->execute(Keyed_Table);
    auto insert = std::make_unique<statement>(*db, Insert_Row);
    if (!check(state, created && insert->prepared(), "create table")) {
      return;
    }
    state.ResumeTiming();
    if (!check(state, load_rows(*db, *insert, rows), "load")) {
      return;
    }
    state.PauseTiming();
    insert.reset();
    db.reset();
    if (Where.on_disk) {
      std::filesystem::remove(path);
    }
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}

// A table file of Durable_Table_Rows rows whose changes are durable at
// commit, with the statement of a durable workload prepared.
class durable_table {
 public:
  durable_table(const scratch_directory &directory, const storage &where, const char *sql)
      : db_(directory.file("table.db")),
        created_(create_table(db_, where, Keyed_Table, make_rows(0, Durable_Table_Rows))),
        statement_(db_, sql) {}

  bool ready() const { return created_ && statement_.prepared(); }
  connection &db() { return db_; }
  statement &prepared() { return statement_; }

 private:
  connection db_;
  bool created_;
  statement statement_;
};

// Sets the count of the row of the n-th change; false unless exactly that row
// changed.
bool update_count(durable_table &table, const std::string &key, uint32_t n) {
  sqlite3_stmt *update = table.prepared().handle();
  return bind_text(update, 1, key.c_str()) &&
         sqlite3_bind_int(update, 2, static_cast<int>(n)) == SQLITE_OK && table.prepared().run() &&
         sqlite3_changes(table.db().handle()) == 1;
}

// One autocommit INSERT of a new row per change.
template <const storage &Where>
void durable_add(benchmark::State &state) {
  scratch_directory directory("sqlite-add");
  durable_table table(directory, Where, Insert_Row);
  if (!check(state, table.ready(), "create table")) {
    return;
  }
  const std::vector<config_row> added = make_rows(Durable_Table_Rows, state.max_iterations);
  size_t n = 0;
  for (auto _ : state) {
    if (!check(state, insert_row(table.prepared(), added[n++]), "insert")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

// `Changes` UPDATEs per transaction, durable when it ends: a single change
// is an autocommit statement, which SQLite makes durable before returning;
// more are wrapped in BEGIN and COMMIT.
template <const storage &Where, uint32_t Changes>
void durable_updates(benchmark::State &state) {
  scratch_directory directory(Changes == 1 ? "sqlite-set" : "sqlite-batch");
  durable_table table(directory, Where, Update_Count);
  if (!check(state, table.ready(), "create table")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(Durable_Table_Rows);
  constexpr bool Explicit = Changes > 1;
  uint32_t n = 0;
  for (auto _ : state) {
    bool updated = !Explicit || table.db().execute("BEGIN");
    for (uint32_t change = 0; updated && change < Changes; ++change, ++n) {
      updated = update_count(table, keys[n % Durable_Table_Rows], n);
    }
    if (!check(state, updated && (!Explicit || table.db().execute("COMMIT")), "update")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * Changes);
}

// A new reader each run: open the file, read every column of every row, close.
void open_and_scan(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  scratch_directory directory("sqlite-scan");
  const std::string path = directory.file("table.db");
  {
    connection db(path);
    if (!check(state, create_table(db, Delete_File, Rowid_Table, make_rows(0, rows)), "load")) {
      return;
    }
  }
  config_row row{};
  for (auto _ : state) {
    connection db(path, SQLITE_OPEN_READONLY);
    statement scan(db, Select_All);
    if (!check(state, db.opened() && scan.prepared(), "open")) {
      return;
    }
    uint32_t seen = 0;
    int result;
    while ((result = sqlite3_step(scan.handle())) == SQLITE_ROW) {
      sqlite3_int64 id = sqlite3_column_int64(scan.handle(), 0);
      copy_columns(scan.handle(), 1, row);
      benchmark::DoNotOptimize(id);
      benchmark::DoNotOptimize(row);
      ++seen;
    }
    if (!check(state, result == SQLITE_DONE && seen == rows, "scan")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// Counts only what the rows add: the connection and its empty table are
// there before the first measurement.
void memory(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const std::vector<config_row> data = make_rows(0, rows);
  for (auto _ : state) {
    connection db(":memory:");
    if (!check(state, create_table(db, Memory, Keyed_Table, {}), "create table")) {
      return;
    }
    statement insert(db, Insert_Row);
    const sqlite3_int64 before = sqlite3_memory_used();
    if (!check(state, load_rows(db, insert, data), "load")) {
      return;
    }
    const sqlite3_int64 after = sqlite3_memory_used();
    if (!check(state, after > before, "memory statistics")) {
      return;
    }
    state.counters["bytes_per_row"] = static_cast<double>(after - before) / rows;
  }
}

// The in-memory rowid table of `rows` rows the selections read, loaded on
// first use and kept for the whole run, as our loaded tables are. Null when
// it could not be made.
connection *loaded_rowid_database(uint32_t rows) {
  static std::map<uint32_t, std::unique_ptr<connection>> databases;
  std::unique_ptr<connection> &db = databases[rows];
  if (db == nullptr) {
    auto made = std::make_unique<connection>(":memory:");
    if (!create_table(*made, Memory, Rowid_Table, make_rows(0, rows)) ||
        !made->execute(Temporary_Tables_In_Memory)) {
      return nullptr;
    }
    db = std::move(made);
  }
  return db.get();
}

// Binds the values of one of the two criteria.
bool bind_criteria(sqlite3_stmt *stmt, bool mixed, const selection_criteria &criteria) {
  if (!mixed) {
    return sqlite3_bind_int(stmt, 1, criteria.above) == SQLITE_OK;
  }
  return bind_text(stmt, 1, criteria.excluded.note) &&
         sqlite3_bind_int(stmt, 2, criteria.low) == SQLITE_OK &&
         sqlite3_bind_int(stmt, 3, criteria.high) == SQLITE_OK;
}

// Steps through every row the prepared SELECT returns, reading its rowid.
template <bool Mixed>
void selection_scan(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  connection *db = loaded_rowid_database(rows);
  if (!check(state, db != nullptr, "load")) {
    return;
  }
  statement select(*db, Mixed ? Select_Mixed : Select_Integer);
  const selection_criteria criteria = selection_criteria_for(rows);
  if (!check(state, select.prepared() && bind_criteria(select.handle(), Mixed, criteria),
             "prepare select")) {
    return;
  }
  for (auto _ : state) {
    uint32_t selected = 0;
    int result;
    while ((result = sqlite3_step(select.handle())) == SQLITE_ROW) {
      benchmark::DoNotOptimize(sqlite3_column_int64(select.handle(), 0));
      ++selected;
    }
    sqlite3_reset(select.handle());
    if (!check(state,
               result == SQLITE_DONE &&
                   selected == (Mixed ? criteria.mixed_matches : criteria.integer_matches),
               "select")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// The number of rows in the copy; -1 when it cannot be counted.
int64_t count_copied(connection &db) {
  statement count(db, Count_Copied);
  if (!count.prepared() || sqlite3_step(count.handle()) != SQLITE_ROW) {
    return -1;
  }
  return sqlite3_column_int64(count.handle(), 0);
}

// CREATE TEMP TABLE ... AS SELECT of the rows the integer criteria pick;
// counting and dropping the copy is not timed.
void selection_copy(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  connection *db = loaded_rowid_database(rows);
  if (!check(state, db != nullptr, "load")) {
    return;
  }
  const selection_criteria criteria = selection_criteria_for(rows);
  for (auto _ : state) {
    // Prepared in each run: dropping the copy changes the schema, which
    // would make SQLite prepare a kept statement again anyway.
    state.PauseTiming();
    auto copy = std::make_unique<statement>(*db, Copy_Integer);
    if (!check(state, copy->prepared() && bind_criteria(copy->handle(), false, criteria),
               "prepare copy")) {
      return;
    }
    state.ResumeTiming();
    if (!check(state, copy->run(), "copy")) {
      return;
    }
    state.PauseTiming();
    copy.reset();
    const bool copied = count_copied(*db) == criteria.integer_matches;
    if (!check(state, copied && db->execute(Drop_Copy), "count and drop the copy")) {
      return;
    }
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

void add_bulk_load(const storage &where, void (*function)(benchmark::State &)) {
  // A few runs of the big loads give a steady figure without taking minutes.
  for (int64_t rows : Row_Counts) {
    add(W3_Bulk_Load, where.system, function, {rows})
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime()
        ->Iterations(std::max<int64_t>(3, 300000 / rows));
  }
}

// The three workloads of durable changes, on a table file of `where`.
// The keyed in-memory table serialized, deserialized into a new connection
// (which takes the copy over and frees it), and scanned with every column
// copied out; closing the connection is not timed.
void ship_table(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  connection source(":memory:");
  if (!check(state, create_table(source, Memory, Keyed_Table, make_rows(0, rows)), "load")) {
    return;
  }
  config_row row{};
  for (auto _ : state) {
    sqlite3_int64 size = 0;
    unsigned char *p_image = sqlite3_serialize(source.handle(), "main", &size, 0);
    auto receiver = std::make_unique<connection>(":memory:");
    const bool made =
        p_image != nullptr && receiver->opened() &&
        sqlite3_deserialize(receiver->handle(), "main", p_image, size, size,
                            SQLITE_DESERIALIZE_FREEONCLOSE | SQLITE_DESERIALIZE_RESIZEABLE) ==
            SQLITE_OK;
    if (!check(state, made, "serialize and deserialize")) {
      return;
    }
    uint32_t seen = 0;
    int result;
    {
      statement scan(*receiver, Select_All);
      if (!check(state, scan.prepared(), "prepare scan")) {
        return;
      }
      while ((result = sqlite3_step(scan.handle())) == SQLITE_ROW) {
        copy_columns(scan.handle(), 0, row);
        benchmark::DoNotOptimize(row);
        ++seen;
      }
    }
    if (!check(state, result == SQLITE_DONE && seen == rows, "scan")) {
      return;
    }
    state.PauseTiming();
    receiver.reset();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

template <const storage &Where>
void add_durable(const std::vector<int64_t> &rows) {
  add(W4_Durable_Set, Where.system, &durable_updates<Where, 1>, rows)->UseRealTime();
  add(W4_Durable_Add, Where.system, &durable_add<Where>, rows)->UseRealTime();
  add(W5_Durable_Batch, Where.system, &durable_updates<Where, Batch_Changes>, rows)->UseRealTime();
}

}  // namespace

void register_sqlite() {
  add(W1_Read_By_Key, Memory.system, &read_by_key)->UseRealTime();
  add(W2_Read_By_Packed_Index, Memory.system, &read_by_rowid)->UseRealTime();
  add(W2_Read_By_Fixed_Index, Memory.system, &read_by_rowid)->UseRealTime();
  add_bulk_load(Memory, &bulk_load<Memory>);
  add_bulk_load(Delete_File, &bulk_load<Delete_File>);
  add_durable<Wal_File>({Durable_Table_Rows});
  add_durable<Delete_File>({Durable_Table_Rows});
  add(W6_Open_And_Scan, Delete_File.system, &open_and_scan)->UseRealTime();
  add(W7_Memory, Memory.system, &memory)->Iterations(1)->UseRealTime();
  add(W8_Select_Integer, Memory.system, &selection_scan<false>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W8_Select_Mixed, Memory.system, &selection_scan<true>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W9_Selection_Copy, Memory.system, &selection_copy, Selection_Copy_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W10_Ship_Table, Memory.system, &ship_table, Ship_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add_concurrent_reads(Wal_File.system, &concurrent_read_by_key, &load_wal_file);
}

}  // namespace compare
