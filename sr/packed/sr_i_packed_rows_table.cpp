// sr_i_packed_rows_table.cpp - the read-only table built straight on the
// rows of a packed buffer: each record checked as it enters, the row index
// filled in one pass, every row committed at once, and the keys entered in
// the key hash table or checked for uniqueness without one.
//
// The rows came from outside, so nothing is read through a record before
// its length word, its anchors and (for a key compared where it lies) its
// key body hold together. Everything that is the same for every row, the
// record's fixed length and which columns are variable-length, is worked
// out once per table.

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <numeric>
#include <vector>

#include "frame/sr_i_errors.h"
#include "packed/sr_i_packed_buffer.h"
#include "packed/sr_i_unpack_table.h"
#include "rows/sr_i_rows.h"
#include "storage/sr_i_prefault.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_create_table.h"

namespace {

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
};

// What a pool record from a buffer must be to be read as a row of the
// table: its length word says its length, it holds the header word and
// every slot, each anchor lies in its variable part, and a key body that is
// compared in place is a whole string or handle.
class record_check {
 public:
  explicit record_check(const sr_i_table_t *p_table)
      : fixed_length_(uint64_t{Sr_Record_Header_Length} + sr_i_row_fixed_length(p_table)),
        key_type_(p_table->p_columns[0].type) {
    for (uint32_t column = 0; column < p_table->total_columns; ++column) {
      if (sr_i_is_variable_length(p_table->p_columns[column].type)) {
        variable_columns_.push_back(column);
      }
    }
  }

  bool holds_together(const unsigned char *p_element, uint32_t length) const {
    if (length < fixed_length_ || sr_i_load_u32(p_element) != length) {
      return false;
    }
    const unsigned char *p_record = p_element + Sr_Record_Header_Length;
    const uint64_t variable_length = length - fixed_length_;
    for (const uint32_t column : variable_columns_) {
      const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(sr_i_row_slot(p_record, column));
      if (!sr_i_packed_span_inside(anchor.offset, anchor.length, variable_length)) {
        return false;
      }
    }
    if (key_type_ != QV_CHAR_PTR && key_type_ != QV_RSRC_HANDLE_PTR) {
      return true;
    }
    const qv_pmsg_value_anchor_t key = sr_i_slot_anchor(sr_i_row_slot(p_record, 0));
    const unsigned char *p_key = p_element + fixed_length_ + key.offset;
    return key_type_ == QV_CHAR_PTR ? key.length > 0 && p_key[key.length - 1] == '\0'
                                    : key.length == sizeof(qv_resource_handle_t);
  }

 private:
  uint64_t fixed_length_;
  qv_data_type_t key_type_;
  std::vector<uint32_t> variable_columns_;
};

