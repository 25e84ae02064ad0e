// compare_ours.cpp - the registry's side of the comparison: every workload
// of compare_workloads.h done through the exported C interface, the way a
// program would use it. Tables are keyed by the row's string key through a
// key hash table with as many buckets as the next power of two above the row
// count, so a lookup costs one bucket walk.

#include <array>
#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "compare_ours.h"
#include "compare_workloads.h"
#include "qv_sr.h"

namespace compare {
namespace {

constexpr int32_t Create_Explicit = 4;  // created writable, caller applies and commits
constexpr int32_t Open_Read_Only = 1;
constexpr int32_t Open_Implicit = 2;  // every change committed before the call returns
constexpr int32_t Open_Explicit = 6;

constexpr uint32_t Total_Columns = 5;
constexpr std::array<const char *, Total_Columns> Column_Names = {"key", "count", "total", "ratio",
                                                                  "note"};

// The registry hands the hash function only the key, so the bucket count is
// a template argument: one function per table size. The standard library's
// string hash works a word at a time, several times faster than a byte-wise
// hash on 16-byte keys; the bucket count is a power of two.
template <uint32_t Buckets>
uint32_t hash_key(const void *p_key) {
  const std::string_view key(static_cast<const char *>(p_key));
  return static_cast<uint32_t>(std::hash<std::string_view>{}(key)) & (Buckets - 1);
}

int32_t compare_keys(const void *p_stored_key, const void *p_key) {
  return std::strcmp(static_cast<const char *>(p_stored_key), static_cast<const char *>(p_key));
}

struct hash_settings {
  uint32_t buckets;
  sr_hash_function_t function;
};

hash_settings hash_settings_for(int64_t rows) {
  if (rows <= 1024) {
    return {1024, hash_key<1024>};
  }
  if (rows <= 131072) {
    return {131072, hash_key<131072>};
  }
  return {1048576, hash_key<1048576>};
}

std::array<sr_column_t, Total_Columns> column_definitions() {
  std::array<sr_column_t, Total_Columns> columns{};
  const std::array<qv_data_type_t, Total_Columns> types = {QV_CHAR_PTR, QV_INT32, QV_INT64,
                                                           QV_FLOAT64, QV_CHAR_PTR};
  for (uint32_t column = 0; column < Total_Columns; ++column) {
    columns[column].name = const_cast<char *>(Column_Names[column]);
    columns[column].type = types[column];
    columns[column].qualifier = column == 0 ? SR_PRIMARY_KEY : SR_STANDARD;
  }
  return columns;
}

// A tree of its own, with "/bench" mounted on a directory when one is given.
class tree {
 public:
  explicit tree(const std::string &directory = "") {
    ok_ =
        sr_open_tree_1(&handle_, 0, 0) == 0 &&
        (directory.empty() || sr_mount_local_tree_1(handle_, "/bench", directory.c_str(), 1) == 0);
  }
  ~tree() {
    if (handle_ != nullptr) {
      sr_close_tree_1(handle_);
    }
  }
  tree(const tree &) = delete;
  tree &operator=(const tree &) = delete;
  bool ok() const { return ok_; }
  sr_opaque_handle_t handle() const { return handle_; }

