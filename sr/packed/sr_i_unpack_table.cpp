// sr_i_unpack_table.cpp - one table of a packed buffer made a read-only
// transient table: its fixed metadata and column definitions decoded within
// the buffer's bounds, its rows array copied whole and handed to
// sr_i_packed_rows_table.cpp, which builds the table on that copy, and the
// table entered in the tree under its packed name.
//
// The copy of the rows array is the one copy the rows go through: the
// table gets one block of its own, so the caller may free the buffer at
// once. Rows are not re-encoded, and only a key that is compared or hashed
// where it lies is looked at inside its body; a reader of any other value
// decodes it through the codec, which checks its body then.

#include "packed/sr_i_unpack_table.h"

#include <cstdlib>
#include <string>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_paths.h"
#include "packed/sr_i_packed_buffer.h"
#include "packed/sr_i_packed_columns.h"
#include "storage/sr_i_prefault.h"
#include "tables/sr_i_create_table.h"

namespace {

// Copies the body of a table's rows array into a block of its own, its
// pages mapped at once when it is large.
int32_t copy_rows_array(const sr_i_packed_buffer_view &view, uint32_t table,
                        sr_i_decoded<unsigned char> &copy, uint32_t &length) {
  const unsigned char *p_slot = view.table_slot(table, SR_I_PACKED_ROWS);
  if (const int32_t rc = sr_i_check_packed_anchor(view, p_slot); rc != 0) {
    return rc;
  }
  qv_pmsg_value_anchor_t anchor;
  std::memcpy(&anchor, p_slot, sizeof anchor);
  copy.reset(static_cast<unsigned char *>(sr_i_allocate_block_to_fill(anchor.length)));
  if (copy == nullptr) {
    return sr_i_raise_no_memory();
  }
  std::memcpy(copy.get(), view.p_indirect + anchor.offset, anchor.length);
  length = anchor.length;
  return 0;
}

// The key hash table an unpacking caller asks for (see sr_i_unpack_table).
int32_t open_hash_table(uint32_t total_hash_buckets, sr_hash_function_t hash_function,
                        sr_hash_keys_compare_function_t compare_function,
                        sr_hash_table_t **pp_hash_table) {
  *pp_hash_table = nullptr;
  if (hash_function == nullptr) {
    return 0;  // a resource-handle key gets the built-in hash with its columns
  }
  return sr_i_hash_table_open_for_client(total_hash_buckets, hash_function, compare_function,
                                         pp_hash_table);
}

}  // namespace

int32_t sr_i_unpack_table(const void *p_buffer, uint32_t total_hash_buckets,
                          sr_hash_function_t hash_function,
                          sr_hash_keys_compare_function_t compare_function, sr_i_tree_t *p_tree,
                          uint32_t table_index, sr_i_table_t **pp_table) {
  sr_i_packed_buffer_view view;
  if (const int32_t rc = sr_i_view_packed_buffer(p_buffer, view); rc != 0) {
    return rc;
  }
  if (table_index >= view.total_tables) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  sr_i_packed_fixed_metadata fixed;
  if (const int32_t rc = sr_i_read_packed_fixed_metadata(view, table_index, fixed); rc != 0) {
    return rc;
  }
  qv_value_t decoded;
  if (const int32_t rc =
          sr_i_decode_packed_value(view, table_index, SR_I_PACKED_COLUMN_METADATA, &decoded);
      rc != 0) {
    return rc;
  }
  sr_i_unpacked_columns columns;
  if (const int32_t rc = sr_i_unpack_column_definitions(decoded.ptr_array, columns); rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_decode_packed_value(view, table_index, SR_I_PACKED_NAME, &decoded);
      rc != 0) {
    return rc;
  }
  const sr_i_decoded<char> name(decoded.ptr_char);
  sr_i_decoded<unsigned char> rows;
  uint32_t rows_length = 0;
  if (const int32_t rc = copy_rows_array(view, table_index, rows, rows_length); rc != 0) {
    return rc;
  }
  uint32_t total_rows = 0;
  if (columns.size() != fixed.total_columns ||
      !sr_i_packed_rows_count(rows.get(), rows_length, total_rows) ||
      total_rows != fixed.total_rows) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  // A table whose rows live outside a pool has no file: a name that would
  // make it persistent in this tree is refused.
  std::string key;
  const bool named = name.get()[0] != '\0';
  if (named) {
    uint32_t block_size = 0;
    if (const int32_t rc = sr_i_resolve_path(p_tree, name.get(), key, block_size); rc != 0) {
      return rc;
    }
    if (block_size != 0) {
      return sr_i_raise_invalid_path(name.get());
    }
    if (p_tree->tables.contains(key)) {
      return sr_i_raise(SR_E_TABLE_EXISTS);
    }
  }
  sr_hash_table_t *p_hash_table = nullptr;
  if (const int32_t rc =
          open_hash_table(total_hash_buckets, hash_function, compare_function, &p_hash_table);
      rc != 0) {
    return rc;
  }
  sr_i_table_t *p_table = nullptr;
  if (const int32_t rc = sr_i_create_read_only_transient_table_from_packed_rows(
          p_tree, named ? key.c_str() : nullptr, columns.data(), columns.size(), p_hash_table,
          rows.release(), rows_length, &p_table);
      rc != 0) {
    return rc;
  }
  p_table->change_counter = fixed.change_counter;
  p_table->applied_change_counter = fixed.change_counter;
  if (named) {
    if (const int32_t rc = sr_i_enter_named_table(p_tree, std::move(key), p_table); rc != 0) {
      return rc;
    }
  } else {
    try {
      p_tree->unnamed_tables.insert(p_table);
    } catch (const std::bad_alloc &) {
      sr_i_close_table(p_table);
      return sr_i_raise_no_memory();
    }
  }
  *pp_table = p_table;
  return 0;
}
