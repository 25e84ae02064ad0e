/*
 * qv_pmsg.h - the protocol-message value library libqv_pmsg: the codec
 * through which every typed value (qv_types.h) is stored in a row record,
 * a packed default value or a packed table buffer.
 *
 * An encoded value is an 8-byte slot (qv_pmsg_value_t) and, for a
 * variable-length type, a body in an indirect area that the caller owns.
 * The slot of a fixed-size type holds the number itself; the slot of a
 * variable-length type holds an anchor (offset, length) to its body. The
 * byte-by-byte format is described in docs/value-encoding.md.
 *
 * Conventions for every function below:
 *  1. Functions return a signed 32-bit result: 0 for success, otherwise one
 *     of the QV_PMSG_RESULT_* codes listed with the function. The library
 *     records no per-thread error information; the code is all there is.
 *  2. QV_PMSG_RESULT_NO_ROOM (5) means exactly "the indirect area is too
 *     small": the same call with a larger area can succeed. No other
 *     condition ever gives 5.
 *  3. Memory: a decoded client value is one block from malloc that the
 *     caller releases with a single free() of the value's pointer. Nothing
 *     else is handed over; the library keeps no pointer to caller memory
 *     after it returns.
 *  4. Slots and bodies may lie at any address: the library reads and writes
 *     them byte-wise and assumes no alignment.
 *  5. Relocation: the body of a variable-length value depends only on its
 *     own bytes. Anchors nested inside it count from the start of that body,
 *     so a caller may copy a body to another offset, or another area, and
 *     rewrite only the top-level slot's offset.
 *  6. String conversion: functions that take a cu_iconv_t (libqv_cu) pass
 *     every string of the value, nested ones included, through it: encoding
 *     converts into the stored form, decoding back. A null handle converts
 *     nothing. A failed conversion fails the call; no string is cut short.
 *  7. Threads: every function is reentrant and keeps no global state. Two
 *     threads may use the library at once as long as they do not write the
 *     same slot or area (a conversion handle may be shared, see qv_cu.h).
 *  8. The `flags` arguments are reserved and must be 0.
 */
#ifndef QV_PMSG_H
#define QV_PMSG_H

#include <stdint.h>

#include "qv_cu.h"
#include "qv_types.h"

#if defined(__GNUC__)
#define QV_PMSG_EXPORT __attribute__((visibility("default")))
#else
#define QV_PMSG_EXPORT
#endif

/* Exceptions never leave the library; C++ callers see that in the type. */
#ifdef __cplusplus
#define QV_PMSG_NOEXCEPT noexcept
#else
#define QV_PMSG_NOEXCEPT
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* Result codes. BAD_CLIENT_VALUE is a client value that cannot be encoded:
 * a structured byte string whose fields do not add up to its length, nesting
 * deeper than QV_PMSG_MAX_NESTING, or a body too large for 32-bit offsets. */
#define QV_PMSG_RESULT_OK 0
#define QV_PMSG_RESULT_NULL_ARGUMENT 1     /* a required pointer was null */
#define QV_PMSG_RESULT_BAD_TYPE 2          /* a data type outside 2..22, at the top or nested */
#define QV_PMSG_RESULT_MALFORMED 3         /* an encoded value or header is truncated or corrupt */
#define QV_PMSG_RESULT_BAD_CLIENT_VALUE 4  /* see above */
#define QV_PMSG_RESULT_NO_ROOM 5           /* the indirect area is too small */
#define QV_PMSG_RESULT_CONVERSION_FAILED 6 /* a string could not be converted */
#define QV_PMSG_RESULT_BAD_FLAGS 7         /* a non-zero reserved flag word */
#define QV_PMSG_RESULT_NO_MEMORY 12        /* memory could not be allocated */

/* The length limit that means "unbounded" to qv_pmsg_build_conv_packed_client_value_1. */
#define QV_PMSG_LENGTH_UNBOUNDED 0xFFFFFFFFu

/* Values of composite types (structured data and the pointer arrays) nested
 * inside each other deeper than this are refused (4 when encoding, 3 when
 * decoding or converting). The top-level value is level 0. */
