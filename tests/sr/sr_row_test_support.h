// sr_row_test_support.h - what the row and transaction tests share: a tree
// with helpers to create tables and to add, read and count rows through the
// exported calls, and the temporary directories and files of the tests of
// persistent tables.

#ifndef SR_ROW_TEST_SUPPORT_H
#define SR_ROW_TEST_SUPPORT_H

#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <initializer_list>
#include <iterator>
#include <map>
#include <memory>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "qv_sr.h"
#include "tables/sr_i_table.h"

namespace sr_test {

inline sr_column_t column(const char *p_name, qv_data_type_t type,
                          uint32_t qualifier = SR_STANDARD) {
  sr_column_t definition{};
  definition.name = const_cast<char *>(p_name);
  definition.type = type;
  definition.qualifier = static_cast<sr_qualifier_t>(qualifier);
  return definition;
}

inline qv_value_t int32_value(int32_t number) {
  qv_value_t value{};
  value.val_int32 = number;
  return value;
}

inline qv_value_t string_value(const char *p_text) {
  qv_value_t value{};
  value.ptr_char = const_cast<char *>(p_text);
  return value;
}

// Column names with values, and pointers to the values, as the calls that
// add, set or read several fields take them.
struct field_list {
  field_list(std::initializer_list<std::pair<const char *, qv_value_t>> list) {
    for (const auto &[p_name, value] : list) {
      names.push_back(p_name);
      values.push_back(value);
    }
    for (qv_value_t &value : values) {
      pointers.push_back(&value);
    }
  }
  field_list(const field_list &) = delete;
  field_list &operator=(const field_list &) = delete;
  uint32_t count() const { return static_cast<uint32_t>(names.size()); }
  std::vector<const char *> names;
  std::vector<qv_value_t> values;
  std::vector<qv_value_t *> pointers;
};

// A zeroed block of a T with `extra` bytes behind it (for the types that end
// in an array), from malloc as callers pass values, freed with free().
template <class T>
std::unique_ptr<T, decltype(&std::free)> zeroed_block(size_t extra = 0) {
  return {static_cast<T *>(std::calloc(1, sizeof(T) + extra)), &std::free};
}

// The calling thread's last error: its code and text.
inline std::pair<int32_t, std::string> last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  std::pair<int32_t, std::string> error{p_error->code, p_error->p_text};
  cu_rel_error_1(p_error);
  return error;
}

// Hash functions over int32 keys, whose 4 bytes the hash table hands over
// unaligned: four buckets by the low bits, or one bucket for every key.
inline int32_t int32_key_at(const void *p_key) {
  int32_t key;
  std::memcpy(&key, p_key, sizeof key);
  return key;
}
inline uint32_t four_buckets(const void *p_key) {
  return static_cast<uint32_t>(int32_key_at(p_key)) & 3u;
}
inline uint32_t one_bucket(const void *) {
  return 0;
}
inline int32_t compare_int32_keys(const void *p_stored_key, const void *p_key) {
  return int32_key_at(p_stored_key) == int32_key_at(p_key) ? 0 : 1;
}

// A tree with "/disk" mounted on `directory`, as a program of its own
// opens it; null when either call fails.
inline sr_opaque_handle_t mounted_tree(const std::string &directory) {
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0) {
    return nullptr;
  }
  if (sr_mount_local_tree_1(tree, "/disk", directory.c_str(), 0) != 0) {
    sr_close_tree_1(tree);
    return nullptr;
  }
  return tree;
}

// A new, empty directory named `p_prefix` and a random suffix, in memory
// (/dev/shm) where the system offers it and `in_memory` asks for it, else in
// /tmp; "" when none can be made.
inline std::string new_directory(const char *p_prefix, bool in_memory = true) {
  for (const char *p_place : {in_memory ? "/dev/shm" : "/tmp", "/tmp"}) {
    std::string pattern = std::string(p_place) + "/" + p_prefix + "_XXXXXX";
    if (mkdtemp(pattern.data()) != nullptr) {
      return pattern;
    }
  }
  ADD_FAILURE() << "no temporary directory";
  return "";
}

