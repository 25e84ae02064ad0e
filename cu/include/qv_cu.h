/*
 * qv_cu.h - the common-utilities library libqv_cu.
 *
 * Conventions for every function below:
 *  1. Functions return a signed 32-bit result: 0 for success, otherwise one
 *     of the CU_RESULT_* codes documented with the function.
 *  2. Memory handed to the caller is released with the matching cu_rel_*_1
 *     function named in the contract.
 *  3. All functions are safe to call from several threads at once. Error
 *     information is kept per thread: one thread never sees another's.
 *  4. No function keeps a pointer to caller memory after it returns.
 */
#ifndef QV_CU_H
#define QV_CU_H

#include <stdint.h>

#include "qv_types.h"

#if defined(__GNUC__)
#define QV_CU_EXPORT __attribute__((visibility("default")))
#else
#define QV_CU_EXPORT
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Result codes of the common utilities. */
#define CU_RESULT_OK 0
#define CU_RESULT_NULL_ARGUMENT 1        /* a required pointer was null */
#define CU_RESULT_UNSUPPORTED_CODE_SET 2 /* the C library cannot convert that code set */
#define CU_RESULT_INVALID_SEQUENCE 3     /* input holds bytes the code set cannot map */
#define CU_RESULT_BAD_FLAGS 4            /* a flag word with unknown bits */
#define CU_RESULT_NO_MEMORY 12           /* memory could not be allocated */

/* ---- Per-thread error information -------------------------------------- */

/*
 * Records an error for the calling thread, replacing any earlier one.
 *   code            the error code the caller returns
 *   reserved        always 0
 *   p_catalog       message catalog name ("qv_sr.cat"), looked up through
 *                   NLSPATH and the locale by catopen()
 *   set, message    message set and number inside the catalog
 *   p_default_text  the built-in text, used when the catalog or the message
 *                   is missing. Its printf conversions (positional like
 *                   "%1$s" or sequential) tell the types of the arguments
 *                   that follow; a catalog text that asks for an argument
 *                   the default text does not have, or with another type,
 *                   is ignored in favour of the default text.
 * Returns `code`. Never fails: when memory runs out the message is dropped
 * and only the code is kept.
 */
QV_CU_EXPORT int32_t cu_set_error_1(int32_t code, int32_t reserved, const char *p_catalog,
                                    int32_t set, int32_t message, const char *p_default_text, ...);

/* Clears the calling thread's error information. Returns 0. */
QV_CU_EXPORT int32_t cu_set_no_error_1(void);

/* A copy of a thread's error information. */
typedef struct cu_error_struct_t {
  int32_t code;       /* 0 when no error is recorded */
  int32_t set;        /* message set, 0 when no error is recorded */
  int32_t message;    /* message number in the set */
  const char *p_text; /* the formatted message, "" when none */
} cu_error_t;

/*
 * Hands back a copy of the calling thread's last error information in
 * *pp_error (code 0 and an empty text when the last call succeeded).
 * Release it with cu_rel_error_1.
 * Returns 0, CU_RESULT_NULL_ARGUMENT or CU_RESULT_NO_MEMORY.
 */
QV_CU_EXPORT int32_t cu_get_error_1(cu_error_t **pp_error);

/* Releases what cu_get_error_1 handed back; a null pointer is ignored. */
QV_CU_EXPORT void cu_rel_error_1(cu_error_t *p_error);

/* ---- Data-type properties and shared values ---------------------------- */

/* Bits of a cu_dtc_table_1 entry. */
#define CU_DTC_VALID 0x0001   /* a data type a value may have (2 to 22) */
#define CU_DTC_NUMERIC 0x0002 /* a fixed-size number */
#define CU_DTC_POINTER 0x0004 /* variable length: the value points to a block */
#define CU_DTC_ARRAY 0x0008   /* one of the nine array types */
#define CU_DTC_SIGNED 0x0010  /* a signed integer */
#define CU_DTC_FLOAT 0x0020   /* a floating-point number (or an array of them) */
#define CU_DTC_INTEGER 0x0040 /* an integer (or an array of them) */

/* Properties of each data type, indexed by the type number
 * (0 to QV_DATA_TYPE_LIMIT - 1). */
QV_CU_EXPORT extern const uint16_t cu_dtc_table_1[QV_DATA_TYPE_LIMIT];

