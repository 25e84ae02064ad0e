/*
 * sr_i_row_operations.h - the row operations behind the exported row calls:
 * adding, reading, setting and deleting rows. Each expects its caller to
 * hold the table's lock (read lock for the reads, write lock for the rest),
 * raises its failure where it happens and returns the code.
 *
 * Rows are named three ways: by fixed index (the row's position in the row
 * index, stable for its life), by packed index (its place among the rows of
 * the applied view, which moves when rows come and go) or by key (the value
 * of column 0).
 */
#ifndef SR_I_ROW_OPERATIONS_H
#define SR_I_ROW_OPERATIONS_H

#include <cstdint>

#include "qv_sr.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

/* ---- Adding (sr_i_add_row.cpp) ------------------------------------------ */

/* Adds a row from named values; unnamed columns take their defaults. */
int32_t sr_i_add_row(sr_i_table_t *p_table, const char *const *p_column_names,
                     const qv_value_t *const *p_p_values, uint32_t total_values);

/*
 * Gives a record already placed in the pool (not yet allocated) an index
 * entry and a hash element, checking the key: 108 for a key that a live row
 * of the applied view holds under SR_PRIMARY_KEY. With a hash table, a key
 * whose row is deleted in the applied view revives that row: the record
 * becomes its applied record and `*pp_existing_hash_table_element` is set
 * (else null). `p_known_bucket`, when not null, is the key's bucket as the
 * caller already computed it. Returns 0, 108 (raised), 12 (raised).
 */
int32_t sr_i_add_row_raw(sr_i_table_t *p_table, void *p_record_data,
                         const qv_value_t *p_input_key_value,
                         sr_i_index_entry_t **pp_new_index_entry,
                         sr_hash_table_element_t **pp_existing_hash_table_element,
                         const uint32_t *p_known_bucket);

/* ---- Reading (sr_i_get_values.cpp) -------------------------------------- */

/* The visible record: the applied one when either the table or the caller
 * wants uncommitted updates, else the committed one. */
int32_t sr_i_get_value_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                       const char *p_column_name, qv_value_t *p_value,
                                       uint32_t uncommitted_updates_visible,
                                       sr_row_state_t *p_row_state);
int32_t sr_i_get_values_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                        const char *const *p_column_names,
                                        qv_value_t *const *p_values, uint32_t total_values,
                                        uint32_t uncommitted_updates_visible,
                                        sr_row_state_t *p_row_state);
int32_t sr_i_get_value_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                        const char *p_column_name, qv_value_t *p_value,
                                        uint32_t uncommitted_updates_visible,
                                        sr_row_state_t *p_row_state);
int32_t sr_i_get_values_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                         const char *const *p_column_names,
                                         qv_value_t *const *p_values, uint32_t total_values,
                                         uint32_t uncommitted_updates_visible,
                                         sr_row_state_t *p_row_state);
int32_t sr_i_get_value_for_key(sr_i_table_t *p_table, qv_value_t row_key, const char *p_column_name,
                               qv_value_t *p_value, uint32_t uncommitted_updates_visible,
                               sr_row_state_t *p_row_state);
int32_t sr_i_get_values_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                const char *const *p_column_names, qv_value_t *const *p_values,
                                uint32_t total_values, uint32_t uncommitted_updates_visible,
                                sr_row_state_t *p_row_state);

/* The fixed index of the row holding `row_key`: through the hash table, or
 * by a scan of the packed index comparing each row's committed key (its
 * applied key when it has none). 202 raised with the key in the message. */
int32_t sr_i_get_fixed_row_index_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                         uint32_t *p_fixed_row_index);

/* ---- Setting (sr_i_set_values.cpp) -------------------------------------- */

int32_t sr_i_set_values_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                        const char *const *p_column_names,
                                        const qv_value_t *const *p_p_values, uint32_t total_values);
int32_t sr_i_set_value_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                       const char *p_column_name, const qv_value_t *p_value);
int32_t sr_i_set_values_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                         const char *const *p_column_names,
                                         const qv_value_t *const *p_p_values,
                                         uint32_t total_values);
int32_t sr_i_set_value_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                        const char *p_column_name, const qv_value_t *p_value);
int32_t sr_i_set_values_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                const char *const *p_column_names,
                                const qv_value_t *const *p_p_values, uint32_t total_values);
int32_t sr_i_set_value_for_key(sr_i_table_t *p_table, qv_value_t row_key, const char *p_column_name,
                               const qv_value_t *p_value);

/* ---- Deleting (sr_i_delete_rows.cpp) ------------------------------------ */

/* Deletes one row of the applied view; its committed record stays until
 * commit. Returns 0 or 12 (raised). */
int32_t sr_i_delete_row(sr_i_table_t *p_table, sr_i_index_entry_t *p_current_index_entry);

/* Deletes every live row of the applied view (null criteria), or those the
 * criteria select. 212, 205, and the expression's codes (raised). */
int32_t sr_i_delete_rows(sr_i_table_t *p_table, const char *p_selection_criteria);

#endif /* SR_I_ROW_OPERATIONS_H */
