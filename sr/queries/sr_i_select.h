/*
 * sr_i_select.h - selection: the rows of a table that criteria pick, copied
 * into a new memory-only table or listed by fixed index. The caller holds
 * the source table's read lock (and, to enter a new table, the tree's write
 * lock); the source is never changed.
 */
#ifndef SR_I_SELECT_H
#define SR_I_SELECT_H

#include <cstdint>
#include <span>

#include "tables/sr_i_table.h"

/*
 * Makes a new unnamed table of the rows of `p_table` that the expanded
 * `p_selection_criteria` (null: every row) pick in the view the table's own
 * setting shows, restricted to the named columns (with a count of 0, all of
 * them): the key column first, then the named ones in order. Every row of
 * it is committed; it is open for writing under explicit control, its
 * change counter the source's plus 1, and it refers to the source's tree
 * without being entered in it. Returns 0 with the table in
 * `*pp_select_table`, or 104, 105, 11, 12, 15 (raised); nothing is made on
 * failure.
 */
int32_t sr_i_select(sr_i_table_t *p_table, const char *const *p_column_names,
                    uint32_t total_column_names, const char *p_selection_criteria,
                    sr_i_table_t **pp_select_table);

/*
 * sr_i_select with the source columns given by position (`source_columns`,
 * the key's 0 first; a position may come twice), in the applied view when
 * `uncommitted_updates_visible` is set, else the committed one: what
 * deleting columns keeps is a selection of the columns left, invisible
 * ones included, and a copy of a table in memory is a selection of all.
 */
int32_t sr_i_select_columns(sr_i_table_t *p_table, std::span<const uint32_t> source_columns,
                            const char *p_selection_criteria, uint32_t uncommitted_updates_visible,
                            sr_i_table_t **pp_select_table);

/*
 * Copies the row record `p_from_record_data` of `p_table` into `p_new_table`
 * as a committed row: whole when `p_column_indices` is null, otherwise the
 * source columns it lists, one per column of the new table. The new
 * table's index must have a free entry. Returns 0, 12 or 15 (raised).
 */
int32_t sr_i_copy_row(const sr_i_table_t *p_table, const void *p_from_record_data,
                      sr_i_table_t *p_new_table, const uint32_t *p_column_indices);

/*
 * The fixed indexes of the rows that the expanded `p_selection_criteria`
 * (null: every row) pick, in fixed-index order, as a malloc'ed array the
 * caller frees (allocated also for a count of 0). The rows are those of the
 * applied view when `uncommitted_updates_visible` or the table's setting
 * asks for it, else of the committed view; the criteria are judged on each
 * row's applied record, and a row without one (deleted in the applied
 * view) does not match. Returns 0, 11, 12 or 15 (raised).
 */
int32_t sr_i_get_selected_rows(sr_i_table_t *p_table, const char *p_selection_criteria,
                               uint32_t uncommitted_updates_visible,
                               uint32_t *p_total_selected_rows,
                               uint32_t **pp_selected_rows_fixed_index);

#endif /* SR_I_SELECT_H */
