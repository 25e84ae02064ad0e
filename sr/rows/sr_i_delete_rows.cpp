// sr_i_delete_rows.cpp - deleting rows from the applied view: one row, all
// rows, or the rows that selection criteria pick. A deleted row keeps its
// committed record (the committed view still reads it) and its place in the
// packed index until the next commit; its pending change becomes a deletion.

#include "frame/sr_i_errors.h"
#include "queries/sr_i_selection_criteria.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_hash_table.h"

int32_t sr_i_delete_row(sr_i_table_t *p_table, sr_i_index_entry_t *p_current_index_entry) {
  if (const int32_t rc = sr_i_common_add_change_entry(p_table, p_current_index_entry, 1); rc != 0) {
    return rc;
  }
  sr_i_index_entry_t &entry = *p_current_index_entry;
  if (entry.p_applied != entry.p_committed) {
    sr_i_rb_free_record(&p_table->record_buffer_pool, entry.p_applied);
  }
  // A row that was never committed has its hash element pointing into the
  // record just released: take the element out now, so that no key lookup
  // or key check reads freed memory. A committed row's element points into
  // its committed record and stays until the deletion is committed.
  if (entry.p_committed == nullptr && entry.p_hash_table_element != nullptr &&
      p_table->p_rows_hash_table != nullptr) {
    sr_i_hash_table_remove_element(p_table->p_rows_hash_table, entry.hash_index,
                                   entry.p_hash_table_element);
    entry.p_hash_table_element = nullptr;
  }
  entry.p_applied = nullptr;
  ++p_table->applied_deletions;
  return 0;
}

namespace {

// Deletes the live rows of the applied view that `wanted` picks, in
// fixed-index order.
template <typename Wanted>
int32_t delete_live_rows(sr_i_table_t *p_table, Wanted &&wanted) {
  const uint32_t live_rows = p_table->total_applied_rows - p_table->applied_deletions;
  uint32_t seen = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows && seen < live_rows; ++position) {
    sr_i_index_entry_t *p_entry = &p_table->p_rows_fixed_index[position];
    if (p_entry->p_applied == nullptr) {
      continue;
    }
    ++seen;
    bool matches = false;
    if (const int32_t rc = wanted(p_entry->p_applied, matches); rc != 0) {
      return rc;
    }
    if (matches) {
      if (const int32_t rc = sr_i_delete_row(p_table, p_entry); rc != 0) {
        return rc;
      }
    }
  }
  return 0;
}

}  // namespace

int32_t sr_i_delete_rows(sr_i_table_t *p_table, const char *p_selection_criteria) {
  if (p_table->ready_for_commit != 0) {
    return sr_i_raise(SR_E_APPLIED_UNCOMMITTED);
  }
  if (p_table->total_applied_rows - p_table->applied_deletions == 0) {
    return sr_i_raise(SR_E_NO_ROWS);
  }
  sr_i_table_criteria criteria;
  if (const int32_t rc = criteria.compile(p_table, p_selection_criteria); rc != 0) {
    return rc;
  }
  return delete_live_rows(p_table, [&](const void *p_record, bool &matches) {
    return criteria.matches(p_table, p_record, &matches);
  });
}
