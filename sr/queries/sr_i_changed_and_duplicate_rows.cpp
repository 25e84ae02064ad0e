// sr_i_changed_and_duplicate_rows.cpp - the rows with pending changes, read
// from the table's two change lists, and the rows that hold one key value,
// found through the key hash table or by a walk of the fixed row index.
//
// Both hand out fixed indexes, which stay valid for a row's life, so a
// caller can go on to read or set the rows they name. The arrays are
// malloc'ed because the caller frees them with free.

#include "queries/sr_i_changed_and_duplicate_rows.h"

#include <cstdlib>
#include <utility>

#include "frame/sr_i_errors.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_hash_table.h"

namespace {

uint32_t list_length(const sr_i_change_entry_t *p_change) {
  uint32_t length = 0;
  for (; p_change != nullptr; p_change = p_change->p_next) {
    ++length;
  }
  return length;
}

// Writes the fixed index of each listed row from `p_rows` on, and returns
// the place behind the last one written.
uint32_t *copy_fixed_indexes(const sr_i_table_t *p_table, const sr_i_change_entry_t *p_change,
                             uint32_t *p_rows) {
  for (; p_change != nullptr; p_change = p_change->p_next) {
    *p_rows++ = sr_i_fixed_position(p_table, p_change->p_index_entry);
  }
  return p_rows;
}

// Whether a row belongs to the view the caller chose.
bool has_visible_record(const sr_i_index_entry_t &entry, uint32_t uncommitted_updates_visible) {
  return (uncommitted_updates_visible != 0 ? entry.p_applied : entry.p_committed) != nullptr;
}

// Fixed indexes as they are found, kept in malloc'ed memory so that the
// array goes to the caller as it stands. Most keys are held by one row or
// a few, so room for ten comes first; beyond that the room doubles, which
// keeps a key shared by many thousands of rows from being copied over and
// over.
class fixed_index_list {
 public:
  fixed_index_list() = default;
  ~fixed_index_list() { std::free(p_rows_); }
  fixed_index_list(const fixed_index_list &) = delete;
  fixed_index_list &operator=(const fixed_index_list &) = delete;

  // 0, or 12 (raised) when the array cannot grow; the rows found stay.
  int32_t append(uint32_t fixed_row_index) {
    if (count_ == capacity_) {
      const uint32_t capacity = capacity_ == 0 ? First_Capacity : capacity_ * 2;
      void *p_grown = std::realloc(p_rows_, sizeof *p_rows_ * capacity);
      if (p_grown == nullptr) {
        return sr_i_raise_no_memory();
      }
      p_rows_ = static_cast<uint32_t *>(p_grown);
      capacity_ = capacity;
    }
    p_rows_[count_++] = fixed_row_index;
    return 0;
  }

  uint32_t count() const { return count_; }

  // The array, which the list no longer frees.
  uint32_t *release() { return std::exchange(p_rows_, nullptr); }

 private:
  static constexpr uint32_t First_Capacity = 10;

  uint32_t *p_rows_ = nullptr;
  uint32_t count_ = 0;
  uint32_t capacity_ = 0;
};

// The rows of the key's bucket whose stored key the table's compare function
// finds equal, newest first as the bucket keeps them. The key pointer is
// formed as a key lookup forms it.
int32_t find_in_hash_table(const sr_i_table_t *p_table, const qv_value_t &key,
                           uint32_t uncommitted_updates_visible, fixed_index_list &rows) {
  const sr_hash_table_t *p_hash_table = p_table->p_rows_hash_table;
  const void *p_key = sr_i_client_key_pointer(p_table->p_columns[0].type, key);
  uint32_t bucket = 0;
  if (const int32_t rc = sr_i_hash_table_bucket(p_hash_table, p_key, &bucket); rc != 0) {
    return rc;
  }
  for (const sr_hash_table_element_t *p_element = p_hash_table->p_elements[bucket];
       p_element != nullptr; p_element = p_element->p_next) {
    if (p_hash_table->p_compare_function(p_element->p_key_value, p_key) != 0 ||
        !has_visible_record(p_table->p_rows_fixed_index[p_element->row_index],
                            uncommitted_updates_visible)) {
      continue;
    }
    if (const int32_t rc = rows.append(p_element->row_index); rc != 0) {
      return rc;
    }
  }
  return 0;
}

// Without a hash table every row of the chosen view is compared, in
// fixed-index order; the walk ends once it has seen as many rows as the
// view holds.
int32_t find_by_walk(const sr_i_table_t *p_table, const qv_value_t &key,
                     uint32_t uncommitted_updates_visible, fixed_index_list &rows) {
  const uint32_t rows_in_view = uncommitted_updates_visible != 0
                                    ? p_table->total_applied_rows - p_table->applied_deletions
                                    : p_table->total_committed_rows;
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  uint32_t seen = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows && seen < rows_in_view; ++position) {
    const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    const void *p_record = uncommitted_updates_visible != 0 ? entry.p_applied : entry.p_committed;
    if (p_record == nullptr) {
      continue;
    }
    ++seen;
    if (sr_i_compare_values(&key, sr_i_row_slot(p_record, 0), key_type,
                            sr_i_row_variable_part(p_table, p_record)) != 0) {
      continue;
    }
    if (const int32_t rc = rows.append(position); rc != 0) {
      return rc;
    }
  }
  return 0;
}

}  // namespace

int32_t sr_i_get_updated_rows(const sr_i_table_t *p_table, uint32_t *p_updated_rows_count,
                              uint32_t **p_p_updated_rows_fixed_indices) {
  const uint32_t total_changes = list_length(p_table->p_rows_change_list);
  const uint32_t total_deletions = list_length(p_table->p_delete_rows_change_list);
  if (total_changes == 0 && total_deletions == 0) {
    *p_updated_rows_count = 0;
    *p_p_updated_rows_fixed_indices = nullptr;
    return 0;
  }
  const size_t total_rows = static_cast<size_t>(total_changes) + total_deletions;
  auto *p_rows = static_cast<uint32_t *>(std::malloc(sizeof(uint32_t) * total_rows));
  if (p_rows == nullptr) {
    return sr_i_raise_no_memory();
  }
  uint32_t *p_deletions = copy_fixed_indexes(p_table, p_table->p_rows_change_list, p_rows);
  copy_fixed_indexes(p_table, p_table->p_delete_rows_change_list, p_deletions);
  *p_updated_rows_count = total_changes;
  *p_p_updated_rows_fixed_indices = p_rows;
  return 0;
}

int32_t sr_i_get_duplicate_rows(const sr_i_table_t *p_table, qv_value_t key_value,
                                uint32_t *p_duplicate_rows_count,
                                uint32_t **p_p_duplicate_rows_fixed_indices,
                                uint32_t uncommitted_updates_visible) {
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  const qv_value_t key = sr_i_value_or_empty(key_type, key_value);
  fixed_index_list rows;
  const int32_t rc = p_table->p_rows_hash_table != nullptr
                         ? find_in_hash_table(p_table, key, uncommitted_updates_visible, rows)
                         : find_by_walk(p_table, key, uncommitted_updates_visible, rows);
  if (rc != 0) {
    return rc;
  }
  if (rows.count() == 0) {
    return sr_i_raise_key_not_found(p_table->p_name, &key, key_type);
  }
  *p_duplicate_rows_count = rows.count();
  *p_p_duplicate_rows_fixed_indices = rows.release();
  return 0;
}
