// sr_x_select.cpp - sr_select_1: the rows that criteria pick, copied into a
// new unnamed table of the tree. The tree's write lock is taken before the
// table's read lock, since the new table is entered in the tree; other
// readers of the source go on meanwhile. Selecting changes nothing shared,
// so it takes neither the fork guard nor ForkMutex.

#include <cstdarg>
#include <new>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"
#include "queries/sr_i_select.h"
#include "queries/sr_i_selection_criteria.h"

namespace {

constexpr sr_i_entry_point_t Select{89, false};

int32_t select_into_new_table(sr_opaque_handle_t table_handle, const char *const *column_names,
                              uint32_t array_count, sr_opaque_handle_t *result,
                              const char *selection_string, va_list replacement_values) {
  if (table_handle == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  auto *p_table = static_cast<sr_i_table_t *>(table_handle);
  sr_i_tree_t *p_tree = p_table->p_tree;
  if (p_tree == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  if (result == nullptr) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  sr_i_write_guard tree_lock(&p_tree->lock);
  if (tree_lock.result() != 0) {
    return tree_lock.result();
  }
  sr_i_read_guard table_lock(&p_table->lock);
  if (table_lock.result() != 0) {
    return table_lock.result();
  }
  sr_i_expanded_criteria expanded;
  if (const int32_t rc = sr_i_expand_criteria(selection_string, replacement_values, expanded);
      rc != 0) {
    return rc;
  }
  sr_i_table_t *p_new_table = nullptr;
  if (const int32_t rc =
          sr_i_select(p_table, column_names, array_count, expanded.get(), &p_new_table);
      rc != 0) {
    return rc;
  }
  try {
    p_tree->unnamed_tables.insert(p_new_table);
  } catch (const std::bad_alloc &) {
    sr_i_close_table(p_new_table);
    return sr_i_raise_no_memory();
  }
  *result = p_new_table;
  return 0;
}

}  // namespace

extern "C" int32_t sr_select_1(sr_opaque_handle_t table_handle, const char *const *column_names,
                               uint32_t array_count, sr_opaque_handle_t *result,
                               const char *selection_string, ...) {
  va_list replacement_values;
  va_start(replacement_values, selection_string);
  const int32_t rc = sr_i_run_entry_point(Select, [&] {
    return select_into_new_table(table_handle, column_names, array_count, result, selection_string,
                                 replacement_values);
  });
  va_end(replacement_values);
  return rc;
}
