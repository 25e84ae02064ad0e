// sr_i_get_values.cpp - reading rows: one or several column values of a row
// named by fixed index, packed index or key, in the committed or the applied
// view, and the translation of a key into the row's fixed index.
//
// Everything here runs under the table's read lock and changes nothing.
// Variable-length values are decoded by libqv_pmsg into one new block per
// value, which the caller owns and frees with free().

#include <cstdint>
#include <cstring>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "qv_pmsg.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_hash_table.h"

namespace {

// How far past the key a lookup asks for the rest of the record: one cache
// line, which holds the values after a short key.
constexpr uintptr_t Record_Tail_Prefetch = 64;

// The record a read sees: the applied one when the table or the caller wants
// uncommitted updates, else the committed one. Null when the row has none.
const void *visible_record(const sr_i_table_t *p_table, uint32_t fixed_row_index,
                           uint32_t uncommitted_updates_visible) {
  const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[fixed_row_index];
  const bool applied_view =
      p_table->uncommitted_updates_visible != 0 || uncommitted_updates_visible != 0;
  return applied_view ? entry.p_applied : entry.p_committed;
}

// Strings leave the table through the tree's conversion; a table outside a
// tree has none.
cu_iconv_t *from_table_conversion(const sr_i_table_t *p_table) {
  return p_table->p_tree != nullptr ? p_table->p_tree->p_from_table_string_conversion_handle
                                    : nullptr;
}

// Hands the caller the value of `column` in `p_record`: the slot itself for a
// fixed-size type, a newly decoded block for a variable-length one.
int32_t read_column(const sr_i_table_t *p_table, const void *p_record, uint32_t column,
                    qv_value_t *p_value) {
  const qv_data_type_t type = p_table->p_columns[column].type;
  const unsigned char *p_slot = sr_i_row_slot(p_record, column);
  if (!sr_i_is_variable_length(type)) {
    std::memcpy(p_value, p_slot, sizeof *p_value);
    return 0;
  }
  const int32_t rc = qv_pmsg_build_conv_packed_client_value_1(
      from_table_conversion(p_table), 0, type, p_value,
      reinterpret_cast<const qv_pmsg_value_t *>(p_slot), sr_i_row_variable_part(p_table, p_record),
      QV_PMSG_LENGTH_UNBOUNDED);
  if (rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_build_conv_packed_client_value", rc);
  }
  return 0;
}

// The first row of the packed index whose key equals `row_key`. A row's
// committed key counts, its applied key only when it was never committed, so
// a pending change of the key does not move the row. 202 is not raised here.
int32_t scan_for_key(const sr_i_table_t *p_table, const qv_value_t &row_key,
                     uint32_t *p_fixed_row_index) {
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  for (uint32_t packed = 0; packed < p_table->total_applied_rows; ++packed) {
    const uint32_t fixed = p_table->p_rows_packed_index[packed];
    const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[fixed];
    const void *p_record = entry.p_committed != nullptr ? entry.p_committed : entry.p_applied;
    // An added row deleted again before apply keeps its packed place but no
    // record.
    if (p_record == nullptr) {
      continue;
    }
    if (sr_i_compare_values(&row_key, sr_i_row_slot(p_record, 0), key_type,
                            sr_i_row_variable_part(p_table, p_record)) == 0) {
      *p_fixed_row_index = fixed;
      return 0;
    }
  }
  return SR_E_NO_ROW_FOR_KEY;
}

}  // namespace

