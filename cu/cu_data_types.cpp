// cu_data_types.cpp - the data-type property table, the shared empty values
// that stand in for null pointers, and the order of resource handles.
//
// The empty values live in read-only storage: they are shared by every
// caller, so a write through one of them must fault rather than corrupt the
// value for everyone.

#include <cstdint>

#include "qv_cu.h"

namespace {

constexpr uint16_t Fixed_Integer = CU_DTC_VALID | CU_DTC_NUMERIC | CU_DTC_INTEGER;
constexpr uint16_t Fixed_Float = CU_DTC_VALID | CU_DTC_NUMERIC | CU_DTC_FLOAT;
constexpr uint16_t Block = CU_DTC_VALID | CU_DTC_POINTER;
constexpr uint16_t Array = Block | CU_DTC_ARRAY;

const char Empty_Char[1] = "";
const qv_binary_t Empty_Binary = {0};
const qv_structured_data_t Empty_Sd = {0, 0};
const qv_array_t Empty_Array = {0, 0};
const qv_resource_handle_t Invalid_Resource_Handle = {
    0xFFFFFFFFu, {0xFFFFFFFFu, 0xFFFFFFFFu, 0xFFFFFFFFu, 0xFFFFFFFFu}};

int32_t compare_words(uint32_t left, uint32_t right) {
  return left < right ? -1 : (left > right ? 1 : 0);
}

}  // namespace

extern "C" {

const uint16_t cu_dtc_table_1[QV_DATA_TYPE_LIMIT] = {
    0,                                       // QV_UNKNOWN
    0,                                       // QV_NONE
    Fixed_Integer | CU_DTC_SIGNED,           // QV_INT32
    Fixed_Integer,                           // QV_UINT32
    Fixed_Integer | CU_DTC_SIGNED,           // QV_INT64
    Fixed_Integer,                           // QV_UINT64
    Fixed_Float,                             // QV_FLOAT32
    Fixed_Float,                             // QV_FLOAT64
    Block,                                   // QV_CHAR_PTR
    Block,                                   // QV_BINARY_PTR
    Block,                                   // QV_RSRC_HANDLE_PTR
    Block,                                   // QV_SD_PTR
    Block,                                   // QV_SBS_PTR
    Array | CU_DTC_INTEGER | CU_DTC_SIGNED,  // QV_INT32_ARRAY
    Array | CU_DTC_INTEGER,                  // QV_UINT32_ARRAY
    Array | CU_DTC_INTEGER | CU_DTC_SIGNED,  // QV_INT64_ARRAY
    Array | CU_DTC_INTEGER,                  // QV_UINT64_ARRAY
    Array | CU_DTC_FLOAT,                    // QV_FLOAT32_ARRAY
    Array | CU_DTC_FLOAT,                    // QV_FLOAT64_ARRAY
    Array,                                   // QV_CHAR_PTR_ARRAY
    Array,                                   // QV_BINARY_PTR_ARRAY
    Array,                                   // QV_RSRC_HANDLE_PTR_ARRAY
    Array,                                   // QV_SD_PTR_ARRAY
};

qv_char_ptr_t const cu_ptr_empty_char_1 = const_cast<char *>(Empty_Char);
qv_binary_ptr_t const cu_ptr_empty_binary_1 = const_cast<qv_binary_t *>(&Empty_Binary);
qv_sd_ptr_t const cu_ptr_empty_sd_1 = const_cast<qv_structured_data_t *>(&Empty_Sd);
qv_array_ptr_t const cu_ptr_empty_array_1 = const_cast<qv_array_t *>(&Empty_Array);
qv_resource_handle_ptr_t const cu_ptr_invld_rsrc_hndl_1 =
    const_cast<qv_resource_handle_t *>(&Invalid_Resource_Handle);

int32_t cu_rsrc_hndl_cmp_1(const qv_resource_handle_t *p_left,
                           const qv_resource_handle_t *p_right) {
  if (p_left == nullptr || p_right == nullptr) {
    // A missing handle sorts before every handle, and equals another missing one.
    return p_left == p_right ? 0 : (p_left == nullptr ? -1 : 1);
  }
  const uint32_t left[] = {p_left->id.id1, p_left->id.id2, p_left->id.id3, p_left->id.id4,
                           p_left->header};
  const uint32_t right[] = {p_right->id.id1, p_right->id.id2, p_right->id.id3, p_right->id.id4,
                            p_right->header};
  for (int word = 0; word < 5; ++word) {
    if (const int32_t order = compare_words(left[word], right[word]); order != 0) {
      return order;
    }
  }
  return 0;
}

}  // extern "C"
