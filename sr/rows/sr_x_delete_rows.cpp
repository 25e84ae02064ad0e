// sr_x_delete_rows.cpp - sr_delete_row_by_index_1 and sr_delete_rows_1:
// pending deletions of one row by packed index, of every row, or of the rows
// selected by criteria.

#include <cstdarg>

#include "frame/sr_i_frame.h"
#include "queries/sr_i_selection_criteria.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {

constexpr sr_i_entry_point_t Delete_Row_By_Index{29, true};
constexpr sr_i_entry_point_t Delete_Rows{31, true};

int32_t delete_row_at_packed_index(sr_i_table_t *p_table, uint32_t row_index) {
  if (row_index >= p_table->total_applied_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  sr_i_index_entry_t *p_entry =
      &p_table->p_rows_fixed_index[p_table->p_rows_packed_index[row_index]];
  // A deleted row keeps its packed position until commit; deleting it again
  // would count it twice.
  if (p_entry->p_applied == nullptr) {
    return sr_i_raise(SR_E_ROW_DELETED);
  }
  return sr_i_delete_row(p_table, p_entry);
}

}  // namespace

extern "C" int32_t sr_delete_row_by_index_1(sr_opaque_handle_t table_handle, uint32_t row_index) {
  return sr_i_run_entry_point(Delete_Row_By_Index, [&] {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return delete_row_at_packed_index(p_table, row_index);
    });
  });
}

extern "C" int32_t sr_delete_rows_1(sr_opaque_handle_t table_handle, const char *selection_criteria,
                                    ...) {
  va_list replacement_values;
  va_start(replacement_values, selection_criteria);
  const int32_t rc = sr_i_run_entry_point(Delete_Rows, [&] {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
      sr_i_expanded_criteria expanded;
      if (const int32_t expand_rc =
              sr_i_expand_criteria(selection_criteria, replacement_values, expanded);
          expand_rc != 0) {
        return expand_rc;
      }
      return sr_i_delete_rows(p_table, expanded.get());
    });
  });
  va_end(replacement_values);
  return rc;
}
