// pmsg_i_decode.cpp - turns an encoded value back into a client value: one
// malloc block in the shapes of qv_types.h, nested values inside it.
//
// Decoding runs in two passes over the body. The first checks every count,
// type, anchor and string against the body's own length (never reading
// outside it), converts the strings, and adds up the block size; the second
// lays the block out, trusting what the first pass checked. Each value's
// piece of the block starts on an 8-byte boundary, so that the caller may
// read the structures in place.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <vector>

#include "pmsg_i_format.h"

static_assert(sizeof(size_t) == sizeof(uint64_t), "block sizes are counted in 64 bits");

namespace {

struct free_deleter {
  void operator()(void *p_memory) const { std::free(p_memory); }
};

using converted_string = std::unique_ptr<char, free_deleter>;

uint64_t round_up(uint64_t bytes) {
  return (bytes + 7) & ~uint64_t{7};
}

// What the measuring pass hands to the building pass: the converted strings,
// in the order in which the walk meets them.
struct decoder {
  cu_iconv_t *p_conversion;  // null when strings pass as they are
  std::vector<converted_string> strings;
  size_t next_string = 0;
};

int32_t measure_body(decoder &state, int32_t type, const unsigned char *p_body, uint32_t length,
                     int depth, uint64_t *p_size);

int32_t measure_string(decoder &state, const unsigned char *p_body, uint32_t length,
                       uint64_t *p_size) {
  if (!pmsg_i_string_body_ok(p_body, length)) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  if (state.p_conversion == nullptr) {
    *p_size = round_up(length);
    return QV_PMSG_RESULT_OK;
  }
  char *p_converted = nullptr;
  int32_t result =
      cu_iconv_str_1(state.p_conversion, reinterpret_cast<const char *>(p_body), &p_converted);
  converted_string converted(p_converted);
  if (result != CU_RESULT_OK) {
    return result == CU_RESULT_NO_MEMORY ? QV_PMSG_RESULT_NO_MEMORY
                                         : QV_PMSG_RESULT_CONVERSION_FAILED;
  }
  *p_size = round_up(std::strlen(converted.get()) + 1);
  state.strings.push_back(std::move(converted));
  return QV_PMSG_RESULT_OK;
}

// Numbers of `width` bytes after a count: the body must hold exactly them.
int32_t measure_numbers(const unsigned char *p_body, uint32_t length, uint32_t width,
                        uint64_t *p_size) {
  if (length < Pmsg_Count_Bytes) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint64_t count = pmsg_i_load_u32(p_body);
  if (length != Pmsg_Count_Bytes + width * count) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  *p_size = sizeof(qv_array_t) + sizeof(qv_value_t) * count;
  return QV_PMSG_RESULT_OK;
}

// A composite body: a count, then records of `stride` bytes, then the nested
// bodies. For a pointer array (`element_type` >= 0) a record is the anchor;
// for structured data (`element_type` < 0) it is the element's type and slot,
// and only variable-length elements have a nested body.
int32_t measure_nested(decoder &state, const unsigned char *p_body, uint32_t length,
                       uint32_t stride, int32_t element_type, int depth, uint64_t *p_size) {
  if (depth > QV_PMSG_MAX_NESTING || length < Pmsg_Count_Bytes) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint64_t count = pmsg_i_load_u32(p_body);
  uint64_t fixed_part = Pmsg_Count_Bytes + stride * count;
  if (fixed_part > length) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint64_t element_bytes =
      element_type < 0 ? sizeof(qv_structured_data_element_t) : sizeof(qv_value_t);
  *p_size = round_up(8 + element_bytes * count);
  uint32_t expected = static_cast<uint32_t>(fixed_part);
  const unsigned char *p_record = p_body + Pmsg_Count_Bytes;
  for (uint64_t index = 0; index < count; ++index, p_record += stride) {
    int32_t type = element_type;
    const unsigned char *p_anchor = p_record;
    if (element_type < 0) {
      uint32_t stored_type = pmsg_i_load_u32(p_record);
      pmsg_i_kind kind = pmsg_i_kind_of(stored_type);
      if (kind == pmsg_i_kind::invalid) {
        return QV_PMSG_RESULT_MALFORMED;
      }
      if (kind == pmsg_i_kind::fixed32 && pmsg_i_load_u32(p_record + 8) != 0) {
        return QV_PMSG_RESULT_MALFORMED;  // the unused half of the slot is zero
      }
      if (pmsg_i_is_fixed(kind)) {
        continue;
      }
      type = static_cast<int32_t>(stored_type);
      p_anchor = p_record + 4;
    }
    uint32_t offset = pmsg_i_load_u32(p_anchor);
    uint32_t nested_length = pmsg_i_load_u32(p_anchor + 4);
    if (!pmsg_i_nested_anchor_ok(offset, nested_length, expected, length)) {
      return QV_PMSG_RESULT_MALFORMED;
    }
    uint64_t nested_size = 0;
    int32_t result =
        measure_body(state, type, p_body + offset, nested_length, depth + 1, &nested_size);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
    *p_size += nested_size;
    expected = offset + nested_length;
  }
  return expected == length ? QV_PMSG_RESULT_OK : QV_PMSG_RESULT_MALFORMED;
}

int32_t measure_body(decoder &state, int32_t type, const unsigned char *p_body, uint32_t length,
                     int depth, uint64_t *p_size) {
  switch (pmsg_i_kind_of(type)) {
    case pmsg_i_kind::string:
      return measure_string(state, p_body, length, p_size);
    case pmsg_i_kind::binary:
      *p_size = round_up(sizeof(qv_binary_t) + uint64_t{length});
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::handle:
      *p_size = round_up(sizeof(qv_resource_handle_t));
      return length == Pmsg_Handle_Bytes ? QV_PMSG_RESULT_OK : QV_PMSG_RESULT_MALFORMED;
    case pmsg_i_kind::byte_string:
      if (length > INT32_MAX || !pmsg_i_byte_string_fields_ok(p_body, length)) {
        return QV_PMSG_RESULT_MALFORMED;
      }
      *p_size = round_up(sizeof(qv_sbs_t) + uint64_t{length});
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::array32:
      return measure_numbers(p_body, length, 4, p_size);
    case pmsg_i_kind::array64:
      return measure_numbers(p_body, length, 8, p_size);
    case pmsg_i_kind::structured:
      return measure_nested(state, p_body, length, Pmsg_Element_Record_Bytes, -1, depth, p_size);
    case pmsg_i_kind::pointer_array:
      return measure_nested(state, p_body, length, Pmsg_Anchor_Bytes,
                            pmsg_i_pointer_element_type(type), depth, p_size);
    case pmsg_i_kind::fixed32:
    case pmsg_i_kind::fixed64:
    case pmsg_i_kind::invalid:
      break;
  }
  return QV_PMSG_RESULT_MALFORMED;
}

// ---- Second pass: the body was checked, lay out the client block --------

void read_fixed_slot(pmsg_i_kind kind, const unsigned char *p_slot, qv_value_t *p_value) {
  qv_value_t value{};
  std::memcpy(&value, p_slot, kind == pmsg_i_kind::fixed32 ? 4 : 8);
  *p_value = value;
}

// Takes `bytes` of the block at the cursor, keeping the cursor 8-aligned.
unsigned char *take(unsigned char **pp_cursor, uint64_t bytes) {
  unsigned char *p_piece = *pp_cursor;
  *pp_cursor += round_up(bytes);
  return p_piece;
}

void build_body(decoder &state, int32_t type, const unsigned char *p_body, uint32_t length,
                unsigned char **pp_cursor, qv_value_t *p_value);

void build_string(decoder &state, const unsigned char *p_body, uint32_t length,
                  unsigned char **pp_cursor, qv_value_t *p_value) {
  const void *p_text = p_body;
  if (state.p_conversion != nullptr) {
    p_text = state.strings[state.next_string++].get();
    length = static_cast<uint32_t>(std::strlen(static_cast<const char *>(p_text)) + 1);
  }
  char *p_copy = reinterpret_cast<char *>(take(pp_cursor, length));
  std::memcpy(p_copy, p_text, length);
  p_value->ptr_char = p_copy;
}

void build_numbers(const unsigned char *p_body, uint32_t width, unsigned char **pp_cursor,
                   qv_value_t *p_value) {
  uint32_t count = pmsg_i_load_u32(p_body);
  auto *p_array =
      reinterpret_cast<qv_array_t *>(take(pp_cursor, 8 + sizeof(qv_value_t) * uint64_t{count}));
  p_array->element_count = count;
  p_array->pad = 0;
  const unsigned char *p_number = p_body + Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_number += width) {
    qv_value_t element{};
    std::memcpy(&element, p_number, width);
    p_array->elements[index] = element;
  }
  p_value->ptr_array = p_array;
}

