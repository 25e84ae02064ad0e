// compare_record_floor.cpp - the floor of the selection scan: a loop written
// by hand over our own row records, the very table our selection reads,
// that takes each value out of its slot and compares it in C. It is what a
// selection costs with nothing between the records and the comparison (no
// lock, no compiled criteria, no evaluator), and it lists the matching rows
// as the selection does. It and the index floor (compare_index_floor.cpp)
// are the parts of the comparison that read the library's internal layout
// (sr/rows/sr_i_rows.h), so they alone include internal headers.

#include <cstring>
#include <vector>

#include "compare_ours.h"
#include "compare_workloads.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_table.h"

namespace compare {
namespace {

constexpr const char *Record_Loop_System = "record-loop";

// The 32-bit integer in the record's slot of `column`.
int32_t integer_in(const void *p_record, uint32_t column) {
  int32_t value;
  std::memcpy(&value, sr_i_row_slot(p_record, column), sizeof value);
  return value;
}

// Whether the string in the record's slot of `column` differs from `p_text`
// of `length` bytes. The stored body is the string and its NUL.
bool string_differs(const sr_i_table_t *p_table, const void *p_record, uint32_t column,
                    const char *p_text, uint32_t length) {
  const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(sr_i_row_slot(p_record, column));
  const unsigned char *p_body = sr_i_row_variable_part(p_table, p_record) + anchor.offset;
  return anchor.length != length + 1 || std::memcmp(p_body, p_text, length) != 0;
}

// The columns the loop reads are where compare_ours.h says, with the types
// it reads them as.
bool columns_as_expected(const sr_i_table_t *p_table) {
  return p_table->total_columns > Note_Column &&
         std::strcmp(p_table->p_columns[Count_Column].name, "count") == 0 &&
         p_table->p_columns[Count_Column].type == QV_INT32 &&
         std::strcmp(p_table->p_columns[Note_Column].name, "note") == 0 &&
         p_table->p_columns[Note_Column].type == QV_CHAR_PTR;
}

// The rows of the committed view, in fixed-index order, judged on their
// applied records as the selection judges them, their positions listed in
// `selected` (sized for every row beforehand).
template <bool Mixed>
uint32_t select_rows(const sr_i_table_t *p_table, const selection_criteria &criteria,
                     uint32_t note_length, uint32_t *p_selected) {
  const uint32_t total_rows = p_table->total_committed_rows;
  uint32_t seen = 0;
  uint32_t total = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows && seen < total_rows; ++position) {
    const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    if (entry.p_committed == nullptr) {
      continue;
    }
    ++seen;
    const void *p_record = entry.p_applied;
    if (p_record == nullptr) {
      continue;
    }
    bool matches;
    if (Mixed) {
      const int32_t count = integer_in(p_record, Count_Column);
      matches =
          string_differs(p_table, p_record, Note_Column, criteria.excluded.note, note_length) &&
          count >= criteria.low && count < criteria.high;
    } else {
      matches = integer_in(p_record, Count_Column) > criteria.above;
    }
    if (matches) {
      p_selected[total++] = position;
    }
  }
  return total;
}

template <bool Mixed>
void record_loop(benchmark::State &state) {
  const auto rows = static_cast<uint32_t>(state.range(0));
  const auto *p_table = static_cast<const sr_i_table_t *>(loaded_transient_table(rows));
  if (!check(state, p_table != nullptr && columns_as_expected(p_table), "load the table")) {
    return;
  }
  const selection_criteria criteria = selection_criteria_for(rows);
  const auto note_length = static_cast<uint32_t>(std::strlen(criteria.excluded.note));
  std::vector<uint32_t> selected(rows);
  for (auto _ : state) {
    const uint32_t total = select_rows<Mixed>(p_table, criteria, note_length, selected.data());
    benchmark::DoNotOptimize(selected.data());
    if (!check(state, total == (Mixed ? criteria.mixed_matches : criteria.integer_matches),
               "rows selected")) {
      return;
    }
  }
  state.SetItemsProcessed(state.iterations() * rows);
}

}  // namespace

void register_record_floor() {
  add(W8_Select_Integer, Record_Loop_System, &record_loop<false>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
  add(W8_Select_Mixed, Record_Loop_System, &record_loop<true>, Selection_Scan_Row_Counts)
      ->Unit(benchmark::kMillisecond);
}

}  // namespace compare
