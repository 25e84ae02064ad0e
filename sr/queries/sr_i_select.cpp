// sr_i_select.cpp - selection: walking the rows of one view of a table,
// judging each with compiled criteria, and either copying the rows that
// match into a new memory-only table (whole, or reduced to chosen columns)
// or listing their fixed indexes.
//
// A new table is built complete before anyone sees it: its pool is sized for
// the copies in one step, its row index for every row that could match, and
// its packed index and hash elements are made once at the end, as after a
// load, so a failure anywhere only has to free it.

#include "queries/sr_i_select.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "frame/sr_i_errors.h"
#include "queries/sr_i_selection_criteria.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_hash_table.h"

namespace {

// One view of a table: the applied records or the committed ones.
struct table_view {
  bool applied;

  uint32_t total_rows(const sr_i_table_t *p_table) const {
    return applied ? p_table->total_applied_rows - p_table->applied_deletions
                   : p_table->total_committed_rows;
  }
  const void *record(const sr_i_index_entry_t &entry) const {
    return applied ? entry.p_applied : entry.p_committed;
  }
};

// How many positions of the fixed index one call of the evaluator judges:
// enough that the call's own cost is spread thin and that few rows come at
// the start of a batch, before the evaluator's reading ahead has begun (256
// was measurably slower); few enough that the verdicts, a byte each, stay
// on the stack.
constexpr uint32_t Batch_Positions = 1024;

// Calls `visit(position, entry, record)` for each row the view shows whose
// record in the `judged` view matches the criteria, in fixed-index order,
// and stops at the first failure it returns. Positions are judged a batch
// at a time, before the view is walked through them.
template <typename Visit>
int32_t walk_matching_rows(const sr_i_table_t *p_table, table_view view, table_view judged,
                           const sr_i_table_criteria &criteria, Visit &&visit) {
  const uint32_t total_rows = view.total_rows(p_table);
  unsigned char verdicts[Batch_Positions];
  uint32_t seen = 0;
  for (uint32_t first = 0; first < p_table->maximum_rows && seen < total_rows;
       first += Batch_Positions) {
    const uint32_t count = std::min(Batch_Positions, p_table->maximum_rows - first);
    const sr_i_index_entry_t *p_entries = p_table->p_rows_fixed_index + first;
    if (const int32_t rc = criteria.judge(p_table, p_entries, count, judged.applied, verdicts);
        rc != 0) {
      return rc;
    }
    for (uint32_t at = 0; at < count && seen < total_rows; ++at) {
      const void *p_record = view.record(p_entries[at]);
      if (p_record == nullptr) {
        continue;
      }
      ++seen;
      if (verdicts[at] == 0) {
        continue;
      }
      if (const int32_t rc = visit(first + at, p_entries[at], p_record); rc != 0) {
        return rc;
      }
    }
  }
  return 0;
}

// The source columns of a selection: the key first, then each named column
// in the caller's order (the key named again is not repeated).
int32_t choose_columns(const sr_i_table_t *p_table, const char *const *p_column_names,
                       uint32_t total_column_names, std::vector<uint32_t> &columns) {
  if (p_column_names == nullptr) {
    return sr_i_raise(SR_E_NO_COLUMNS);
  }
  columns.reserve(total_column_names + 1);
  columns.push_back(0);
  for (uint32_t at = 0; at < total_column_names; ++at) {
    const int32_t column =
        p_column_names[at] != nullptr ? sr_i_find_column(p_table, p_column_names[at]) : -1;
    if (column < 0) {
      return sr_i_raise(SR_E_INVALID_COLUMN);
    }
    if (column != 0) {
      columns.push_back(static_cast<uint32_t>(column));
    }
  }
  return 0;
}

// Whether the chosen columns are all of the table's in order, so that rows
// are copied as they are.
bool copies_whole_rows(const sr_i_table_t *p_table, std::span<const uint32_t> columns) {
  if (columns.size() != p_table->total_columns) {
    return false;
  }
  for (uint32_t column = 0; column < columns.size(); ++column) {
    if (columns[column] != column) {
      return false;
    }
  }
  return true;
}

// The record's data length, without the pool's header.
uint32_t record_data_length(const void *p_record) {
  return sr_i_rb_record_header(const_cast<void *>(p_record))->record_length -
         Sr_Record_Header_Length;
}

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
};

// An empty result table shaped like the source, reduced to `columns`: pool
// room for every copy at once, the metadata record, a row index for every
// row that could match, the source's kind of key hash table.
int32_t make_result_table(const sr_i_table_t *p_table, std::span<const uint32_t> columns,
                          sr_i_table_t *p_new_table) {
  p_new_table->mode = Sr_Mode_Writable;
  p_new_table->implicitly_controlled = 0;
  if (const uint32_t used = p_table->record_buffer_pool.used_bytes; used > 0) {
    if (const int32_t rc = sr_i_rb_make_room(&p_new_table->record_buffer_pool, used); rc != 0) {
      return rc;
    }
  }
  if (const int32_t rc = sr_i_build_selected_metadata_record(p_new_table, p_table, columns);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_establish_rows_index(p_new_table, p_table->total_applied_rows);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc =
          sr_i_hash_table_open_like(p_table->p_rows_hash_table, &p_new_table->p_rows_hash_table);
      rc != 0) {
    return rc;
  }
  return sr_i_open_key_hash_and_metadata(p_new_table);
}

}  // namespace

