// sr_i_delete_columns.cpp - the rebuilt image of a table that loses
// columns: a selection, with no criteria, of the key and every column not
// named, in table order. Invisible columns cannot be named, so they are
// always kept.

#include <cstring>
#include <vector>

#include "frame/sr_i_errors.h"
#include "queries/sr_i_select.h"
#include "rows/sr_i_rows.h"
#include "schema/sr_i_schema_changes.h"

int32_t sr_i_delete_columns(sr_i_table_t *p_table, const char *const *p_column_names,
                            uint32_t total_column_names, sr_i_table_t **pp_result_table) {
  if (p_column_names == nullptr) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  if (total_column_names == 0) {
    return sr_i_raise(SR_E_NO_COLUMNS);
  }
  if (const int32_t rc = sr_i_check_rebuildable(p_table); rc != 0) {
    return rc;
  }
  if (total_column_names > p_table->total_columns - 1) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  std::vector<bool> deleted(p_table->total_columns, false);
  for (uint32_t at = 0; at < total_column_names; ++at) {
    const int32_t column = sr_i_find_column(p_table, p_column_names[at]);
    if (column <= 0 || (p_table->p_columns[column].qualifier & SR_INVISIBLE) != 0) {
      return sr_i_raise(SR_E_INVALID_COLUMN);
    }
    deleted[column] = true;
  }
  std::vector<uint32_t> kept{0};
  for (uint32_t column = 1; column < p_table->total_columns; ++column) {
    if (!deleted[column]) {
      kept.push_back(column);
    }
  }
  return sr_i_select_columns(p_table, kept, nullptr, 0, pp_result_table);
}
