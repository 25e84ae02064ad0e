// sr_x_get_updated_rows.cpp - sr_get_updated_rows_1: the fixed indexes of
// the rows with pending changes, so that a client can see what it is about
// to apply. A reader: it takes the table's read lock and changes nothing.

#include "frame/sr_i_frame.h"
#include "queries/sr_i_changed_and_duplicate_rows.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Get_Updated_Rows{67, false};
}

extern "C" int32_t sr_get_updated_rows_1(sr_opaque_handle_t table_handle,
                                         uint32_t *p_updated_rows_count,
                                         uint32_t **p_p_updated_rows_fixed_indices) {
  return sr_i_run_entry_point(Get_Updated_Rows, [&]() -> int32_t {
    // The handle is checked before the pointers.
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_updated_rows_count == nullptr || p_p_updated_rows_fixed_indices == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_updated_rows(p_table, p_updated_rows_count, p_p_updated_rows_fixed_indices);
    });
  });
}
