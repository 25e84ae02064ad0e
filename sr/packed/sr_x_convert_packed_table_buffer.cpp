// sr_x_convert_packed_table_buffer.cpp - sr_convert_packed_table_buffer_1:
// a packed buffer from a machine of the other byte order taken over to this
// one, in place. It changes only the caller's buffer, so it takes no lock.

#include "frame/sr_i_frame.h"
#include "packed/sr_i_packed_buffer.h"

namespace {
constexpr sr_i_entry_point_t Convert_Packed_Table_Buffer{117, false};
}

extern "C" int32_t sr_convert_packed_table_buffer_1(void *p_buffer,
                                                    uint32_t header_already_converted,
                                                    int32_t do_conversion) {
  return sr_i_run_entry_point(Convert_Packed_Table_Buffer, [&]() -> int32_t {
    if (p_buffer == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_convert_packed_buffer(p_buffer, header_already_converted, do_conversion);
  });
}
