// pmsg_x_entry_points.cpp - the five exported operations of libqv_pmsg.
//
// Each entry point checks its arguments in one order (flags, type, required
// pointers), calls the internal operation of its topic file and returns its
// code. Nothing thrown inside gets out: the internals throw only
// std::bad_alloc (from the decoder's list of converted strings), which
// becomes NO_MEMORY.

#include <cstdint>
#include <cstring>
#include <new>

#include "pmsg_i_format.h"

namespace {

// The type as a plain number; a caller may pass any value in the enum.
int32_t type_number(qv_data_type_t type) {
  int32_t number;
  static_assert(sizeof number == sizeof type);
  std::memcpy(&number, &type, sizeof number);
  return number;
}

unsigned char *bytes_of(void *p_memory) {
  return static_cast<unsigned char *>(p_memory);
}

const unsigned char *bytes_of(const void *p_memory) {
  return static_cast<const unsigned char *>(p_memory);
}

}  // namespace

extern "C" {

QV_PMSG_EXPORT int32_t qv_pmsg_size_conv_protocol_value_1(uint32_t total_values, uint32_t flags,
                                                          qv_data_type_t type,
                                                          const qv_value_t *p_values,
                                                          uint32_t *p_length) noexcept {
  if (flags != 0) {
    return QV_PMSG_RESULT_BAD_FLAGS;
  }
  int32_t number = type_number(type);
  if (pmsg_i_kind_of(number) == pmsg_i_kind::invalid) {
    return QV_PMSG_RESULT_BAD_TYPE;
  }
  if (p_length == nullptr || (p_values == nullptr && total_values != 0)) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  return pmsg_i_size_values(number, p_values, total_values, p_length);
}

QV_PMSG_EXPORT int32_t qv_pmsg_build_conv_protocol_value_1(
    cu_iconv_t *p_conversion, uint32_t flags, qv_data_type_t type, const qv_value_t *p_value,
    qv_pmsg_value_t *p_slot, void *p_indirect, uint32_t indirect_length,
    uint32_t *p_indirect_offset) noexcept {
  if (flags != 0) {
    return QV_PMSG_RESULT_BAD_FLAGS;
  }
  int32_t number = type_number(type);
  pmsg_i_kind kind = pmsg_i_kind_of(number);
  if (kind == pmsg_i_kind::invalid) {
    return QV_PMSG_RESULT_BAD_TYPE;
  }
  if (p_value == nullptr || p_slot == nullptr) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  if (!pmsg_i_is_fixed(kind) &&
      (p_indirect_offset == nullptr || (p_indirect == nullptr && indirect_length != 0))) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  try {
    return pmsg_i_encode_value(p_conversion, number, *p_value, bytes_of(p_slot),
                               bytes_of(p_indirect), indirect_length, p_indirect_offset);
  } catch (const std::bad_alloc &) {
    return QV_PMSG_RESULT_NO_MEMORY;
  }
}

QV_PMSG_EXPORT int32_t qv_pmsg_build_conv_packed_client_value_1(
    cu_iconv_t *p_conversion, uint32_t flags, qv_data_type_t type, qv_value_t *p_value,
    const qv_pmsg_value_t *p_slot, const void *p_indirect, uint32_t indirect_length) noexcept {
  if (flags != 0) {
    return QV_PMSG_RESULT_BAD_FLAGS;
  }
  int32_t number = type_number(type);
  pmsg_i_kind kind = pmsg_i_kind_of(number);
  if (kind == pmsg_i_kind::invalid) {
    return QV_PMSG_RESULT_BAD_TYPE;
  }
  if (p_value == nullptr || p_slot == nullptr ||
      (!pmsg_i_is_fixed(kind) && p_indirect == nullptr)) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  try {
    return pmsg_i_decode_value(p_conversion, number, bytes_of(p_slot), bytes_of(p_indirect),
                               indirect_length, p_value);
  } catch (const std::bad_alloc &) {
    return QV_PMSG_RESULT_NO_MEMORY;
  }
}

QV_PMSG_EXPORT int32_t qv_pmsg_cnv_required_1(qv_pmsg_header_t *p_header,
                                              int32_t *p_conversion_required,
                                              int32_t *p_header_converted) noexcept {
  if (p_header == nullptr || p_conversion_required == nullptr || p_header_converted == nullptr) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  return pmsg_i_check_header(p_header, p_conversion_required, p_header_converted);
}

QV_PMSG_EXPORT int32_t qv_pmsg_convert_pmsg_value_1(qv_pmsg_value_t *p_slot, qv_data_type_t type,
                                                    void *p_indirect) noexcept {
  int32_t number = type_number(type);
  pmsg_i_kind kind = pmsg_i_kind_of(number);
  if (kind == pmsg_i_kind::invalid) {
    return QV_PMSG_RESULT_BAD_TYPE;
  }
  if (p_slot == nullptr || (!pmsg_i_is_fixed(kind) && p_indirect == nullptr)) {
    return QV_PMSG_RESULT_NULL_ARGUMENT;
  }
  return pmsg_i_convert_value(bytes_of(p_slot), number, bytes_of(p_indirect),
                              QV_PMSG_LENGTH_UNBOUNDED);
}

}  // extern "C"
