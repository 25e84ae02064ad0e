// sr_i_compare_values.cpp - the comparison of a client value with a value
// stored in a row record, which key checks, key lookups and selection use.
//
// Only numbers, strings and resource handles can be equal. Floating-point
// values compare by "neither is greater", so a NaN on either side equals
// everything; every other type (binaries, structured data, arrays) is never
// equal, so such keys are only ever found through a hash table.

#include <cstring>

#include "qv_cu.h"
#include "rows/sr_i_rows.h"

namespace {

template <typename Number>
Number stored_number(const void *p_slot) {
  Number number;
  std::memcpy(&number, p_slot, sizeof number);
  return number;
}

template <typename Number>
int32_t three_way(Number client, Number stored) {
  if (client < stored) {
    return -1;
  }
  return client > stored ? 1 : 0;
}

template <typename Number>
int32_t compare_floating(Number client, Number stored) {
  if (stored > client) {
    return -1;
  }
  return client > stored ? 1 : 0;
}

}  // namespace

int32_t sr_i_compare_values(const qv_value_t *p_value, const void *p_slot, qv_data_type_t type,
                            const void *p_indirect) {
  switch (type) {
    case QV_INT32:
      return three_way(p_value->val_int32, stored_number<int32_t>(p_slot));
    case QV_UINT32:
      return three_way(p_value->val_uint32, stored_number<uint32_t>(p_slot));
    case QV_INT64:
      return three_way(p_value->val_int64, stored_number<int64_t>(p_slot));
    case QV_UINT64:
      return three_way(p_value->val_uint64, stored_number<uint64_t>(p_slot));
    case QV_FLOAT32:
      return compare_floating(p_value->val_float32, stored_number<float>(p_slot));
    case QV_FLOAT64:
      return compare_floating(p_value->val_float64, stored_number<double>(p_slot));
    case QV_CHAR_PTR: {
      const char *p_client = p_value->ptr_char != nullptr ? p_value->ptr_char : "";
      const auto *p_stored =
          static_cast<const char *>(p_indirect) + sr_i_slot_anchor(p_slot).offset;
      return std::strcmp(p_client, p_stored);
    }
    case QV_RSRC_HANDLE_PTR: {
      // The stored handle is not aligned: compare a copy.
      qv_resource_handle_t stored;
      std::memcpy(&stored,
                  static_cast<const unsigned char *>(p_indirect) + sr_i_slot_anchor(p_slot).offset,
                  sizeof stored);
      const qv_resource_handle_t *p_client =
          p_value->ptr_rsrc_handle != nullptr ? p_value->ptr_rsrc_handle : cu_ptr_invld_rsrc_hndl_1;
      return cu_rsrc_hndl_cmp_1(p_client, &stored);
    }
    default:
      return -1;
  }
}