 private:
  sr_opaque_handle_t handle_ = nullptr;
  bool ok_ = false;
};

int32_t add_row(sr_opaque_handle_t table, const config_row &row) {
  qv_value_t key{}, count{}, total{}, ratio{}, note{};
  key.ptr_char = const_cast<char *>(row.key);
  count.val_int32 = row.count;
  total.val_int64 = row.total;
  ratio.val_float64 = row.ratio;
  note.ptr_char = const_cast<char *>(row.note);
  qv_value_t *const values[Total_Columns] = {&key, &count, &total, &ratio, &note};
  return sr_add_row_1(table, Column_Names.data(), values, Total_Columns);
}

// Rows 0 .. rows-1, formatted once per size so that no workload times
// their formatting.
const std::vector<config_row> &rows_of(int64_t rows) {
  static std::map<int64_t, std::vector<config_row>> made;
  std::vector<config_row> &made_rows = made[rows];
  for (auto i = static_cast<uint32_t>(made_rows.size()); i < rows; ++i) {
    made_rows.push_back(make_row(i));
  }
  return made_rows;
}

// Creates `path` in `owner` with `rows` rows, applied and committed in one
// transaction. Null on failure.
sr_opaque_handle_t create_loaded_table(sr_opaque_handle_t owner, const char *path, int64_t rows) {
  auto columns = column_definitions();
  const hash_settings hash = hash_settings_for(rows);
  sr_opaque_handle_t table = nullptr;
  if (sr_create_hashed_key_table_1(owner, path, columns.data(), Total_Columns, Create_Explicit,
                                   hash.buckets, hash.function, compare_keys, &table) != 0) {
    return nullptr;
  }
  for (const config_row &row : rows_of(rows)) {
    if (add_row(table, row) != 0) {
      return nullptr;
    }
  }
  if (sr_apply_1(table, 0) != 0 || sr_commit_1(table) != 0) {
    return nullptr;
  }
  return table;
}

// The values of one row as a read hands them over; the strings are the
// caller's to free.
struct read_row {
  qv_value_t key{}, count{}, total{}, ratio{}, note{};
  std::array<qv_value_t *, Total_Columns> results() {
    return {&key, &count, &total, &ratio, &note};
  }
  void release() {
    benchmark::DoNotOptimize(count.val_int32 + total.val_int64 + ratio.val_float64);
    std::free(key.ptr_char);
    std::free(note.ptr_char);
  }
};

// Reads every column of rows of `table` by key, in the lookup order from
// read `next` on, for as long as the benchmark runs.
void read_keys(benchmark::State &state, sr_opaque_handle_t table, size_t next) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  if (!check(state, table != nullptr, "load the table")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(rows);
  for (auto _ : state) {
    read_row row;
    qv_value_t key{};
    key.ptr_char = const_cast<char *>(keys[next].c_str());
    next = next + 1 == keys.size() ? 0 : next + 1;
    const int32_t rc = sr_get_fields_by_key_1(table, key, Column_Names.data(), row.results().data(),
                                              Total_Columns);
    if (!check(state, rc == 0, "sr_get_fields_by_key_1")) {
      return;
    }
    row.release();
  }
  state.SetItemsProcessed(state.iterations());
}

void read_by_key(benchmark::State &state) {
  read_keys(state, loaded_transient_table(state.range(0)), 0);
}

// Workload 11's tables of one size: the one the threads share, and the
// floor's private copies, one per thread of the largest run, each in a tree
// of its own so that the threads reading them share nothing. All are loaded
// together, one after another, the first time either side asks, and kept
// for the whole run. Loaded at different moments they get memory in
// different states of the heap (fresh pages, or pieces freed by earlier
// workloads), and the comparison would measure the heap as well as the
// sharing: the shared table used to be w1's, loaded at the start of a full
// run, and the copies were loaded after every other workload had run.
struct concurrent_read_tables {
  sr_opaque_handle_t shared = nullptr;
  std::vector<sr_opaque_handle_t> copies;
};

const concurrent_read_tables &concurrent_tables(int64_t rows) {
  static std::vector<std::unique_ptr<tree>> owners;
  static std::map<int64_t, concurrent_read_tables> made;
  auto [place, inserted] = made.try_emplace(rows);
  concurrent_read_tables &tables = place->second;
  if (inserted) {
    for (int table = 0; table <= most_concurrent_readers(); ++table) {
      owners.push_back(std::make_unique<tree>());
      const sr_opaque_handle_t loaded =
          owners.back()->ok() ? create_loaded_table(owners.back()->handle(), "/w11", rows)
                              : nullptr;
      if (table == 0) {
        tables.shared = loaded;
      } else {
        tables.copies.push_back(loaded);
      }
    }
  }
  return tables;
}

void load_concurrent_tables(const benchmark::State &state) {
  concurrent_tables(state.range(0));
}

void read_shared_table(benchmark::State &state) {
  read_keys(state, concurrent_tables(state.range(0)).shared,
            first_read_of_thread(state, static_cast<size_t>(state.range(0))));
}

void read_private_copy(benchmark::State &state) {
  read_keys(state,
            concurrent_tables(state.range(0)).copies.at(static_cast<size_t>(state.thread_index())),
            first_read_of_thread(state, static_cast<size_t>(state.range(0))));
}

template <bool Fixed_Index>
void read_by_index(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  if (!check(state, table != nullptr, "load the table")) {
    return;
  }
  uint64_t n = 0;
  for (auto _ : state) {
    read_row row;
    const auto index = static_cast<int32_t>(lookup_row(n++, rows));
    const int32_t rc = Fixed_Index ? sr_get_fields_by_fixed_index_and_visibility_1(
                                         table, index, Column_Names.data(), row.results().data(),
                                         Total_Columns, 0, nullptr)
                                   : sr_get_fields_by_index_1(table, index, Column_Names.data(),
                                                              row.results().data(), Total_Columns);
    if (!check(state, rc == 0, "read by index")) {
      return;
    }
    row.release();
  }
  state.SetItemsProcessed(state.iterations());
}

// Each iteration loads a new table into a new tree, both made and closed
// untimed, as the peers load into a new database. A transient table stays
// in its tree after its handle is closed, so one tree for every iteration
// would hold every table loaded so far and each load would take fresh
// memory from the kernel, where the peers reuse what they freed.
template <bool Persistent>
void bulk_load(benchmark::State &state) {
  rows_of(state.range(0));
  std::unique_ptr<scratch_directory> directory;
  if (Persistent) {
    directory = std::make_unique<scratch_directory>("ours-bulk");
  }
  uint32_t generation = 0;
  for (auto _ : state) {
    state.PauseTiming();
    auto owner = std::make_unique<tree>(Persistent ? directory->path() : "");
    if (!check(state, owner->ok(), "open the tree")) {
      return;
    }
    const std::string path = "/bench/bulk" + std::to_string(generation++);
    state.ResumeTiming();
    sr_opaque_handle_t table = create_loaded_table(owner->handle(), path.c_str(), state.range(0));
    if (!check(state, table != nullptr, "load the table")) {
      return;
    }
    state.PauseTiming();
    sr_close_table_1(table);
    owner.reset();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * state.range(0));
}

// A persistent table of Durable_Table_Rows rows, reopened with `mode`.
struct durable_table {
  scratch_directory directory{"ours-durable"};
  tree owner{directory.path()};
  sr_opaque_handle_t table = nullptr;

