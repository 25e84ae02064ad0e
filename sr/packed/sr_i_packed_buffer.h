/*
 * sr_i_packed_buffer.h - the packed table buffer: several tables in one
 * self-describing block that another process, possibly on a machine of the
 * other byte order, converts, inspects and unpacks. docs/packed-buffer-format.md
 * gives the bytes; in short:
 *
 *   +0                 the 8-byte header of libqv_pmsg (length, version,
 *                      writer's byte order, protocol type 2, spare)
 *   +8                 four 8-byte slots: 0, 1, the length again, the table
 *                      count T (a 32-bit number in each first half)
 *   +40 + 32 i         table i: four slots, the anchors of its name, fixed
 *                      metadata, column metadata and rows
 *   +(4 T + 5) x 8     the indirect area that every anchor counts from
 *
 * A buffer comes from outside the process, so nothing in it is trusted: the
 * functions here check every length, count, offset and anchor before they
 * follow it, and refuse a buffer that does not hold together with 14.
 */
#ifndef SR_I_PACKED_BUFFER_H
#define SR_I_PACKED_BUFFER_H

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "qv_pmsg.h"
#include "qv_sr.h"

inline constexpr uint32_t Sr_Packed_Slot_Bytes = 8;
inline constexpr uint32_t Sr_Packed_Header_Bytes = 8;
/* Header and the four buffer slots: a buffer of no table. */
inline constexpr uint32_t Sr_Packed_Empty_Buffer_Bytes = 40;
inline constexpr uint32_t Sr_Packed_Slots_Per_Table = 4;
inline constexpr uint8_t Sr_Packed_Protocol_Type = 2;

/* The buffer slots: two fixed numbers that also show the byte order the
 * buffer is read in, the length, the table count. */
enum sr_i_packed_buffer_slot : uint32_t {
  SR_I_PACKED_ZERO_SLOT = 0,
  SR_I_PACKED_ONE_SLOT = 1,
  SR_I_PACKED_LENGTH_SLOT = 2,
  SR_I_PACKED_TABLE_COUNT_SLOT = 3,
};

/* The four slots of each table, in their order. */
enum sr_i_packed_table_slot : uint32_t {
  SR_I_PACKED_NAME = 0,            /* QV_CHAR_PTR */
  SR_I_PACKED_FIXED_METADATA = 1,  /* QV_SD_PTR, five elements */
  SR_I_PACKED_COLUMN_METADATA = 2, /* QV_SD_PTR_ARRAY, one per column */
  SR_I_PACKED_ROWS = 3,            /* QV_BINARY_PTR_ARRAY, one per row */
};

inline constexpr qv_data_type_t Sr_Packed_Table_Slot_Types[Sr_Packed_Slots_Per_Table] = {
    QV_CHAR_PTR, QV_SD_PTR, QV_SD_PTR_ARRAY, QV_BINARY_PTR_ARRAY};

/* Bytes before the indirect area of a buffer of `total_tables` tables
 * (64-bit: a hostile count must not wrap). */
inline uint64_t sr_i_packed_fixed_part_bytes(uint64_t total_tables) {
  return (Sr_Packed_Slots_Per_Table * total_tables + 5) * Sr_Packed_Slot_Bytes;
}

inline uint32_t sr_i_load_u32(const unsigned char *p_bytes) {
  uint32_t word;
  std::memcpy(&word, p_bytes, sizeof word);
  return word;
}
inline void sr_i_store_u32(unsigned char *p_bytes, uint32_t word) {
  std::memcpy(p_bytes, &word, sizeof word);
}

/* Whether `length` bytes from `offset` lie within `extent` bytes. */
inline bool sr_i_packed_span_inside(uint64_t offset, uint64_t length, uint64_t extent) {
  return offset <= extent && length <= extent - offset;
}

/*
 * The body of a table's rows array (a pointer array of binaries): a count,
 * one anchor per row counting from the body's start, then the row records.
 * True when the count's anchors fit in the body and, for a row, when its
 * anchor lies in the body behind them; `anchor` then holds it.
 */
