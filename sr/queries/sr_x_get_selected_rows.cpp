// sr_x_get_selected_rows.cpp - sr_get_selected_rows_v_1: the fixed indexes
// of the rows that criteria pick, under the table's read lock alone. A
// reading call: no fork guard, no ForkMutex.

#include <cstdarg>

#include "frame/sr_i_frame.h"
#include "queries/sr_i_select.h"
#include "queries/sr_i_selection_criteria.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Get_Selected_Rows{63, false};
}

extern "C" int32_t sr_get_selected_rows_v_1(sr_opaque_handle_t table_handle,
                                            const char *p_selection_criteria, va_list ap,
                                            uint32_t uncommitted_updates_visible,
                                            uint32_t *p_total_selected_rows,
                                            uint32_t **p_p_selected_rows_fixed_index) {
  return sr_i_run_entry_point(Get_Selected_Rows, [&] {
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
      if (p_total_selected_rows == nullptr || p_p_selected_rows_fixed_index == nullptr) {
        return sr_i_raise(SR_E_NULL_POINTER);
      }
      sr_i_expanded_criteria expanded;
      if (const int32_t rc = sr_i_expand_criteria(p_selection_criteria, ap, expanded); rc != 0) {
        return rc;
      }
      return sr_i_get_selected_rows(p_table, expanded.get(), uncommitted_updates_visible,
                                    p_total_selected_rows, p_p_selected_rows_fixed_index);
    });
  });
}