  explicit durable_table(int32_t mode) {
    if (!owner.ok()) {
      return;
    }
    sr_opaque_handle_t loaded =
        create_loaded_table(owner.handle(), "/bench/durable", Durable_Table_Rows);
    if (loaded == nullptr || sr_close_table_1(loaded) != 0) {
      return;
    }
    const hash_settings hash = hash_settings_for(Durable_Table_Rows);
    if (sr_open_hashed_key_table_1(owner.handle(), "/bench/durable", mode, hash.buckets,
                                   hash.function, compare_keys, &table) != 0) {
      table = nullptr;
    }
  }
};

int32_t set_count(sr_opaque_handle_t table, const std::string &key, int32_t count) {
  qv_value_t key_value{}, count_value{};
  key_value.ptr_char = const_cast<char *>(key.c_str());
  count_value.val_int32 = count;
  return sr_set_field_by_key_1(table, key_value, "count", &count_value);
}

void durable_set(benchmark::State &state) {
  durable_table durable(Open_Implicit);
  if (!check(state, durable.table != nullptr, "open the table")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(Durable_Table_Rows);
  uint64_t n = 0;
  for (auto _ : state) {
    const int32_t rc =
        set_count(durable.table, keys[n % Durable_Table_Rows], -static_cast<int32_t>(n));
    ++n;
    if (!check(state, rc == 0, "sr_set_field_by_key_1")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

void durable_add(benchmark::State &state) {
  durable_table durable(Open_Implicit);
  if (!check(state, durable.table != nullptr, "open the table")) {
    return;
  }
  // Rows past the table's first ones, formatted before timing.
  const std::vector<config_row> added = make_rows(Durable_Table_Rows, state.max_iterations);
  size_t next = 0;
  for (auto _ : state) {
    if (!check(state, add_row(durable.table, added[next++]) == 0, "sr_add_row_1")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations());
}

void durable_batch(benchmark::State &state) {
  durable_table durable(Open_Explicit);
  if (!check(state, durable.table != nullptr, "open the table")) {
    return;
  }
  const std::vector<std::string> keys = lookup_keys(Durable_Table_Rows);
  uint64_t n = 0;
  for (auto _ : state) {
    for (uint32_t change = 0; change < Batch_Changes; ++change, ++n) {
      if (!check(
              state,
              set_count(durable.table, keys[n % Durable_Table_Rows], static_cast<int32_t>(n)) == 0,
              "sr_set_field_by_key_1")) {
        return;
      }
    }
    if (!check(state, sr_apply_1(durable.table, 0) == 0 && sr_commit_1(durable.table) == 0,
               "apply and commit")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * Batch_Changes);
}

// Each iteration is a new process's first look at the table: a new tree,
// the table loaded from its file, every column of every row read.
void open_and_scan(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  scratch_directory directory("ours-scan");
  {
    tree writer(directory.path());
    if (!check(state,
               writer.ok() && create_loaded_table(writer.handle(), "/bench/scan", rows) != nullptr,
               "write the table file")) {
      return;
    }
  }
  for (auto _ : state) {
    tree reader(directory.path());
    sr_opaque_handle_t table = nullptr;
    if (!check(state,
               reader.ok() &&
                   sr_open_table_1(reader.handle(), "/bench/scan", Open_Read_Only, &table) == 0,
               "open the table")) {
      return;
    }
    for (uint32_t index = 0; index < rows; ++index) {
      read_row row;
      if (!check(state,
                 sr_get_fields_by_index_1(table, static_cast<int32_t>(index), Column_Names.data(),
                                          row.results().data(), Total_Columns) == 0,
                 "sr_get_fields_by_index_1")) {
        return;
      }
      row.release();
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

void memory(benchmark::State &state) {
  const int64_t rows = state.range(0);
  for (auto _ : state) {
    tree owner;
    const uint64_t before = heap_bytes_in_use();
    sr_opaque_handle_t table = create_loaded_table(owner.handle(), "/memory", rows);
    const uint64_t after = heap_bytes_in_use();
    if (!check(state, table != nullptr, "load the table")) {
      return;
    }
    state.counters["bytes_per_row"] = static_cast<double>(after - before) / rows;
  }
}

// sr_get_selected_rows_v_1 with the criteria's values as arguments.
int32_t get_selected_rows(sr_opaque_handle_t table, uint32_t *p_total, uint32_t **pp_rows,
                          const char *p_criteria, ...) {
  va_list values;
  va_start(values, p_criteria);
  const int32_t rc = sr_get_selected_rows_v_1(table, p_criteria, values, 0, p_total, pp_rows);
  va_end(values);
  return rc;
}

// The committed view's rows that one of the two criteria pick, as the
// malloc'ed array of fixed indexes the call hands over (and the caller
// frees).
template <bool Mixed>
void selection_scan(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  if (!check(state, table != nullptr, "load the table")) {
    return;
  }
  const selection_criteria criteria = selection_criteria_for(rows);
  char *const p_excluded_note = const_cast<char *>(criteria.excluded.note);
  for (auto _ : state) {
    uint32_t total = 0;
    uint32_t *p_rows = nullptr;
    const int32_t rc =
        Mixed ? get_selected_rows(table, &total, &p_rows, Mixed_Criteria, p_excluded_note,
                                  criteria.low, criteria.high)
              : get_selected_rows(table, &total, &p_rows, Integer_Criteria, criteria.above);
    if (!check(state, rc == 0, "sr_get_selected_rows_v_1")) {
      return;
    }
    benchmark::DoNotOptimize(p_rows);
    std::free(p_rows);
    if (!check(state, total == (Mixed ? criteria.mixed_matches : criteria.integer_matches),
               "rows selected")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// The rows the integer criteria pick, every column, copied into a new table
// by sr_select_1; checking and closing that table is not timed.
void selection_copy(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  if (!check(state, table != nullptr, "load the table")) {
    return;
  }
  const selection_criteria criteria = selection_criteria_for(rows);
  for (auto _ : state) {
    sr_opaque_handle_t result = nullptr;
    if (!check(state,
               sr_select_1(table, nullptr, 0, &result, Integer_Criteria, criteria.above) == 0,
               "sr_select_1")) {
      return;
    }
    state.PauseTiming();
    sr_table_metadata_t *p_metadata = nullptr;
    const bool copied = sr_get_table_metadata_1(result, 0, &p_metadata) == 0 &&
                        p_metadata->number_of_rows == criteria.integer_matches;
    if (p_metadata != nullptr) {
      sr_free_table_metadata_1(p_metadata);
    }
    const bool closed = sr_close_table_1(result) == 0;
    if (!check(state, copied && closed, "rows copied")) {
      return;
    }
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// Every row of the loaded table packed, the buffer unpacked into a new
// tree (keyed through the same hash) and freed, every value read there;
// closing the tree is not timed.
void ship_table(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  if (!check(state, table != nullptr, "load the table")) {
    return;
  }
  const hash_settings hash = hash_settings_for(rows);
  const uint32_t committed_view = 0, all_rows = 0;
  for (auto _ : state) {
    void *p_buffer = nullptr;
    if (!check(state,
               sr_pack_tables_1(1, &table, &committed_view, &all_rows, nullptr, &p_buffer) == 0,
               "sr_pack_tables_1")) {
      return;
    }
    auto receiver = std::make_unique<tree>();
    sr_opaque_handle_t unpacked = nullptr;
    const bool made =
        receiver->ok() && sr_unpack_table_1(p_buffer, hash.buckets, hash.function, compare_keys,
                                            receiver->handle(), 0, &unpacked) == 0;
    std::free(p_buffer);
    if (!check(state, made, "sr_unpack_table_1") ||
        !check(state, read_every_value(unpacked, rows), "read every value")) {
      return;
    }
    state.PauseTiming();
    receiver.reset();
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

// sr_unpack_table_1 alone, from a buffer packed once.
void unpack(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  sr_opaque_handle_t table = loaded_transient_table(rows);
  const uint32_t committed_view = 0, all_rows = 0;
  void *p_buffer = nullptr;
  if (!check(state,
             table != nullptr &&
                 sr_pack_tables_1(1, &table, &committed_view, &all_rows, nullptr, &p_buffer) == 0,
             "pack the table")) {
    return;
  }
  const hash_settings hash = hash_settings_for(rows);
  for (auto _ : state) {
    state.PauseTiming();
    auto receiver = std::make_unique<tree>();
    state.ResumeTiming();
    sr_opaque_handle_t unpacked = nullptr;
    if (!check(
            state,
            receiver->ok() && sr_unpack_table_1(p_buffer, hash.buckets, hash.function, compare_keys,
                                                receiver->handle(), 0, &unpacked) == 0,
            "sr_unpack_table_1")) {
      break;
    }
    state.PauseTiming();
    receiver.reset();
    state.ResumeTiming();
  }
  std::free(p_buffer);
  state.SetItemsProcessed(state.iterations() * rows);
}

}  // namespace

bool read_every_value(sr_opaque_handle_t table, uint32_t rows) {
  for (uint32_t index = 0; index < rows; ++index) {
    read_row row;
    if (sr_get_fields_by_index_1(table, static_cast<int32_t>(index), Column_Names.data(),
                                 row.results().data(), Total_Columns) != 0) {
      return false;
    }
    row.release();
  }
  qv_value_t beyond{};
  return sr_get_field_by_index_1(table, static_cast<int32_t>(rows), "count", &beyond) ==
         SR_E_NO_ROW_FOR_INDEX;
}

// Loaded transient tables are kept for the whole run, one per size, since
// Google Benchmark calls a benchmark several times while it settles on an
// iteration count and loading a million rows each time would dominate.
sr_opaque_handle_t loaded_transient_table(int64_t rows) {
  static tree owner;
  static std::map<int64_t, sr_opaque_handle_t> tables;
  auto &table = tables[rows];
  if (table == nullptr && owner.ok()) {
    const std::string path = "/loaded" + std::to_string(rows);
    table = create_loaded_table(owner.handle(), path.c_str(), rows);
  }
  return table;
}

sr_opaque_handle_t unpacked_transient_table(int64_t rows) {
  static tree receiver;
  static std::map<int64_t, sr_opaque_handle_t> tables;
  auto &table = tables[rows];
  sr_opaque_handle_t loaded = loaded_transient_table(rows);
  if (table != nullptr || loaded == nullptr || !receiver.ok()) {
    return table;
  }
  const uint32_t committed_view = 0, all_rows = 0;
  void *p_buffer = nullptr;
  if (sr_pack_tables_1(1, &loaded, &committed_view, &all_rows, nullptr, &p_buffer) == 0) {
    const hash_settings hash = hash_settings_for(rows);
    if (sr_unpack_table_1(p_buffer, hash.buckets, hash.function, compare_keys, receiver.handle(), 0,
                          &table) != 0) {
      table = nullptr;
    }
    std::free(p_buffer);
  }
  return table;
}

void register_ours() {
  add(W1_Read_By_Key, "ours", read_by_key);
  add(W2_Read_By_Packed_Index, "ours", read_by_index<false>);
  add(W2_Read_By_Fixed_Index, "ours", read_by_index<true>);
  add(W3_Bulk_Load, "ours", bulk_load<false>)->Unit(benchmark::kMillisecond);
  add(W3_Bulk_Load, "ours-file", bulk_load<true>)->Unit(benchmark::kMillisecond);
  add(W4_Durable_Set, "ours", durable_set, {Durable_Table_Rows});
  add(W4_Durable_Add, "ours", durable_add, {Durable_Table_Rows});
  add(W5_Durable_Batch, "ours", durable_batch, {Durable_Table_Rows})->Unit(benchmark::kMillisecond);
  add(W6_Open_And_Scan, "ours", open_and_scan)->Unit(benchmark::kMillisecond);
  add(W7_Memory, "ours", memory)->Iterations(1);
  add(W8_Select_Integer, "ours", selection_scan<false>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W8_Select_Mixed, "ours", selection_scan<true>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W9_Selection_Copy, "ours", selection_copy, Selection_Copy_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W10_Ship_Table, "ours", ship_table, Ship_Row_Counts)->Unit(benchmark::kMillisecond);
  add(W10_Unpack, "ours", unpack, Ship_Row_Counts)->Unit(benchmark::kMillisecond);
  add_concurrent_reads("ours", read_shared_table, load_concurrent_tables);
  add_concurrent_reads(W11_Floor, read_private_copy, load_concurrent_tables);
}

}  // namespace compare
