// sr_i_delete_table.cpp - deleting a table by path, and taking a table out
// of its tree. A deleted table that handles still hold lives on for them,
// detached: its path is free at once for a new table.

#include <algorithm>
#include <new>
#include <utility>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "namespace/sr_i_namespace.h"
#include "storage/sr_i_files.h"

void sr_i_take_out_of_tree(sr_i_tree_t *p_tree, sr_i_table_t *p_table) {
  if (p_tree->unnamed_tables.erase(p_table) == 0 && p_tree->detached_tables.erase(p_table) == 0) {
    std::erase_if(p_tree->tables, [&](const auto &entry) { return entry.second == p_table; });
  }
}

int32_t sr_i_detach_table(sr_i_tree_t *p_tree, sr_i_table_t *p_table) {
  sr_i_detached_place place;
  if (const int32_t rc = sr_i_make_detached_place(p_table, place); rc != 0) {
    return rc;
  }
  sr_i_detach_table_at(p_tree, p_table, std::move(place));
  return 0;
}

int32_t sr_i_make_detached_place(sr_i_table_t *p_table, sr_i_detached_place &place) {
  // The node is made in a set of its own and taken out of it: the tree's
  // set then only links it in, which allocates nothing.
  try {
    decltype(sr_i_tree_t::detached_tables) maker;
    place = maker.extract(maker.insert(p_table).first);
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  return 0;
}

void sr_i_detach_table_at(sr_i_tree_t *p_tree, sr_i_table_t *p_table, sr_i_detached_place place) {
  sr_i_take_out_of_tree(p_tree, p_table);
  // An unnamed table is freed by its last close whatever its count says;
  // a named one held by handles is the tree's to free if they never are.
  if (p_table->references == 0) {
    sr_i_close_table(p_table);
  } else if (p_table->p_name != nullptr) {
    p_tree->detached_tables.insert(std::move(place));
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
    if (const int32_t rc = sr_i_detach_table(p_tree, found->second); rc != 0) {
      return rc;
    }
  }
  if (block_size == 0) {
    return was_open ? 0 : sr_i_raise(SR_E_NO_TABLE);
  }
  // The file goes whether or not the table was open here.
  return sr_i_remove_table_files(key);
}

int32_t sr_i_remove_table_files(const std::string &file, bool *p_removed) {
  // Named first: once the table file is gone, nothing may fail.
  const std::string side_file = file + ".rewrite";
  bool removed = false;
  const int32_t rc = sr_i_remove_file_durably(file.c_str(), &removed);
  if (removed) {
    sr_i_discard_file(side_file.c_str());
  }
  if (p_removed != nullptr) {
    *p_removed = removed;
  }
  return rc;
}
