// compare_lmdb.cpp - the LMDB side of the comparison: reads by key, bulk
// loads, durable changes and batches, a new reader scanning a table file, and
// the pages a table maps per row.
//
// LMDB keeps its default durability (every commit synced). A row is stored as
// its 16 key bytes and a packed value of the other columns; readers copy the
// value out of the map, as a caller must before the transaction ends.

#include <lmdb.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "compare_workloads.h"

namespace compare {
namespace {

constexpr const char *System = "lmdb";

// Large enough for a million rows plus every change the durable workloads add.
constexpr size_t Map_Size = size_t{1} << 30;

struct [[gnu::packed]] stored_value {
  int32_t count;
  int64_t total;
  double ratio;
  char note[Note_Length];
};

class environment {
 public:
  environment() = default;
  ~environment() {
    if (env_ != nullptr) {
      mdb_env_close(env_);
    }
  }
  environment(const environment &) = delete;
  environment &operator=(const environment &) = delete;

  // Opens the table file at `path` (one file and its lock file, no directory
  // of its own) and its main database.
  bool open(const std::string &path, unsigned flags);
  MDB_env *handle() const { return env_; }
  MDB_dbi table() const { return table_; }

 private:
  MDB_env *env_ = nullptr;
  MDB_dbi table_ = 0;
};

// A transaction that is aborted unless committed.
class transaction {
 public:
  transaction(const environment &env, unsigned flags) {
    if (mdb_txn_begin(env.handle(), nullptr, flags, &txn_) != 0) {
      txn_ = nullptr;
    }
  }
  ~transaction() {
    if (txn_ != nullptr) {
      mdb_txn_abort(txn_);
    }
  }
  transaction(const transaction &) = delete;
  transaction &operator=(const transaction &) = delete;

  bool begun() const { return txn_ != nullptr; }
  MDB_txn *handle() const { return txn_; }
  bool commit() { return mdb_txn_commit(std::exchange(txn_, nullptr)) == 0; }

