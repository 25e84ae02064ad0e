// pmsg_i_encode.cpp - writes a client value into its slot and, for a
// variable-length type, its body in the caller's indirect area.
//
// Bodies are written in one pass, front to back: a composite body claims
// its fixed part (count and element records or anchors) first, then writes
// each nested body right behind the previous one and fills in the nested
// anchor, counted from the composite body's own start. Running out of room
// anywhere gives NO_ROOM; what was written past the caller's offset is then
// scratch, and the caller's slot and offset are left alone.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "pmsg_i_client_values.h"
#include "pmsg_i_format.h"

namespace {

struct free_deleter {
  void operator()(char *p_text) const { std::free(p_text); }
};

// The state of one encoding: the area and how far it is written.
struct encoder {
  cu_iconv_t *p_conversion;  // null when strings pass as they are
  unsigned char *p_area;
  uint32_t capacity;
  uint64_t position;
};

// Claims `bytes` at the current position. A body that could never fit
// behind a 32-bit offset is the client's fault, not the area's.
int32_t claim(encoder &state, uint64_t bytes, unsigned char **pp_bytes) {
  uint64_t end = state.position + bytes;
  if (end > state.capacity) {
    return end > UINT32_MAX ? QV_PMSG_RESULT_BAD_CLIENT_VALUE : QV_PMSG_RESULT_NO_ROOM;
  }
  *pp_bytes = state.p_area + state.position;
  state.position = end;
  return QV_PMSG_RESULT_OK;
}

int32_t write_bytes(encoder &state, const void *p_source, uint64_t bytes) {
  unsigned char *p_target = nullptr;
  int32_t result = claim(state, bytes, &p_target);
  if (result == QV_PMSG_RESULT_OK && bytes != 0) {
    std::memcpy(p_target, p_source, bytes);
  }
  return result;
}

void write_fixed_slot(pmsg_i_kind kind, const qv_value_t &value, unsigned char *p_slot) {
  if (kind == pmsg_i_kind::fixed32) {
    pmsg_i_store_u32(p_slot, value.val_uint32);
    pmsg_i_store_u32(p_slot + 4, 0);
  } else {
    pmsg_i_store_u64(p_slot, value.val_uint64);
  }
}

int32_t encode_body(encoder &state, int32_t type, const qv_value_t &value, int depth);

int32_t encode_string(encoder &state, const char *p_text) {
  p_text = pmsg_i_client_string(p_text);
  if (state.p_conversion == nullptr) {
    return write_bytes(state, p_text, std::strlen(p_text) + 1);
  }
  char *p_converted = nullptr;
  int32_t result = cu_iconv_str_1(state.p_conversion, p_text, &p_converted);
  std::unique_ptr<char, free_deleter> converted(p_converted);
  if (result != CU_RESULT_OK) {
    return result == CU_RESULT_NO_MEMORY ? QV_PMSG_RESULT_NO_MEMORY
                                         : QV_PMSG_RESULT_CONVERSION_FAILED;
  }
  return write_bytes(state, converted.get(), std::strlen(converted.get()) + 1);
}

int32_t encode_byte_string(encoder &state, const qv_sbs_t *p_byte_string) {
  int32_t length = pmsg_i_client_byte_string_length(p_byte_string);
  if (length == 0) {
    return QV_PMSG_RESULT_OK;
  }
  if (length < 0 || !pmsg_i_byte_string_fields_ok(p_byte_string->fields, uint64_t(length))) {
    return QV_PMSG_RESULT_BAD_CLIENT_VALUE;
  }
  return write_bytes(state, p_byte_string->fields, static_cast<uint64_t>(length));
}

int32_t encode_numbers(encoder &state, const qv_array_t *p_array, uint32_t width) {
  uint32_t count = pmsg_i_client_element_count(p_array);
  unsigned char *p_target = nullptr;
  int32_t result = claim(state, Pmsg_Count_Bytes + uint64_t{width} * count, &p_target);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  pmsg_i_store_u32(p_target, count);
  p_target += Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_target += width) {
    std::memcpy(p_target, &p_array->elements[index], width);
  }
  return QV_PMSG_RESULT_OK;
}

// Writes a nested body behind the previous one and its anchor, counted from
// the enclosing body's start.
int32_t encode_nested(encoder &state, uint64_t enclosing_start, int32_t type,
                      const qv_value_t &value, int depth, unsigned char *p_anchor) {
  uint64_t start = state.position;
  int32_t result = encode_body(state, type, value, depth);
  if (result == QV_PMSG_RESULT_OK) {
    pmsg_i_store_u32(p_anchor, static_cast<uint32_t>(start - enclosing_start));
    pmsg_i_store_u32(p_anchor + 4, static_cast<uint32_t>(state.position - start));
  }
  return result;
}

