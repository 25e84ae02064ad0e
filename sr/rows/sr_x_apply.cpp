// sr_x_apply.cpp - sr_apply_1: moves a table's pending changes to applied.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_transaction.h"
#include "storage/sr_i_storage.h"

namespace {
constexpr sr_i_entry_point_t Apply{7, true};
}

extern "C" int32_t sr_apply_1(sr_opaque_handle_t table_handle, uint64_t change_counter) {
  return sr_i_run_entry_point(Apply, [&] {
    return sr_i_with_writable_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_apply(p_table, sr_i_rewrite_wanted(p_table), change_counter);
    });
  });
}
