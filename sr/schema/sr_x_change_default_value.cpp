// sr_x_change_default_value.cpp - sr_change_default_value_1: a new default
// for one visible column, for the rows added from now on.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr sr_i_entry_point_t Change_Default_Value{11, true};

}  // namespace

extern "C" int32_t sr_change_default_value_1(sr_opaque_handle_t table_handle,
                                             const char *column_name, qv_value_t new_value) {
  return sr_i_run_entry_point(Change_Default_Value, [&]() -> int32_t {
    return sr_i_rebuild_table(table_handle, [&](sr_i_table_t *p_table, sr_i_table_t **pp_new) {
      if (column_name == nullptr) {
        return sr_i_raise(SR_E_NULL_POINTER);
      }
      return sr_i_update_metadata(p_table, nullptr, 0, column_name, nullptr, &new_value, pp_new);
    });
  });
}
