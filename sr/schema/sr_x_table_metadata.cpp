// sr_x_table_metadata.cpp - sr_get_table_metadata_1 and
// sr_free_table_metadata_1: a description of an open table, made and freed
// by schema/sr_i_table_metadata.cpp.

#include "frame/sr_i_frame.h"
#include "schema/sr_i_table_metadata.h"
#include "tables/sr_i_table.h"

namespace {

constexpr sr_i_entry_point_t Get_Table_Metadata{65, false};
constexpr sr_i_entry_point_t Free_Table_Metadata{37, false};

}  // namespace

extern "C" int32_t sr_get_table_metadata_1(sr_opaque_handle_t table_handle, int32_t all_metadata,
                                           sr_table_metadata_t **p_p_metadata) {
  return sr_i_run_entry_point(Get_Table_Metadata, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_p_metadata == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_table = static_cast<sr_i_table_t *>(table_handle);
    sr_i_read_guard table_lock(&p_table->lock);
    if (table_lock.result() != 0) {
      return table_lock.result();
    }
    return sr_i_get_table_metadata(p_table, all_metadata, p_p_metadata);
  });
}

extern "C" int32_t sr_free_table_metadata_1(sr_table_metadata_t *p_metadata) {
  return sr_i_run_entry_point(Free_Table_Metadata, [&]() -> int32_t {
    if (p_metadata == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    sr_i_free_table_metadata(p_metadata);
    return 0;
  });
}
