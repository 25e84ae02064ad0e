// sr_x_mount_local_tree.cpp - sr_mount_local_tree_1: maps a registry path
// prefix onto a directory, so that tables created below it are persistent
// files there. The directory and its parents are created if missing.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_paths.h"

namespace {
constexpr sr_i_entry_point_t Mount_Local_Tree{71, true};
}

extern "C" int32_t sr_mount_local_tree_1(sr_opaque_handle_t tree_handle,
                                         const char *p_registry_path, const char *p_filesystem_path,
                                         int32_t /*create*/) {
  return sr_i_run_entry_point(Mount_Local_Tree, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_filesystem_path == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    std::string key;
    uint32_t persistent = 0;
    if (const int32_t rc = sr_i_resolve_path(p_tree, p_registry_path, key, persistent); rc != 0) {
      return rc;
    }
    if (persistent != 0) {
      return sr_i_raise(SR_E_MOUNT_POINT_EXISTS);
    }
    if (p_tree->tables.contains(key)) {
      return sr_i_raise(SR_E_TABLE_EXISTS);
    }
    if (const int32_t rc = sr_i_create_all_directories_in_path(p_filesystem_path); rc != 0) {
      return rc;
    }
    sr_i_mount_point_t mount_point{std::string(p_registry_path) + "/", p_filesystem_path,
                                   Sr_Mount_Block_Size};
    const std::string name = mount_point.name;
    if (!p_tree->mount_points.emplace(name, std::move(mount_point)).second) {
      return sr_i_raise(SR_E_MOUNT_POINT_EXISTS);
    }
    return 0;
  });
}
