/*
 * sr_i_create_table.h - making tables: column validation, the metadata
 * record that holds a table's column definitions, names, structured-data
 * definitions and packed default values, and the creation of transient
 * tables. The exported calls and the dispatcher are in sr_x_create_table.cpp.
 */
#ifndef SR_I_CREATE_TABLE_H
#define SR_I_CREATE_TABLE_H

#include <cstdint>

#include "qv_cu.h"
#include "qv_sr.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

struct sr_i_tree_struct_t;

/* Create modes: SR_MODE_EXPLICIT_CONTROL asks for explicit control (the
 * caller applies and commits); 0 to 7 are accepted. */
inline constexpr int32_t Sr_Create_Explicit_Control = SR_MODE_EXPLICIT_CONTROL;
inline constexpr int32_t Sr_Highest_Create_Mode =
    SR_MODE_READ | SR_MODE_WRITE | SR_MODE_EXPLICIT_CONTROL;

/*
 * Makes a transient table named `p_name` (null for an unnamed table) with a
 * copy of the columns. The table takes `p_rows_hash_table` (closed on every
 * failure); without one, a resource-handle key gets the built-in hash. The
 * caller's column array is in its original order again on return. The row
 * index starts with room for `expected_rows` (at least the usual first
 * hundred), so a caller about to fill the table does not grow it row by row.
 * Returns 0 and the table in *pp_table, or 104, 105, 106, 107, 108, 11, 12
 * (raised).
 */
int32_t sr_i_create_transient_table(struct sr_i_tree_struct_t *p_tree, const char *p_name,
                                    sr_column_t *p_columns, uint32_t total_columns, int32_t mode,
                                    sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table,
                                    uint32_t expected_rows = Sr_Initial_Transient_Rows);

/*
 * The common step of making a transient table, without the first pool
 * block and without a mode: a row index of `initial_rows` positions, the
 * column defaults encoded through `p_default_conversion` (null when they
 * are in the stored form already). The table takes `p_rows_hash_table` as
 * sr_i_create_transient_table does. Returns 0 and the table in *pp_table,
 * or 104, 105, 106, 107, 108, 11, 12 (raised).
 */
int32_t sr_i_create_transient_table_object(struct sr_i_tree_struct_t *p_tree, const char *p_name,
                                           const sr_column_t *p_columns, uint32_t total_columns,
                                           int32_t mode, uint32_t initial_rows,
                                           cu_iconv_t *p_default_conversion,
                                           sr_hash_table_t *p_rows_hash_table,
                                           sr_i_table_t **pp_table);

/*
 * The dispatcher of the exported creation calls: checks the arguments,
 * resolves the path and makes a transient table entered into the tree, or
 * refuses. Takes ownership of `p_rows_hash_table`.
 */
int32_t sr_x_create_table(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                          sr_column_t *p_columns, uint32_t array_count, int32_t mode,
                          sr_hash_table_t *p_rows_hash_table,
                          sr_opaque_handle_t *p_result_table_handle);

#endif /* SR_I_CREATE_TABLE_H */
