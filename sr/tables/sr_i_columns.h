/*
 * sr_i_columns.h - column definitions of a new table: validation, the
 * packing of variable-length defaults, and the metadata record.
 */
#ifndef SR_I_COLUMNS_H
#define SR_I_COLUMNS_H

#include <cstdint>
#include <span>
#include <vector>

#include "qv_cu.h"
#include "qv_sr.h"
#include "tables/sr_i_table.h"

/* Whether values of `type` keep their data outside the 8-byte slot. */
inline bool sr_i_is_variable_length(qv_data_type_t type) {
  const auto number = static_cast<uint32_t>(type);
  return number < QV_DATA_TYPE_LIMIT && (cu_dtc_table_1[number] & CU_DTC_POINTER) != 0;
}

/* The fields of a structured-data definition as the metadata record keeps
 * it (a field count, then per field its type word and its NUL-terminated
 * name); the names point into that form. */
std::vector<sr_sd_field_def_t> sr_i_structured_definition_fields(const sr_sd_def_t *p_packed);

/* A column name: 1 to 255 bytes, a letter, then letters, digits and "_". */
bool sr_i_valid_column_name(const char *p_name);

/* Exchanges two column definitions. */
void sr_i_swap_columns(sr_column_t *p_first, sr_column_t *p_second);

/* The value itself, or for a null pointer of a variable-length type the
 * shared empty value of that type: a stored value is never null. */
qv_value_t sr_i_value_or_empty(qv_data_type_t type, qv_value_t value);

/*
 * Checks a new table's columns: each one's name, type, base qualifier,
 * structured-data definition and, for the key, its type (105); then one key
 * exactly (107 none, 108 several); then distinct names (106). 104 for no
 * column. On success `key_position` is the key column's index.
 */
int32_t sr_i_validate_columns(const sr_column_t *p_columns, uint32_t total_columns,
                              uint32_t &key_position);

/*
 * Encodes the default value of every variable-length column into `packed`
 * (strings through `p_conversion`, which may be null) and replaces the
 * column's default_value by the value's anchor in `packed`. Returns 0, or 11
 * (raised) when the codec refuses a value.
 */
int32_t sr_i_pack_variable_length_default_values(cu_iconv_t *p_conversion, sr_column_t *p_columns,
                                                 uint32_t total_columns,
                                                 std::vector<unsigned char> &packed,
                                                 uint32_t &total_variable_length_columns);

/*
 * Reserves the table's metadata record (the first record of its empty pool)
 * and fills it from the columns (defaults already packed), pointing the
 * table's p_columns and each column's name and sd_defn into it.
 * Returns 0, 12 or 15 (raised).
 */
int32_t sr_i_build_metadata_record(sr_i_table_t *p_table, const sr_column_t *p_columns,
                                   uint32_t total_columns, uint32_t total_variable_length_columns,
                                   const std::vector<unsigned char> &packed_defaults);

/*
 * Reserves the metadata record of `p_table` (an empty pool) holding the
 * columns of `p_source` at the positions `source_columns`, in that order
 * (a position may come twice): definitions, names, defaults and
 * structured-data definitions copied, their references into the record
 * made anew. Returns 0, 12 or 15 (raised).
 */
int32_t sr_i_build_selected_metadata_record(sr_i_table_t *p_table, const sr_i_table_t *p_source,
                                            std::span<const uint32_t> source_columns);

#endif /* SR_I_COLUMNS_H */
