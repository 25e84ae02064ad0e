// sr_x_get_total_packed_tables.cpp - sr_get_total_packed_tables_1: how many
// tables a packed buffer in this machine's byte order holds, once its
// header and slots are seen to hold together. No lock: only the caller's
// buffer is read.

#include "frame/sr_i_frame.h"
#include "packed/sr_i_packed_buffer.h"

namespace {
constexpr sr_i_entry_point_t Get_Total_Packed_Tables{113, false};
}

extern "C" int32_t sr_get_total_packed_tables_1(const void *p_buffer,
                                                uint32_t *p_total_packed_tables) {
  return sr_i_run_entry_point(Get_Total_Packed_Tables, [&]() -> int32_t {
    if (p_buffer == nullptr || p_total_packed_tables == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    sr_i_packed_buffer_view view;
    if (const int32_t rc = sr_i_view_packed_buffer(p_buffer, view); rc != 0) {
      return rc;
    }
    *p_total_packed_tables = view.total_tables;
    return 0;
  });
}
