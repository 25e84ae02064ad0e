// sr_x_unmount_local_tree.cpp - sr_unmount_local_tree_1: removes a mount
// point. Tables already open below it keep their files; later creates and
// opens of those paths no longer find the mount point and make transient
// tables.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_paths.h"

namespace {
constexpr sr_i_entry_point_t Unmount_Local_Tree{105, false};
}

extern "C" int32_t sr_unmount_local_tree_1(sr_opaque_handle_t tree_handle,
                                           const char *p_registry_path) {
  return sr_i_run_entry_point(Unmount_Local_Tree, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    if (p_tree->mount_points.empty()) {
      return sr_i_raise(SR_E_NO_MOUNT_POINT);
    }
    std::string key;
    uint32_t persistent = 0;
    if (const int32_t rc = sr_i_resolve_path(p_tree, p_registry_path, key, persistent); rc != 0) {
      return rc;
    }
    // The mount point's own path resolves to itself; a path below it
    // resolves to a file path and finds nothing.
    if (p_tree->mount_points.erase(key + "/") == 0) {
      return sr_i_raise(SR_E_NO_MOUNT_POINT);
    }
    return 0;
  });
}
