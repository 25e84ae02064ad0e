// sr_x_open_table.cpp - sr_open_table_1, sr_open_hashed_key_table_1 and
// sr_i_open_table_vorel_format: a handle on a table by its registry path. A
// named table exists once per tree; every opening shares that object and
// counts a reference. A persistent table is loaded from its file on its
// first opening. The first writable opening decides the control kind;
// later writable openings must agree with it (211).

#include <utility>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_paths.h"
#include "frame/sr_i_tree.h"
#include "storage/sr_i_storage.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

namespace {

constexpr sr_i_entry_point_t Open_Table{77, false};
constexpr sr_i_entry_point_t Open_Hashed_Key_Table{79, false};

constexpr int32_t Open_For_Reading = SR_MODE_READ;
constexpr int32_t Open_For_Writing = SR_MODE_WRITE;
constexpr int32_t Open_Explicit_Control = SR_MODE_EXPLICIT_CONTROL;

// The accepted modes in their normal form (SR_MODE_READ, SR_MODE_WRITE or
// SR_MODE_WRITE_EXPLICIT), or 0 for a refused one.
int32_t normalised_open_mode(int32_t mode) {
  switch (mode) {
    case SR_MODE_READ:
      return Open_For_Reading;
    case SR_MODE_WRITE:
    case SR_MODE_WRITE | SR_MODE_READ:
      return Open_For_Writing;
    case SR_MODE_WRITE_EXPLICIT:
    case SR_MODE_WRITE_EXPLICIT | SR_MODE_READ:
      return Open_For_Writing | Open_Explicit_Control;
    default:
      return 0;
  }
}

// Gives an open table the mode of a writable or read-only opening.
void take_open_mode(sr_i_table_t *p_table, int32_t mode) {
  p_table->implicitly_controlled = (mode & Open_Explicit_Control) ? 0 : 1;
  p_table->mode = (mode & Open_For_Writing) ? Sr_Mode_Writable : Sr_Mode_Read_Only;
}

// Loads a persistent table again with a writable mode, and moves the new
// contents into the open object, so that every handle on it sees the
// writable table; the old contents are freed.
int32_t reload_writable(sr_i_table_t *p_table, const char *p_registry_path, int32_t mode,
                        uint32_t block_size, sr_hash_table_t *&p_rows_hash_table) {
  sr_i_table_t *p_loaded = nullptr;
  sr_hash_table_t *p_offered = std::exchange(p_rows_hash_table, nullptr);
  if (const int32_t rc =
          sr_i_open_persistent_table(p_table->p_tree, p_registry_path, p_table->p_name, mode,
                                     block_size, p_offered, &p_loaded);
      rc != 0) {
    return rc;
  }
  sr_i_swap_table_contents(p_table, p_loaded);
  sr_i_close_table(p_loaded);
  return 0;
}

// `p_rows_hash_table` is taken (and set to null) when the table is loaded
// from its file now; otherwise it stays the caller's.
int32_t do_open_table(sr_opaque_handle_t tree_handle, const char *p_registry_path, int32_t mode,
                      sr_hash_table_t *&p_rows_hash_table,
                      sr_opaque_handle_t *p_result_table_handle) {
  if (tree_handle == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  if (p_result_table_handle == nullptr) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  mode = normalised_open_mode(mode);
  if (mode == 0) {
    return sr_i_raise(SR_E_INVALID_MODE);
  }
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
  const auto found = p_tree->tables.find(key);
  if (found == p_tree->tables.end()) {
    if (block_size == 0) {
      return sr_i_raise(SR_E_NO_TABLE);
    }
    sr_i_table_t *p_loaded = nullptr;
    if (const int32_t rc =
            sr_i_open_persistent_table(p_tree, p_registry_path, key.c_str(), mode, block_size,
                                       std::exchange(p_rows_hash_table, nullptr), &p_loaded);
        rc != 0) {
      return rc;
    }
    if (const int32_t rc = sr_i_enter_named_table(p_tree, std::move(key), p_loaded); rc != 0) {
      return rc;
    }
    *p_result_table_handle = p_loaded;
    return 0;
  }
  sr_i_table_t *p_table = found->second;
  sr_i_write_guard table_lock(&p_table->lock);
  if (table_lock.result() != 0) {
    return table_lock.result();
  }
  // The reference is counted once nothing can fail any more, so that a
  // refused opening leaves the count as it was.
  const bool writing = (mode & Open_For_Writing) != 0;
  // Rows unpacked from a packed buffer live outside the pool, where no
  // change may replace or free them: such a table is read only for good.
  if (writing && p_table->p_packed_rows_array != nullptr) {
    return sr_i_raise(SR_E_ACCESS);
  }
  if (p_table->references == 0) {
    take_open_mode(p_table, mode);  // present in the tree but not open
  } else if (writing && p_table->mode == Sr_Mode_Writable) {
    const bool explicit_request = (mode & Open_Explicit_Control) != 0;
    if (explicit_request == (p_table->implicitly_controlled != 0)) {
      return sr_i_raise(SR_E_EXCLUSIVE_MODES);
    }
  } else if (writing) {
    // A read-only table turns writable; one with a file must be read again
    // under the writer's lock, since another process may have changed it.
    if (p_table->p_file != nullptr) {
      if (const int32_t rc =
              reload_writable(p_table, p_registry_path, mode, block_size, p_rows_hash_table);
          rc != 0) {
        return rc;
      }
    }
    take_open_mode(p_table, mode);
  }
  ++p_table->references;
  *p_result_table_handle = p_table;
  return 0;
}

}  // namespace

extern "C" int32_t sr_open_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                   int32_t mode, sr_opaque_handle_t *p_result_table_handle) {
  return sr_i_run_entry_point(Open_Table, [&] {
    sr_hash_table_t *p_no_hash_table = nullptr;
    return do_open_table(tree_handle, p_registry_path, mode, p_no_hash_table,
                         p_result_table_handle);
  });
}

extern "C" int32_t sr_open_hashed_key_table_1(sr_opaque_handle_t tree_handle,
                                              const char *p_registry_path, int32_t mode,
                                              uint32_t total_hash_buckets,
                                              sr_hash_function_t p_hash_function,
                                              sr_hash_keys_compare_function_t p_compare_function,
                                              sr_opaque_handle_t *p_result_table_handle) {
  return sr_i_run_entry_point(Open_Hashed_Key_Table, [&]() -> int32_t {
    // The hash table is built first so that a table loaded by this opening
    // takes it; a table already in memory keeps the one it has, and the new
    // one is dropped.
    sr_hash_table_t *p_hash_table = nullptr;
    if (const int32_t rc = sr_i_hash_table_open_for_client(total_hash_buckets, p_hash_function,
                                                           p_compare_function, &p_hash_table);
        rc != 0) {
      return rc;
    }
    const int32_t rc =
        do_open_table(tree_handle, p_registry_path, mode, p_hash_table, p_result_table_handle);
    sr_i_hash_table_close(p_hash_table);  // null when the loaded table took it
    return rc;
  });
}

// Files of the older layout have the same column descriptors, so one reader
// serves both.
extern "C" int32_t sr_i_open_table_vorel_format(sr_opaque_handle_t tree_handle,
                                                const char *p_registry_path, int32_t mode,
                                                sr_hash_table_t *p_rows_hash_table,
                                                sr_opaque_handle_t *p_result_table_handle) {
  return sr_i_run_entry_point(Open_Table, [&] {
    return do_open_table(tree_handle, p_registry_path, mode, p_rows_hash_table,
                         p_result_table_handle);
  });
}
