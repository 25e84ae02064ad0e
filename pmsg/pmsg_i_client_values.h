// pmsg_i_client_values.h - reading the caller's values (the shapes of
// qv_types.h) the way both sizing and encoding must agree on: a null pointer
// anywhere in a value stands for that type's empty value, and a data type
// stored in a caller's structure is read as a plain number, since a caller
// may have put anything there.

#ifndef PMSG_I_CLIENT_VALUES_H
#define PMSG_I_CLIENT_VALUES_H

#include <cstdint>
#include <cstring>

#include "qv_types.h"

// The invalid resource handle (every word all bits set), which a null
// handle pointer encodes as.
inline constexpr qv_resource_handle_t Pmsg_Invalid_Handle = {
    0xFFFFFFFFu, {0xFFFFFFFFu, 0xFFFFFFFFu, 0xFFFFFFFFu, 0xFFFFFFFFu}};

inline const char *pmsg_i_client_string(const char *p_text) {
  return p_text != nullptr ? p_text : "";
}

inline const qv_resource_handle_t *pmsg_i_client_handle(const qv_resource_handle_t *p_handle) {
  return p_handle != nullptr ? p_handle : &Pmsg_Invalid_Handle;
}

inline uint32_t pmsg_i_client_binary_length(const qv_binary_t *p_binary) {
  return p_binary != nullptr ? p_binary->length : 0;
}

// A structured byte string's length may be negative in a caller's value;
// the encoders refuse that, so it is handed back signed.
inline int32_t pmsg_i_client_byte_string_length(const qv_sbs_t *p_byte_string) {
  return p_byte_string != nullptr ? p_byte_string->length : 0;
}

inline uint32_t pmsg_i_client_element_count(const qv_structured_data_t *p_structured) {
  return p_structured != nullptr ? p_structured->element_count : 0;
}

inline uint32_t pmsg_i_client_element_count(const qv_array_t *p_array) {
  return p_array != nullptr ? p_array->element_count : 0;
}

// The data type of a structured-data element, read without trusting that
// it is one of the enumeration's values.
inline int32_t pmsg_i_client_element_type(const qv_structured_data_element_t &element) {
  int32_t type;
  std::memcpy(&type, &element.data_type, sizeof type);
  return type;
}

#endif  // PMSG_I_CLIENT_VALUES_H
