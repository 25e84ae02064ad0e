/*
 * sr_i_rows.h - the row record and what every row operation shares.
 *
 * A row record is one record of the table's record buffer pool, the same
 * layout whether it is a row's applied, committed or pending version:
 *
 *   +0            u32 header word: the file offset of the row's committed
 *                 record when the row has one, else 0
 *   +4            one 8-byte slot per column, in column order: the value of a
 *                 fixed-size type, or the anchor (offset from the start of the
 *                 variable part, length) of a variable-length value
 *   +4 + 8 x n    the variable part: the encoded bodies, back to back
 *
 * Records are not aligned (see sr_i_record_buffer_pool.h): every read and
 * write of a header word or slot goes through memcpy, and slot pointers are
 * handed to libqv_pmsg, which reads them byte-wise.
 *
 * The key is column 0. The key pointer of a record, which the key hash table
 * keeps, is the first slot for a fixed-size key type and the start of the
 * key's body for a variable-length one.
 */
#ifndef SR_I_ROWS_H
#define SR_I_ROWS_H

#include <cstdint>
#include <cstring>
#include <vector>

#include "qv_pmsg.h"
#include "qv_sr.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_table.h"

inline constexpr uint32_t Sr_Row_Header_Length = 4;
inline constexpr uint32_t Sr_Row_Slot_Length = 8;

/* Header word and slots of a row record of `p_table`. */
inline uint32_t sr_i_row_fixed_length(const sr_i_table_t *p_table) {
  return Sr_Row_Header_Length + Sr_Row_Slot_Length * p_table->total_columns;
}

inline unsigned char *sr_i_row_slot(void *p_record, uint32_t column) {
  return static_cast<unsigned char *>(p_record) + Sr_Row_Header_Length +
         Sr_Row_Slot_Length * column;
}
inline const unsigned char *sr_i_row_slot(const void *p_record, uint32_t column) {
  return static_cast<const unsigned char *>(p_record) + Sr_Row_Header_Length +
         Sr_Row_Slot_Length * column;
}

inline unsigned char *sr_i_row_variable_part(const sr_i_table_t *p_table, void *p_record) {
  return static_cast<unsigned char *>(p_record) + sr_i_row_fixed_length(p_table);
}
inline const unsigned char *sr_i_row_variable_part(const sr_i_table_t *p_table,
                                                   const void *p_record) {
  return static_cast<const unsigned char *>(p_record) + sr_i_row_fixed_length(p_table);
}

inline uint32_t sr_i_row_header_word(const void *p_record) {
  uint32_t word;
  std::memcpy(&word, p_record, sizeof word);
  return word;
}
inline void sr_i_set_row_header_word(void *p_record, uint32_t word) {
  std::memcpy(p_record, &word, sizeof word);
}

/* The anchor held in an 8-byte slot (of a record or of a column default). */
inline qv_pmsg_value_anchor_t sr_i_slot_anchor(const void *p_slot) {
  qv_pmsg_value_anchor_t anchor;
  std::memcpy(&anchor, p_slot, sizeof anchor);
  return anchor;
}

/* The packed default bodies of the variable-length columns: their columns'
 * default_value slots hold anchors into this area. */
inline const unsigned char *sr_i_default_data(const sr_i_table_t *p_table) {
  return reinterpret_cast<const unsigned char *>(p_table->p_columns + p_table->total_columns);
}

/* The key pointer of a record (see above). */
const void *sr_i_row_key(const sr_i_table_t *p_table, const void *p_record);

/* The key pointer of a client's key value, which the key hash table hashes
 * and compares with the key pointers of records: the block the value points
 * at for a variable-length key type, the value's own 8 bytes otherwise (so
 * the pointer is only good while `key` lives). */
inline const void *sr_i_client_key_pointer(qv_data_type_t key_type, const qv_value_t &key) {
  if (!sr_i_is_variable_length(key_type)) {
    return &key;
  }
  const void *p_block;
  std::memcpy(&p_block, &key, sizeof p_block);
  return p_block;
}

/* The column of that exact name, or -1. `likely_column`, when a column of
 * the table, is compared first: callers naming several columns mostly name
 * them in table order. */
int32_t sr_i_find_column(const sr_i_table_t *p_table, const char *p_name,
                         uint32_t likely_column = 0);

/* The first of a caller's `total_names` names (null ones skipped) equal to
 * `p_name`, or -1. */
int32_t sr_i_find_named_value(const char *p_name, const char *const *p_names, uint32_t total_names);

/*
 * A row record under construction, outside the pool: the header word and
 * slots first, the variable part growing behind them. Add and set build a
 * record here, then move it into the pool at its exact length.
 */
class sr_i_row_builder {
 public:
  explicit sr_i_row_builder(const sr_i_table_t *p_table);

