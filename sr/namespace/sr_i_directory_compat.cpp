// sr_i_directory_compat.cpp - the older directory calls: the tables and
// directories directly below a registry path, and making and deleting
// directories.
//
// Registry paths have no directories of their own: a directory is implied
// by every table, mount point or remembered directory whose path passes
// through it. Below a mount point the tables are flat files, so nothing
// there can stand for an empty directory; a directory made there reserves
// nothing, and it is listed once a table lies below it. Outside every mount
// point the tree remembers the directories made, so that a directory made
// and still empty is listed, until it is deleted or the tree is closed.

#include <cstdlib>
#include <cstring>
#include <set>
#include <string>
#include <string_view>
#include <utility>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "namespace/sr_i_listing.h"
#include "tables/sr_i_table.h"

namespace {

// A directory's path as the tree remembers it: no trailing "/", except for
// the root itself.
std::string without_trailing_slash(std::string path) {
  while (path.size() > 1 && path.ends_with('/')) {
    path.pop_back();
  }
  return path;
}

// The prefix every path below the directory begins with: the directory and
// one "/".
std::string below(const std::string &directory) {
  return directory.ends_with('/') ? directory : directory + "/";
}

// The names found directly below one directory, each kind of each name
// once, in name order.
class children {
 public:
  explicit children(std::string prefix) : prefix_(std::move(prefix)) {}

  // Counts `path` (a table's, or with `is_directory` a directory's) as the
  // child it passes through: the table itself when it lies directly below,
  // else the directory of its next component.
  void add(std::string_view path, bool is_directory) {
    if (!path.starts_with(prefix_) || path.size() == prefix_.size()) {
      return;
    }
    const std::string_view rest = path.substr(prefix_.size());
    const size_t slash = rest.find('/');
    if (slash == std::string_view::npos) {
      found_.emplace(std::string(path), is_directory ? SR_DIRECTORY : SR_TABLE);
    } else if (slash != 0) {
      found_.emplace(prefix_ + std::string(rest.substr(0, slash)), SR_DIRECTORY);
    }
  }

  const std::string &prefix() const { return prefix_; }
  const auto &found() const { return found_; }

 private:
  std::string prefix_;
  std::set<std::pair<std::string, sr_entry_t>> found_;
};

// The records handed to the caller, owned here until they are.
class entry_list {
 public:
  entry_list() = default;
  ~entry_list() { sr_i_free_directory_list(p_entries_, total_); }
  entry_list(const entry_list &) = delete;
  entry_list &operator=(const entry_list &) = delete;

  // Room for `count` records; an empty list is an array too. 0 or 12.
  int32_t reserve(size_t count) {
    p_entries_ = static_cast<sr_entry_metadata_t *>(
        std::calloc(count == 0 ? 1 : count, sizeof(sr_entry_metadata_t)));
    return p_entries_ == nullptr ? sr_i_raise_no_memory() : 0;
  }

  // 0 or 12.
  int32_t append(const std::string &name, sr_entry_t type, sr_storage_t storage) {
    sr_entry_metadata_t &entry = p_entries_[total_];
    entry.name = strdup(name.c_str());
    if (entry.name == nullptr) {
      return sr_i_raise_no_memory();
    }
    entry.type = type;
    entry.storage = storage;
    entry.p_table_list = nullptr;
    ++total_;
    return 0;
  }

  void hand_out(sr_entry_metadata_t **pp_entries, uint32_t *p_count) {
    *pp_entries = p_entries_;
    *p_count = total_;
    p_entries_ = nullptr;
    total_ = 0;
  }

