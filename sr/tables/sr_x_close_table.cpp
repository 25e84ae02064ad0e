// sr_x_close_table.cpp - sr_close_table_1: gives a table handle back. A
// transient table stays in its tree, rows and all, after its last handle is
// closed, unless it was deleted meanwhile; an unnamed table (a result) is
// freed at once.

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"
#include "tables/sr_i_table.h"

namespace {
constexpr sr_i_entry_point_t Close_Table{13, false};
}

extern "C" int32_t sr_close_table_1(sr_opaque_handle_t table_handle) {
  return sr_i_run_entry_point(Close_Table, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_table = static_cast<sr_i_table_t *>(table_handle);
    sr_i_tree_t *p_tree = p_table->p_tree;
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    if (p_table->p_name == nullptr) {
      p_tree->unnamed_tables.erase(p_table);
      sr_i_close_table(p_table);
      return 0;
    }
    if (p_table->references > 0) {
      --p_table->references;
    }
    if (p_table->references == 0) {
      const auto found = p_tree->tables.find(p_table->p_name);
      const bool still_in_tree = found != p_tree->tables.end() && found->second == p_table;
      if (p_table->p_file != nullptr && still_in_tree) {
        p_tree->tables.erase(found);  // persistent: dropped from memory
        sr_i_close_table(p_table);
      } else if (!still_in_tree) {
        p_tree->detached_tables.erase(p_table);
        sr_i_close_table(p_table);  // deleted while it was open
      }
    }
    return 0;
  });
}
