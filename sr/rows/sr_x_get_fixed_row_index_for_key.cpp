// sr_x_get_fixed_row_index_for_key.cpp - sr_get_fixed_row_index_for_key_1:
// translates a key into the fixed index of its row, so that a client can
// keep naming the row while other rows come and go. A reader: it takes the
// table's read lock and changes nothing.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Get_Fixed_Row_Index_For_Key{107, false};
}

extern "C" int32_t sr_get_fixed_row_index_for_key_1(sr_opaque_handle_t table_handle,
                                                    qv_value_t key_value,
                                                    uint32_t *p_fixed_row_index) {
  return sr_i_run_entry_point(Get_Fixed_Row_Index_For_Key, [&]() -> int32_t {
    // The handle is checked before the pointer.
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_fixed_row_index == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_read_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_get_fixed_row_index_for_key(p_table, key_value, p_fixed_row_index);
    });
  });
}
