// sr_x_overlay_memory_column_qualifier.cpp -
// sr_overlay_memory_column_qualifier_1: a standard column's flags changed
// in memory only.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr sr_i_entry_point_t Overlay_Memory_Column_Qualifier{83, true};

}  // namespace

extern "C" int32_t sr_overlay_memory_column_qualifier_1(sr_opaque_handle_t table_handle,
                                                        const char *p_column_name,
                                                        sr_qualifier_t new_qualifier) {
  return sr_i_run_entry_point(Overlay_Memory_Column_Qualifier, [&]() -> int32_t {
    return sr_i_overlay_column(table_handle, p_column_name, [&](sr_i_table_t *p_table) {
      return sr_i_overlay_memory_column_qualifier(p_table, p_column_name, new_qualifier);
    });
  });
}
