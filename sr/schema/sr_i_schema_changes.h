/*
 * sr_i_schema_changes.h - changing the columns of an open table.
 *
 * Adding, deleting and renaming columns and changing a default rebuild the
 * table: a new table object is built with the new columns and a copy of
 * every committed row, made durable (a persistent table's file written anew
 * beside it and renamed over it), and its image is exchanged into the open
 * object, so that every handle sees the new schema at once and a failure
 * anywhere leaves the table and its file as they were. The two overlays
 * change the column definitions in memory alone.
 *
 * Everything here runs under the table's write lock.
 */
#ifndef SR_I_SCHEMA_CHANGES_H
#define SR_I_SCHEMA_CHANGES_H

#include <cstdint>

#include "frame/sr_i_errors.h"
#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "tables/sr_i_table.h"

/*
 * 206 unless the table is open for writing; 209 while it has pending
 * changes, or applied ones not committed (raised). A rebuild copies the
 * committed rows only, so it must not start while anything else is on the
 * way.
 */
int32_t sr_i_check_rebuildable(const sr_i_table_t *p_table);

/*
 * Builds the rebuilt image of `p_table` for one of three changes: columns
 * added (`p_new_columns`, names null), a column renamed (`p_old_column_name`
 * to `p_new_column_name`), or a column's default replaced
 * (`p_old_column_name` and `p_new_value`). Every column is kept, invisible
 * ones too, but only a visible column can be named. Existing rows keep
 * their values; added columns take their defaults. The result is a
 * memory-only table, not entered in the tree, with every row committed.
 * Returns 0 with it in `*pp_result_table`, or 206, 209, 105 (unknown or
 * invisible column), the creation codes for the new column list (104 to 108,
 * 11), 12 (raised).
 */
int32_t sr_i_update_metadata(sr_i_table_t *p_table, const sr_column_t *p_new_columns,
                             uint32_t total_new_columns, const char *p_old_column_name,
                             const char *p_new_column_name, const qv_value_t *p_new_value,
                             sr_i_table_t **pp_result_table);

/*
 * Builds the rebuilt image of `p_table` without the named columns: a
 * selection of the key and every column left, in table order. Returns 0
 * with it in `*pp_result_table`, or 101, 104, 206, 209, 105 (more names than
 * columns besides the key; an unknown, key or invisible column), 12
 * (raised).
 */
int32_t sr_i_delete_columns(sr_i_table_t *p_table, const char *const *p_column_names,
                            uint32_t total_column_names, sr_i_table_t **pp_result_table);

/*
 * Makes the rebuilt image `p_new_table` the image of the open `p_table` and
 * frees the old one; `p_new_table` is consumed either way. A persistent
 * table's file is first written anew through apply (by rewrite) and commit;
 * if that fails the table and its file are as before and the failure is
 * returned. The change counter ends one higher (a persistent table's as its
 * commit sets it). 0, or the codes of apply and commit (10, 12, 16, 206).
 */
int32_t sr_i_complete_rebuild(sr_i_table_t *p_table, sr_i_table_t *p_new_table);

/*
 * Exchanges the image of a table between the open object and a rebuilt
 * one: column definitions, rows with their indexes, hash table and pool,
 * counters, and the file bookkeeping. What makes the open object the table
 * its holders know (name, lock, references, mode, tree, application
 * metadata, visibility setting) stays.
 */
void sr_i_swap_after_metadata_update(sr_i_table_t *p_table, sr_i_table_t *p_new_table);

/*
 * Replaces the default value of the column named `p_column_name` (any
 * column) in memory: rows are not touched and nothing is written. A
 * variable-length default is encoded over the old one in place, so it may
 * not be longer. Returns 0, or 105 (no such column), 205 (longer than the
 * stored default), 11, 12 (raised).
 */
int32_t sr_i_overlay_memory_default_value(sr_i_table_t *p_table, const char *p_column_name,
                                          qv_value_t new_default_value);

/*
 * Replaces the qualifier of the standard column `p_column_name` in memory
 * by `new_qualifier`, which must also be standard: only the flag bits
 * change. Returns 0 or 105 (raised).
 */
int32_t sr_i_overlay_memory_column_qualifier(sr_i_table_t *p_table, const char *p_column_name,
                                             sr_qualifier_t new_qualifier);

/*
 * The common body of the rebuilding calls: 100 for a null handle, the
 * table's write lock, then `build(p_table, &p_new_table)` (which makes its
 * own checks, in its own order) and sr_i_complete_rebuild.
 */
template <typename Build>
int32_t sr_i_rebuild_table(sr_opaque_handle_t table_handle, Build &&build) {
  return sr_i_with_table_locked_for_writing(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
    sr_i_table_t *p_new_table = nullptr;
    if (const int32_t rc = build(p_table, &p_new_table); rc != 0) {
      return rc;
    }
    return sr_i_complete_rebuild(p_table, p_new_table);
  });
}

/* The common body of the overlays: 100 for a null handle, 101 for a null
 * column name, the table's write lock, then `overlay(p_table)`. */
template <typename Overlay>
int32_t sr_i_overlay_column(sr_opaque_handle_t table_handle, const char *p_column_name,
                            Overlay &&overlay) {
  if (table_handle != nullptr && p_column_name == nullptr) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  return sr_i_with_table_locked_for_writing(table_handle, overlay);
}

#endif /* SR_I_SCHEMA_CHANGES_H */
