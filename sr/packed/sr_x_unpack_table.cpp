// sr_x_unpack_table.cpp - sr_unpack_table_1: one table of a packed buffer
// made a read-only transient table of a tree. It enters a table in the
// tree, so it runs with the fork guard and ForkMutex and takes the tree's
// write lock, as creating a table does.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"
#include "packed/sr_i_unpack_table.h"

namespace {
constexpr sr_i_entry_point_t Unpack_Table{111, true};
}

extern "C" int32_t sr_unpack_table_1(const void *p_buffer, uint32_t total_hash_buckets,
                                     sr_hash_function_t hash_function,
                                     sr_hash_keys_compare_function_t compare_function,
                                     sr_opaque_handle_t tree_handle, uint32_t table_index,
                                     sr_opaque_handle_t *p_table) {
  return sr_i_run_entry_point(Unpack_Table, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    // A client hash comes with its compare function and bucket count, all
    // checked before anything is done.
    if (p_buffer == nullptr || p_table == nullptr ||
        (hash_function != nullptr && (compare_function == nullptr || total_hash_buckets == 0))) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    sr_i_table_t *p_unpacked = nullptr;
    if (const int32_t rc = sr_i_unpack_table(p_buffer, total_hash_buckets, hash_function,
                                             compare_function, p_tree, table_index, &p_unpacked);
        rc != 0) {
      return rc;
    }
    *p_table = p_unpacked;
    return 0;
  });
}
