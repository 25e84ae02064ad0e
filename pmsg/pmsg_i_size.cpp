// pmsg_i_size.cpp - how many indirect bytes a client value's body takes,
// without writing it. Owns the check of a structured byte string's fields,
// which sizing, encoding and decoding share.
//
// The sizes here are the ones pmsg_i_encode.cpp produces for a value whose
// strings are not converted; the two files must change together.

#include <cstdint>
#include <cstring>

#include "pmsg_i_client_values.h"
#include "pmsg_i_format.h"

static_assert(sizeof(qv_data_type_t) == sizeof(int32_t), "data types travel as 32-bit numbers");

bool pmsg_i_byte_string_fields_ok(const unsigned char *p_fields, uint64_t length) {
  uint64_t position = 0;
  while (position < length) {
    if (length - position < Pmsg_Field_Header_Bytes) {
      return false;
    }
    int16_t field_length = pmsg_i_load_i16(p_fields + position);
    position += Pmsg_Field_Header_Bytes;
    if (field_length < 0 || length - position < static_cast<uint64_t>(field_length)) {
      return false;
    }
    position += static_cast<uint64_t>(field_length);
  }
  return true;
}

namespace {

// Anything above this cannot be addressed by a 32-bit anchor.
constexpr uint64_t Largest_Body = UINT32_MAX;

int32_t size_body(int32_t type, const qv_value_t &value, int depth, uint64_t *p_size);

// Adds a nested body's size, stopping as soon as the total is too large.
int32_t add_nested(int32_t type, const qv_value_t &value, int depth, uint64_t *p_size) {
  uint64_t nested = 0;
  int32_t result = size_body(type, value, depth, &nested);
  if (result != QV_PMSG_RESULT_OK) {
    return result;
  }
  *p_size += nested;
  return *p_size > Largest_Body ? QV_PMSG_RESULT_BAD_CLIENT_VALUE : QV_PMSG_RESULT_OK;
}

int32_t size_structured(const qv_structured_data_t *p_structured, int depth, uint64_t *p_size) {
  uint32_t count = pmsg_i_client_element_count(p_structured);
  *p_size = Pmsg_Count_Bytes + uint64_t{Pmsg_Element_Record_Bytes} * count;
  for (uint32_t index = 0; index < count && *p_size <= Largest_Body; ++index) {
    const qv_structured_data_element_t &element = p_structured->elements[index];
    int32_t type = pmsg_i_client_element_type(element);
    pmsg_i_kind kind = pmsg_i_kind_of(type);
    if (kind == pmsg_i_kind::invalid) {
      return QV_PMSG_RESULT_BAD_TYPE;
    }
    if (!pmsg_i_is_fixed(kind)) {
      int32_t result = add_nested(type, element.value, depth + 1, p_size);
      if (result != QV_PMSG_RESULT_OK) {
        return result;
      }
    }
  }
  return *p_size > Largest_Body ? QV_PMSG_RESULT_BAD_CLIENT_VALUE : QV_PMSG_RESULT_OK;
}

int32_t size_pointer_array(int32_t type, const qv_array_t *p_array, int depth, uint64_t *p_size) {
  uint32_t count = pmsg_i_client_element_count(p_array);
  int32_t element_type = pmsg_i_pointer_element_type(type);
  *p_size = Pmsg_Count_Bytes + uint64_t{Pmsg_Anchor_Bytes} * count;
  for (uint32_t index = 0; index < count && *p_size <= Largest_Body; ++index) {
    int32_t result = add_nested(element_type, p_array->elements[index], depth + 1, p_size);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
  }
  return *p_size > Largest_Body ? QV_PMSG_RESULT_BAD_CLIENT_VALUE : QV_PMSG_RESULT_OK;
}

int32_t size_body(int32_t type, const qv_value_t &value, int depth, uint64_t *p_size) {
  switch (pmsg_i_kind_of(type)) {
    case pmsg_i_kind::fixed32:
    case pmsg_i_kind::fixed64:
      *p_size = 0;
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::string:
      *p_size = std::strlen(pmsg_i_client_string(value.ptr_char)) + 1;
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::binary:
      *p_size = pmsg_i_client_binary_length(value.ptr_binary);
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::handle:
      *p_size = Pmsg_Handle_Bytes;
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::byte_string: {
      int32_t length = pmsg_i_client_byte_string_length(value.ptr_sbs);
      if (length < 0 ||
          (length > 0 && !pmsg_i_byte_string_fields_ok(value.ptr_sbs->fields, uint64_t(length)))) {
        return QV_PMSG_RESULT_BAD_CLIENT_VALUE;
      }
      *p_size = static_cast<uint64_t>(length);
      return QV_PMSG_RESULT_OK;
    }
    case pmsg_i_kind::array32:
      *p_size = Pmsg_Count_Bytes + uint64_t{4} * pmsg_i_client_element_count(value.ptr_array);
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::array64:
      *p_size = Pmsg_Count_Bytes + uint64_t{8} * pmsg_i_client_element_count(value.ptr_array);
      return QV_PMSG_RESULT_OK;
    case pmsg_i_kind::structured:
      if (depth > QV_PMSG_MAX_NESTING) {
        return QV_PMSG_RESULT_BAD_CLIENT_VALUE;
      }
      return size_structured(value.ptr_sd, depth, p_size);
    case pmsg_i_kind::pointer_array:
      if (depth > QV_PMSG_MAX_NESTING) {
        return QV_PMSG_RESULT_BAD_CLIENT_VALUE;
      }
      return size_pointer_array(type, value.ptr_array, depth, p_size);
    case pmsg_i_kind::invalid:
      break;
  }
  return QV_PMSG_RESULT_BAD_TYPE;
}

}  // namespace

int32_t pmsg_i_size_values(int32_t type, const qv_value_t *p_values, uint32_t total_values,
                           uint32_t *p_length) {
  uint64_t total = 0;
  for (uint32_t index = 0; index < total_values; ++index) {
    int32_t result = add_nested(type, p_values[index], 0, &total);
    if (result != QV_PMSG_RESULT_OK) {
      return result;
    }
  }
  *p_length = static_cast<uint32_t>(total);
  return QV_PMSG_RESULT_OK;
}
