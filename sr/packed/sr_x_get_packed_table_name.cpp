// sr_x_get_packed_table_name.cpp - sr_get_packed_table_name_1: the name a
// table was packed under, pointing into the caller's buffer (in this
// machine's byte order). No lock and no copy.

#include "frame/sr_i_frame.h"
#include "packed/sr_i_packed_buffer.h"

namespace {
constexpr sr_i_entry_point_t Get_Packed_Table_Name{115, false};
}

extern "C" int32_t sr_get_packed_table_name_1(const void *p_buffer, uint32_t table_index,
                                              const char **p_table_name) {
  return sr_i_run_entry_point(Get_Packed_Table_Name, [&]() -> int32_t {
    if (p_buffer == nullptr || p_table_name == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    sr_i_packed_buffer_view view;
    if (const int32_t rc = sr_i_view_packed_buffer(p_buffer, view); rc != 0) {
      return rc;
    }
    return sr_i_get_packed_table_name(view, table_index, p_table_name);
  });
}
