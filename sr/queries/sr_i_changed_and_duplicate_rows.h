/*
 * sr_i_changed_and_duplicate_rows.h - two lists of a table's rows by fixed
 * index, handed to the caller as malloc'ed arrays that it frees with free:
 * the rows with pending changes, and the rows that hold one key value.
 *
 * Both expect the caller to hold the table's read lock, change nothing in
 * the table, raise their failures where they happen and return the code;
 * on failure the caller's pointers are left as they were.
 */
#ifndef SR_I_CHANGED_AND_DUPLICATE_ROWS_H
#define SR_I_CHANGED_AND_DUPLICATE_ROWS_H

#include <cstdint>

#include "qv_sr.h"
#include "tables/sr_i_table.h"

/*
 * The rows on the table's change lists: the added and updated rows in list
 * order, then the deleted rows in list order, all in one array. The count
 * is that of the added and updated rows alone; the deleted rows follow it.
 * With both lists empty the array is null and the count 0.
 * Returns 0 or 12 (raised).
 */
int32_t sr_i_get_updated_rows(const sr_i_table_t *p_table, uint32_t *p_updated_rows_count,
                              uint32_t **p_p_updated_rows_fixed_indices);

/*
 * The rows whose key equals `key_value`, among the rows that have an
 * applied record (`uncommitted_updates_visible` not 0) or a committed one
 * (0); the table's own visibility setting plays no part. With a hash table
 * they come in the order of the key's bucket, the most recently added
 * first; without one in fixed-index order. A null pointer key stands for
 * the empty value of its type, as it does when a row is added.
 * Returns 0 with at least one row; 202 (raised, naming the key and the
 * table) with none; 12 or 15 (a client hash function's bad bucket), raised.
 */
int32_t sr_i_get_duplicate_rows(const sr_i_table_t *p_table, qv_value_t key_value,
                                uint32_t *p_duplicate_rows_count,
                                uint32_t **p_p_duplicate_rows_fixed_indices,
                                uint32_t uncommitted_updates_visible);

#endif /* SR_I_CHANGED_AND_DUPLICATE_ROWS_H */
