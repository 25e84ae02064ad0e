// sr_x_abort.cpp - sr_abort_1: throws away a table's pending and applied
// changes.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Abort{1, true};
}

extern "C" int32_t sr_abort_1(sr_opaque_handle_t table_handle) {
  return sr_i_run_entry_point(Abort, [&] {
    return sr_i_with_writable_table(table_handle,
                                    [&](sr_i_table_t *p_table) { return sr_i_abort(p_table); });
  });
}
