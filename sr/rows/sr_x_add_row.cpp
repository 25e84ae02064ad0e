// sr_x_add_row.cpp - sr_add_row_1: adds one row to a table opened for
// writing, as a pending change (committed at once on an implicitly
// controlled table).

#include "frame/sr_i_frame.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Add_Row{5, true};
}

extern "C" int32_t sr_add_row_1(sr_opaque_handle_t table_handle, const char *const *p_column_names,
                                qv_value_t *const *p_p_fields, uint32_t total_values) {
  return sr_i_run_entry_point(Add_Row, [&] {
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) {
      return sr_i_add_row(p_table, p_column_names, p_p_fields, total_values);
    });
  });
}