 private:
  sr_entry_metadata_t *p_entries_ = nullptr;
  uint32_t total_ = 0;
};

// Every table below `prefix` is offered to `visit(path)` until it returns
// a code other than 0: from the mount directory when `prefix` lies below a
// mount point, else the tree's transient tables. That code, 0, or the 206
// or 10 of reading the directory.
template <typename Visit>
int32_t for_each_table_below(const sr_i_tree_t *p_tree, const std::string &prefix, Visit visit) {
  if (const sr_i_mount_point_t *p_mount = sr_i_find_mount_point(p_tree, prefix)) {
    return sr_i_for_each_table_file(p_mount->filesystem_path.c_str(), [&](std::string_view name) {
      const std::string path = sr_i_registry_path_of_file(*p_mount, name);
      return path.starts_with(prefix) ? visit(std::string_view(path)) : 0;
    });
  }
  for (auto entry = p_tree->tables.lower_bound(prefix);
       entry != p_tree->tables.end() && entry->first.starts_with(prefix); ++entry) {
    if (entry->second->p_file == nullptr) {
      if (const int32_t rc = visit(std::string_view(entry->first)); rc != 0) {
        return rc;
      }
    }
  }
  return 0;
}

// The mount point names below or at `prefix`, without their "/".
template <typename Visit>
void for_each_mount_point_from(const sr_i_tree_t *p_tree, const std::string &prefix, Visit visit) {
  for (auto mount = p_tree->mount_points.lower_bound(prefix);
       mount != p_tree->mount_points.end() && mount->first.starts_with(prefix); ++mount) {
    visit(std::string_view(mount->first).substr(0, mount->first.size() - 1));
  }
}

// Persistent when the entry lies below a mount point (a directory: when
// its own path with "/" does).
sr_storage_t storage_of(const sr_i_tree_t *p_tree, const std::string &name, sr_entry_t type) {
  const std::string path = type == SR_DIRECTORY ? below(name) : name;
  return sr_i_find_mount_point(p_tree, path) != nullptr ? SR_PERSISTENT : SR_TRANSIENT;
}

}  // namespace

int32_t sr_i_get_directory_list(sr_i_tree_t *p_tree, const char *p_registry_path,
                                sr_entry_metadata_t **pp_entries, uint32_t *p_count) {
  if (const int32_t rc = sr_i_check_path_syntax(p_registry_path); rc != 0) {
    return rc;
  }
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  children found(below(p_registry_path));
  const bool below_mount_point = sr_i_find_mount_point(p_tree, found.prefix()) != nullptr;
  if (const int32_t rc = for_each_table_below(p_tree, found.prefix(),
                                              [&](std::string_view path) {
                                                found.add(path, false);
                                                return 0;
                                              });
      rc != 0) {
    return rc;
  }
  for_each_mount_point_from(p_tree, found.prefix(),
                            [&](std::string_view path) { found.add(path, true); });
  if (!below_mount_point) {
    for (const std::string &directory : p_tree->directories) {
      found.add(directory, true);
    }
  }
  entry_list list;
  if (const int32_t rc = list.reserve(found.found().size()); rc != 0) {
    return rc;
  }
  for (const auto &[name, type] : found.found()) {
    if (const int32_t rc = list.append(name, type, storage_of(p_tree, name, type)); rc != 0) {
      return rc;
    }
  }
  list.hand_out(pp_entries, p_count);
  return 0;
}

void sr_i_free_directory_list(sr_entry_metadata_t *p_entries, uint32_t count) {
  if (p_entries == nullptr) {
    return;
  }
  for (uint32_t entry = 0; entry < count; ++entry) {
    std::free(p_entries[entry].name);
  }
  std::free(p_entries);
}

int32_t sr_i_create_directory(sr_i_tree_t *p_tree, const char *p_registry_path) {
  if (const int32_t rc = sr_i_check_path_syntax(p_registry_path); rc != 0) {
    return rc;
  }
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  std::string directory = without_trailing_slash(p_registry_path);
  // The root always exists; below a mount point there is nothing to keep.
  if (directory != "/" && sr_i_find_mount_point(p_tree, below(directory)) == nullptr) {
    p_tree->directories.insert(std::move(directory));
  }
  return 0;
}

int32_t sr_i_delete_directory(sr_i_tree_t *p_tree, const char *p_registry_path) {
  if (const int32_t rc = sr_i_check_path_syntax(p_registry_path); rc != 0) {
    return rc;
  }
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  const std::string directory = without_trailing_slash(p_registry_path);
  const std::string prefix = below(directory);
  bool holds_mount_point = false;
  for_each_mount_point_from(p_tree, prefix, [&](std::string_view) { holds_mount_point = true; });
  if (holds_mount_point) {
    return sr_i_raise(SR_E_MOUNT_POINT_EXISTS);
  }
  if (const int32_t rc = for_each_table_below(
          p_tree, prefix, [](std::string_view) { return sr_i_raise(SR_E_TABLE_EXISTS); });
      rc != 0) {
    return rc;
  }
  // The directory goes with every empty directory made below it.
  std::erase_if(p_tree->directories, [&](const std::string &remembered) {
    return remembered == directory || remembered.starts_with(prefix);
  });
  return 0;
}
