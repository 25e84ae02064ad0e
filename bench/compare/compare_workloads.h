// compare_workloads.h - what every program of the side-by-side comparison
// shares: the row every system stores, the table sizes, the order in which
// keys are looked up, a scratch directory on disk, and the naming scheme the
// report relies on.
//
// A benchmark is registered as "<workload>/<system>" with the row count as its
// argument, so Google Benchmark names it "<workload>/<system>/<rows>". The
// report groups by workload and rows and compares every system with the one
// named "ours". Rates are items per second (an item is one row read, one row
// written, one row scanned or one change); workload 7 reports the counter
// "bytes_per_row" instead.
#ifndef COMPARE_WORKLOADS_H
#define COMPARE_WORKLOADS_H

#include <benchmark/benchmark.h>

#include <cstdint>
#include <cstdio>
#include <string>
#include <vector>

namespace compare {

// A realistic configuration row: a 16-byte string key, a 32-bit and a 64-bit
// integer, a double and a 32-byte string.
inline constexpr size_t Key_Length = 16;
inline constexpr size_t Note_Length = 32;

struct config_row {
  char key[Key_Length + 1];
  int32_t count;
  int64_t total;
  double ratio;
  char note[Note_Length + 1];
};

// Row `i` of every table; the same for every system.
inline config_row make_row(uint32_t i) {
  config_row row{};
  std::snprintf(row.key, sizeof row.key, "cfg-%012u", i);
  row.count = static_cast<int32_t>(i);
  row.total = static_cast<int64_t>(i) * 1000003;
  row.ratio = i * 0.5;
  std::snprintf(row.note, sizeof row.note, "note for row %019u", i);
  return row;
}

// The workloads. Each system does the same work, the way its own
// documentation recommends for speed; one item is one row or one change.
//  w1 read by key: every column of one row looked up by key in a table held
//     in memory (strings copied out to the caller).
//  w2 read by index: every column of one row named by position (ours by
//     packed and by fixed index; SQLite by rowid).
//  w3 bulk load: `rows` rows added in one transaction, committed; timed from
//     an empty table to the commit.
//  w4 durable change: one change (set the 32-bit column of an existing row, or
//     add a row) on a table of 1,000 rows, durable on disk before the call
//     returns.
//  w5 durable batch: 1,000 sets per transaction, durable at commit.
//  w6 open and scan: a table file of `rows` rows opened by a new reader and
//     every column of every row read.
//  w7 memory: bytes held per row by a table of `rows` rows in memory.
//  w8 selection scan: the rows that criteria pick, listed by position
//     (ours: fixed indexes; SQLite: rowids), from a table held in memory; one
//     item is one row scanned. Two criteria: an integer comparison, and a
//     string comparison with an integer range (see selection_criteria).
//  w9 selection copy: the rows the integer criteria pick copied into a new
//     table in memory; one item is one row scanned, not one row copied.
//  w10 ship a table: every row of a table held in memory made one buffer
//     (ours: sr_pack_tables_1; SQLite: sqlite3_serialize), the buffer made
//     a table of another handle (ours: sr_unpack_table_1 into a new tree;
//     SQLite: sqlite3_deserialize into a new connection), and every column
//     of every row read there; one item is one row. w10_unpack times the
//     unpacking alone, beside the floor of building its row index and key
//     hash table alone ("index-build", compare_index_floor.cpp).
//  w11 concurrent reads: w1's read by key, by 1, 2 and (where the machine
//     has four processors) 4 threads at once from one table held in memory
//     (LMDB: one read transaction per thread, reset and renewed around each
//     read; SQLite: one connection per thread to one WAL file). One item is
//     one row read by any thread, so the rate is all threads' together. The
//     floor ("private-copies") is the same threads each reading a table of
//     its own through our interface, sharing nothing.
inline constexpr const char *W1_Read_By_Key = "w1_read_by_key";
inline constexpr const char *W2_Read_By_Packed_Index = "w2_read_by_packed_index";
inline constexpr const char *W2_Read_By_Fixed_Index = "w2_read_by_fixed_index";
inline constexpr const char *W3_Bulk_Load = "w3_bulk_load";
inline constexpr const char *W4_Durable_Set = "w4_durable_set";
inline constexpr const char *W4_Durable_Add = "w4_durable_add";
inline constexpr const char *W5_Durable_Batch = "w5_durable_batch";
inline constexpr const char *W6_Open_And_Scan = "w6_open_and_scan";
inline constexpr const char *W7_Memory = "w7_memory";
inline constexpr const char *W8_Select_Integer = "w8_selection_scan_integer";
inline constexpr const char *W8_Select_Mixed = "w8_selection_scan_mixed";
inline constexpr const char *W9_Selection_Copy = "w9_selection_copy";
inline constexpr const char *W10_Ship_Table = "w10_ship_table";
inline constexpr const char *W10_Unpack = "w10_unpack";
inline constexpr const char *W11_Concurrent_Reads = "w11_concurrent_reads";
// The system name of workload 11's floor.
inline constexpr const char *W11_Floor = "private-copies";

// Rows of the tables the durable workloads change, and changes per batch.
inline constexpr uint32_t Durable_Table_Rows = 1000;
inline constexpr uint32_t Batch_Changes = 1000;

// The table sizes of the scaling workloads.
inline const std::vector<int64_t> Row_Counts = {1000, 100000, 1000000};

// The table sizes of the selection scan and of the selection copy.
inline const std::vector<int64_t> Selection_Scan_Row_Counts = {100000, 1000000};
inline const std::vector<int64_t> Selection_Copy_Row_Counts = {1000000};

// The table size of the shipping workload.
inline const std::vector<int64_t> Ship_Row_Counts = {100000};
// The table sizes of the concurrent reads.
inline const std::vector<int64_t> Concurrent_Read_Row_Counts = {1000, 100000};

// The values of the selection criteria for a table of `rows` rows, the same
// in every system; each picks about a tenth of the rows.
//  integer: count > above, true for the last tenth of the rows.
//  mixed: note != excluded_note && count >= low && count < high. Every
//     note is different, so the string comparison is true for all rows but
//     one; it comes first so that every row pays for it, and the range picks
//     a tenth of the rows from the middle of the table, the excluded note's
//     row among them.
struct selection_criteria {
  int32_t above;
  int32_t low;
  int32_t high;
  config_row excluded;  // its note is the excluded one
  uint32_t integer_matches;
  uint32_t mixed_matches;
};

inline selection_criteria selection_criteria_for(uint32_t rows) {
  selection_criteria criteria{};
  const uint32_t tenth = rows / 10;
  criteria.above = static_cast<int32_t>(rows - tenth) - 1;
  criteria.low = static_cast<int32_t>(rows / 2);
  criteria.high = criteria.low + static_cast<int32_t>(tenth);
  criteria.excluded = make_row(static_cast<uint32_t>(criteria.low) + 1);
  criteria.integer_matches = tenth;
  criteria.mixed_matches = tenth - 1;
  return criteria;
}

// The criteria in the registry's language, with "$" replacement variables
// for the values above in the order they are listed.
inline constexpr const char *Integer_Criteria = "count > $i";
inline constexpr const char *Mixed_Criteria = "note != $s && count >= $i && count < $i";

// The n-th key a read workload looks up in a table of `rows` rows: a fixed
// stride through the table, coprime with every size above, so consecutive
// reads land far apart and every row is visited once per `rows` reads.
inline uint32_t lookup_row(uint64_t n, uint32_t rows) {
  return static_cast<uint32_t>((n * 7919u) % rows);
}

// Rows first .. first+count-1, formatted before a timed loop.
inline std::vector<config_row> make_rows(uint32_t first, uint64_t count) {
  std::vector<config_row> rows(count);
  for (uint64_t i = 0; i < count; ++i) {
    rows[i] = make_row(static_cast<uint32_t>(first + i));
  }
  return rows;
}

// The keys of reads 0 .. rows-1, formatted before a timed loop; read n uses
// keys[n % rows].
inline std::vector<std::string> lookup_keys(uint32_t rows) {
  std::vector<std::string> keys;
  keys.reserve(rows);
  for (uint32_t n = 0; n < rows; ++n) {
    keys.emplace_back(make_row(lookup_row(n, rows)).key);
  }
  return keys;
}

// A fresh directory for a benchmark's files, removed with everything in it
// when the object goes away. It lies below $QV_BENCH_DIR, or /var/tmp, so
// that durable workloads flush to a real disk rather than to memory.
class scratch_directory {
 public:
  explicit scratch_directory(const char *p_label);
  ~scratch_directory();
  scratch_directory(const scratch_directory &) = delete;
  scratch_directory &operator=(const scratch_directory &) = delete;
  const std::string &path() const { return path_; }
  std::string file(const char *p_name) const { return path_ + "/" + p_name; }

