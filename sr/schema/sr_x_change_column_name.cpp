// sr_x_change_column_name.cpp - sr_change_column_name_1: one visible column
// under a new name.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr sr_i_entry_point_t Change_Column_Name{9, true};

}  // namespace

extern "C" int32_t sr_change_column_name_1(sr_opaque_handle_t table_handle, const char *column_name,
                                           const char *new_name) {
  return sr_i_run_entry_point(Change_Column_Name, [&]() -> int32_t {
    return sr_i_rebuild_table(table_handle, [&](sr_i_table_t *p_table, sr_i_table_t **pp_new) {
      if (column_name == nullptr || new_name == nullptr) {
        return sr_i_raise(SR_E_NULL_POINTER);
      }
      return sr_i_update_metadata(p_table, nullptr, 0, column_name, new_name, nullptr, pp_new);
    });
  });
}