// A file's bytes, none when it cannot be read; and a file made of `bytes`.
inline std::string file_bytes(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}
inline void write_file(const std::string &path, const std::string &bytes) {
  std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
}

inline int32_t add_fields(sr_opaque_handle_t table, const field_list &row) {
  return sr_add_row_1(table, row.names.data(), row.pointers.data(), row.count());
}

// Rows of the tables below: a string "name" or an int32 "id" as the key,
// with an int32 "count".
inline int32_t add_named(sr_opaque_handle_t table, const char *p_name, int32_t count) {
  return add_fields(table, {{"name", string_value(p_name)}, {"count", int32_value(count)}});
}

inline int32_t add_numbered(sr_opaque_handle_t table, int32_t id, int32_t count) {
  return add_fields(table, {{"id", int32_value(id)}, {"count", int32_value(count)}});
}

// The rows of one view (`uncommitted` 1: the applied one), key to "count",
// read by packed index; rows without a record in that view are left out.
// Key is std::string for a string key column, int32_t for an int32 one.
template <class Key>
std::map<Key, int32_t> rows_in(sr_opaque_handle_t table, const char *p_key, uint32_t uncommitted) {
  std::map<Key, int32_t> rows;
  for (int32_t at = 0;; ++at) {
    field_list row{{p_key, {}}, {"count", {}}};
    const int32_t rc = sr_get_fields_by_index_and_visibility_1(
        table, at, row.names.data(), row.pointers.data(), 2, uncommitted, nullptr);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      return rows;
    }
    if (rc == SR_E_ROW_DELETED) {
      continue;
    }
    if (rc != 0) {
      ADD_FAILURE() << "reading packed row " << at << " gave " << rc;
      return rows;
    }
    if constexpr (std::is_same_v<Key, std::string>) {
      rows[row.values[0].ptr_char] = row.values[1].val_int32;
      std::free(row.values[0].ptr_char);
    } else {
      rows[row.values[0].val_int32] = row.values[1].val_int32;
    }
  }
}

// sr_get_selected_rows_v_1 with the criteria's values as arguments.
inline int32_t list_rows(sr_opaque_handle_t table, uint32_t visible, uint32_t *p_total,
                         uint32_t **pp_rows, const char *p_criteria, ...) {
  va_list ap;
  va_start(ap, p_criteria);
  const int32_t rc = sr_get_selected_rows_v_1(table, p_criteria, ap, visible, p_total, pp_rows);
  va_end(ap);
  return rc;
}

inline sr_i_table_t *object(sr_opaque_handle_t handle) {
  return static_cast<sr_i_table_t *>(handle);
}

// Create modes: implicitly controlled (0) or explicitly controlled (4).
inline constexpr int32_t Implicit = 0;
inline constexpr int32_t Explicit = 4;