int32_t encode_structured(encoder &state, const qv_structured_data_t *p_structured, int depth) {
  uint32_t count = pmsg_i_client_element_count(p_structured);
  uint64_t start = state.position;
  unsigned char *p_records = nullptr;
  int32_t result =
      claim(state, Pmsg_Count_Bytes + uint64_t{Pmsg_Element_Record_Bytes} * count, &p_records);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  pmsg_i_store_u32(p_records, count);
  p_records += Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_records += Pmsg_Element_Record_Bytes) {
    const qv_structured_data_element_t &element = p_structured->elements[index];
    int32_t type = pmsg_i_client_element_type(element);
    pmsg_i_kind kind = pmsg_i_kind_of(type);
    if (kind == pmsg_i_kind::invalid) {
      return QV_PMSG_RESULT_BAD_TYPE;
    }
    pmsg_i_store_u32(p_records, static_cast<uint32_t>(type));
    if (pmsg_i_is_fixed(kind)) {
      write_fixed_slot(kind, element.value, p_records + 4);
      continue;
    }
    result = encode_nested(state, start, type, element.value, depth + 1, p_records + 4);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
  }
  return QV_PMSG_RESULT_OK;
}

int32_t encode_pointer_array(encoder &state, int32_t type, const qv_array_t *p_array, int depth) {
  uint32_t count = pmsg_i_client_element_count(p_array);
  int32_t element_type = pmsg_i_pointer_element_type(type);
  uint64_t start = state.position;
  unsigned char *p_anchors = nullptr;
  int32_t result = claim(state, Pmsg_Count_Bytes + uint64_t{Pmsg_Anchor_Bytes} * count, &p_anchors);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  pmsg_i_store_u32(p_anchors, count);
  p_anchors += Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_anchors += Pmsg_Anchor_Bytes) {
    result =
        encode_nested(state, start, element_type, p_array->elements[index], depth + 1, p_anchors);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
  }
  return QV_PMSG_RESULT_OK;
}

int32_t encode_body(encoder &state, int32_t type, const qv_value_t &value, int depth) {
  switch (pmsg_i_kind_of(type)) {
    case pmsg_i_kind::string:
      return encode_string(state, value.ptr_char);
    case pmsg_i_kind::binary:
      return value.ptr_binary == nullptr
                 ? QV_PMSG_RESULT_OK
                 : write_bytes(state, value.ptr_binary->data, value.ptr_binary->length);
    case pmsg_i_kind::handle:
      return write_bytes(state, pmsg_i_client_handle(value.ptr_rsrc_handle), Pmsg_Handle_Bytes);
    case pmsg_i_kind::byte_string:
      return encode_byte_string(state, value.ptr_sbs);
    case pmsg_i_kind::array32:
      return encode_numbers(state, value.ptr_array, 4);
    case pmsg_i_kind::array64:
      return encode_numbers(state, value.ptr_array, 8);
    case pmsg_i_kind::structured:
      return depth > QV_PMSG_MAX_NESTING ? QV_PMSG_RESULT_BAD_CLIENT_VALUE
                                         : encode_structured(state, value.ptr_sd, depth);
    case pmsg_i_kind::pointer_array:
      return depth > QV_PMSG_MAX_NESTING
                 ? QV_PMSG_RESULT_BAD_CLIENT_VALUE
                 : encode_pointer_array(state, type, value.ptr_array, depth);
    case pmsg_i_kind::fixed32:
    case pmsg_i_kind::fixed64:
    case pmsg_i_kind::invalid:
      break;
  }
  return QV_PMSG_RESULT_BAD_TYPE;
}

}  // namespace

int32_t pmsg_i_encode_value(cu_iconv_t *p_conversion, int32_t type, const qv_value_t &value,
                            unsigned char *p_slot, unsigned char *p_area, uint32_t capacity,
                            uint32_t *p_offset) {
  pmsg_i_kind kind = pmsg_i_kind_of(type);
  if (pmsg_i_is_fixed(kind)) {
    write_fixed_slot(kind, value, p_slot);
    return QV_PMSG_RESULT_OK;
  }
  if (*p_offset > capacity) {
    return QV_PMSG_RESULT_NO_ROOM;
  }
  if (p_conversion != nullptr && cu_iconv_is_unchanged_1(p_conversion)) {
    p_conversion = nullptr;
  }
  encoder state{p_conversion, p_area, capacity, *p_offset};
  int32_t result = encode_body(state, type, value, 0);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  pmsg_i_store_u32(p_slot, *p_offset);
  pmsg_i_store_u32(p_slot + 4, static_cast<uint32_t>(state.position - *p_offset));
  *p_offset = static_cast<uint32_t>(state.position);
  return QV_PMSG_RESULT_OK;
}