int32_t sr_i_copy_row(const sr_i_table_t *p_table, const void *p_from_record_data,
                      sr_i_table_t *p_new_table, const uint32_t *p_column_indices) {
  sr_i_record_buffer_pool_t *p_pool = &p_new_table->record_buffer_pool;
  void *p_record = nullptr;
  if (p_column_indices == nullptr) {
    const uint32_t length = record_data_length(p_from_record_data);
    if (const int32_t rc = sr_i_reserve_record(p_pool, length, SR_I_RECORD_ROW, &p_record);
        rc != 0) {
      return rc;
    }
    std::memcpy(p_record, p_from_record_data, length);
  } else {
    // Bodies refer to nothing outside themselves, so each moves by its
    // anchor alone, packed in the new column order.
    sr_i_row_builder builder(p_new_table);
    const unsigned char *p_variable = sr_i_row_variable_part(p_table, p_from_record_data);
    for (uint32_t column = 0; column < p_new_table->total_columns; ++column) {
      const unsigned char *p_slot = sr_i_row_slot(p_from_record_data, p_column_indices[column]);
      if (sr_i_is_variable_length(p_new_table->p_columns[column].type)) {
        const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(p_slot);
        builder.put_body(column, p_variable + anchor.offset, anchor.length);
      } else {
        builder.put_slot(column, p_slot);
      }
    }
    sr_i_record_metadata_t *p_previous_free = nullptr;
    if (const int32_t rc = sr_i_place_row_record(p_new_table, builder, &p_record, &p_previous_free);
        rc != 0) {
      return rc;
    }
    if (const int32_t rc = sr_i_rb_allocate_record(p_pool, p_record, p_previous_free,
                                                   builder.length(), SR_I_RECORD_ROW);
        rc != 0) {
      return rc;
    }
  }
  sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_new_table);
  if (p_entry == nullptr) {
    sr_i_rb_free_record(p_pool, p_record);
    return sr_i_raise_internal();  // the index was sized for every row
  }
  p_entry->p_applied = p_record;
  p_entry->p_committed = p_record;
  ++p_new_table->total_applied_rows;
  return 0;
}

int32_t sr_i_select(sr_i_table_t *p_table, const char *const *p_column_names,
                    uint32_t total_column_names, const char *p_selection_criteria,
                    sr_i_table_t **pp_select_table) {
  std::vector<uint32_t> columns;
  if (total_column_names != 0) {
    if (const int32_t rc = choose_columns(p_table, p_column_names, total_column_names, columns);
        rc != 0) {
      return rc;
    }
  } else {
    for (uint32_t column = 0; column < p_table->total_columns; ++column) {
      columns.push_back(column);
    }
  }
  return sr_i_select_columns(p_table, columns, p_selection_criteria,
                             p_table->uncommitted_updates_visible, pp_select_table);
}

int32_t sr_i_select_columns(sr_i_table_t *p_table, std::span<const uint32_t> columns,
                            const char *p_selection_criteria, uint32_t uncommitted_updates_visible,
                            sr_i_table_t **pp_select_table) {
  sr_i_table_t *p_new_table = sr_i_create_null_table();
  if (p_new_table == nullptr) {
    return SR_E_NO_MEMORY;
  }
  table_closer closer{p_new_table};
  if (const int32_t rc = make_result_table(p_table, columns, p_new_table); rc != 0) {
    return rc;
  }
  sr_i_table_criteria criteria;
  if (const int32_t rc = criteria.compile(p_table, p_selection_criteria); rc != 0) {
    return rc;
  }
  const uint32_t *p_column_indices = copies_whole_rows(p_table, columns) ? nullptr : columns.data();
  const table_view view{uncommitted_updates_visible != 0};
  const auto copy_row = [&](uint32_t, const sr_i_index_entry_t &, const void *p_record) {
    return sr_i_copy_row(p_table, p_record, p_new_table, p_column_indices);
  };
  if (const int32_t rc = walk_matching_rows(p_table, view, view, criteria, copy_row); rc != 0) {
    return rc;
  }
  p_new_table->total_committed_rows = p_new_table->total_applied_rows;
  if (const int32_t rc = sr_i_establish_secondary_row_access(p_new_table); rc != 0) {
    return rc;
  }
  p_new_table->p_tree = p_table->p_tree;
  p_new_table->change_counter = p_table->change_counter + 1;
  p_new_table->applied_change_counter = p_new_table->change_counter;
  *pp_select_table = p_new_table;
  closer.p_table = nullptr;
  return 0;
}

int32_t sr_i_get_selected_rows(sr_i_table_t *p_table, const char *p_selection_criteria,
                               uint32_t uncommitted_updates_visible,
                               uint32_t *p_total_selected_rows,
                               uint32_t **pp_selected_rows_fixed_index) {
  const table_view view{uncommitted_updates_visible != 0 ||
                        p_table->uncommitted_updates_visible != 0};
  // Room for every visible row, and never a request for nothing.
  const uint32_t room = view.total_rows(p_table);
  auto *p_rows = static_cast<uint32_t *>(std::malloc((room > 0 ? room : 1) * sizeof(uint32_t)));
  if (p_rows == nullptr) {
    return sr_i_raise_no_memory();
  }
  sr_i_table_criteria criteria;
  uint32_t total = 0;
  int32_t rc = criteria.compile(p_table, p_selection_criteria);
  if (rc == 0) {
    // Criteria are judged on the row's pending values, in either view; a
    // row deleted in the applied view has none and does not match.
    const table_view judged{true};
    rc = walk_matching_rows(p_table, view, judged, criteria,
                            [&](uint32_t position, const sr_i_index_entry_t &, const void *) {
                              p_rows[total++] = position;
                              return 0;
                            });
  }
  if (rc != 0) {
    std::free(p_rows);
    return rc;
  }
  *p_total_selected_rows = total;
  *pp_selected_rows_fixed_index = p_rows;
  return 0;
}