/* Shared, read-only empty values that stand in for null pointers. */
QV_CU_EXPORT extern qv_char_ptr_t const cu_ptr_empty_char_1;     /* "" */
QV_CU_EXPORT extern qv_binary_ptr_t const cu_ptr_empty_binary_1; /* length 0 */
QV_CU_EXPORT extern qv_sd_ptr_t const cu_ptr_empty_sd_1;         /* no elements */
QV_CU_EXPORT extern qv_array_ptr_t const cu_ptr_empty_array_1;   /* no elements */
/* The invalid resource handle: every word has all bits set. */
QV_CU_EXPORT extern qv_resource_handle_ptr_t const cu_ptr_invld_rsrc_hndl_1;

/*
 * A total order on resource handles: compares id1, id2, id3, id4 and then
 * the header, each as unsigned. Returns -1, 0 or 1. Two handles are equal
 * exactly when all five words are.
 */
QV_CU_EXPORT int32_t cu_rsrc_hndl_cmp_1(const qv_resource_handle_t *p_left,
                                        const qv_resource_handle_t *p_right);

/* ---- Code-set conversion ----------------------------------------------- */

/* The calling process's current locale (LC_CTYPE). */
typedef struct cu_locale_info_struct_t {
  const char *p_locale_name; /* e.g. "C", "en_US.UTF-8" */
  const char *p_code_set;    /* e.g. "ANSI_X3.4-1968", "UTF-8", "ISO-8859-1" */
} cu_locale_info_t;

/* Reads the current locale into *pp_info; release with cu_rel_locale_info_1.
 * Returns 0, CU_RESULT_NULL_ARGUMENT or CU_RESULT_NO_MEMORY. */
QV_CU_EXPORT int32_t cu_get_locale_info_1(cu_locale_info_t **pp_info);

/* Releases what cu_get_locale_info_1 handed back; null is ignored. */
QV_CU_EXPORT void cu_rel_locale_info_1(cu_locale_info_t *p_info);

/*
 * Non-zero when strings of this locale need no conversion to or from the
 * stored form (UTF-8): the locale's code set is UTF-8, or the locale is the
 * C/POSIX one, whose bytes are kept as they are so that a program which never
 * calls setlocale() stores its UTF-8 text intact. A null pointer gives 0.
 */
QV_CU_EXPORT int32_t cu_utf8_is_not_modified_1(const cu_locale_info_t *p_info);

/* Conversion flags of cu_iconv_open_1. */
#define CU_ICONV_TO_STORED 0   /* from the process's code set into UTF-8 */
#define CU_ICONV_FROM_STORED 1 /* from UTF-8 into the process's code set */
#define CU_ICONV_UNCHANGED 8   /* added when the code sets agree: bytes pass as they are */

/* A conversion handle; opaque. */
typedef struct cu_iconv_struct_t cu_iconv_t;

/*
 * Opens a converter between `p_code_set` and the stored form, in the
 * direction the flags give. Returns 0 and the handle in *pp_handle, or
 * CU_RESULT_NULL_ARGUMENT, CU_RESULT_BAD_FLAGS, CU_RESULT_UNSUPPORTED_CODE_SET,
 * CU_RESULT_NO_MEMORY. Close it with cu_iconv_close_1. A handle may be used
 * by several threads at once.
 */
QV_CU_EXPORT int32_t cu_iconv_open_1(const char *p_code_set, uint32_t flags,
                                     cu_iconv_t **pp_handle);

/*
 * Converts the NUL-terminated string `p_in` into a new NUL-terminated string
 * in *pp_out, which the caller releases with free(). A null handle converts
 * nothing (the copy is byte for byte). Returns 0, CU_RESULT_NULL_ARGUMENT,
 * CU_RESULT_INVALID_SEQUENCE (nothing is handed back) or CU_RESULT_NO_MEMORY.
 */
QV_CU_EXPORT int32_t cu_iconv_str_1(cu_iconv_t *p_handle, const char *p_in, char **pp_out);

/* Non-zero when the handle leaves every string unchanged (a null handle, or
 * one opened with CU_ICONV_UNCHANGED), so callers may skip the conversion. */
QV_CU_EXPORT int32_t cu_iconv_is_unchanged_1(const cu_iconv_t *p_handle);

/* Closes a conversion handle; null is ignored. Returns 0. */
QV_CU_EXPORT int32_t cu_iconv_close_1(cu_iconv_t *p_handle);

#ifdef __cplusplus
}
#endif

/* The selection expression language: compiler and evaluator. */
#include "qv_cu_expression.h"

#endif /* QV_CU_H */
