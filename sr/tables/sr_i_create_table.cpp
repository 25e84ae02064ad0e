// sr_i_create_table.cpp - making a transient table: validated columns (key
// first), the null table, its row index, its metadata record with packed
// defaults, its key hash table and its application metadata container, and
// a first pool block sized for the first rows.
//
// The caller's column array is never written: the key column is moved
// first in a copy, so the caller finds its array as it gave it on every path.

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_create_table.h"

namespace {

// Closes what it holds unless released: the table on a failed creation
// (and with it the hash table it took).
struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
  sr_i_table_t *release() {
    sr_i_table_t *p_done = p_table;
    p_table = nullptr;
    return p_done;
  }
};

}  // namespace

int32_t sr_i_create_transient_table_object(sr_i_tree_t *p_tree, const char *p_name,
                                           const sr_column_t *p_columns, uint32_t total_columns,
                                           int32_t mode, uint32_t initial_rows,
                                           cu_iconv_t *p_default_conversion,
                                           sr_hash_table_t *p_rows_hash_table,
                                           sr_i_table_t **pp_table) {
  uint32_t key_position = 0;
  if (const int32_t rc = sr_i_validate_columns(p_columns, total_columns, key_position); rc != 0) {
    sr_i_hash_table_close(p_rows_hash_table);
    return rc;
  }
  std::vector<sr_column_t> columns(p_columns, p_columns + total_columns);
  if (key_position != 0) {
    sr_i_swap_columns(&columns[0], &columns[key_position]);
  }
  sr_i_table_t *p_new_table = sr_i_create_null_table();
  if (p_new_table == nullptr) {
    sr_i_hash_table_close(p_rows_hash_table);
    return SR_E_NO_MEMORY;
  }
  table_closer table{p_new_table};
  p_new_table->p_rows_hash_table = p_rows_hash_table;
  p_new_table->implicitly_controlled = (mode & Sr_Create_Explicit_Control) ? 0 : 1;
  p_new_table->p_tree = p_tree;
  if (p_name != nullptr && (p_new_table->p_name = strdup(p_name)) == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (const int32_t rc = sr_i_establish_rows_index(p_new_table, initial_rows); rc != 0) {
    return rc;
  }
  std::vector<unsigned char> packed_defaults;
  uint32_t total_variable_length_columns = 0;
  if (const int32_t rc = sr_i_pack_variable_length_default_values(
          p_default_conversion, columns.data(), total_columns, packed_defaults,
          total_variable_length_columns);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_build_metadata_record(p_new_table, columns.data(), total_columns,
                                                    total_variable_length_columns, packed_defaults);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_open_key_hash_and_metadata(p_new_table); rc != 0) {
    return rc;
  }
  *pp_table = table.release();
  return 0;
}

int32_t sr_i_create_transient_table(sr_i_tree_t *p_tree, const char *p_name, sr_column_t *p_columns,
                                    uint32_t total_columns, int32_t mode,
                                    sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table,
                                    uint32_t expected_rows) {
  sr_i_table_t *p_new_table = nullptr;
  cu_iconv_t *p_conversion = p_tree ? p_tree->p_to_table_string_conversion_handle : nullptr;
  if (const int32_t rc =
          sr_i_create_transient_table_object(p_tree, p_name, p_columns, total_columns, mode,
                                             std::max(expected_rows, Sr_Initial_Transient_Rows),
                                             p_conversion, p_rows_hash_table, &p_new_table);
      rc != 0) {
    return rc;
  }
  table_closer table{p_new_table};
  // One block big enough for the first hundred rows of a typical size, so
  // that they do not each find the pool full. Nothing of it is touched until
  // rows arrive.
  const uint32_t row_estimate =
      p_new_table->total_variable_length_columns * 100 + (p_new_table->total_columns + 3) * 8;
  if (const int32_t rc = sr_i_rb_make_room(&p_new_table->record_buffer_pool, row_estimate * 100);
      rc != 0) {
    return rc;
  }
  p_new_table->mode = Sr_Mode_Writable;
  *pp_table = table.release();
  return 0;
}
