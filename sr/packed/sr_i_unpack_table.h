/*
 * sr_i_unpack_table.h - unpacking: one table of a packed buffer becomes a
 * read-only transient table of a tree, built on the buffer's row records
 * without copying them into a pool.
 */
#ifndef SR_I_UNPACK_TABLE_H
#define SR_I_UNPACK_TABLE_H

#include <cstdint>

#include "frame/sr_i_tree.h"
#include "qv_sr.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

/*
 * Makes a read-only transient table of `p_tree` named `p_name` (null for an
 * unnamed table) whose rows are the records of `p_packed_rows_array`: a
 * malloc'ed copy, `length` bytes, of the body of a packed rows array
 * (sr_i_packed_buffer.h) in this machine's byte order. Each record is
 * checked before it enters: its anchor in the array, its length word,
 * every anchor inside its variable part, and a key body a hash or
 * comparison reads in place. The index points into the array, which the
 * table keeps and frees when it is freed. Every row is committed. The table
 * takes `p_rows_hash_table` and the array, and frees both on failure; it is
 * not entered in the tree. Returns 0 and the table in *pp_table, 14 (a
 * record that does not hold together), 108, 11, 12 and the codes of table
 * creation (raised).
 */
int32_t sr_i_create_read_only_transient_table_from_packed_rows(
    sr_i_tree_t *p_tree, const char *p_name, sr_column_t *p_columns, uint32_t total_columns,
    sr_hash_table_t *p_rows_hash_table, void *p_packed_rows_array, uint32_t length,
    sr_i_table_t **pp_table);

/*
 * Unpacks table `table_index` of a buffer in this machine's byte order into
 * `p_tree`, whose write lock the caller holds, and enters it there: under
 * its packed name, or unnamed when that name is "". Key hashing: the
 * caller's bucket count and functions when `hash_function` is not null
 * (101 unless all three are given), the built-in hash for a resource-handle
 * key, none otherwise. Returns 0 and the table, or 14, 203, 101, 102 (a
 * name below a mount point of the tree, or not a path), 201, 108, 11, 12
 * and the codes of table creation (raised).
 */
int32_t sr_i_unpack_table(const void *p_buffer, uint32_t total_hash_buckets,
                          sr_hash_function_t hash_function,
                          sr_hash_keys_compare_function_t compare_function, sr_i_tree_t *p_tree,
                          uint32_t table_index, sr_i_table_t **pp_table);

#endif /* SR_I_UNPACK_TABLE_H */
