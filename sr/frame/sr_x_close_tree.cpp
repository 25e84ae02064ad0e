// sr_x_close_tree.cpp - sr_close_tree_1: ends a tree, closing everything it
// holds whatever handles the caller still has.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"

namespace {
constexpr sr_i_entry_point_t Close_Tree{15, false};
}

extern "C" int32_t sr_close_tree_1(sr_opaque_handle_t tree_handle) {
  return sr_i_run_entry_point(Close_Tree, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    if (const int32_t rc = sr_i_unregister_tree(p_tree); rc != 0) {
      return rc;
    }
    return sr_i_close_tree(p_tree);
  });
}
