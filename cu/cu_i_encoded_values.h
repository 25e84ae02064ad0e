// cu_i_encoded_values.h - the encoded form of a row's values as the
// expression evaluator reads it: what a data type's slot holds and how the
// body of a variable-length type is shaped, the sizes of a body's fixed
// parts, and unaligned loads.
//
// CU_EXPR_MODE_ENCODED_SLOTS (qv_cu_expression.h) promises to evaluate rows
// in this form, so this library keeps its own reader's description of it;
// docs/value-encoding.md is the complete form, which libqv_pmsg writes. The
// codec builds on this library and never the reverse, so nothing here comes
// from the codec; the expression tests evaluate rows that the codec encoded,
// which keeps reader and writer in step.

#ifndef CU_I_ENCODED_VALUES_H
#define CU_I_ENCODED_VALUES_H

#include <cstdint>
#include <cstring>

#include "qv_types.h"

// What the evaluator finds for a data type: a number in the slot, or an
// anchor to a body of one of these shapes.
enum class cu_i_layout : uint8_t {
  invalid,        // not a type a value may have
  number,         // 2 to 7: the number is in the slot
  string,         // 8: the bytes and a NUL
  bytes,          // 9, 12: plain bytes (a structured byte string as its packed fields)
  handle,         // 10: the five words of a qv_resource_handle_t
  structured,     // 11: count, element records, element bodies
  array32,        // 13, 14, 17: count and 32-bit numbers
  array64,        // 15, 16, 18: count and 64-bit numbers
  pointer_array,  // 19 to 22: count, anchors, element bodies
};

inline cu_i_layout cu_i_layout_of(uint8_t type) {
  switch (type) {
    case QV_INT32:
    case QV_UINT32:
    case QV_INT64:
    case QV_UINT64:
    case QV_FLOAT32:
    case QV_FLOAT64:
      return cu_i_layout::number;
    case QV_CHAR_PTR:
      return cu_i_layout::string;
    case QV_BINARY_PTR:
    case QV_SBS_PTR:
      return cu_i_layout::bytes;
    case QV_RSRC_HANDLE_PTR:
      return cu_i_layout::handle;
    case QV_SD_PTR:
      return cu_i_layout::structured;
    case QV_INT32_ARRAY:
    case QV_UINT32_ARRAY:
    case QV_FLOAT32_ARRAY:
      return cu_i_layout::array32;
    case QV_INT64_ARRAY:
    case QV_UINT64_ARRAY:
    case QV_FLOAT64_ARRAY:
      return cu_i_layout::array64;
    case QV_CHAR_PTR_ARRAY:
    case QV_BINARY_PTR_ARRAY:
    case QV_RSRC_HANDLE_PTR_ARRAY:
    case QV_SD_PTR_ARRAY:
      return cu_i_layout::pointer_array;
    default:
      return cu_i_layout::invalid;
  }
}

constexpr uint32_t Cu_I_Slot_Bytes = 8;             // a number, or an anchor
constexpr uint32_t Cu_I_Count_Bytes = 4;            // the element count opening a composite body
constexpr uint32_t Cu_I_Anchor_Bytes = 8;           // offset, then length
constexpr uint32_t Cu_I_Element_Record_Bytes = 12;  // structured data: type word, then slot
constexpr uint32_t Cu_I_Handle_Bytes = sizeof(qv_resource_handle_t);

// Slots and bodies may start at any byte and hold host-order numbers.
inline uint32_t cu_i_load_u32(const unsigned char *p_bytes) {
  uint32_t value;
  std::memcpy(&value, p_bytes, sizeof value);
  return value;
}
inline uint64_t cu_i_load_u64(const unsigned char *p_bytes) {
  uint64_t value;
  std::memcpy(&value, p_bytes, sizeof value);
  return value;
}

#endif  // CU_I_ENCODED_VALUES_H
