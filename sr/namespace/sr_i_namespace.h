/*
 * sr_i_namespace.h - copying, moving and deleting tables by registry path,
 * between memory and disk in every direction.
 *
 * A persistent target is written as "<file>.rewrite" beside the target file
 * and renamed over it, under two file locks taken in this order: the mount
 * directory's ",Lock" file, then the target file itself. Other processes
 * that copy into the same directory wait on the first; a writer of the
 * target waits on the second. Readers take no lock and find the old table
 * or the new one.
 *
 * Lock order, outermost first: ForkMutex, the tree's write lock, the source
 * table's lock, the ",Lock" file, the target file's lock.
 */
#ifndef SR_I_NAMESPACE_H
#define SR_I_NAMESPACE_H

#include <cstdint>
#include <string>

#include "frame/sr_i_tree.h"
#include "tables/sr_i_table.h"

/* The two file locks of a persistent target, held while the object lives:
 * closing the descriptors this object opened ends them. */
class sr_i_target_lock {
 public:
  sr_i_target_lock() = default;
  ~sr_i_target_lock();
  sr_i_target_lock(const sr_i_target_lock &) = delete;
  sr_i_target_lock &operator=(const sr_i_target_lock &) = delete;

  /*
   * Locks the ",Lock" file of the directory of `target_file` (made 0644 when
   * missing), then the target file when there is one: through the
   * descriptor of `p_open_target` when that table is open here for writing
   * (it holds the lock already), else through a new one. A missing or empty
   * target counts as none. 0, 206, 16 or 10 (raised).
   */
  int32_t lock(const std::string &target_file, const sr_i_table_t *p_open_target);

  /* Bytes in the target file when it was locked: 0 for no table. */
  uint64_t target_length() const { return target_length_; }

  /* Whether a target file was there to lock. */
  bool holds_target() const { return holds_target_; }

 private:
  int lock_fd_ = -1;
  int target_fd_ = -1; /* only when opened here */
  uint64_t target_length_ = 0;
  bool holds_target_ = false;
};

/*
 * The engine of the four copy and move calls. The source is `p_source` (an
 * open table of `p_tree`) or, when that is null, the table at
 * `p_source_path`; the target is `p_target_path`, replaced only with
 * `overwrite`. With `remove_source` the source is gone afterwards: from the
 * tree, and its files from the disk. Takes the tree's write lock. Returns
 * 0, or 12, 15, 16, 10, 102, 200 (no source), 201 (a target exists), 206,
 * 209 (an open target to overwrite has changes on the way), raised; on
 * failure the target and the source are as they were.
 */
int32_t sr_i_duplicate_table(sr_i_tree_t *p_tree, sr_i_table_t *p_source, const char *p_source_path,
                             const char *p_target_path, bool remove_source, bool overwrite);

/*
 * Deletes the table at `p_registry_path`: out of the tree (freed unless
 * handles are held, which keep working on it), and for a persistent path
 * its file and side file off the disk, whether or not it was open. Takes
 * the tree's write lock. 0, 102, 200, 206, 16 or 10 (raised).
 */
int32_t sr_i_delete_table(sr_i_tree_t *p_tree, const char *p_registry_path);

/* Takes a table out of its tree's named, unnamed or detached tables, without
 * freeing it. The caller holds the tree's write lock. */
void sr_i_take_out_of_tree(sr_i_tree_t *p_tree, sr_i_table_t *p_table);

/*
 * Takes an open table out of its tree and frees it when no handle holds
 * it; otherwise it lives on, detached, until its last handle is closed.
 * The caller holds the tree's write lock. Returns 0, or 12 (raised) with
 * the table where it was.
 */
int32_t sr_i_detach_table(sr_i_tree_t *p_tree, sr_i_table_t *p_table);

/* A place among a tree's detached tables, made before the table is
 * detached so that detaching it cannot fail: what a step needs that
 * detaches a table after something it cannot take back. */
using sr_i_detached_place = decltype(sr_i_tree_t::detached_tables)::node_type;

/* Makes the place for `p_table`. Returns 0 or 12 (raised). */
int32_t sr_i_make_detached_place(sr_i_table_t *p_table, sr_i_detached_place &place);

/* sr_i_detach_table at a place made for the table. */
void sr_i_detach_table_at(sr_i_tree_t *p_tree, sr_i_table_t *p_table, sr_i_detached_place place);

/* Removes a table file from the disk durably, then its side file. 0, 200,
 * 206, 16 or 10 (raised); `*p_removed` (if given) says whether the file is
 * gone, which it is when only the flush of its directory failed. */
int32_t sr_i_remove_table_files(const std::string &file, bool *p_removed = nullptr);

#endif /* SR_I_NAMESPACE_H */
