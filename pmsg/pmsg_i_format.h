// pmsg_i_format.h - the shared vocabulary of the value codec's internals:
// how each data type is laid out (its kind), the sizes of the fixed parts of
// a body, unaligned loads and stores, the rules a nested anchor must obey,
// and the internal operations that the exported entry points call.
//
// Every internal operation returns a QV_PMSG_RESULT_* code and may throw
// only std::bad_alloc, which the entry points turn into NO_MEMORY.

#ifndef PMSG_I_FORMAT_H
#define PMSG_I_FORMAT_H

#include <cstdint>
#include <cstring>

#include "qv_pmsg.h"

// How a data type is encoded.
enum class pmsg_i_kind {
  invalid,        // not a type a value may have
  fixed32,        // 2, 3, 6: a 32-bit number in the slot
  fixed64,        // 4, 5, 7: a 64-bit number in the slot
  string,         // 8: the bytes and a NUL
  binary,         // 9: the bytes
  handle,         // 10: five 32-bit words
  structured,     // 11: count, element records, element bodies
  byte_string,    // 12: the packed fields
  array32,        // 13, 14, 17: count and 32-bit numbers
  array64,        // 15, 16, 18: count and 64-bit numbers
  pointer_array,  // 19 to 22: count, anchors, element bodies
};

inline pmsg_i_kind pmsg_i_kind_of(int64_t type) {
  switch (type) {
    case QV_INT32:
    case QV_UINT32:
    case QV_FLOAT32:
      return pmsg_i_kind::fixed32;
    case QV_INT64:
    case QV_UINT64:
    case QV_FLOAT64:
      return pmsg_i_kind::fixed64;
    case QV_CHAR_PTR:
      return pmsg_i_kind::string;
    case QV_BINARY_PTR:
      return pmsg_i_kind::binary;
    case QV_RSRC_HANDLE_PTR:
      return pmsg_i_kind::handle;
    case QV_SD_PTR:
      return pmsg_i_kind::structured;
    case QV_SBS_PTR:
      return pmsg_i_kind::byte_string;
    case QV_INT32_ARRAY:
    case QV_UINT32_ARRAY:
    case QV_FLOAT32_ARRAY:
      return pmsg_i_kind::array32;
    case QV_INT64_ARRAY:
    case QV_UINT64_ARRAY:
    case QV_FLOAT64_ARRAY:
      return pmsg_i_kind::array64;
    case QV_CHAR_PTR_ARRAY:
    case QV_BINARY_PTR_ARRAY:
    case QV_RSRC_HANDLE_PTR_ARRAY:
    case QV_SD_PTR_ARRAY:
      return pmsg_i_kind::pointer_array;
    default:
      return pmsg_i_kind::invalid;
  }
}

inline bool pmsg_i_is_fixed(pmsg_i_kind kind) {
  return kind == pmsg_i_kind::fixed32 || kind == pmsg_i_kind::fixed64;
}

// The element type of a pointer array (19 to 22): 8 to 11.
inline int32_t pmsg_i_pointer_element_type(int32_t array_type) {
  return array_type - (QV_CHAR_PTR_ARRAY - QV_CHAR_PTR);
}

constexpr uint32_t Pmsg_Count_Bytes = 4;            // the element count opening a composite body
constexpr uint32_t Pmsg_Anchor_Bytes = 8;           // offset and length
constexpr uint32_t Pmsg_Element_Record_Bytes = 12;  // structured data: type and slot
constexpr uint32_t Pmsg_Handle_Bytes = 20;          // header and four identity words
constexpr uint32_t Pmsg_Field_Header_Bytes = 4;     // structured byte string field header

// Unaligned access to the little pieces of a slot or body, in host order.
inline uint32_t pmsg_i_load_u32(const unsigned char *p_bytes) {
  uint32_t value;
  std::memcpy(&value, p_bytes, sizeof value);
  return value;
}
inline void pmsg_i_store_u32(unsigned char *p_bytes, uint32_t value) {
  std::memcpy(p_bytes, &value, sizeof value);
}
inline uint64_t pmsg_i_load_u64(const unsigned char *p_bytes) {
  uint64_t value;
  std::memcpy(&value, p_bytes, sizeof value);
  return value;
}
inline void pmsg_i_store_u64(unsigned char *p_bytes, uint64_t value) {
  std::memcpy(p_bytes, &value, sizeof value);
}
inline int16_t pmsg_i_load_i16(const unsigned char *p_bytes) {
  int16_t value;
  std::memcpy(&value, p_bytes, sizeof value);
  return value;
}

// Reverses the byte order of `width` bytes in place.
inline void pmsg_i_reverse_bytes(unsigned char *p_bytes, uint32_t width) {
  for (uint32_t low = 0, high = width - 1; low < high; ++low, --high) {
    unsigned char swapped = p_bytes[low];
    p_bytes[low] = p_bytes[high];
    p_bytes[high] = swapped;
  }
}

// The layout rule that keeps decoding linear and bodies relocatable: the
// bodies nested in a composite body follow its fixed part back to back, in
// element order, and end exactly where the composite body ends. `expected`
// is where the next nested body must start (the end of the previous one).
inline bool pmsg_i_nested_anchor_ok(uint32_t offset, uint32_t length, uint32_t expected,
                                    uint32_t enclosing_length) {
  return offset == expected && length <= enclosing_length - offset;
}

// A string body: at least the NUL, and no NUL before the last byte.
inline bool pmsg_i_string_body_ok(const unsigned char *p_body, uint32_t length) {
  return length >= 1 && p_body[length - 1] == '\0' &&
         std::memchr(p_body, '\0', length - 1) == nullptr;
}

// Walks the fields of a structured byte string held in host order: true
// when they fill `length` bytes exactly.
bool pmsg_i_byte_string_fields_ok(const unsigned char *p_fields, uint64_t length);

// ---- Operations behind the entry points ---------------------------------

// Sums the encoded body sizes of `total_values` client values (no string
// conversion). Fixed types count 0.
int32_t pmsg_i_size_values(int32_t type, const qv_value_t *p_values, uint32_t total_values,
                           uint32_t *p_length);

// Encodes one value of a valid type into the slot and the area.
int32_t pmsg_i_encode_value(cu_iconv_t *p_conversion, int32_t type, const qv_value_t &value,
                            unsigned char *p_slot, unsigned char *p_area, uint32_t capacity,
                            uint32_t *p_offset);

// Decodes one value of a valid type; `area_length` bounds the top-level
// anchor (QV_PMSG_LENGTH_UNBOUNDED trusts it).
int32_t pmsg_i_decode_value(cu_iconv_t *p_conversion, int32_t type, const unsigned char *p_slot,
                            const unsigned char *p_area, uint32_t area_length, qv_value_t *p_value);

// Converts one value of a valid type from the other byte order in place;
// `area_length` bounds the top-level anchor (QV_PMSG_LENGTH_UNBOUNDED trusts
// it). The bounded form is what hostile-input tests and the fuzzer drive.
int32_t pmsg_i_convert_value(unsigned char *p_slot, int32_t type, unsigned char *p_area,
                             uint32_t area_length);

// Reads the header and takes it over to this machine when needed.
int32_t pmsg_i_check_header(qv_pmsg_header_t *p_header, int32_t *p_conversion_required,
                            int32_t *p_header_converted);

#endif  // PMSG_I_FORMAT_H
