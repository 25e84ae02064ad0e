// sr_x_repair_tables.cpp - sr_repair_tables_1: removes the rewrite files
// that crashed applies or creations may have left beside persistent
// tables. The table files themselves are never touched: their readers
// already ignore whatever an uncommitted apply wrote.
//
// A side file whose lock is held is being written by a live apply,
// creation or copy, here or in another process, and is left alone. Repair
// runs in a forked child too (it takes neither the fork guard nor
// ForkMutex).

#include <string>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_paths.h"
#include "frame/sr_i_tree.h"
#include "storage/sr_i_files.h"

namespace {
constexpr sr_i_entry_point_t Repair_Tables{87, false};
}

extern "C" int32_t sr_repair_tables_1(sr_opaque_handle_t tree_handle,
                                      const char *const *p_registry_paths, uint32_t total_paths) {
  return sr_i_run_entry_point(Repair_Tables, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (total_paths == 0) {
      return 0;
    }
    if (p_registry_paths == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    for (uint32_t at = 0; at < total_paths; ++at) {
      std::string file_path;
      uint32_t block_size = 0;
      if (const int32_t rc = sr_i_resolve_path(p_tree, p_registry_paths[at], file_path, block_size);
          rc != 0) {
        return rc;
      }
      if (block_size != 0) {
        // A missing rewrite file is the normal case.
        sr_i_discard_abandoned_file((file_path + ".rewrite").c_str());
      }
    }
    return 0;
  });
}
