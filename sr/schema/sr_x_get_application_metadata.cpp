// sr_x_get_application_metadata.cpp - sr_get_application_metadata_1: hands
// the caller a copy of the table's application metadata (element 0 of its
// container) in the view the table reads by default: the applied one when
// the table shows uncommitted updates, else the committed one.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_read_write_lock.h"
#include "schema/sr_i_application_metadata.h"
#include "tables/sr_i_table.h"

namespace {
constexpr sr_i_entry_point_t Get_Application_Metadata{39, false};
}

extern "C" int32_t sr_get_application_metadata_1(sr_opaque_handle_t table_handle,
                                                 qv_binary_t **p_p_application_metadata) {
  return sr_i_run_entry_point(Get_Application_Metadata, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_p_application_metadata == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_table = static_cast<sr_i_table_t *>(table_handle);
    sr_i_read_guard table_lock(&p_table->lock);
    if (table_lock.result() != 0) {
      return table_lock.result();
    }
    // Every table is made with its container; a table without one is broken.
    if (p_table->p_application_metadata == nullptr) {
      return sr_i_raise_internal();
    }
    return sr_i_get_application_metadata_element_binary(p_table->p_application_metadata, 0,
                                                        p_table->uncommitted_updates_visible,
                                                        p_p_application_metadata);
  });
}