inline bool sr_i_packed_rows_count(const unsigned char *p_body, uint32_t length,
                                   uint32_t &total_rows) {
  if (length < 4) {
    return false;
  }
  total_rows = sr_i_load_u32(p_body);
  return uint64_t{Sr_Packed_Slot_Bytes} * total_rows <= length - 4;
}
inline bool sr_i_packed_row_anchor(const unsigned char *p_body, uint32_t length,
                                   uint32_t total_rows, uint32_t row,
                                   qv_pmsg_value_anchor_t &anchor) {
  std::memcpy(&anchor, p_body + 4 + Sr_Packed_Slot_Bytes * row, sizeof anchor);
  return anchor.offset >= 4 + uint64_t{Sr_Packed_Slot_Bytes} * total_rows &&
         sr_i_packed_span_inside(anchor.offset, anchor.length, length);
}

/* A buffer whose header and buffer slots hold together, read in this
 * machine's byte order. */
struct sr_i_packed_buffer_view {
  unsigned char *p_buffer;
  uint32_t length;
  uint32_t total_tables;
  unsigned char *p_indirect; /* the indirect area */
  uint32_t indirect_length;

  unsigned char *table_slot(uint32_t table, sr_i_packed_table_slot slot) const {
    return p_buffer + Sr_Packed_Empty_Buffer_Bytes +
           (Sr_Packed_Slots_Per_Table * table + slot) * Sr_Packed_Slot_Bytes;
  }
};

/*
 * Checks the header and the buffer slots of a buffer in this machine's
 * byte order: this machine's architecture byte, version 0, protocol type 2,
 * a length of at least 40 that slot 2 repeats, slots 0 and 1 holding 0 and
 * 1, and room for the slots of every table. Fills `view`, whose pointers
 * are writable for the conversion; the other callers only read through
 * them. Returns 0, or 14 (raised).
 */
int32_t sr_i_view_packed_buffer(const void *p_buffer, sr_i_packed_buffer_view &view);

/* 0 when the anchor in the slot of a variable-length value lies inside the
 * view's indirect area, else 14 (raised). */
int32_t sr_i_check_packed_anchor(const sr_i_packed_buffer_view &view, const unsigned char *p_slot);

/* The name of table `table_index`, a pointer into the buffer. Returns 0,
 * 203 (raised) past the last table, 14 (raised). */
int32_t sr_i_get_packed_table_name(const sr_i_packed_buffer_view &view, uint32_t table_index,
                                   const char **pp_name);

/* A value decoded by libqv_pmsg: one malloc block. */
struct sr_i_free_deleter {
  void operator()(void *p_block) const { std::free(p_block); }
};
template <typename T>
using sr_i_decoded = std::unique_ptr<T, sr_i_free_deleter>;

/*
 * Decodes the value in one of a table's slots, never reading outside the
 * indirect area. A value whose body does not hold together gives 14; any
 * other failure of the codec 11, each raised.
 */
int32_t sr_i_decode_packed_value(const sr_i_packed_buffer_view &view, uint32_t table,
                                 sr_i_packed_table_slot slot, qv_value_t *p_value);

/* What a table's fixed metadata says. */
struct sr_i_packed_fixed_metadata {
  uint32_t total_rows;
  uint32_t total_columns;
  uint64_t change_counter;
};

/* Decodes a table's fixed metadata: five elements of the right types, or 14
 * (raised); 11 and 12 as sr_i_decode_packed_value. */
int32_t sr_i_read_packed_fixed_metadata(const sr_i_packed_buffer_view &view, uint32_t table,
                                        sr_i_packed_fixed_metadata &metadata);

/*
 * Packs `total_tables` tables (see sr_pack_tables_1 in qv_sr.h) into a new
 * malloc'ed buffer handed back in *pp_buffer. Takes the tables' read locks
 * in array order and releases them in the same order. Returns 0, 100, 101,
 * 203, 204, 11, 12 (raised); no buffer on failure.
 */
int32_t sr_i_pack_tables(uint32_t total_tables, const sr_opaque_handle_t *p_table_handles,
                         const uint32_t *p_uncommitted_updates_visible,
                         const uint32_t *p_total_row_fixed_indices,
                         const uint32_t *p_row_fixed_indices, void **pp_buffer);

/*
 * Converts a buffer written in the other byte order to this machine's, in
 * place (see sr_convert_packed_table_buffer_1). Returns 0, 14 (the buffer
 * is then partly converted and useless), 11 (raised).
 */
int32_t sr_i_convert_packed_buffer(void *p_buffer, uint32_t header_already_converted,
                                   int32_t do_conversion);

#endif /* SR_I_PACKED_BUFFER_H */
