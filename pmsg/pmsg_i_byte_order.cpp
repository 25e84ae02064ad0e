// pmsg_i_byte_order.cpp - values written by a machine of the other byte
// order: the header check that tells whether a buffer needs conversion, and
// the in-place conversion of one value with everything nested in it.
//
// Conversion reads each count, type, anchor and field length in the
// writer's order, reverses it, and only then uses it, checking it by the
// same rules as decoding (pmsg_i_format.h), so a corrupt value stops with
// MALFORMED instead of leading the walk outside the body. Numbers are
// reversed; string, binary and opaque field bytes are not.

#include <cstddef>
#include <cstdint>
#include <cstring>

#include "pmsg_i_format.h"

namespace {

// Reverses the 32-bit word at p_word and returns its new value.
uint32_t reverse_u32(unsigned char *p_word) {
  pmsg_i_reverse_bytes(p_word, 4);
  return pmsg_i_load_u32(p_word);
}

// Reverses `count` numbers of `width` bytes each.
void reverse_numbers(unsigned char *p_numbers, uint64_t count, uint32_t width) {
  for (uint64_t index = 0; index < count; ++index, p_numbers += width) {
    pmsg_i_reverse_bytes(p_numbers, width);
  }
}

int32_t convert_body(int32_t type, unsigned char *p_body, uint32_t length, int depth);

// Field data of a numeric type holds numbers of that type's width; any other
// field data is bytes.
int32_t convert_byte_string(unsigned char *p_fields, uint32_t length) {
  if (length > INT32_MAX) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint32_t position = 0;
  while (position < length) {
    if (length - position < Pmsg_Field_Header_Bytes) {
      return QV_PMSG_RESULT_MALFORMED;
    }
    unsigned char *p_field = p_fields + position;
    pmsg_i_reverse_bytes(p_field, 2);
    int16_t field_length = pmsg_i_load_i16(p_field);
    position += Pmsg_Field_Header_Bytes;
    if (field_length < 0 || length - position < static_cast<uint32_t>(field_length)) {
      return QV_PMSG_RESULT_MALFORMED;
    }
    auto field_type = static_cast<int8_t>(p_field[2]);
    pmsg_i_kind kind = pmsg_i_kind_of(field_type);
    uint32_t width = kind == pmsg_i_kind::fixed32 ? 4 : kind == pmsg_i_kind::fixed64 ? 8 : 0;
    if (width != 0 && field_length % width == 0) {
      reverse_numbers(p_field + Pmsg_Field_Header_Bytes, field_length / width, width);
    }
    position += static_cast<uint32_t>(field_length);
  }
  return QV_PMSG_RESULT_OK;
}

int32_t convert_numbers(unsigned char *p_body, uint32_t length, uint32_t width) {
  if (length < Pmsg_Count_Bytes) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint64_t count = reverse_u32(p_body);
  if (length != Pmsg_Count_Bytes + width * count) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  reverse_numbers(p_body + Pmsg_Count_Bytes, count, width);
  return QV_PMSG_RESULT_OK;
}

// The composite bodies; see measure_nested in pmsg_i_decode.cpp for the
// meaning of `stride` and `element_type`.
int32_t convert_nested(unsigned char *p_body, uint32_t length, uint32_t stride,
                       int32_t element_type, int depth) {
  if (depth > QV_PMSG_MAX_NESTING || length < Pmsg_Count_Bytes) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint64_t count = reverse_u32(p_body);
  uint64_t fixed_part = Pmsg_Count_Bytes + stride * count;
  if (fixed_part > length) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  uint32_t expected = static_cast<uint32_t>(fixed_part);
  unsigned char *p_record = p_body + Pmsg_Count_Bytes;
  for (uint64_t index = 0; index < count; ++index, p_record += stride) {
    int32_t type = element_type;
    unsigned char *p_anchor = p_record;
    if (element_type < 0) {
      uint32_t stored_type = reverse_u32(p_record);
      pmsg_i_kind kind = pmsg_i_kind_of(stored_type);
      if (kind == pmsg_i_kind::invalid) {
        return QV_PMSG_RESULT_MALFORMED;
      }
      if (kind == pmsg_i_kind::fixed32 && pmsg_i_load_u32(p_record + 8) != 0) {
        return QV_PMSG_RESULT_MALFORMED;  // the unused half of the slot is zero
      }
      if (pmsg_i_is_fixed(kind)) {
        pmsg_i_reverse_bytes(p_record + 4, kind == pmsg_i_kind::fixed32 ? 4 : 8);
        continue;
      }
      type = static_cast<int32_t>(stored_type);
      p_anchor = p_record + 4;
    }
    uint32_t offset = reverse_u32(p_anchor);
    uint32_t nested_length = reverse_u32(p_anchor + 4);
    if (!pmsg_i_nested_anchor_ok(offset, nested_length, expected, length)) {
      return QV_PMSG_RESULT_MALFORMED;
    }
    int32_t result = convert_body(type, p_body + offset, nested_length, depth + 1);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
    expected = offset + nested_length;
  }
  return expected == length ? QV_PMSG_RESULT_OK : QV_PMSG_RESULT_MALFORMED;
}

int32_t convert_body(int32_t type, unsigned char *p_body, uint32_t length, int depth) {
  switch (pmsg_i_kind_of(type)) {
    case pmsg_i_kind::string:
      return pmsg_i_string_body_ok(p_body, length) ? QV_PMSG_RESULT_OK : QV_PMSG_RESULT_MALFORMED;
    case pmsg_i_kind::binary:
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::handle:
      if (length != Pmsg_Handle_Bytes) {
        return QV_PMSG_RESULT_MALFORMED;
      }
      reverse_numbers(p_body, Pmsg_Handle_Bytes / 4, 4);
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::byte_string:
      return convert_byte_string(p_body, length);
    case pmsg_i_kind::array32:
      return convert_numbers(p_body, length, 4);
    case pmsg_i_kind::array64:
      return convert_numbers(p_body, length, 8);
    case pmsg_i_kind::structured:
      return convert_nested(p_body, length, Pmsg_Element_Record_Bytes, -1, depth);
    case pmsg_i_kind::pointer_array:
      return convert_nested(p_body, length, Pmsg_Anchor_Bytes, pmsg_i_pointer_element_type(type),
                            depth);
    case pmsg_i_kind::fixed32:
    case pmsg_i_kind::fixed64:
    case pmsg_i_kind::invalid:
      break;
  }
  return QV_PMSG_RESULT_MALFORMED;
}

}  // namespace

