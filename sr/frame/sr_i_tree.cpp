// sr_i_tree.cpp - the life of a tree apart from its entry points: the set
// of open trees, the string conversion handles, and the teardown shared by
// sr_close_tree_1 and a failed sr_open_tree_1, and the entering of new
// named tables.

#include "frame/sr_i_tree.h"

#include <new>

#include "frame/sr_i_errors.h"
#include "tables/sr_i_table.h"

std::set<sr_i_tree_t *> *P_Registry_Trees;
pthread_mutex_t Registry_Trees_Mutex = PTHREAD_MUTEX_INITIALIZER;

namespace {

// Holds Registry_Trees_Mutex for a scope once locked.
class registry_trees_guard {
 public:
  registry_trees_guard() : result_(pthread_mutex_lock(&Registry_Trees_Mutex)) {}
  ~registry_trees_guard() {
    if (result_ == 0) {
      pthread_mutex_unlock(&Registry_Trees_Mutex);
    }
  }
  registry_trees_guard(const registry_trees_guard &) = delete;
  registry_trees_guard &operator=(const registry_trees_guard &) = delete;
  int result() const { return result_; }

 private:
  int result_;
};

}  // namespace

int32_t sr_i_get_string_conversion_handles(cu_iconv_t **pp_to_table, cu_iconv_t **pp_from_table) {
  cu_locale_info_t *p_locale = nullptr;
  if (const int32_t rc = cu_get_locale_info_1(&p_locale); rc != 0) {
    return sr_i_raise_library_call("qv_get_local_info", rc);
  }
  uint32_t to_flags = CU_ICONV_TO_STORED;
  uint32_t from_flags = CU_ICONV_FROM_STORED;
  if (cu_utf8_is_not_modified_1(p_locale) != 0) {
    to_flags |= CU_ICONV_UNCHANGED;
    from_flags |= CU_ICONV_UNCHANGED;
  }
  int32_t rc = cu_iconv_open_1(p_locale->p_code_set, to_flags, pp_to_table);
  if (rc == 0) {
    rc = cu_iconv_open_1(p_locale->p_code_set, from_flags, pp_from_table);
  }
  cu_rel_locale_info_1(p_locale);
  if (rc != 0) {
    return sr_i_raise_library_call("qv_iconv_open", rc);
  }
  return 0;
}

int32_t sr_i_register_tree(sr_i_tree_t *p_tree) {
  registry_trees_guard guard;
  if (guard.result() != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", guard.result());
  }
  if (P_Registry_Trees == nullptr) {
    // Never freed: a tree may be closed while the process exits.
    P_Registry_Trees = new std::set<sr_i_tree_t *>;
  }
  P_Registry_Trees->insert(p_tree);
  return 0;
}

int32_t sr_i_unregister_tree(sr_i_tree_t *p_tree) {
  registry_trees_guard guard;
  if (guard.result() != 0) {
    return guard.result();
  }
  if (P_Registry_Trees == nullptr || P_Registry_Trees->erase(p_tree) == 0) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  return 0;
}

int32_t sr_i_close_tree(sr_i_tree_t *p_tree) {
  {
    sr_i_write_guard guard(&p_tree->lock);
    if (guard.result() != 0) {
      return guard.result();
    }
    cu_iconv_close_1(p_tree->p_to_table_string_conversion_handle);
    p_tree->p_to_table_string_conversion_handle = nullptr;
    cu_iconv_close_1(p_tree->p_from_table_string_conversion_handle);
    p_tree->p_from_table_string_conversion_handle = nullptr;
    for (auto &[name, p_table] : p_tree->tables) {
      sr_i_close_table(p_table);
    }
    p_tree->tables.clear();
    for (sr_i_table_t *p_table : p_tree->unnamed_tables) {
      sr_i_close_table(p_table);
    }
    p_tree->unnamed_tables.clear();
    for (sr_i_table_t *p_table : p_tree->detached_tables) {
      sr_i_close_table(p_table);
    }
    p_tree->detached_tables.clear();
    p_tree->mount_points.clear();
  }
  sr_i_rw_close(&p_tree->lock);
  delete p_tree;
  return 0;
}

int32_t sr_i_enter_named_table(sr_i_tree_t *p_tree, std::string key, sr_i_table_t *p_table) {
  sr_i_named_table_place place;
  if (const int32_t rc = sr_i_make_named_table_place(std::move(key), place); rc != 0) {
    sr_i_close_table(p_table);
    return rc;
  }
  sr_i_enter_table_at(p_tree, std::move(place), p_table);
  return 0;
}

int32_t sr_i_make_named_table_place(std::string key, sr_i_named_table_place &place) {
  // The node is made in a map of its own and taken out of it: the tree's
  // map then only links it in, which allocates nothing.
  try {
    decltype(sr_i_tree_t::tables) maker;
    place = maker.extract(maker.emplace(std::move(key), nullptr).first);
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  return 0;
}

void sr_i_enter_table_at(sr_i_tree_t *p_tree, sr_i_named_table_place place, sr_i_table_t *p_table) {
  place.mapped() = p_table;
  p_tree->tables.insert(std::move(place));
}
