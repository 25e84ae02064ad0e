// sr_x_delete_table.cpp - sr_delete_table_1: a table and, below a mount
// point, its file deleted by path.

#include "frame/sr_i_frame.h"
#include "namespace/sr_i_namespace.h"

namespace {

constexpr sr_i_entry_point_t Delete_Table{33, true};

}  // namespace

extern "C" int32_t sr_delete_table_1(sr_opaque_handle_t tree_handle, const char *p_registry_path) {
  return sr_i_run_entry_point(Delete_Table, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    return sr_i_delete_table(static_cast<sr_i_tree_t *>(tree_handle), p_registry_path);
  });
}