int32_t pmsg_i_convert_value(unsigned char *p_slot, int32_t type, unsigned char *p_area,
                             uint32_t area_length) {
  pmsg_i_kind kind = pmsg_i_kind_of(type);
  if (pmsg_i_is_fixed(kind)) {
    pmsg_i_reverse_bytes(p_slot, kind == pmsg_i_kind::fixed32 ? 4 : 8);
    return QV_PMSG_RESULT_OK;
  }
  uint32_t offset = reverse_u32(p_slot);
  uint32_t length = reverse_u32(p_slot + 4);
  if (area_length != QV_PMSG_LENGTH_UNBOUNDED && uint64_t{offset} + length > area_length) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  return convert_body(type, p_area + offset, length, 0);
}

int32_t pmsg_i_check_header(qv_pmsg_header_t *p_header, int32_t *p_conversion_required,
                            int32_t *p_header_converted) {
  // Byte-wise: a header inside a caller's buffer need not be aligned.
  auto *p_bytes = reinterpret_cast<unsigned char *>(p_header);
  unsigned char version = p_bytes[offsetof(qv_pmsg_header_t, qv_pmsg_version)];
  unsigned char architecture = p_bytes[offsetof(qv_pmsg_header_t, qv_pmsg_arch_props)];
  if (version != QV_PMSG_VERSION ||
      (architecture != QV_PMSG_ARCH_BIG_ENDIAN && architecture != QV_PMSG_ARCH_LITTLE_ENDIAN)) {
    return QV_PMSG_RESULT_MALFORMED;
  }
  if (architecture == QV_PMSG_ARCH_LOCAL) {
    *p_conversion_required = 0;
    *p_header_converted = 0;
    return QV_PMSG_RESULT_OK;
  }
  pmsg_i_reverse_bytes(p_bytes + offsetof(qv_pmsg_header_t, qv_pmsg_length), 4);
  p_bytes[offsetof(qv_pmsg_header_t, qv_pmsg_arch_props)] = QV_PMSG_ARCH_LOCAL;
  *p_conversion_required = 1;
  *p_header_converted = 1;
  return QV_PMSG_RESULT_OK;
}
