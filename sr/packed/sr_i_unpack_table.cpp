// sr_i_unpack_table.cpp - one table of a packed buffer made a read-only
// transient table: its fixed metadata and column definitions decoded within
// the buffer's bounds, its rows array copied whole, each row record checked
// as it enters, the row index and key hash table pointed straight at the
// records in that copy, and the table entered in the tree under its packed
// name.
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
#include "rows/sr_i_rows.h"
#include "storage/sr_i_prefault.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_create_table.h"

namespace {

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
};

// Whether a pool record from a buffer can be read as a row of the table:
// its length word says its length, it holds the header word and every
// slot, each anchor lies in its variable part, and a key body that is
// compared in place is a whole string or handle.
bool row_holds_together(const sr_i_table_t *p_table, const unsigned char *p_element,
                        uint32_t length) {
  const uint64_t fixed_length = uint64_t{Sr_Record_Header_Length} + sr_i_row_fixed_length(p_table);
  if (length < fixed_length || sr_i_load_u32(p_element) != length) {
    return false;
  }
  const unsigned char *p_record = p_element + Sr_Record_Header_Length;
  const uint64_t variable_length = length - fixed_length;
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    if (!sr_i_is_variable_length(p_table->p_columns[column].type)) {
      continue;
    }
    const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(sr_i_row_slot(p_record, column));
    if (!sr_i_packed_span_inside(anchor.offset, anchor.length, variable_length)) {
      return false;
    }
  }
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  if (key_type != QV_CHAR_PTR && key_type != QV_RSRC_HANDLE_PTR) {
    return true;
  }
  const qv_pmsg_value_anchor_t key = sr_i_slot_anchor(sr_i_row_slot(p_record, 0));
  const unsigned char *p_key = sr_i_row_variable_part(p_table, p_record) + key.offset;
  return key_type == QV_CHAR_PTR ? key.length > 0 && p_key[key.length - 1] == '\0'
                                 : key.length == sizeof(qv_resource_handle_t);
}

// A table without a key hash table checks a key under SR_PRIMARY_KEY by
// comparing it with the rows before it, as adding rows does: each row's key
// is decoded and compared with the keys of the rows in front of it.
int32_t check_keys_by_scan(const sr_i_table_t *p_table) {
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  for (uint32_t row = 1; row < p_table->total_committed_rows; ++row) {
    const void *p_record = p_table->p_rows_fixed_index[row].p_committed;
    qv_pmsg_value_t slot;
    std::memcpy(&slot, sr_i_row_slot(p_record, 0), sizeof slot);
    qv_value_t key{};
    if (const int32_t rc = qv_pmsg_build_conv_packed_client_value_1(
            nullptr, 0, key_type, &key, &slot, sr_i_row_variable_part(p_table, p_record),
            QV_PMSG_LENGTH_UNBOUNDED);
        rc != 0) {
      return sr_i_raise_library_call("qv_pmsg_build_conv_packed_client_value", rc);
    }
    const sr_i_decoded<void> decoded(sr_i_is_variable_length(key_type) ? key.ptr_char : nullptr);
    for (uint32_t earlier = 0; earlier < row; ++earlier) {
      const void *p_earlier = p_table->p_rows_fixed_index[earlier].p_committed;
      if (sr_i_compare_values(&key, sr_i_row_slot(p_earlier, 0), key_type,
                              sr_i_row_variable_part(p_table, p_earlier)) == 0) {
        return sr_i_raise(SR_E_DUPLICATE_KEY);
      }
    }
  }
  return 0;
}

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
  copy.reset(static_cast<unsigned char *>(std::malloc(anchor.length > 0 ? anchor.length : 1)));
  if (copy == nullptr) {
    return sr_i_raise_no_memory();
  }
  sr_i_prefault(copy.get(), anchor.length);
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

int32_t sr_i_create_read_only_transient_table_from_packed_rows(
    sr_i_tree_t *p_tree, const char *p_name, sr_column_t *p_columns, uint32_t total_columns,
    sr_hash_table_t *p_rows_hash_table, void *p_packed_rows_array, uint32_t length,
    sr_i_table_t **pp_table) {
  sr_i_decoded<unsigned char> rows(static_cast<unsigned char *>(p_packed_rows_array));
  uint32_t total_rows = 0;
  if (!sr_i_packed_rows_count(rows.get(), length, total_rows)) {
    sr_i_hash_table_close(p_rows_hash_table);
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  sr_i_table_t *p_new_table = nullptr;
  if (const int32_t rc =
          sr_i_create_transient_table_object(p_tree, p_name, p_columns, total_columns, SR_MODE_READ,
                                             total_rows, nullptr, p_rows_hash_table, &p_new_table);
      rc != 0) {
    return rc;
  }
  table_closer closer{p_new_table};
  // Each row takes the next index entry as it comes, committed at once; the
  // packed index and the key hash table are then made in one pass, as after
  // a load.
  for (uint32_t row = 0; row < total_rows; ++row) {
    qv_pmsg_value_anchor_t anchor;
    if (!sr_i_packed_row_anchor(rows.get(), length, total_rows, row, anchor) ||
        !row_holds_together(p_new_table, rows.get() + anchor.offset, anchor.length)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_new_table);
    p_entry->p_applied = rows.get() + anchor.offset + Sr_Record_Header_Length;
    p_entry->p_committed = p_entry->p_applied;
  }
  p_new_table->total_applied_rows = total_rows;
  p_new_table->total_committed_rows = total_rows;
  if (p_new_table->p_rows_hash_table == nullptr &&
      (p_new_table->p_columns[0].qualifier & 15u) == SR_PRIMARY_KEY) {
    if (const int32_t rc = check_keys_by_scan(p_new_table); rc != 0) {
      return rc;
    }
  }
  if (const int32_t rc = sr_i_establish_secondary_row_access(p_new_table); rc != 0) {
    return rc;
  }
  p_new_table->p_packed_rows_array = rows.release();
  p_new_table->mode = Sr_Mode_Read_Only;
  *pp_table = p_new_table;
  closer.p_table = nullptr;
  return 0;
}

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
