/*
 * qv_types.h - the typed values shared by the registry, its callers and the
 * companion libraries (common utilities, value codec).
 *
 * The numbers of qv_data_type_t appear in every stored and packed format, so
 * they never change. A value is one 8-byte qv_value_t: fixed-size types are
 * held in place, variable-length types point to one contiguous block whose
 * shape is declared below. All integers inside those blocks are in host order.
 *
 * This header is C; it is included by C and C++ translation units alike.
 */
#ifndef QV_TYPES_H
#define QV_TYPES_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* The data types of a value. Types 2 to 7 are fixed-size, 8 to 22 are
 * variable-length (their value is a pointer to a block). */
typedef enum {
  QV_UNKNOWN = 0,
  QV_NONE = 1,
  QV_INT32 = 2,
  QV_UINT32 = 3,
  QV_INT64 = 4,
  QV_UINT64 = 5,
  QV_FLOAT32 = 6,
  QV_FLOAT64 = 7,
  QV_CHAR_PTR = 8,
  QV_BINARY_PTR = 9,
  QV_RSRC_HANDLE_PTR = 10,
  QV_SD_PTR = 11,
  QV_SBS_PTR = 12,
  QV_INT32_ARRAY = 13,
  QV_UINT32_ARRAY = 14,
  QV_INT64_ARRAY = 15,
  QV_UINT64_ARRAY = 16,
  QV_FLOAT32_ARRAY = 17,
  QV_FLOAT64_ARRAY = 18,
  QV_CHAR_PTR_ARRAY = 19,
  QV_BINARY_PTR_ARRAY = 20,
  QV_RSRC_HANDLE_PTR_ARRAY = 21,
  QV_SD_PTR_ARRAY = 22
} qv_data_type_t;

/* One more than the highest data type number. */
#define QV_DATA_TYPE_LIMIT 23

/* A counted byte string: `length` bytes follow the count. */
typedef struct qv_binary_struct_t {
  uint32_t length;
  unsigned char data[];
} qv_binary_t;

/* The identity part of a resource handle. */
typedef struct qv_resource_id_struct_t {
  uint32_t id1;
  uint32_t id2;
  uint32_t id3;
  uint32_t id4;
} qv_resource_id_t;

/* A resource handle: a header word (two 16-bit halves) and its identity. */
typedef struct qv_resource_handle_struct_t {
  uint32_t header;
  qv_resource_id_t id;
} qv_resource_handle_t;

/* One field of a structured byte string: `field_length` bytes of data
 * follow this 4-byte field header directly. */
typedef struct qv_sbs_field_struct_t {
  int16_t field_length;
  int8_t field_dtype;
  int8_t field_sn;
  unsigned char field_data[];
} qv_sbs_field_t;

/* A structured byte string: `length` bytes of qv_sbs_field_t records packed
 * back to back, each one 4 + field_length bytes long, with no padding. */
typedef struct qv_sbs_struct_t {
  int32_t length;
  unsigned char fields[];
} qv_sbs_t;

struct qv_structured_data_struct_t;
struct qv_array_struct_t;

typedef char *qv_char_ptr_t;
typedef qv_binary_t *qv_binary_ptr_t;
typedef qv_resource_handle_t *qv_resource_handle_ptr_t;
typedef struct qv_structured_data_struct_t *qv_sd_ptr_t;
typedef qv_sbs_t *qv_sbs_ptr_t;
typedef struct qv_array_struct_t *qv_array_ptr_t;

/* A value of any type, eight bytes. */
typedef union qv_value_union_t {
  int32_t val_int32;
  uint32_t val_uint32;
  int64_t val_int64;
  uint64_t val_uint64;
  float val_float32;
  double val_float64;
  qv_char_ptr_t ptr_char;
  qv_binary_ptr_t ptr_binary;
  qv_resource_handle_ptr_t ptr_rsrc_handle;
  qv_sd_ptr_t ptr_sd;
  qv_sbs_ptr_t ptr_sbs;
  qv_array_ptr_t ptr_array;
} qv_value_t;

/* One typed element of a structured-data value. */
typedef struct qv_structured_data_element_struct_t {
  qv_data_type_t data_type;
  uint32_t pad;
  qv_value_t value;
} qv_structured_data_element_t;

/* Structured data: `element_count` typed elements. */
typedef struct qv_structured_data_struct_t {
  uint32_t element_count;
  uint32_t pad;
  qv_structured_data_element_t elements[];
} qv_structured_data_t;

/* An array: `element_count` values, all of the array's element type (for the
 * pointer arrays each element points to its own block). */
typedef struct qv_array_struct_t {
  uint32_t element_count;
  uint32_t pad;
  qv_value_t elements[];
} qv_array_t;

#ifdef __cplusplus
}
#endif

#endif /* QV_TYPES_H */