 private:
  MDB_txn *txn_ = nullptr;
};

bool environment::open(const std::string &path, unsigned flags) {
  if (mdb_env_create(&env_) != 0) {
    env_ = nullptr;
    return false;
  }
  if (mdb_env_set_mapsize(env_, Map_Size) != 0 ||
      mdb_env_open(env_, path.c_str(), flags | MDB_NOSUBDIR, 0644) != 0) {
    return false;
  }
  transaction txn(*this, flags & MDB_RDONLY);
  return txn.begun() && mdb_dbi_open(txn.handle(), nullptr, 0, &table_) == 0 && txn.commit();
}

MDB_val key_of(const char *key) {
  return MDB_val{Key_Length, const_cast<char *>(key)};
}

stored_value pack(const config_row &row) {
  stored_value value{row.count, row.total, row.ratio, {}};
  std::memcpy(value.note, row.note, Note_Length);
  return value;
}

// Copies a stored row out of the map. The value may lie at any address, so it
// is copied whole before its fields are read.
void copy_out(const MDB_val &key, const MDB_val &data, config_row &row) {
  stored_value value;
  std::memcpy(&value, data.mv_data, sizeof value);
  std::memcpy(row.key, key.mv_data, Key_Length);
  row.key[Key_Length] = '\0';
  row.count = value.count;
  row.total = value.total;
  row.ratio = value.ratio;
  std::memcpy(row.note, value.note, Note_Length);
  row.note[Note_Length] = '\0';
}

bool put_row(MDB_txn *txn, MDB_dbi table, const config_row &row, unsigned flags) {
  MDB_val key = key_of(row.key);
  stored_value value = pack(row);
  MDB_val data{sizeof value, &value};
  return mdb_put(txn, table, &key, &data, flags) == 0;
}

// Stores `rows` in one write transaction. The rows come in key order, so each
// is appended: LMDB's documented fast path for loading sorted data.
bool load_rows(const environment &env, const std::vector<config_row> &rows) {
  transaction txn(env, 0);
  if (!txn.begun()) {
    return false;
  }
  for (const config_row &row : rows) {
    if (!put_row(txn.handle(), env.table(), row, MDB_APPEND)) {
      return false;
    }
  }
  return txn.commit();
}

bool open_loaded(environment &env, const std::string &path, const std::vector<config_row> &rows) {
  return env.open(path, 0) && load_rows(env, rows);
}

// Get, modify, put: sets the count of the row stored under `key`.
bool update_count(MDB_txn *txn, MDB_dbi table, const std::string &key_text, uint32_t n) {
  MDB_val key = key_of(key_text.c_str());
  MDB_val data;
  if (mdb_get(txn, table, &key, &data) != 0 || data.mv_size != sizeof(stored_value)) {
    return false;
  }
  stored_value value;
  std::memcpy(&value, data.mv_data, sizeof value);
  value.count = static_cast<int32_t>(n);
  MDB_val changed{sizeof value, &value};
  return mdb_put(txn, table, &key, &changed, 0) == 0;
}

// Each read is its own read-only transaction. One handle is reset and renewed
// for every read, as LMDB recommends for a thread that reads repeatedly.
void read_by_key(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  scratch_directory directory("lmdb-read");
  environment env;
  if (!check(state, open_loaded(env, directory.file("table.mdb"), make_rows(0, rows)), "load")) {
    return;
  }
  transaction reader(env, MDB_RDONLY);
  if (!check(state, reader.begun(), "begin read")) {
    return;
  }
  mdb_txn_reset(reader.handle());
  const std::vector<std::string> keys = lookup_keys(rows);
  config_row row{};
  size_t next = 0;
  for (auto _ : state) {
    MDB_val key = key_of(keys[next].c_str());
    MDB_val data;
    const bool found = mdb_txn_renew(reader.handle()) == 0 &&
                       mdb_get(reader.handle(), env.table(), &key, &data) == 0;
    if (found) {
      copy_out(key, data, row);
    }
    mdb_txn_reset(reader.handle());
    if (!check(state, found, "get")) {
      return;
    }
    benchmark::DoNotOptimize(row);
    next = next + 1 == keys.size() ? 0 : next + 1;
  }
  state.SetItemsProcessed(state.iterations());
}

// Workload 11: a table file of `rows` rows for each size, loaded before
// the threads start and kept for the whole run; the threads only look it
// up. Null when it could not be loaded.
struct loaded_file {
  scratch_directory directory{"lmdb-threads"};
  environment env;
};

std::map<int64_t, std::unique_ptr<loaded_file>> &loaded_files() {
  static std::map<int64_t, std::unique_ptr<loaded_file>> files;
  return files;
}

void load_shared_environment(const benchmark::State &state) {
  std::unique_ptr<loaded_file> &file = loaded_files()[state.range(0)];
  if (file == nullptr) {
    auto loaded = std::make_unique<loaded_file>();
    if (open_loaded(loaded->env, loaded->directory.file("table.mdb"),
                    make_rows(0, static_cast<uint64_t>(state.range(0))))) {
      file = std::move(loaded);
    }
  }
}

// Each thread has its own read transaction, reset and renewed around each
// read as in w1.
void concurrent_read_by_key(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const loaded_file *p_file = loaded_files().at(rows).get();
  if (!check(state, p_file != nullptr, "load")) {
    return;
  }
  const environment *env = &p_file->env;
  transaction reader(*env, MDB_RDONLY);
  if (!check(state, reader.begun(), "begin read")) {
    return;
  }
  mdb_txn_reset(reader.handle());
  const std::vector<std::string> keys = lookup_keys(rows);
  config_row row{};
  size_t next = first_read_of_thread(state, rows);
  for (auto _ : state) {
    MDB_val key = key_of(keys[next].c_str());
    MDB_val data;
    const bool found = mdb_txn_renew(reader.handle()) == 0 &&
                       mdb_get(reader.handle(), env->table(), &key, &data) == 0;
    if (found) {
      copy_out(key, data, row);
    }
    mdb_txn_reset(reader.handle());
    if (!check(state, found, "get")) {
      return;
    }
    benchmark::DoNotOptimize(row);
    next = next + 1 == keys.size() ? 0 : next + 1;
  }
  state.SetItemsProcessed(state.iterations());
}

// Each run loads into a new, empty table file; making it and dropping it are
// not part of the load, so the timer is paused for both.
void bulk_load(benchmark::State &state) {
  const std::vector<config_row> rows = make_rows(0, state.range(0));
  scratch_directory directory("lmdb-load");
  int run = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const std::string path = directory.file(("load-" + std::to_string(run++) + ".mdb").c_str());
    auto env = std::make_unique<environment>();
    if (!check(state, env->open(path, 0), "open")) {
      return;
    }
    state.ResumeTiming();
    if (!check(state, load_rows(*env, rows), "load")) {
      return;
    }
    state.PauseTiming();
    env.reset();
    std::filesystem::remove(path);
    std::filesystem::remove(path + "-lock");
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}

// A table file of Durable_Table_Rows rows; every commit is synced.
bool open_durable_table(environment &env, const scratch_directory &directory) {
  return open_loaded(env, directory.file("table.mdb"), make_rows(0, Durable_Table_Rows));
}

void durable_add(benchmark::State &state) {
  scratch_directory directory("lmdb-add");
  environment env;
  if (!check(state, open_durable_table(env, directory), "create table")) {
    return;
  }
  const std::vector<config_row> added = make_rows(Durable_Table_Rows, state.max_iterations);
  size_t n = 0;
  for (auto _ : state) {
    transaction txn(env, 0);
    const bool stored = txn.begun() &&
                        put_row(txn.handle(), env.table(), added[n++], MDB_NOOVERWRITE) &&
                        txn.commit();
    if (!check(state, stored, "add")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

// `Changes` updates per write transaction, synced when it commits.
template <uint32_t Changes>
void durable_updates(benchmark::State &state) {
  scratch_directory directory(Changes == 1 ? "lmdb-set" : "lmdb-batch");
  environment env;
  if (!check(state, open_durable_table(env, directory), "create table")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(Durable_Table_Rows);
  uint32_t n = 0;
  for (auto _ : state) {
    transaction txn(env, 0);
    bool updated = txn.begun();
    for (uint32_t change = 0; updated && change < Changes; ++change, ++n) {
      updated = update_count(txn.handle(), env.table(), keys[n % Durable_Table_Rows], n);
    }
    if (!check(state, updated && txn.commit(), "update")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * Changes);
}

// A new reader each run: open the file, walk a cursor over every row copying
// it out, close.
void open_and_scan(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  scratch_directory directory("lmdb-scan");
  const std::string path = directory.file("table.mdb");
  {
    environment writer;
    if (!check(state, open_loaded(writer, path, make_rows(0, rows)), "load")) {
      return;
    }
  }
  config_row row{};
  for (auto _ : state) {
    environment env;
    if (!check(state, env.open(path, MDB_RDONLY), "open")) {
      return;
    }
    transaction txn(env, MDB_RDONLY);
    MDB_cursor *cursor = nullptr;
    if (!check(state, txn.begun() && mdb_cursor_open(txn.handle(), env.table(), &cursor) == 0,
               "open cursor")) {
      return;
    }
    uint32_t seen = 0;
    MDB_val key;
    MDB_val data;
    int result = mdb_cursor_get(cursor, &key, &data, MDB_FIRST);
    for (; result == 0; result = mdb_cursor_get(cursor, &key, &data, MDB_NEXT)) {
      copy_out(key, data, row);
      benchmark::DoNotOptimize(row);
      ++seen;
    }
    mdb_cursor_close(cursor);
    if (!check(state, result == MDB_NOTFOUND && seen == rows, "scan")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// LMDB's memory is the part of the map its pages fill: every page up to the
// last one in use.
void memory(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const std::vector<config_row> data = make_rows(0, rows);
  scratch_directory directory("lmdb-memory");
  for (auto _ : state) {
    environment env;
    MDB_envinfo info;
    MDB_stat stat;
    const bool measured = open_loaded(env, directory.file("table.mdb"), data) &&
                          mdb_env_info(env.handle(), &info) == 0 &&
                          mdb_env_stat(env.handle(), &stat) == 0;
    if (!check(state, measured, "load")) {
      return;
    }
    const double bytes = static_cast<double>(info.me_last_pgno + 1) * stat.ms_psize;
    state.counters["bytes_per_row"] = bytes / rows;
  }
}

}  // namespace

void register_lmdb() {
  const std::vector<int64_t> durable_rows = {Durable_Table_Rows};
  add(W1_Read_By_Key, System, &read_by_key)->UseRealTime();
  // A few runs of the big loads give a steady figure without taking minutes.
  for (int64_t rows : Row_Counts) {
    add(W3_Bulk_Load, System, &bulk_load, {rows})
        ->Unit(benchmark::kMillisecond)
        ->UseRealTime()
        ->Iterations(std::max<int64_t>(3, 300000 / rows));
  }
  add(W4_Durable_Set, System, &durable_updates<1>, durable_rows)->UseRealTime();
  add(W4_Durable_Add, System, &durable_add, durable_rows)->UseRealTime();
  add(W5_Durable_Batch, System, &durable_updates<Batch_Changes>, durable_rows)->UseRealTime();
  add(W6_Open_And_Scan, System, &open_and_scan)->UseRealTime();
  add(W7_Memory, System, &memory)->Iterations(1)->UseRealTime();
  add_concurrent_reads(System, &concurrent_read_by_key, &load_shared_environment);
}

}  // namespace compare