// Points the first `total_rows` index entries, in order, at the records
// of the rows array, each checked first, and lists them in the packed index
// in the same order. 14 (raised) for a record that does not hold together.
int32_t enter_rows(sr_i_table_t *p_table, const unsigned char *p_rows, uint32_t length,
                   uint32_t total_rows) {
  const record_check check(p_table);
  sr_i_index_entry_t *p_index = p_table->p_rows_fixed_index;
  sr_i_map_block_to_fill(p_index, uint64_t{total_rows} * sizeof *p_index);
  for (uint32_t row = 0; row < total_rows; ++row) {
    qv_pmsg_value_anchor_t anchor;
    if (!sr_i_packed_row_anchor(p_rows, length, total_rows, row, anchor) ||
        !check.holds_together(p_rows + anchor.offset, anchor.length)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    sr_i_index_entry_t &entry = p_index[row];
    entry.p_applied = const_cast<unsigned char *>(p_rows) + anchor.offset + Sr_Record_Header_Length;
    entry.p_committed = entry.p_applied;
    entry.packed_index = row;
    p_table->p_rows_packed_index[row] = row;
  }
  // The entries below `total_rows` are taken and the rest never were, which
  // is how the free chain stands after taking them one by one.
  p_table->p_rows_never_used = p_index + total_rows;
  p_table->p_rows_free_chain = total_rows < p_table->maximum_rows ? p_index + total_rows : nullptr;
  p_table->total_applied_rows = total_rows;
  p_table->total_committed_rows = total_rows;
  return 0;
}

const void *committed_row_key(const void *p_table, const sr_i_index_entry_t *p_entry) {
  return sr_i_row_key(static_cast<const sr_i_table_t *>(p_table), p_entry->p_committed);
}

// Three-way comparison of the keys of two rows, by the comparison adding a
// row checks keys with; the keys were checked whole by record_check.
int32_t compare_row_keys(const sr_i_table_t *p_table, const void *p_record,
                         const void *p_other_record) {
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  qv_value_t key{};
  qv_resource_handle_t handle;
  if (key_type == QV_CHAR_PTR) {
    key.ptr_char = static_cast<char *>(const_cast<void *>(sr_i_row_key(p_table, p_record)));
  } else if (key_type == QV_RSRC_HANDLE_PTR) {
    std::memcpy(&handle, sr_i_row_key(p_table, p_record), sizeof handle);
    key.ptr_rsrc_handle = &handle;
  } else {
    std::memcpy(&key, sr_i_row_slot(p_record, 0), sizeof key);
  }
  return sr_i_compare_values(&key, sr_i_row_slot(p_other_record, 0), key_type,
                             sr_i_row_variable_part(p_table, p_other_record));
}

bool is_nan_key(const sr_i_table_t *p_table, const void *p_record) {
  const unsigned char *p_slot = sr_i_row_slot(p_record, 0);
  if (p_table->p_columns[0].type == QV_FLOAT32) {
    float number;
    std::memcpy(&number, p_slot, sizeof number);
    return std::isnan(number);
  }
  if (p_table->p_columns[0].type == QV_FLOAT64) {
    double number;
    std::memcpy(&number, p_slot, sizeof number);
    return std::isnan(number);
  }
  return false;
}

// A table without a key hash table checks a key under SR_PRIMARY_KEY
// against every other row, as adding rows does. Sorted by key, equal keys
// are neighbours: n log n comparisons instead of one per pair. A NaN key
// equals every key under that comparison and cannot be sorted, so beside
// any other row it is a duplicate. 108 (raised) for a repeated key.
int32_t check_keys_by_sorting(const sr_i_table_t *p_table) {
  const uint32_t total_rows = p_table->total_committed_rows;
  if (total_rows < 2) {
    return 0;
  }
  const auto record = [p_table](uint32_t row) {
    return p_table->p_rows_fixed_index[row].p_committed;
  };
  std::vector<uint32_t> order(total_rows);
  std::iota(order.begin(), order.end(), 0u);
  if (std::any_of(order.begin(), order.end(),
                  [&](uint32_t row) { return is_nan_key(p_table, record(row)); })) {
    return sr_i_raise(SR_E_DUPLICATE_KEY);
  }
  std::sort(order.begin(), order.end(), [&](uint32_t row, uint32_t other) {
    return compare_row_keys(p_table, record(row), record(other)) < 0;
  });
  for (uint32_t at = 1; at < total_rows; ++at) {
    if (compare_row_keys(p_table, record(order[at - 1]), record(order[at])) == 0) {
      return sr_i_raise(SR_E_DUPLICATE_KEY);
    }
  }
  return 0;
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
  if (const int32_t rc = enter_rows(p_new_table, rows.get(), length, total_rows); rc != 0) {
    return rc;
  }
  const sr_qualifier_t key_qualifier = p_new_table->p_columns[0].qualifier;
  if (p_new_table->p_rows_hash_table != nullptr) {
    if (const int32_t rc = sr_i_hash_table_add_entries(
            p_new_table->p_rows_hash_table, p_new_table->p_rows_fixed_index, total_rows,
            committed_row_key, p_new_table, key_qualifier);
        rc != 0) {
      return rc;
    }
  } else if ((key_qualifier & 15u) == SR_PRIMARY_KEY) {
    if (const int32_t rc = check_keys_by_sorting(p_new_table); rc != 0) {
      return rc;
    }
  }
  p_new_table->p_packed_rows_array = rows.release();
  p_new_table->mode = Sr_Mode_Read_Only;
  *pp_table = p_new_table;
  closer.p_table = nullptr;
  return 0;
}
