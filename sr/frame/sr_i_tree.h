/*
 * sr_i_tree.h - trees, the client's handle on the registry, and the
 * process-wide set of open trees.
 *
 * A tree owns its named tables (by name), its unnamed tables (selection
 * results, by address), its mount points (by name, byte for byte), the
 * directories made by the older directory calls, the two
 * string conversion handles every string value passes through, and the
 * read-write lock that serialises changes to its namespace. The tree lock is
 * taken before any table lock; Registry_Trees_Mutex guards only the set of
 * open trees and is never held together with another lock.
 */
#ifndef SR_I_TREE_H
#define SR_I_TREE_H

#include <pthread.h>

#include <cstdint>
#include <map>
#include <set>
#include <string>

#include "frame/sr_i_read_write_lock.h"
#include "qv_cu.h"

/* A mount point: the registry path prefix `name` maps onto the directory
 * `filesystem_path`, whose files are written in blocks of `block_size`. */
typedef struct sr_i_mount_point_struct_t {
  std::string name;
  std::string filesystem_path;
  uint32_t block_size = 0;
} sr_i_mount_point_t;

struct sr_i_table_struct_t;

typedef struct sr_i_tree_struct_t {
  /* Named tables by key: a transient table's registry path, a persistent
   * table's file path (see sr_i_resolve_path). std::string orders bytes as
   * strcmp does. A transient table stays here until deleted; a persistent
   * one while it is open. */
  std::map<std::string, struct sr_i_table_struct_t *, std::less<>> tables;
  /* Tables without a name, by address. */
  std::set<struct sr_i_table_struct_t *> unnamed_tables;
  /* Named tables deleted, moved away or replaced while handles still held
   * them: freed by their last close, or with the tree. */
  std::set<struct sr_i_table_struct_t *> detached_tables;
  /* Mount points by name. */
  std::map<std::string, sr_i_mount_point_t, std::less<>> mount_points;
  /* Directories made by the older directory calls outside every mount
   * point, by registry path without a trailing "/": an empty directory
   * exists only here. Below a mount point a directory is implied by the
   * table files whose paths pass through it, and nothing is kept. */
  std::set<std::string, std::less<>> directories;
  /* From the process's code set into the stored form, and back; fixed for
   * the life of the tree. */
  cu_iconv_t *p_to_table_string_conversion_handle = nullptr;
  cu_iconv_t *p_from_table_string_conversion_handle = nullptr;
  sr_i_read_write_lock_t lock;
} sr_i_tree_t;

/* Every open tree of the process, by address; guarded by Registry_Trees_Mutex. */
extern std::set<sr_i_tree_t *> *P_Registry_Trees;
extern pthread_mutex_t Registry_Trees_Mutex;

/*
 * Opens the two conversion handles for the process's current locale.
 * Returns 0, or 11 (raised) naming "qv_get_local_info" or "qv_iconv_open".
 * On failure the handle already opened is left in *pp_to_table for the
 * caller's teardown.
 */
int32_t sr_i_get_string_conversion_handles(cu_iconv_t **pp_to_table, cu_iconv_t **pp_from_table);

/*
 * Adds a tree to the set of open trees: 0, or 10 (raised) when
 * Registry_Trees_Mutex cannot be locked, or 12 (raised).
 * Takes a tree out: 0; 100 (raised) when it is not an open tree; the
 * mutex call's own result, without a message, when the mutex cannot be
 * locked.
 */
int32_t sr_i_register_tree(sr_i_tree_t *p_tree);
int32_t sr_i_unregister_tree(sr_i_tree_t *p_tree);

/*
 * Tears a tree down: takes its lock for writing (a failure returns the code
 * and leaves the tree alive), closes the conversion handles, every table
 * whatever handles are still held, and the mount points, then frees the
 * tree. It takes no table lock: no other thread may use the tables. Used by sr_close_tree_1 and by
 * a failed open.
 */
int32_t sr_i_close_tree(sr_i_tree_t *p_tree);

/* Enters a new table into the tree's named tables under `key`, with the
 * tree write-locked. On failure (12, raised) the table is freed. */
int32_t sr_i_enter_named_table(sr_i_tree_t *p_tree, std::string key,
                               struct sr_i_table_struct_t *p_table);

/* A place among a tree's named tables, made before the table is entered so
 * that entering it cannot fail. A table that moves to another name needs
 * one: once it has left its old name (or its file has), a failure could
 * neither give it back nor free it under the handles that hold it. */
using sr_i_named_table_place = decltype(sr_i_tree_t::tables)::node_type;

/* Makes the place for `key`. Returns 0 or 12 (raised). */
int32_t sr_i_make_named_table_place(std::string key, sr_i_named_table_place &place);

/* Enters `p_table` at `place`, with the tree write-locked; no table of the
 * tree may hold the place's key. */
void sr_i_enter_table_at(sr_i_tree_t *p_tree, sr_i_named_table_place place,
                         struct sr_i_table_struct_t *p_table);

#endif /* SR_I_TREE_H */
