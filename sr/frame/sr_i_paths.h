/*
 * sr_i_paths.h - registry paths: the syntax check, resolution of a path to
 * the key a table is known by (its registry path, or for a table below a
 * mount point the path of its file), and creation of mount directories.
 *
 * Below a mount point every table is one flat file in the mount directory,
 * named by the rest of its registry path with "," for "/": mount /a on
 * /var/reg, and /a/b/c/t is the file /var/reg/b,c,t. That is why "," is not
 * allowed in registry paths.
 */
#ifndef SR_I_PATHS_H
#define SR_I_PATHS_H

#include <cstdint>
#include <string>

#include "frame/sr_i_tree.h"

/* Block size of every mount point; a non-zero resolution result means the
 * path lies below a mount point (the table is persistent). */
inline constexpr uint32_t Sr_Mount_Block_Size = 512;

/*
 * 0, or 102 (raised, naming the path or "<NULL POINTER>"): 1 to 255 bytes,
 * each a letter, digit, "_" or "/", no "//". A leading "/" is not required;
 * a trailing "/" and a lone "/" are valid.
 */
int32_t sr_i_check_path_syntax(const char *p_path);

/*
 * Resolves `p_registry_path` in `p_tree` (whose lock the caller holds).
 * When the path lies below a mount point, `key` is the table's file path and
 * `persistent` the mount point's block size; otherwise `key` is the path
 * itself and `persistent` 0. When mount points are nested (/a and /a/b both
 * mounted), the deepest mount point that contains the path wins.
 * Returns 0 or 102 (raised); 12 by std::bad_alloc.
 */
int32_t sr_i_resolve_path(const sr_i_tree_t *p_tree, const char *p_registry_path, std::string &key,
                          uint32_t &persistent);

/* The mount point containing `path` (whole components), deepest first; null
 * when there is none. */
const sr_i_mount_point_t *sr_i_find_mount_point(const sr_i_tree_t *p_tree, const std::string &path);

/*
 * Creates every directory of `path` (mode 0755), keeping those that exist;
 * each one made is flushed into its parent. Returns 0, or the raised 206,
 * 16 or 10 of the first that cannot be made.
 */
int32_t sr_i_create_all_directories_in_path(const std::string &path);

#endif /* SR_I_PATHS_H */
