/*
 * sr_i_table.h - the table object behind every table handle, transient or
 * persistent: column definitions (in the metadata record), row records (in
 * the record buffer pool), the fixed row index with its free chain, the
 * packed index of live rows, the change lists, the key hash table, the
 * transaction state, and for a persistent table its file
 * (storage/sr_i_table_file.h).
 *
 * A row keeps its fixed index position for life; the packed index lists the
 * rows in order. Pending changes are entries of two doubly linked lists that
 * point at their rows' index entries.
 */
#ifndef SR_I_TABLE_H
#define SR_I_TABLE_H

#include <cstdint>

#include "frame/sr_i_read_write_lock.h"
#include "qv_sr.h"
#include "tables/sr_i_record_buffer_pool.h"

struct sr_hash_table_struct_t;
struct sr_hash_table_element_struct_t;
struct sr_i_application_metadata_struct_t;
struct sr_i_tree_struct_t;
struct sr_i_change_entry_struct_t;
struct sr_i_table_file_struct_t;

/* Table open modes (the `mode` field). */
inline constexpr uint32_t Sr_Mode_Read_Only = 1;
inline constexpr uint32_t Sr_Mode_Writable = 2;

/* The values of ready_for_commit: what the last apply did. Applied
 * changes wait for commit or abort; further changes are refused. */
inline constexpr uint32_t Sr_Nothing_Applied = 0;
inline constexpr uint32_t Sr_Applied_In_Place = 1;   /* in memory, or appended to the file */
inline constexpr uint32_t Sr_Applied_By_Rewrite = 2; /* written as a new file beside it */

/* Positions a new transient table starts with, and what 0 stands for. */
inline constexpr uint32_t Sr_Initial_Transient_Rows = 100;
inline constexpr uint32_t Sr_Default_Index_Rows = 10;

/* One position of the fixed row index. The two 32-bit positions share one
 * 8-byte word so that an entry takes 48 bytes, not 56: the index holds an
 * entry for every row and doubles as it grows. */
typedef struct sr_i_index_entry_struct_t {
  void *p_applied;   /* the row record as applied, or null */
  void *p_committed; /* the row record as committed; null: no committed row */
  uint32_t file_offset;
  uint32_t applied_file_offset;
  /* The row's pending change; while the entry is free, the next free entry. */
  void *p_pending_change;
  uint32_t hash_index;
  uint32_t packed_index;
  struct sr_hash_table_element_struct_t *p_hash_table_element;
} sr_i_index_entry_t;
static_assert(sizeof(sr_i_index_entry_t) == 48);

/* A pending change of one row. */
typedef struct sr_i_change_entry_struct_t {
  uint32_t deletion;
  sr_i_index_entry_t *p_index_entry;
  struct sr_i_change_entry_struct_t *p_next;
  struct sr_i_change_entry_struct_t *p_prev;
} sr_i_change_entry_t;

/* Change entries are carved from blocks of this many, owned by the table. */
inline constexpr uint32_t Sr_Change_Entries_Per_Block = 128;

typedef struct sr_i_change_entry_block_struct_t {
  struct sr_i_change_entry_block_struct_t *p_next; /* the block made before */
  sr_i_change_entry_t entries[Sr_Change_Entries_Per_Block];
} sr_i_change_entry_block_t;

