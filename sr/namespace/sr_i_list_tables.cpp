// sr_i_list_tables.cpp - the registry paths of the tables below a path:
// from the mount directory's file names below a mount point, from the
// tree's transient tables elsewhere.
//
// The list is built in a local array that grows by 100 entries before it
// would overflow; whatever path the call leaves by without handing it out
// (a raised code, an escaping std::bad_alloc), the entries made so far and
// the array are freed, so a failed listing leaves nothing behind.

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "namespace/sr_i_listing.h"
#include "storage/sr_i_files.h"
#include "tables/sr_i_table.h"

namespace {

constexpr uint32_t List_Growth = 100;

// The array handed to the caller, owned here until it is.
class table_list {
 public:
  table_list() = default;
  ~table_list() { sr_i_free_table_list(p_list_, total_); }
  table_list(const table_list &) = delete;
  table_list &operator=(const table_list &) = delete;

  // Room for the first entries, so that an empty listing hands out an
  // array too. 0 or 12.
  int32_t start() { return grow(); }

  // Appends a copy of `prefix` followed by `rest`, with every "," of `rest`
  // turned into "/" when `from_file_name`. 0 or 12.
  int32_t append(std::string_view prefix, std::string_view rest, bool from_file_name) {
    if (total_ == capacity_) {
      if (const int32_t rc = grow(); rc != 0) {
        return rc;
      }
    }
    auto *p_entry = static_cast<char *>(std::malloc(prefix.size() + rest.size() + 1));
    if (p_entry == nullptr) {
      return sr_i_raise_no_memory();
    }
    // An empty view may hold no pointer at all, which memcpy must not get.
    std::memcpy(p_entry, prefix.data(), prefix.size());
    char *p_rest = p_entry + prefix.size();
    if (!rest.empty()) {
      std::memcpy(p_rest, rest.data(), rest.size());
    }
    p_rest[rest.size()] = '\0';
    if (from_file_name) {
      for (char *p_comma = std::strchr(p_rest, ','); p_comma != nullptr;
           p_comma = std::strchr(p_comma + 1, ',')) {
        *p_comma = '/';
      }
    }
    p_list_[total_++] = p_entry;
    return 0;
  }

  // Gives the array and its entries to the caller.
  void hand_out(char ***ppp_list, uint32_t *p_count) {
    *ppp_list = p_list_;
    *p_count = total_;
    p_list_ = nullptr;
    total_ = 0;
  }

 private:
  int32_t grow() {
    const size_t capacity = size_t{capacity_} + List_Growth;
    void *p_grown = std::realloc(p_list_, capacity * sizeof(char *));
    if (p_grown == nullptr) {
      return sr_i_raise_no_memory();
    }
    p_list_ = static_cast<char **>(p_grown);
    capacity_ = static_cast<uint32_t>(capacity);
    return 0;
  }

  char **p_list_ = nullptr;
  uint32_t total_ = 0;
  uint32_t capacity_ = 0;
};

// Below a mount point: the file `file_path` names the table at the path
// listed; every table file of its directory whose name begins with the
// file's own name is listed. 0, 206, 10 or 12.
int32_t list_table_files(const sr_i_mount_point_t &mount_point, const std::string &file_path,
                         table_list &list) {
  const size_t slash = file_path.rfind('/');
  const std::string directory = slash == 0 ? "/" : file_path.substr(0, slash);
  const std::string_view file_name_prefix = std::string_view(file_path).substr(slash + 1);
  return sr_i_for_each_table_file(directory.c_str(), [&](std::string_view name) {
    return name.starts_with(file_name_prefix) ? list.append(mount_point.name, name, true) : 0;
  });
}

// Elsewhere: the transient tables whose paths begin with `prefix`. A
// persistent table is in the same map under its file path, and is passed
// over: its directory is where it is listed.
int32_t list_transient_tables(const sr_i_tree_t *p_tree, std::string_view prefix,
                              table_list &list) {
  for (auto entry = p_tree->tables.lower_bound(prefix);
       entry != p_tree->tables.end() && entry->first.starts_with(prefix); ++entry) {
    if (entry->second->p_file == nullptr) {
      if (const int32_t rc = list.append(entry->first, {}, false); rc != 0) {
        return rc;
      }
    }
  }
  return 0;
}

}  // namespace

bool sr_i_is_table_file_name(std::string_view file_name) {
  return !file_name.empty() && !file_name.starts_with('.') && file_name != ",Lock" &&
         !file_name.ends_with(".rewrite");
}

std::string sr_i_registry_path_of_file(const sr_i_mount_point_t &mount_point,
                                       std::string_view file_name) {
  std::string path = mount_point.name;
  const size_t start = path.size();
  path.append(file_name);
  std::replace(path.begin() + static_cast<std::ptrdiff_t>(start), path.end(), ',', '/');
  return path;
}

int32_t sr_i_list_tables(sr_i_tree_t *p_tree, const char *p_registry_path, char ***ppp_list,
                         uint32_t *p_count) {
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  // A mount point's own path lists its whole directory, "/" or not: only
  // with the "/" does it resolve into the directory.
  std::string path = p_registry_path;
  if (!path.empty() && !path.ends_with('/') && p_tree->mount_points.contains(path + "/")) {
    path += '/';
  }
  table_list list;
  if (const int32_t rc = list.start(); rc != 0) {
    return rc;
  }
  std::string resolved;
  uint32_t persistent = 0;
  if (const int32_t rc = sr_i_resolve_path(p_tree, path.c_str(), resolved, persistent); rc != 0) {
    return rc;
  }
  if (persistent != 0) {
    const sr_i_mount_point_t *p_mount_point = sr_i_find_mount_point(p_tree, path);
    if (p_mount_point == nullptr) {
      return sr_i_raise_internal();
    }
    if (const int32_t rc = list_table_files(*p_mount_point, resolved, list); rc != 0) {
      return rc;
    }
  } else if (const int32_t rc = list_transient_tables(p_tree, resolved, list); rc != 0) {
    return rc;
  }
  list.hand_out(ppp_list, p_count);
  return 0;
}

void sr_i_free_table_list(char **p_list, uint32_t count) {
  if (p_list == nullptr) {
    return;
  }
  for (uint32_t entry = 0; entry < count; ++entry) {
    std::free(p_list[entry]);
  }
  std::free(p_list);
}
