// sr_i_key_not_found.cpp - the "no row for this key" error of the by-key
// operations. It returns the code of 2605-202 but the text of 2605-213,
// which names the key (rendered by its type) and the table, so that a
// caller who only checks codes sees 202 and a person reading the message
// sees what was looked for where.

#include <cinttypes>
#include <cstdio>
#include <cstring>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_trace.h"

namespace {

// Renders a key value as its message shows it.
void render_key(const qv_value_t *p_key, qv_data_type_t type, char *p_text, size_t size) {
  if (p_key == nullptr) {
    std::snprintf(p_text, size, "%s", "***UNKNOWN KEY TYPE****");
    return;
  }
  switch (type) {
    case QV_INT32:
      std::snprintf(p_text, size, "%d", p_key->val_int32);
      break;
    case QV_UINT32:
      std::snprintf(p_text, size, "%u", p_key->val_uint32);
      break;
    case QV_INT64:
      std::snprintf(p_text, size, "%lld", static_cast<long long>(p_key->val_int64));
      break;
    case QV_UINT64:
      std::snprintf(p_text, size, "%llu", static_cast<unsigned long long>(p_key->val_uint64));
      break;
    case QV_FLOAT32:
      std::snprintf(p_text, size, "%g", static_cast<double>(p_key->val_float32));
      break;
    case QV_FLOAT64:
      std::snprintf(p_text, size, "%lg", p_key->val_float64);
      break;
    case QV_CHAR_PTR:
      std::snprintf(p_text, size, "%.255s", p_key->ptr_char ? p_key->ptr_char : "");
      break;
    case QV_RSRC_HANDLE_PTR: {
      const qv_resource_handle_t *p_handle =
          p_key->ptr_rsrc_handle ? p_key->ptr_rsrc_handle : cu_ptr_invld_rsrc_hndl_1;
      uint16_t halves[2];  // the header's two 16-bit halves, in memory order
      std::memcpy(halves, &p_handle->header, sizeof halves);
      std::snprintf(p_text, size, "0x%04x 0x%04x 0x%08x 0x%08x 0x%08x 0x%08x", halves[0], halves[1],
                    p_handle->id.id1, p_handle->id.id2, p_handle->id.id3, p_handle->id.id4);
      break;
    }
    default:
      std::snprintf(p_text, size, "%s", "***UNKNOWN KEY TYPE****");
      break;
  }
}

}  // namespace

int32_t sr_i_raise_key_not_found(const char *p_table_name, const qv_value_t *p_key,
                                 qv_data_type_t type) {
  char key_text[512];
  render_key(p_key, type, key_text, sizeof key_text);
  const char *p_table = p_table_name ? p_table_name : "(UNKNOWN_TABLE_NAME)";
  cu_set_error_1(SR_E_NO_ROW_FOR_KEY, 0, Sr_Message_Catalog, Sr_Message_Set,
                 SR_I_MESSAGE_KEY_NOT_FOUND, cu_mesgtbl_qv_sr_set[SR_I_MESSAGE_KEY_NOT_FOUND],
                 key_text, p_table);
  if (sr_i_trace_on(SR_I_TRACE_ERRORS)) {
    tr_record_strings_1(Sr_Trace_Component, 120, 2, key_text, p_table);
  }
  return SR_E_NO_ROW_FOR_KEY;
}
