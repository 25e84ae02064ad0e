/*
 * sr_i_packed_columns.h - a table's column definitions as a packed buffer
 * carries them: one structured value per column, of seven elements,
 *
 *   0 QV_CHAR_PTR        the name
 *   1 QV_UINT32          the type
 *   2 QV_UINT32          the qualifier, modifiers included
 *   3 QV_INT32           the properties
 *   4 QV_UINT32_ARRAY    the field types of the structured-data definition
 *   5 QV_CHAR_PTR_ARRAY  the field names of that definition
 *   6 the column's type  the default value
 *
 * and the way back to sr_column_t for a table unpacked from the buffer.
 * Strings travel in the stored form, as in the row records beside them.
 */
#ifndef SR_I_PACKED_COLUMNS_H
#define SR_I_PACKED_COLUMNS_H

#include <cstdint>
#include <memory>
#include <vector>

#include "packed/sr_i_packed_buffer.h"
#include "qv_sr.h"
#include "tables/sr_i_table.h"

/* The column metadata of one table as a client value of type
 * QV_SD_PTR_ARRAY, for the codec to encode into a buffer. */
class sr_i_packed_column_metadata {
 public:
  /* Builds it from the table's columns. Returns 0, 11 or 12 (raised). */
  int32_t build(const sr_i_table_t *p_table);
  const qv_value_t &value() const { return value_; }

 private:
  template <typename T>
  T *new_block(size_t bytes);

  std::vector<std::unique_ptr<unsigned char[]>> blocks_;
  std::vector<sr_i_decoded<void>> decoded_defaults_;
  qv_value_t value_{};
};

/*
 * The column definitions of a packed table, rebuilt from its decoded column
 * metadata. Names and variable-length defaults point into the decoded
 * block, which the object keeps for as long as it lives.
 */
class sr_i_unpacked_columns {
 public:
  sr_column_t *data() { return columns_.data(); }
  uint32_t size() const { return static_cast<uint32_t>(columns_.size()); }
  const sr_column_t &operator[](uint32_t column) const { return columns_[column]; }

 private:
  friend int32_t sr_i_unpack_column_definitions(qv_array_t *p_column_metadata,
                                                sr_i_unpacked_columns &columns);
  sr_i_decoded<qv_array_t> p_metadata_;
  std::vector<sr_column_t> columns_;
  std::vector<std::unique_ptr<unsigned char[]>> definitions_; /* sr_sd_def_t blocks */
};

/*
 * Takes over a decoded column metadata array (freed with `columns`, also on
 * failure) and rebuilds the column definitions from it. Every element must
 * have the shape above, each default the type of its column, and the key
 * must be column 0 and no other; otherwise 14 (raised). 12 (raised).
 */
int32_t sr_i_unpack_column_definitions(qv_array_t *p_column_metadata,
                                       sr_i_unpacked_columns &columns);

#endif /* SR_I_PACKED_COLUMNS_H */