 private:
  std::string path_;
};

// Size in bytes of the file at `path`; 0 when it does not exist.
uint64_t file_size(const std::string &path);

// Bytes the C heap holds in use (small and large blocks); measures the memory
// a system keeps for its rows.
uint64_t heap_bytes_in_use();

// Registers `function` as "<workload>/<system>" once per entry of `rows`.
benchmark::internal::Benchmark *add(const std::string &workload, const std::string &system,
                                    void (*function)(benchmark::State &),
                                    const std::vector<int64_t> &rows = Row_Counts);

// Registers `function` as a workload 11 benchmark of `system`, run by each
// thread count the machine has processors for; `setup` makes what the
// threads share before they start.
benchmark::internal::Benchmark *add_concurrent_reads(const std::string &system,
                                                     void (*function)(benchmark::State &),
                                                     void (*setup)(const benchmark::State &));

// The most threads workload 11 runs: 4 where the machine has four
// processors, else 2.
int most_concurrent_readers();

// Where the reads of the calling thread start in the lookup order: the
// threads spread evenly over it, so that they do not read the same rows in
// step.
inline size_t first_read_of_thread(const benchmark::State &state, size_t rows) {
  return rows * static_cast<size_t>(state.thread_index()) / static_cast<size_t>(state.threads());
}

// Fails the running benchmark with `what` when `ok` is false. Returns `ok`.
bool check(benchmark::State &state, bool ok, const char *what);

// The registrations of each program of the comparison; main calls them all.
void register_ours();
void register_sqlite();
void register_lmdb();
void register_floors();
void register_record_floor();
void register_index_floor();

}  // namespace compare

#endif  // COMPARE_WORKLOADS_H
