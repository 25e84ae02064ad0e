// sr_x_set_application_metadata.cpp - sr_set_application_metadata_1:
// replaces the table's application metadata (element 0 of its container,
// added when missing) with a copy of the caller's bytes, as a change that
// commit makes durable and abort undoes.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_transaction.h"
#include "schema/sr_i_application_metadata.h"
#include "tables/sr_i_table.h"

namespace {
constexpr sr_i_entry_point_t Set_Application_Metadata{91, true};
}

extern "C" int32_t sr_set_application_metadata_1(sr_opaque_handle_t table_handle,
                                                 const qv_binary_t *p_application_metadata) {
  return sr_i_run_entry_point(Set_Application_Metadata, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_application_metadata == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_change_table(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
      // Every table is made with its container; a table without one is
      // broken.
      if (p_table->p_application_metadata == nullptr) {
        return sr_i_raise_internal();
      }
      return sr_i_set_application_metadata(p_table->p_application_metadata, 0,
                                           p_application_metadata->length,
                                           p_application_metadata->data);
    });
  });
}