void build_structured(decoder &state, const unsigned char *p_body, unsigned char **pp_cursor,
                      qv_value_t *p_value) {
  uint32_t count = pmsg_i_load_u32(p_body);
  auto *p_structured = reinterpret_cast<qv_structured_data_t *>(
      take(pp_cursor, 8 + sizeof(qv_structured_data_element_t) * uint64_t{count}));
  p_structured->element_count = count;
  p_structured->pad = 0;
  const unsigned char *p_record = p_body + Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_record += Pmsg_Element_Record_Bytes) {
    qv_structured_data_element_t &element = p_structured->elements[index];
    int32_t type = static_cast<int32_t>(pmsg_i_load_u32(p_record));
    element.data_type = static_cast<qv_data_type_t>(type);
    element.pad = 0;
    pmsg_i_kind kind = pmsg_i_kind_of(type);
    if (pmsg_i_is_fixed(kind)) {
      read_fixed_slot(kind, p_record + 4, &element.value);
    } else {
      build_body(state, type, p_body + pmsg_i_load_u32(p_record + 4), pmsg_i_load_u32(p_record + 8),
                 pp_cursor, &element.value);
    }
  }
  p_value->ptr_sd = p_structured;
}

void build_pointer_array(decoder &state, int32_t type, const unsigned char *p_body,
                         unsigned char **pp_cursor, qv_value_t *p_value) {
  uint32_t count = pmsg_i_load_u32(p_body);
  auto *p_array =
      reinterpret_cast<qv_array_t *>(take(pp_cursor, 8 + sizeof(qv_value_t) * uint64_t{count}));
  p_array->element_count = count;
  p_array->pad = 0;
  int32_t element_type = pmsg_i_pointer_element_type(type);
  const unsigned char *p_anchor = p_body + Pmsg_Count_Bytes;
  for (uint32_t index = 0; index < count; ++index, p_anchor += Pmsg_Anchor_Bytes) {
    build_body(state, element_type, p_body + pmsg_i_load_u32(p_anchor),
               pmsg_i_load_u32(p_anchor + 4), pp_cursor, &p_array->elements[index]);
  }
  p_value->ptr_array = p_array;
}

