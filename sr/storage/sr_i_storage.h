/*
 * sr_i_storage.h - the bytes of a table file and the operations that
 * make, read and change it.
 *
 * A table file is a log of records, each behind a 12-byte header (length,
 * next offset 0, type): the metadata record at offset 0, then row records,
 * deletion records and commit records. The first live commit record ends
 * the committed state; anything behind it belongs to an apply that was
 * never committed and is never read. A record in memory carries the pool's
 * 20-byte header instead, so it is 8 bytes longer; the metadata record is
 * also 12 bytes longer per column, its name and definition offsets being
 * pointers in memory.
 */
#ifndef SR_I_STORAGE_H
#define SR_I_STORAGE_H

#include <cstdint>
#include <span>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

/* Record types of a table file. */
inline constexpr uint32_t Sr_Dead_Record = 0;
inline constexpr uint32_t Sr_Metadata_Record = 1;
inline constexpr uint32_t Sr_Row_Record = 2;
inline constexpr uint32_t Sr_Deletion_Record = 3;
/* Sr_Live_Commit_Record (0xFFFFFFFF) is in sr_i_commit_record.h. */

inline constexpr uint32_t Sr_File_Record_Header_Length = 12;
/* In-memory records are this much longer than on disk. */
inline constexpr uint32_t Sr_Memory_Record_Extra = 8;
/* A file shorter than this cannot be a table. */
inline constexpr uint32_t Sr_Shortest_Table_File = 13;

/* The metadata record of `p_table` in its file form. 0 or 12 (raised). */
int32_t sr_i_convert_metadata_memory_record_to_disk_record(const sr_i_table_t *p_table,
                                                           std::vector<unsigned char> &disk);

/*
 * Rebuilds the metadata record of a table with an empty pool from its file
 * form (header included), checking every offset and length against the
 * record first. 0, 14 (raised) for a record that does not hold together,
 * 12.
 */
int32_t sr_i_convert_metadata_disk_record_to_memory_record(sr_i_table_t *p_table,
                                                           std::span<const unsigned char> disk);

/*
 * Creates the persistent table `p_file_path` (below a mount point of block
 * size `block_size`) from validated columns: the table in memory, then its
 * file, written as a rewrite file and renamed into place. On success the
 * table holds the lock of its file. `p_rows_hash_table` (or null) is taken
 * over whatever the outcome. Returns 0 or a raised code (10, 12, 16, 201,
 * 206, and the codes of transient creation); a failure leaves no file.
 */
int32_t sr_i_create_persistent_table(struct sr_i_tree_struct_t *p_tree, const char *p_registry_path,
                                     const char *p_file_path, sr_column_t *p_columns,
                                     uint32_t total_columns, int32_t mode, uint32_t block_size,
                                     sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table);

/*
 * Loads the persistent table in `p_file_path` at its committed state.
 * `mode` is a normalised open mode (SR_MODE_WRITE: writable, which locks
 * the file, waiting for another writer to close it; SR_MODE_EXPLICIT_CONTROL:
 * explicit control).
 * `p_rows_hash_table` (or null) is taken over whatever the outcome, and so
 * is `locked_fd`: a descriptor of the file open for reading and writing
 * that already holds its lock, which a writable table then uses instead of
 * opening and locking the file itself (a second descriptor of this process
 * would wait for that lock for ever).
 * Returns 0 or a raised code: 10, 12, 14, 16, 101, 200, 206, 213, 214, 215.
 */
int32_t sr_i_open_persistent_table(struct sr_i_tree_struct_t *p_tree, const char *p_registry_path,
                                   const char *p_file_path, int32_t mode, uint32_t block_size,
                                   sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table,
                                   int locked_fd = -1);

/*
 * Whether an apply should write the live rows into a new file instead of
 * appending: the table has a file past 16384 bytes and the pool's used
 * bytes are under half of it. The percentage is computed in unsigned 32-bit
 * arithmetic, wrapping for pools past 42,949,672 bytes, as the file
 * format's other writers do.
 */
uint32_t sr_i_rewrite_wanted(const sr_i_table_t *p_table);

/*
 * Writes the table's pending changes where no reader looks yet: appended
 * behind the live commit record, or with `rewrite` as a complete new file
 * beside the table file; flushed either way. `*p_applied` says which
 * (Sr_Applied_In_Place or Sr_Applied_By_Rewrite), also on failure, for the
 * abort. 0 or a raised code (10, 12, 16, 206).
 */
int32_t sr_i_apply_to_file(sr_i_table_t *p_table, uint32_t rewrite, uint32_t *p_applied);

/*
 * Makes what the apply wrote (`applied`, as it reported) the file's
 * committed state: the old commit record killed, or the rewrite file
 * renamed onto the table file and the directory flushed. `*p_committed`
 * says whether the file now holds the new state; it can be true with a
 * failure, when only the directory flush after the rename failed. 0 or a
 * raised code (10, 16, 206).
 */
int32_t sr_i_commit_file(sr_i_table_t *p_table, uint32_t applied, bool *p_committed);

/* Throws away what the apply wrote: the appended tail cut off, or the
 * rewrite file removed. */
void sr_i_abort_file(sr_i_table_t *p_table, uint32_t applied);

/*
 * Writes `p_table` (the rows of its applied view, its application metadata
 * and change counter) as a complete table file to the empty file `path`,
 * open as `fd`, and flushes it. The table is not changed. 0 or a raised
 * code (10, 12, 16, 206).
 */
int32_t sr_i_write_table_file(const sr_i_table_t *p_table, int fd, const std::string &path);

#endif /* SR_I_STORAGE_H */