#define QV_PMSG_MAX_NESTING 64

/* The common header of a protocol-message buffer: the first 8 bytes of a
 * packed table buffer. Its length word is in the writer's byte order until
 * qv_pmsg_cnv_required_1 has looked at it. */
typedef struct qv_pmsg_header_struct_t {
  uint32_t qv_pmsg_length;    /* total buffer length in bytes, header included */
  uint8_t qv_pmsg_version;    /* QV_PMSG_VERSION */
  uint8_t qv_pmsg_arch_props; /* writer's byte order: QV_PMSG_ARCH_* */
  uint8_t qv_pmsg_proto_type; /* the protocol of the buffer; the caller's, not read here */
  uint8_t qv_pmsg_spare;      /* 0 */
} qv_pmsg_header_t;

#define QV_PMSG_VERSION 0
#define QV_PMSG_ARCH_BIG_ENDIAN 1
#define QV_PMSG_ARCH_LITTLE_ENDIAN 2
/* The architecture-properties value of the machine this was compiled for. */
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_BIG_ENDIAN__
#define QV_PMSG_ARCH_LOCAL QV_PMSG_ARCH_BIG_ENDIAN
#else
#define QV_PMSG_ARCH_LOCAL QV_PMSG_ARCH_LITTLE_ENDIAN
#endif

/* Where a variable-length value's body lies: `offset` counts from the start
 * of the indirect area (top-level slot) or from the start of the enclosing
 * body (nested slot); `length` is the body's exact byte count. */
typedef struct qv_pmsg_value_anchor_struct_t {
  uint32_t offset;
  uint32_t length;
} qv_pmsg_value_anchor_t;

/* One 8-byte slot. A 32-bit number fills the first four bytes and the other
 * four are zero. The union is a convenience for reading a slot known to be
 * aligned; the library itself never relies on that. */
typedef union qv_pmsg_value_union_t {
  int32_t val_int32;
  uint32_t val_uint32;
  int64_t val_int64;
  uint64_t val_uint64;
  float val_float32;
  double val_float64;
  qv_pmsg_value_anchor_t anchor;
  unsigned char bytes[8];
} qv_pmsg_value_t;

/*
 * The number of indirect bytes that encoding needs, without string
 * conversion (a conversion that changes a string's length changes it).
 *   total_values  how many values lie one after another at p_values; their
 *                 sizes are summed (1 sizes a single value)
 *   flags         0
 *   type          their data type, 2 to 22 (fixed types need 0 bytes)
 *   p_values      the client values (may be null when total_values is 0)
 *   p_length      receives the byte count
 * Returns 0, NULL_ARGUMENT, BAD_FLAGS, BAD_TYPE, BAD_CLIENT_VALUE (also when
 * the sum exceeds 32 bits). *p_length is set only on success.
 */
QV_PMSG_EXPORT int32_t qv_pmsg_size_conv_protocol_value_1(uint32_t total_values, uint32_t flags,
                                                          qv_data_type_t type,
                                                          const qv_value_t *p_values,
                                                          uint32_t *p_length) QV_PMSG_NOEXCEPT;

/*
 * Encodes one client value into its slot and, for a variable-length type,
 * its body at p_indirect + *p_indirect_offset.
 *   p_conversion        converts strings into the stored form; null for none
 *   flags               0
 *   type                2 to 22
 *   p_value             the client value; a null pointer inside it (at the
 *                       top or nested) is encoded as the type's empty value
 *                       ("", a zero-length binary or structured byte string,
 *                       no elements, the invalid resource handle)
 *   p_slot              receives the number or the anchor
 *   p_indirect          start of the indirect area (may be null when
 *                       indirect_length is 0)
 *   indirect_length     the area's total capacity in bytes, from p_indirect
 *   p_indirect_offset   where the body goes; advanced past it on success.
 *                       May be null for a fixed-size type.
 * On success the anchor's offset is *p_indirect_offset as it was on entry.
 * Returns 0, NULL_ARGUMENT, BAD_FLAGS, BAD_TYPE, BAD_CLIENT_VALUE,
 * NO_ROOM (the body would pass indirect_length; the slot and the offset are
 * untouched, bytes past the offset may have been scribbled on),
 * CONVERSION_FAILED, NO_MEMORY.
 */