void build_body(decoder &state, int32_t type, const unsigned char *p_body, uint32_t length,
                unsigned char **pp_cursor, qv_value_t *p_value) {
  switch (pmsg_i_kind_of(type)) {
    case pmsg_i_kind::string:
      build_string(state, p_body, length, pp_cursor, p_value);
      return;
    case pmsg_i_kind::binary: {
      auto *p_binary = reinterpret_cast<qv_binary_t *>(take(pp_cursor, 4 + uint64_t{length}));
      p_binary->length = length;
      if (length != 0) {
        std::memcpy(p_binary->data, p_body, length);
      }
      p_value->ptr_binary = p_binary;
      return;
    }
    case pmsg_i_kind::handle: {
      auto *p_handle =
          reinterpret_cast<qv_resource_handle_t *>(take(pp_cursor, sizeof(qv_resource_handle_t)));
      std::memcpy(p_handle, p_body, Pmsg_Handle_Bytes);
      p_value->ptr_rsrc_handle = p_handle;
      return;
    }
    case pmsg_i_kind::byte_string: {
      auto *p_byte_string = reinterpret_cast<qv_sbs_t *>(take(pp_cursor, 4 + uint64_t{length}));
      p_byte_string->length = static_cast<int32_t>(length);
      if (length != 0) {
        std::memcpy(p_byte_string->fields, p_body, length);
      }
      p_value->ptr_sbs = p_byte_string;
      return;
    }
    case pmsg_i_kind::array32:
      build_numbers(p_body, 4, pp_cursor, p_value);
      return;
    case pmsg_i_kind::array64:
      build_numbers(p_body, 8, pp_cursor, p_value);
      return;
    case pmsg_i_kind::structured:
      build_structured(state, p_body, pp_cursor, p_value);
      return;
    case pmsg_i_kind::pointer_array:
      build_pointer_array(state, type, p_body, pp_cursor, p_value);
      return;
    case pmsg_i_kind::fixed32:
    case pmsg_i_kind::fixed64:
    case pmsg_i_kind::invalid:
      return;
  }
}

}  // namespace

int32_t pmsg_i_decode_value(cu_iconv_t *p_conversion, int32_t type, const unsigned char *p_slot,
                            const unsigned char *p_area, uint32_t area_length,
                            qv_value_t *p_value) {
  pmsg_i_kind kind = pmsg_i_kind_of(type);
  if (pmsg_i_is_fixed(kind)) {
    read_fixed_slot(kind, p_slot, p_value);
    return QV_PMSG_RESULT_OK;
  }
  uint32_t offset = pmsg_i_load_u32(p_slot);
  uint32_t length = pmsg_i_load_u32(p_slot + 4);
  if (area_length != QV_PMSG_LENGTH_UNBOUNDED && uint64_t{offset} + length > area_length) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  if (p_conversion != nullptr && cu_iconv_is_unchanged_1(p_conversion)) {
    p_conversion = nullptr;
  }
  const unsigned char *p_body = p_area + offset;
  // The commonest value, a string that passes as it is, is checked and
  // copied in one step, without the walk that nested values need.
  if (kind == pmsg_i_kind::string && p_conversion == nullptr) {
    if (!pmsg_i_string_body_ok(p_body, length)) {
      return QV_PMSG_RESULT_MALFORMED;
    }
    auto *p_copy = static_cast<char *>(std::malloc(static_cast<size_t>(round_up(length))));
    if (p_copy == nullptr) {
      return QV_PMSG_RESULT_NO_MEMORY;
    }
    std::memcpy(p_copy, p_body, length);
    p_value->ptr_char = p_copy;
    return QV_PMSG_RESULT_OK;
  }
  decoder state{p_conversion, {}};
  uint64_t size = 0;
  int32_t result = measure_body(state, type, p_body, length, 0, &size);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  auto *p_block = static_cast<unsigned char *>(std::malloc(static_cast<size_t>(size)));
  if (p_block == nullptr) {
    return QV_PMSG_RESULT_NO_MEMORY;
  }
  unsigned char *p_cursor = p_block;
  qv_value_t value{};
  build_body(state, type, p_body, length, &p_cursor, &value);
  *p_value = value;
  return QV_PMSG_RESULT_OK;
}
