// sr_x_copy_table.cpp - sr_copy_table_by_handle_1 and
// sr_copy_table_by_name_1: a table copied to another path, in memory or on
// disk; the source stays as it is.

#include "frame/sr_i_frame.h"
#include "namespace/sr_i_namespace.h"

namespace {

constexpr sr_i_entry_point_t Copy_Table_By_Handle{19, true};
constexpr sr_i_entry_point_t Copy_Table_By_Name{21, true};

}  // namespace

extern "C" int32_t sr_copy_table_by_handle_1(sr_opaque_handle_t table_handle,
                                             const char *p_target_table_name, int32_t overwrite) {
  return sr_i_run_entry_point(Copy_Table_By_Handle, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_table = static_cast<sr_i_table_t *>(table_handle);
    return sr_i_duplicate_table(p_table->p_tree, p_table, nullptr, p_target_table_name, false,
                                overwrite != 0);
  });
}

extern "C" int32_t sr_copy_table_by_name_1(sr_opaque_handle_t tree_handle,
                                           const char *p_source_table_name,
                                           const char *p_target_table_name, int32_t overwrite) {
  return sr_i_run_entry_point(Copy_Table_By_Name, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    return sr_i_duplicate_table(static_cast<sr_i_tree_t *>(tree_handle), nullptr,
                                p_source_table_name, p_target_table_name, false, overwrite != 0);
  });
}
