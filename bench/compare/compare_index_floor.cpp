// compare_index_floor.cpp - the floor of unpacking (w10_unpack): the row
// index and key hash table of an unpacked table built again, by a loop
// written by hand, from the records of a table already unpacked, where they
// lie. It is the work no unpacking can leave out: every row gets an entry
// of the fixed row index (the 48-byte entry a table's index is made of,
// pointing at its record, listed in the packed index), and its key is
// hashed by the same client function into a chained table of the same
// bucket count and checked against the keys already there with the same
// compare function. Left out is what sr_unpack_table_1 does besides: read
// and check the buffer's header and metadata, copy the rows so that the
// caller may free its buffer, check each record before following it, and
// make the table and enter it in a tree. The blocks are had from the heap
// as a program would have them, without the page advice the library gives
// its own large blocks. Like the record floor, it reads the library's
// internal layout and so includes internal headers.

#include <cstdlib>
#include <cstring>
#include <memory>

#include "compare_ours.h"
#include "compare_workloads.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

namespace compare {
namespace {

constexpr const char *Index_Build_System = "index-build";

// The key body of a record whose key is a string.
const void *string_key(const sr_i_table_t *p_table, const void *p_record) {
  const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(sr_i_row_slot(p_record, 0));
  return sr_i_row_variable_part(p_table, p_record) + anchor.offset;
}

struct chained_element {
  uint32_t row;
  const void *p_key;
  chained_element *p_next;
};

// Builds the index and the hash table of `p_table`'s rows into blocks of
// its own and frees them. False when a key is found twice or memory runs
// out.
bool build_index(const sr_i_table_t *p_table, sr_hash_function_t hash,
                 sr_hash_keys_compare_function_t compare, uint32_t buckets) {
  const uint32_t rows = p_table->total_committed_rows;
  std::unique_ptr<sr_i_index_entry_t, decltype(&std::free)> index(
      static_cast<sr_i_index_entry_t *>(std::calloc(rows, sizeof(sr_i_index_entry_t))), &std::free);
  std::unique_ptr<uint32_t, decltype(&std::free)> packed(
      static_cast<uint32_t *>(std::calloc(rows, sizeof(uint32_t))), &std::free);
  std::unique_ptr<chained_element *[]> heads(new chained_element *[buckets]());
  std::unique_ptr<chained_element[]> elements(new chained_element[rows]);
  if (index == nullptr || packed == nullptr) {
    return false;
  }
  for (uint32_t row = 0; row < rows; ++row) {
    const void *p_record = p_table->p_rows_fixed_index[row].p_committed;
    sr_i_index_entry_t &entry = index.get()[row];
    entry.p_applied = const_cast<void *>(p_record);
    entry.p_committed = entry.p_applied;
    entry.packed_index = row;
    packed.get()[row] = row;
    const void *p_key = string_key(p_table, p_record);
    const uint32_t bucket = hash(p_key);
    for (const chained_element *p_older = heads[bucket]; p_older != nullptr;
         p_older = p_older->p_next) {
      if (compare(p_older->p_key, p_key) == 0) {
        return false;
      }
    }
    elements[row] = {row, p_key, heads[bucket]};
    heads[bucket] = &elements[row];
    entry.hash_index = bucket;
  }
  benchmark::DoNotOptimize(index.get());
  benchmark::DoNotOptimize(heads.get());
  return true;
}

void index_build(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const auto *p_table = static_cast<const sr_i_table_t *>(unpacked_transient_table(rows));
  if (!check(state,
             p_table != nullptr && p_table->p_rows_hash_table != nullptr &&
                 p_table->total_committed_rows == rows && p_table->p_columns[0].type == QV_CHAR_PTR,
             "unpack the table")) {
    return;
  }
  const sr_hash_table_t *p_hash = p_table->p_rows_hash_table;
  for (auto _ : state) {
    if (!check(state,
               build_index(p_table, p_hash->p_hash_function, p_hash->p_compare_function,
                           p_hash->total_hash_buckets),
               "build the index")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

}  // namespace

void register_index_floor() {
  add(W10_Unpack, Index_Build_System, &index_build, Ship_Row_Counts)->Unit(benchmark::kMillisecond);
}

}  // namespace compare