QV_PMSG_EXPORT int32_t qv_pmsg_build_conv_protocol_value_1(
    cu_iconv_t *p_conversion, uint32_t flags, qv_data_type_t type, const qv_value_t *p_value,
    qv_pmsg_value_t *p_slot, void *p_indirect, uint32_t indirect_length,
    uint32_t *p_indirect_offset) QV_PMSG_NOEXCEPT;

/*
 * Decodes one encoded value into a client value.
 *   p_conversion     converts strings from the stored form; null for none
 *   flags            0
 *   type             2 to 22: the type the value was encoded with
 *   p_value          receives the number, or the pointer to a new block in
 *                    the value shape of qv_types.h (nested values inside the
 *                    same block); release it with free()
 *   p_slot           the encoded slot (a 32-bit number is read from its
 *                    first four bytes only)
 *   p_indirect       start of the indirect area (unused for fixed types)
 *   indirect_length  how many bytes from p_indirect may be read, or
 *                    QV_PMSG_LENGTH_UNBOUNDED (-1) to trust the top-level
 *                    anchor. Either way nothing outside the anchor's body is
 *                    read, and the body's inner structure is checked.
 * Returns 0, NULL_ARGUMENT, BAD_FLAGS, BAD_TYPE, MALFORMED,
 * CONVERSION_FAILED, NO_MEMORY. On failure *p_value is unchanged and nothing
 * is allocated.
 */
QV_PMSG_EXPORT int32_t qv_pmsg_build_conv_packed_client_value_1(
    cu_iconv_t *p_conversion, uint32_t flags, qv_data_type_t type, qv_value_t *p_value,
    const qv_pmsg_value_t *p_slot, const void *p_indirect,
    uint32_t indirect_length) QV_PMSG_NOEXCEPT;

/*
 * Tells whether a buffer written by another machine needs conversion, and
 * takes the header over to this machine: when the writer's byte order
 * differs, the length word is reversed and the architecture byte set to
 * QV_PMSG_ARCH_LOCAL, so that a second call answers 0. The caller must then
 * convert every value of the buffer (qv_pmsg_convert_pmsg_value_1) before
 * reading any.
 *   p_header                 the buffer's first 8 bytes
 *   p_conversion_required    receives 1 when the values need conversion
 *   p_header_converted       receives 1 when this call rewrote the header
 *                            (its length word is now readable)
 * Returns 0, NULL_ARGUMENT, MALFORMED (an unknown version or architecture
 * byte; the header is left as it was).
 */
QV_PMSG_EXPORT int32_t qv_pmsg_cnv_required_1(qv_pmsg_header_t *p_header,
                                              int32_t *p_conversion_required,
                                              int32_t *p_header_converted) QV_PMSG_NOEXCEPT;

/*
 * Converts one value written in the other byte order to this machine's, in
 * place: the slot, and for a variable-length type its body and every body
 * nested in it. Bytes of strings and binaries are left as they are. Call it
 * only on values that need conversion: it reads every count, type and anchor
 * in the other byte order, so a value already in this machine's order comes
 * out corrupt (or is refused as malformed).
 *   p_slot      the slot
 *   type        2 to 22
 *   p_indirect  start of the indirect area (unused for fixed types)
 * The top-level anchor is trusted (there is no length limit); everything
 * inside the body is checked against the body's length. (The library's
 * tests and fuzz target drive the same conversion with a length limit.)
 * Returns 0, NULL_ARGUMENT, BAD_TYPE, MALFORMED (the value is then partly
 * converted and must be discarded).
 */
QV_PMSG_EXPORT int32_t qv_pmsg_convert_pmsg_value_1(qv_pmsg_value_t *p_slot, qv_data_type_t type,
                                                    void *p_indirect) QV_PMSG_NOEXCEPT;

#ifdef __cplusplus
}
#endif

#endif /* QV_PMSG_H */