  /* Encodes a client value into the column's slot (and the variable part),
   * strings through `p_conversion` (may be null); a null pointer of a
   * variable-length type is stored as the type's empty value. Returns 0, or
   * 11 (raised) naming the codec's function. */
  int32_t put_value(uint32_t column, const qv_value_t &value, cu_iconv_t *p_conversion);

  /* Copies a slot as it stands (a fixed-size value). */
  void put_slot(uint32_t column, const void *p_slot);

  /* Copies an encoded body and anchors it in the column's slot. */
  void put_body(uint32_t column, const void *p_body, uint32_t length);

  /* Copies the column's value from an existing record of the same table. */
  void copy_column(uint32_t column, const void *p_record);

  /* Copies the column's default value. */
  void copy_default(uint32_t column);

  void set_header_word(uint32_t word) { sr_i_set_row_header_word(p_bytes_, word); }

  uint32_t length() const { return fixed_length_ + used_; }
  const unsigned char *data() const { return p_bytes_; }

  sr_i_row_builder(const sr_i_row_builder &) = delete;
  sr_i_row_builder &operator=(const sr_i_row_builder &) = delete;

 private:
  /* A row of ordinary size is built in the builder itself, with no
   * allocation; a longer one moves to the heap. */
  static constexpr size_t Inline_Bytes = 512;

  unsigned char *variable_part() { return p_bytes_ + fixed_length_; }
  void reserve_variable(uint32_t length);
  void grow(size_t capacity);

  const sr_i_table_t *p_table_;
  uint32_t fixed_length_;
  uint32_t used_ = 0; /* bytes of the variable part in use */
  unsigned char inline_bytes_[Inline_Bytes];
  std::vector<unsigned char> heap_bytes_;
  unsigned char *p_bytes_ = inline_bytes_;
  size_t capacity_ = Inline_Bytes;
};

/*
 * Finds room in the table's pool for the built record and copies it there;
 * the record stays free in the pool until sr_i_rb_allocate_record takes it
 * with the returned previous free record. Returns 0 or 12 (raised).
 */
int32_t sr_i_place_row_record(sr_i_table_t *p_table, const sr_i_row_builder &builder,
                              void **pp_record, sr_i_record_metadata_t **pp_previous_free_record);

/* The value with a null pointer of a variable-length type replaced by the
 * library's empty value of that type. */
qv_value_t sr_i_dup_nonscalar_value(qv_data_type_t type, const qv_value_t &from);

/*
 * Records a pending change of a row: a deletion (`deletion` 1) or an addition
 * or update (0). A row keeps at most one change entry; an entry of the other
 * kind moves to the end of the right list. Returns 0 or 12 (raised).
 */
int32_t sr_i_common_add_change_entry(sr_i_table_t *p_table, sr_i_index_entry_t *p_index_entry,
                                     uint32_t deletion);
inline int32_t sr_i_add_change_entry(sr_i_table_t *p_table, sr_i_index_entry_t *p_index_entry) {
  return sr_i_common_add_change_entry(p_table, p_index_entry, 0);
}

/* Unlinks a change entry from its list and frees it; the row's
 * p_pending_change is cleared. */
void sr_i_remove_change_entry(sr_i_table_t *p_table, sr_i_change_entry_t *p_change);

/* Fixed-index position of an index entry. */
inline uint32_t sr_i_fixed_position(const sr_i_table_t *p_table,
                                    const sr_i_index_entry_t *p_entry) {
  return static_cast<uint32_t>(p_entry - p_table->p_rows_fixed_index);
}

/*
 * Takes the entry at packed position `packed` out of the packed index by
 * moving the last packed position into its place, and counts one applied
 * row fewer.
 */
void sr_i_remove_from_packed_index(sr_i_table_t *p_table, uint32_t packed);

/*
 * Compares a client value with a stored slot of a record whose variable part
 * starts at `p_indirect`: -1, 0 (equal) or 1. Numbers by value (a NaN on
 * either side is equal to everything), strings byte-wise, resource handles
 * by cu_rsrc_hndl_cmp_1; every other type is never equal (-1).
 */
int32_t sr_i_compare_values(const qv_value_t *p_value, const void *p_slot, qv_data_type_t type,
                            const void *p_indirect);

/* The row's state from its two records. */
sr_row_state_t sr_i_get_row_state_for_fixed_index(const sr_i_table_t *p_table,
                                                  uint32_t fixed_row_index);

/*
 * Rebuilds the packed index and the key hash table from the committed rows
 * (after a table was loaded or copied). Returns 0 or the hash table's code.
 */
int32_t sr_i_establish_secondary_row_access(sr_i_table_t *p_table);

#endif /* SR_I_ROWS_H */
