// sr_x_open_tree.cpp - sr_open_tree_1: makes a tree, the client's handle on
// the registry. The first call of the process also installs the fork
// handler and registers the trace component.

#include <new>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"

namespace {
constexpr sr_i_entry_point_t Open_Tree{81, false};
}

extern "C" int32_t sr_open_tree_1(sr_opaque_handle_t *tree_handle, uint32_t /*number_of_retries*/,
                                  uint32_t /*timeout*/) {
  return sr_i_run_entry_point(Open_Tree, [&]() -> int32_t {
    sr_i_establish_fork_handlers();
    sr_i_register_for_trace();
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_tree = new (std::nothrow) sr_i_tree_t;
    if (p_tree == nullptr) {
      return sr_i_raise_no_memory();
    }
    sr_i_rw_open(&p_tree->lock);
    int32_t rc = sr_i_get_string_conversion_handles(&p_tree->p_to_table_string_conversion_handle,
                                                    &p_tree->p_from_table_string_conversion_handle);
    if (rc == 0) {
      rc = sr_i_register_tree(p_tree);
    }
    if (rc != 0) {
      // Nothing of a half-made tree survives; its own teardown cannot fail
      // here, as no other thread knows the tree.
      sr_i_close_tree(p_tree);
      return rc;
    }
    *tree_handle = p_tree;
    return 0;
  });
}
