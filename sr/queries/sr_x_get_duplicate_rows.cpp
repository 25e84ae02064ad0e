// sr_x_get_duplicate_rows.cpp - sr_get_duplicate_rows_1: the fixed indexes
// of every row that holds a key value, which matters where the key is not
// checked for uniqueness (SR_PRIMARY_KEY_NOCHECK) and a key lookup finds
// only one of them. A reader: it takes the table's read lock and changes
// nothing.

#include "frame/sr_i_frame.h"
#include "queries/sr_i_changed_and_duplicate_rows.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Get_Duplicate_Rows{41, false};
}

extern "C" int32_t sr_get_duplicate_rows_1(sr_opaque_handle_t table_handle, qv_value_t key_value,
                                           uint32_t *p_duplicate_rows_count,
                                           uint32_t **p_p_duplicate_rows_fixed_indices,
                                           uint32_t uncommitted_updates_visible) {
  return sr_i_run_entry_point(Get_Duplicate_Rows, [&]() -> int32_t {
    // The handle is checked before the pointers.
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_duplicate_rows_count == nullptr || p_p_duplicate_rows_fixed_indices == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_duplicate_rows(p_table, key_value, p_duplicate_rows_count,
                                     p_p_duplicate_rows_fixed_indices, uncommitted_updates_visible);
    });
  });
}
