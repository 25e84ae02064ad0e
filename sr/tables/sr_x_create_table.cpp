// sr_x_create_table.cpp - sr_create_table_1 and sr_create_hashed_key_table_1,
// and the dispatcher they share: argument checks, path resolution, and the
// new table (transient, or persistent with its first file) entered into its
// tree.

#include <memory>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_paths.h"
#include "frame/sr_i_tree.h"
#include "storage/sr_i_storage.h"
#include "tables/sr_i_create_table.h"

namespace {

constexpr sr_i_entry_point_t Create_Table{23, true};
constexpr sr_i_entry_point_t Create_Hashed_Key_Table{25, true};

// Owns a hash table until creation takes it.
struct hash_table_closer {
  void operator()(sr_hash_table_t *p_hash_table) const { sr_i_hash_table_close(p_hash_table); }
};
using owned_hash_table = std::unique_ptr<sr_hash_table_t, hash_table_closer>;

}  // namespace

int32_t sr_x_create_table(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                          sr_column_t *p_columns, uint32_t array_count, int32_t mode,
                          sr_hash_table_t *p_rows_hash_table,
                          sr_opaque_handle_t *p_result_table_handle) {
  owned_hash_table hash_table(p_rows_hash_table);
  if (tree_handle == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  if (p_result_table_handle == nullptr || (p_columns == nullptr && array_count != 0)) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  if (mode < 0 || mode > Sr_Highest_Create_Mode) {
    return sr_i_raise(SR_E_INVALID_MODE);
  }
  // A created table is always open for writing; only explicit control stays.
  mode = (mode & Sr_Create_Explicit_Control) ? SR_MODE_WRITE_EXPLICIT : SR_MODE_WRITE;
  auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  std::string key;
  uint32_t block_size = 0;
  if (const int32_t rc = sr_i_resolve_path(p_tree, p_registry_path, key, block_size); rc != 0) {
    return rc;
  }
  if (p_tree->tables.contains(key)) {
    return sr_i_raise(SR_E_TABLE_EXISTS);
  }
  sr_i_table_t *p_table = nullptr;
  const int32_t rc = block_size != 0
                         ? sr_i_create_persistent_table(p_tree, p_registry_path, key.c_str(),
                                                        p_columns, array_count, mode, block_size,
                                                        hash_table.release(), &p_table)
                         : sr_i_create_transient_table(p_tree, key.c_str(), p_columns, array_count,
                                                       mode, hash_table.release(), &p_table);
  if (rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_enter_named_table(p_tree, std::move(key), p_table); rc != 0) {
    return rc;
  }
  *p_result_table_handle = p_table;
  return 0;
}

extern "C" int32_t sr_create_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                     sr_column_t *p_columns, uint32_t array_count, int32_t mode,
                                     sr_opaque_handle_t *p_result_table_handle) {
  return sr_i_run_entry_point(Create_Table, [&] {
    return sr_x_create_table(tree_handle, p_registry_path, p_columns, array_count, mode, nullptr,
                             p_result_table_handle);
  });
}

extern "C" int32_t sr_create_hashed_key_table_1(sr_opaque_handle_t tree_handle,
                                                const char *p_registry_path, sr_column_t *p_columns,
                                                uint32_t array_count, int32_t mode,
                                                uint32_t total_hash_buckets,
                                                sr_hash_function_t p_hash_function,
                                                sr_hash_keys_compare_function_t p_compare_function,
                                                sr_opaque_handle_t *p_result_table_handle) {
  return sr_i_run_entry_point(Create_Hashed_Key_Table, [&]() -> int32_t {
    sr_hash_table_t *p_hash_table = nullptr;
    if (const int32_t rc = sr_i_hash_table_open_for_client(total_hash_buckets, p_hash_function,
                                                           p_compare_function, &p_hash_table);
        rc != 0) {
      return rc;
    }
    return sr_x_create_table(tree_handle, p_registry_path, p_columns, array_count, mode,
                             p_hash_table, p_result_table_handle);
  });
}
