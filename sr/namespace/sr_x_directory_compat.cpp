// sr_x_directory_compat.cpp - the older directory calls, kept for programs
// written against them: sr_i_get_directory_list_compat,
// sr_i_free_directory_list_compat, sr_i_create_directory_compat and
// sr_i_delete_directory_compat, over namespace/sr_i_directory_compat.cpp.
//
// Listing and freeing change nothing and work in a forked child; making
// and deleting a directory change the tree's namespace, so they have the
// fork guard and ForkMutex of every changing call.

#include "frame/sr_i_frame.h"
#include "namespace/sr_i_listing.h"

namespace {

constexpr sr_i_entry_point_t Get_Directory_List{121, false};
constexpr sr_i_entry_point_t Free_Directory_List{123, false};
constexpr sr_i_entry_point_t Create_Directory{125, true};
constexpr sr_i_entry_point_t Delete_Directory{127, true};

}  // namespace

extern "C" int32_t sr_i_get_directory_list_compat(sr_opaque_handle_t tree_handle,
                                                  const char *p_registry_path,
                                                  sr_entry_metadata_t **p_p_entries,
                                                  uint32_t *p_total_entries) {
  return sr_i_run_entry_point(Get_Directory_List, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    if (p_p_entries == nullptr || p_total_entries == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_get_directory_list(static_cast<sr_i_tree_t *>(tree_handle), p_registry_path,
                                   p_p_entries, p_total_entries);
  });
}

extern "C" int32_t sr_i_free_directory_list_compat(sr_entry_metadata_t *p_entries,
                                                   uint32_t total_entries) {
  return sr_i_run_entry_point(Free_Directory_List, [&]() -> int32_t {
    if (p_entries == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    sr_i_free_directory_list(p_entries, total_entries);
    return 0;
  });
}

extern "C" int32_t sr_i_create_directory_compat(sr_opaque_handle_t tree_handle,
                                                const char *p_registry_path) {
  return sr_i_run_entry_point(Create_Directory, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    return sr_i_create_directory(static_cast<sr_i_tree_t *>(tree_handle), p_registry_path);
  });
}

extern "C" int32_t sr_i_delete_directory_compat(sr_opaque_handle_t tree_handle,
                                                const char *p_registry_path) {
  return sr_i_run_entry_point(Delete_Directory, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    return sr_i_delete_directory(static_cast<sr_i_tree_t *>(tree_handle), p_registry_path);
  });
}
