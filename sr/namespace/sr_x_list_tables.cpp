// sr_x_list_tables.cpp - sr_list_tables_1 and sr_free_table_list_1: the
// registry paths of the tables below a path, made and freed by
// namespace/sr_i_list_tables.cpp.
//
// Listing changes nothing: it has no fork guard and takes no ForkMutex, so
// it works in a forked child too. It takes the tree's write lock, which
// serialises it with the calls that add or remove tables.

#include "frame/sr_i_frame.h"
#include "namespace/sr_i_listing.h"

namespace {

constexpr sr_i_entry_point_t List_Tables{69, false};
constexpr sr_i_entry_point_t Free_Table_List{35, false};

}  // namespace

extern "C" int32_t sr_list_tables_1(sr_opaque_handle_t tree_handle, const char *p_registry_path,
                                    char ***p_table_list, uint32_t *array_count) {
  return sr_i_run_entry_point(List_Tables, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_registry_path == nullptr) {
      return sr_i_raise_invalid_path(nullptr);
    }
    if (p_table_list == nullptr || array_count == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_list_tables(static_cast<sr_i_tree_t *>(tree_handle), p_registry_path, p_table_list,
                            array_count);
  });
}

extern "C" int32_t sr_free_table_list_1(char **p_table_list, uint32_t array_count) {
  return sr_i_run_entry_point(Free_Table_List, [&]() -> int32_t {
    if (p_table_list == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    sr_i_free_table_list(p_table_list, array_count);
    return 0;
  });
}
