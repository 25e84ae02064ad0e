/*
 * sr_i_listing.h - which tables exist below a registry path, and the older
 * directory calls built on the same reading of the namespace.
 *
 * Below a mount point the tables are the files of the mount directory: each
 * file name is the rest of a registry path with "," for "/", and beside
 * them lie the ",Lock" file, side files ending in ".rewrite" and whatever
 * else is hidden (names starting with "."), none of them tables. Elsewhere
 * the tables are the transient tables the tree holds; a persistent table
 * open in the tree is known there by its file path and is found through
 * its directory instead.
 *
 * Every function here takes the tree's write lock itself: the listing and
 * the directory calls read the tree's tables and mount points, and the
 * directory calls change the tree's remembered directories.
 */
#ifndef SR_I_LISTING_H
#define SR_I_LISTING_H

#include <cstdint>
#include <string>
#include <string_view>

#include "frame/sr_i_tree.h"
#include "qv_sr.h"
#include "storage/sr_i_files.h"

/* Whether a name in a mount directory is a table file: not hidden, not the
 * ",Lock" file, not a side file. */
bool sr_i_is_table_file_name(std::string_view file_name);

/* The registry path of the table file `file_name` below `mount_point`: the
 * mount point's name, then the file name with "/" for every ",". */
std::string sr_i_registry_path_of_file(const sr_i_mount_point_t &mount_point,
                                       std::string_view file_name);

/*
 * Calls `visit(file_name)` (a std::string_view, valid for the call) for
 * every table file of the directory `p_directory`, in directory order,
 * until one returns a code other than 0. Returns that code, or 0, or the
 * 206 or 10 (raised) of reading the directory.
 */
template <typename Visit>
int32_t sr_i_for_each_table_file(const char *p_directory, Visit visit) {
  sr_i_directory_reader reader;
  if (const int32_t rc = reader.open(p_directory); rc != 0) {
    return rc;
  }
  for (;;) {
    const char *p_name = nullptr;
    if (const int32_t rc = reader.next(&p_name); rc != 0 || p_name == nullptr) {
      return rc;
    }
    if (sr_i_is_table_file_name(p_name)) {
      if (const int32_t rc = visit(std::string_view(p_name)); rc != 0) {
        return rc;
      }
    }
  }
}

/*
 * The registry paths of the tables whose paths begin with
 * `p_registry_path`, not null (the mount point's own path, with or without its "/",
 * lists the whole mount directory), as a malloc'ed array of `*p_count`
 * malloc'ed strings in `*ppp_list`; the array is handed out even when it
 * holds none. 0, or 102, 12, 15, 206, 10 (raised); on failure nothing
 * is handed out and nothing made is kept.
 */
int32_t sr_i_list_tables(sr_i_tree_t *p_tree, const char *p_registry_path, char ***ppp_list,
                         uint32_t *p_count);

/* Frees a list of `count` entries; null entries are passed over. */
void sr_i_free_table_list(char **p_list, uint32_t count);

/*
 * The tables and directories directly below the directory
 * `p_registry_path`, in name order, as a malloc'ed array of `*p_count`
 * records with malloc'ed names in `*pp_entries`. 0, or 102, 12, 206, 10
 * (raised); on failure nothing is handed out.
 */
int32_t sr_i_get_directory_list(sr_i_tree_t *p_tree, const char *p_registry_path,
                                sr_entry_metadata_t **pp_entries, uint32_t *p_count);

/* Frees a list of `count` records and their names. */
void sr_i_free_directory_list(sr_entry_metadata_t *p_entries, uint32_t count);

/* Makes a directory: remembered by the tree when transient, nothing to do
 * below a mount point. 0, or 102, 12 (raised). */
int32_t sr_i_create_directory(sr_i_tree_t *p_tree, const char *p_registry_path);

/* Deletes a directory with nothing but directories below it. 0, or 102,
 * 201 (a table below it), 207 (a mount point at or below it), 12, 206, 10
 * (raised). */
int32_t sr_i_delete_directory(sr_i_tree_t *p_tree, const char *p_registry_path);

#endif /* SR_I_LISTING_H */