class RowTables : public ::testing::Test {
 protected:
  void SetUp() override { ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0); }
  void TearDown() override {
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
    if (!directory_.empty()) {
      std::filesystem::remove_all(directory_);
    }
  }

  // "/disk" mounted on a new directory (directory_), removed at the end.
  void mount_disk() {
    directory_ = new_directory("qv_tables");
    ASSERT_EQ(sr_mount_local_tree_1(tree_, "/disk", directory_.c_str(), 0), 0);
  }

  // A table of `columns`; with `p_hash`, one whose int32 key has a hash
  // table of `buckets` buckets.
  sr_opaque_handle_t make_table(const char *p_path, std::vector<sr_column_t> columns, int32_t mode,
                                sr_hash_function_t p_hash = nullptr, uint32_t buckets = 4) {
    const auto total = static_cast<uint32_t>(columns.size());
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(p_hash != nullptr
                  ? sr_create_hashed_key_table_1(tree_, p_path, columns.data(), total, mode,
                                                 buckets, p_hash, compare_int32_keys, &table)
                  : sr_create_table_1(tree_, p_path, columns.data(), total, mode, &table),
              0);
    return table;
  }

  static void apply_commit(sr_opaque_handle_t table) {
    ASSERT_EQ(sr_apply_1(table, 0), 0);
    ASSERT_EQ(sr_commit_1(table), 0);
  }

  // A table keyed by the string "name", with an int32 "count" (default 7)
  // and a string "note" (default "none").
  sr_opaque_handle_t create_named_counts(const char *p_path, int32_t mode,
                                         uint32_t key_qualifier = SR_PRIMARY_KEY) {
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, key_qualifier),
                                        column("count", QV_INT32, SR_STANDARD),
                                        column("note", QV_CHAR_PTR, SR_STANDARD)};
    columns[1].default_value.val_int32 = 7;
    columns[2].default_value.ptr_char = const_cast<char *>("none");
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns.data(), 3, mode, &table), 0);
    return table;
  }

  // A table keyed by the int32 "id", with an int32 "count" (default 7).
  sr_opaque_handle_t create_numbered(const char *p_path, int32_t mode) {
    std::vector<sr_column_t> columns = {column("id", QV_INT32, SR_PRIMARY_KEY),
                                        column("count", QV_INT32, SR_STANDARD)};
    columns[1].default_value.val_int32 = 7;
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns.data(), 2, mode, &table), 0);
    return table;
  }

  // The "count" of the row with string key `p_name`, in the applied view
  // (`uncommitted` 1) or the committed one; -1 when the read fails.
  static int32_t count_of(sr_opaque_handle_t table, const char *p_name, uint32_t uncommitted) {
    qv_value_t result{};
    const int32_t rc = sr_get_field_by_key_and_visibility_1(table, string_value(p_name), "count",
                                                            &result, uncommitted, nullptr);
    return rc == 0 ? result.val_int32 : -1;
  }

  static std::string string_at_fixed(sr_opaque_handle_t table, uint32_t fixed, const char *p_column,
                                     uint32_t uncommitted) {
    qv_value_t result{};
    if (sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed), p_column,
                                                     &result, uncommitted, nullptr) != 0) {
      return "<error>";
    }
    std::string text = result.ptr_char;
    std::free(result.ptr_char);
    return text;
  }

  // An int32 column of the row at `fixed`; -1 when the read fails.
  static int32_t int32_at_fixed(sr_opaque_handle_t table, uint32_t fixed, const char *p_column,
                                uint32_t uncommitted) {
    qv_value_t result{};
    const int32_t rc = sr_get_field_by_fixed_index_and_visibility_1(
        table, static_cast<int32_t>(fixed), p_column, &result, uncommitted, nullptr);
    return rc == 0 ? result.val_int32 : -1;
  }

  static sr_row_state_t state_of(sr_opaque_handle_t table, uint32_t fixed) {
    qv_value_t result{};
    sr_row_state_t state = SR_ROW_STATE_NO_ROW;
    const int32_t rc = sr_get_field_by_fixed_index_and_visibility_1(
        table, static_cast<int32_t>(fixed), "count", &result, 1, &state);
    if (rc == SR_E_ROW_DELETED) {
      // No applied record: the committed view tells a deleted row from none.
      return sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed),
                                                          "count", &result, 0, &state) == 0
                 ? state
                 : SR_ROW_STATE_NO_ROW;
    }
    return state;
  }

  static uint32_t fixed_index_of(sr_opaque_handle_t table, const char *p_name) {
    uint32_t fixed = 0xFFFFFFFFu;
    EXPECT_EQ(sr_get_fixed_row_index_for_key_1(table, string_value(p_name), &fixed), 0);
    return fixed;
  }

  sr_opaque_handle_t tree_ = nullptr;
  std::string directory_;
};

}  // namespace sr_test

#endif  // SR_ROW_TEST_SUPPORT_H