typedef struct sr_i_table_struct_t {
  char *p_name; /* absolute registry path, or null for an unnamed table */
  uint32_t references;
  void *p_metadata_record_data;
  sr_column_t *p_columns;
  uint32_t total_columns;
  uint32_t total_variable_length_columns;
  uint32_t maximum_rows;
  uint32_t total_applied_rows;
  uint32_t total_committed_rows;
  sr_i_index_entry_t *p_rows_fixed_index;
  uint32_t *p_rows_packed_index;
  sr_i_change_entry_t *p_rows_change_list;
  sr_i_change_entry_t *p_rows_change_list_tail;
  sr_i_change_entry_t *p_delete_rows_change_list;
  sr_i_change_entry_t *p_delete_rows_change_list_tail;
  uint32_t implicitly_controlled;
  uint32_t uncommitted_updates_visible;
  uint64_t change_counter;
  uint64_t applied_change_counter;
  struct sr_i_tree_struct_t *p_tree;
  struct sr_i_table_struct_t *p_next;
  uint32_t mode;
  uint32_t block_size;       /* the mount point's; 0 for a transient table */
  uint32_t ready_for_commit; /* set by the transaction code alone */
  uint32_t applied_deletions;
  /* The file of a persistent table; null for a transient one. */
  struct sr_i_table_file_struct_t *p_file;
  char *p_persistent_table_registry_path;
  struct sr_hash_table_struct_t *p_rows_hash_table;
  sr_i_index_entry_t *p_rows_free_chain;
  /* The lowest index entry never handed out. It and every entry above it
   * are free, zero and chained without links, each to the next: making or
   * growing the index does not walk the new entries to chain them, so the
   * part of a large index no row has reached yet is never touched. */
  sr_i_index_entry_t *p_rows_never_used;
  struct sr_i_application_metadata_struct_t *p_application_metadata;
  /* A table unpacked from a packed buffer keeps its rows here, one block,
   * instead of in the pool; null for every other table. */
  void *p_packed_rows_array;
  /* Where change entries come from: the newest block first in the chain,
   * whose last `unused_change_entries` entries were never handed out, and
   * entries given back during the transaction, waiting for the next change.
   * One allocation serves many changes, and ending the transaction frees
   * the blocks in one step. */
  sr_i_change_entry_block_t *p_change_entry_blocks;
  uint32_t unused_change_entries;
  sr_i_change_entry_t *p_free_change_entries; /* linked through p_next */
  sr_i_read_write_lock_t lock;
  sr_i_record_buffer_pool_t record_buffer_pool;
} sr_i_table_t;

/*
 * The null table every table object starts from: one reference, implicitly
 * controlled, change counter 1, no name, columns, index or files
 * (descriptors -1), an empty pool, its lock open, and uncommitted updates
 * visible when SR_UNCOMMITTED_UPDATES_VISIBLE is set in the environment.
 * Null when memory runs out (12 raised). Free it with sr_i_close_table.
 */
sr_i_table_t *sr_i_create_null_table();

/* Frees the table and everything it owns, writing nothing: what is pending
 * or applied and not committed is dropped. Null is ignored. */
void sr_i_close_table(sr_i_table_t *p_table);

/* Makes both indexes for `maximum_rows` positions (10 for 0), all free.
 * Returns 0 or 12 (raised). */
int32_t sr_i_establish_rows_index(sr_i_table_t *p_table, uint32_t maximum_rows);

/* Adds `total_new_rows` free positions to an index with none free, keeping
 * the pending changes pointed at their rows when the index moves. Returns 0
 * or 12 (raised); a failure leaves the index, its free chain and the
 * pending changes as they were. */
int32_t sr_i_grow_index(sr_i_table_t *p_table, uint32_t total_new_rows);

/* What a table gets once its columns are known, whether created or loaded:
 * the built-in key hash table when the key is a resource handle and the
 * caller brought no hash table, and the application metadata container.
 * 12 (raised) when either cannot be had. */
int32_t sr_i_open_key_hash_and_metadata(sr_i_table_t *p_table);

/* Clears an entry and gives it back; the chain stays in address order. */
void sr_i_rows_free_chain_insert(sr_i_table_t *p_table, sr_i_index_entry_t *p_entry);

/* Takes the lowest free entry, or null when none is free. */
sr_i_index_entry_t *sr_i_rows_free_chain_remove(sr_i_table_t *p_table);

/* Frees every change entry, of both lists and given back, and empties the
 * lists. */
void sr_i_free_change_lists(sr_i_table_t *p_table);

/* A cleared change entry of the table's own, or null (12 raised). */
sr_i_change_entry_t *sr_i_new_change_entry(sr_i_table_t *p_table);

/* Gives one change entry, already unlinked from its list, back to the
 * table for the next change. */
void sr_i_free_change_entry(sr_i_table_t *p_table, sr_i_change_entry_t *p_change);

/* Whether `length` bytes from `offset` lie in one file block of the
 * table's block size (a record ending on a boundary does not); the block
 * number of `offset` goes to `block`. */
bool sr_i_record_contained_in_block(const sr_i_table_t *p_table, uint32_t offset, uint32_t length,
                                    uint32_t &block);

/* Exchanges the contents of two table objects, except the open object's
 * identity: its lock, reference count, tree and link stay. Neither lock may
 * be held by another thread; the caller may hold `p_open`'s. */
void sr_i_swap_table_contents(sr_i_table_t *p_open, sr_i_table_t *p_other);

#endif /* SR_I_TABLE_H */