int32_t sr_i_get_value_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                       const char *p_column_name, qv_value_t *p_value,
                                       uint32_t uncommitted_updates_visible,
                                       sr_row_state_t *p_row_state) {
  if (fixed_row_index >= p_table->maximum_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  const int32_t column = sr_i_find_column(p_table, p_column_name);
  if (column < 0) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  const void *p_record = visible_record(p_table, fixed_row_index, uncommitted_updates_visible);
  if (p_record == nullptr) {
    return sr_i_raise(SR_E_ROW_DELETED);
  }
  const int32_t rc = read_column(p_table, p_record, static_cast<uint32_t>(column), p_value);
  if (rc != 0) {
    return rc;
  }
  if (p_row_state != nullptr) {
    *p_row_state = sr_i_get_row_state_for_fixed_index(p_table, fixed_row_index);
  }
  return 0;
}

// Unlike the single read, the row is checked before any name: a deleted row
// gives 204 even when a name is unknown. Values read before a failing name
// stay with the caller, who frees them.
int32_t sr_i_get_values_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                        const char *const *p_column_names,
                                        qv_value_t *const *p_values, uint32_t total_values,
                                        uint32_t uncommitted_updates_visible,
                                        sr_row_state_t *p_row_state) {
  if (fixed_row_index >= p_table->maximum_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  const void *p_record = visible_record(p_table, fixed_row_index, uncommitted_updates_visible);
  if (p_record == nullptr) {
    return sr_i_raise(SR_E_ROW_DELETED);
  }
  int32_t column = -1;
  for (uint32_t value = 0; value < total_values; ++value) {
    column = sr_i_find_column(p_table, p_column_names[value], static_cast<uint32_t>(column + 1));
    if (column < 0) {
      return sr_i_raise(SR_E_INVALID_COLUMN);
    }
    const int32_t rc =
        read_column(p_table, p_record, static_cast<uint32_t>(column), p_values[value]);
    if (rc != 0) {
      return rc;
    }
  }
  if (p_row_state != nullptr) {
    *p_row_state = sr_i_get_row_state_for_fixed_index(p_table, fixed_row_index);
  }
  return 0;
}

int32_t sr_i_get_value_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                        const char *p_column_name, qv_value_t *p_value,
                                        uint32_t uncommitted_updates_visible,
                                        sr_row_state_t *p_row_state) {
  if (row_index >= p_table->total_applied_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  return sr_i_get_value_for_fixed_index(p_table, p_table->p_rows_packed_index[row_index],
                                        p_column_name, p_value, uncommitted_updates_visible,
                                        p_row_state);
}

int32_t sr_i_get_values_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                         const char *const *p_column_names,
                                         qv_value_t *const *p_values, uint32_t total_values,
                                         uint32_t uncommitted_updates_visible,
                                         sr_row_state_t *p_row_state) {
  if (row_index >= p_table->total_applied_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  return sr_i_get_values_for_fixed_index(p_table, p_table->p_rows_packed_index[row_index],
                                         p_column_names, p_values, total_values,
                                         uncommitted_updates_visible, p_row_state);
}

int32_t sr_i_get_value_for_key(sr_i_table_t *p_table, qv_value_t row_key, const char *p_column_name,
                               qv_value_t *p_value, uint32_t uncommitted_updates_visible,
                               sr_row_state_t *p_row_state) {
  uint32_t fixed_row_index = 0;
  const int32_t rc = sr_i_get_fixed_row_index_for_key(p_table, row_key, &fixed_row_index);
  if (rc != 0) {
    return rc;
  }
  return sr_i_get_value_for_fixed_index(p_table, fixed_row_index, p_column_name, p_value,
                                        uncommitted_updates_visible, p_row_state);
}

int32_t sr_i_get_values_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                const char *const *p_column_names, qv_value_t *const *p_values,
                                uint32_t total_values, uint32_t uncommitted_updates_visible,
                                sr_row_state_t *p_row_state) {
  uint32_t fixed_row_index = 0;
  const int32_t rc = sr_i_get_fixed_row_index_for_key(p_table, row_key, &fixed_row_index);
  if (rc != 0) {
    return rc;
  }
  return sr_i_get_values_for_fixed_index(p_table, fixed_row_index, p_column_names, p_values,
                                         total_values, uncommitted_updates_visible, p_row_state);
}

// The hash table knows every row that still has an element, whatever the
// view: a row deleted by a pending change is found, and reading it then
// gives 204. A null pointer key is looked for as the empty value of its type,
// which is how adding a row stores it.
int32_t sr_i_get_fixed_row_index_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                         uint32_t *p_fixed_row_index) {
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  const qv_value_t key = sr_i_value_or_empty(key_type, row_key);
  int32_t rc;
  if (p_table->p_rows_hash_table != nullptr) {
    // In a table larger than the cache every step of a lookup misses: the
    // bucket, the element, the key in its record, the row's index entry and
    // the record's slots and values. As soon as an element names its row
    // and key, the index entry and the record around the key are asked for,
    // so that their misses overlap the comparison's instead of following
    // it. The record's fixed part is taken to lie just before the key, where
    // it is when the key is the first variable-length value (a fixed-size
    // key lies in the slots themselves); when it is not, a prefetch is lost.
    const sr_i_index_entry_t *p_entries = p_table->p_rows_fixed_index;
    const uint32_t fixed_length =
        sr_i_is_variable_length(key_type) ? sr_i_row_fixed_length(p_table) : Sr_Row_Header_Length;
    rc = sr_i_hash_table_find_row(
        p_table->p_rows_hash_table, sr_i_client_key_pointer(key_type, key), p_fixed_row_index,
        [p_entries, fixed_length](const sr_hash_table_element_t &element) {
          // In integers: a home's key may be null or point into a freed
          // record, and a prefetch may go anywhere.
          const auto key_address = reinterpret_cast<uintptr_t>(element.p_key_value);
          __builtin_prefetch(&p_entries[element.row_index]);
          __builtin_prefetch(reinterpret_cast<const void *>(key_address - fixed_length));
          __builtin_prefetch(reinterpret_cast<const void *>(key_address + Record_Tail_Prefetch));
        });
  } else {
    rc = scan_for_key(p_table, key, p_fixed_row_index);
  }
  if (rc == SR_E_NO_ROW_FOR_KEY) {
    return sr_i_raise_key_not_found(p_table->p_name, &key, key_type);
  }
  return rc;
}
