// sr_i_delete_table.cpp - deleting a table by path, and taking a table out
// of its tree. A deleted table that handles still hold lives on for them,
// detached: its path is free at once for a new table.

#include <algorithm>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "namespace/sr_i_namespace.h"
#include "storage/sr_i_files.h"

void sr_i_take_out_of_tree(sr_i_tree_t *p_tree, sr_i_table_t *p_table) {
  if (p_tree->unnamed_tables.erase(p_table) == 0 && p_tree->detached_tables.erase(p_table) == 0) {
    std::erase_if(p_tree->tables, [&](const auto &entry) { return entry.second == p_table; });
  }
}

void sr_i_detach_table(sr_i_tree_t *p_tree, sr_i_table_t *p_table) {
  sr_i_take_out_of_tree(p_tree, p_table);
  // An unnamed table is freed by its last close whatever its count says;
  // a named one held by handles is the tree's to free if they never are.
  if (p_table->references == 0) {
    sr_i_close_table(p_table);
  } else if (p_table->p_name != nullptr) {
    p_tree->detached_tables.insert(p_table);
  }
}

int32_t sr_i_delete_table(sr_i_tree_t *p_tree, const char *p_registry_path) {
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
  const bool was_open = found != p_tree->tables.end();
  if (was_open) {
    sr_i_detach_table(p_tree, found->second);
  }
  if (block_size == 0) {
    return was_open ? 0 : sr_i_raise(SR_E_NO_TABLE);
  }
  // The file goes whether or not the table was open here.
  return sr_i_remove_table_files(key);
}

int32_t sr_i_remove_table_files(const std::string &file, bool *p_removed) {
  bool removed = false;
  const int32_t rc = sr_i_remove_file_durably(file.c_str(), &removed);
  if (removed) {
    sr_i_discard_file((file + ".rewrite").c_str());
  }
  if (p_removed != nullptr) {
    *p_removed = removed;
  }
  return rc;
}
