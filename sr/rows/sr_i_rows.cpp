// sr_i_rows.cpp - what the row operations share: the key pointer of a
// record, column lookup by name, the record builder, the change entries of
// the two change lists, the packed index's compaction, row states and the
// rebuilding of the packed index and key hash table from committed rows.

#include "rows/sr_i_rows.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "frame/sr_i_errors.h"
#include "tables/sr_i_hash_table.h"

const void *sr_i_row_key(const sr_i_table_t *p_table, const void *p_record) {
  const unsigned char *p_slot = sr_i_row_slot(p_record, 0);
  if (!sr_i_is_variable_length(p_table->p_columns[0].type)) {
    return p_slot;
  }
  return sr_i_row_variable_part(p_table, p_record) + sr_i_slot_anchor(p_slot).offset;
}

namespace {
// Compared inline, byte by byte: names are short and mostly differ in their
// first byte, and a call to strcmp per column costs more than the work.
bool same_name(const char *p_one, const char *p_other) {
  for (; *p_one == *p_other; ++p_one, ++p_other) {
    if (*p_one == '\0') {
      return true;
    }
  }
  return false;
}

bool is_column_named(const sr_i_table_t *p_table, uint32_t column, const char *p_name) {
  return same_name(p_table->p_columns[column].name, p_name);
}
}  // namespace

int32_t sr_i_find_column(const sr_i_table_t *p_table, const char *p_name, uint32_t likely_column) {
  if (p_name == nullptr) {
    return -1;
  }
  if (likely_column < p_table->total_columns && is_column_named(p_table, likely_column, p_name)) {
    return static_cast<int32_t>(likely_column);
  }
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    if (is_column_named(p_table, column, p_name)) {
      return static_cast<int32_t>(column);
    }
  }
  return -1;
}

int32_t sr_i_find_named_value(const char *p_name, const char *const *p_names,
                              uint32_t total_names) {
  for (uint32_t at = 0; at < total_names; ++at) {
    if (p_names[at] != nullptr && same_name(p_names[at], p_name)) {
      return static_cast<int32_t>(at);
    }
  }
  return -1;
}

// ---- The record builder ---------------------------------------------------

namespace {
// The first guess at a variable-length value's body; the builder grows past
// it when a value needs more.
constexpr uint32_t First_Guess_Per_Variable_Column = 32;
}  // namespace

sr_i_row_builder::sr_i_row_builder(const sr_i_table_t *p_table)
    : p_table_(p_table), fixed_length_(sr_i_row_fixed_length(p_table)) {
  const size_t first_guess = fixed_length_ + size_t{First_Guess_Per_Variable_Column} *
                                                 p_table->total_variable_length_columns;
  if (first_guess > capacity_) {
    grow(first_guess);
  }
  // The header word and the slots: every one is written before the record
  // is used, but a record never carries bytes nobody wrote.
  std::memset(p_bytes_, 0, fixed_length_);
}

// Moves the row to a heap buffer of at least `capacity` bytes, keeping what
// was built. Throws std::bad_alloc, which the entry point turns into 12.
void sr_i_row_builder::grow(size_t capacity) {
  capacity = std::max(capacity, capacity_ * 2);
  if (p_bytes_ == inline_bytes_) {
    heap_bytes_.assign(inline_bytes_, inline_bytes_ + capacity_);
  }
  heap_bytes_.resize(capacity);
  p_bytes_ = heap_bytes_.data();
  capacity_ = capacity;
}

void sr_i_row_builder::reserve_variable(uint32_t length) {
  const size_t needed = size_t{fixed_length_} + used_ + length;
  if (needed > capacity_) {
    grow(needed);
  }
}

int32_t sr_i_row_builder::put_value(uint32_t column, const qv_value_t &value,
                                    cu_iconv_t *p_conversion) {
  const qv_data_type_t type = p_table_->p_columns[column].type;
  if (!sr_i_is_variable_length(type)) {
    put_slot(column, &value);
    return 0;
  }
  const qv_value_t stored = sr_i_dup_nonscalar_value(type, value);
  qv_pmsg_value_t slot{};
  for (;;) {
    const auto room = static_cast<uint32_t>(capacity_ - fixed_length_);
    const int32_t rc = qv_pmsg_build_conv_protocol_value_1(p_conversion, 0, type, &stored, &slot,
                                                           variable_part(), room, &used_);
    if (rc == 0) {
      break;
    }
    if (rc != QV_PMSG_RESULT_NO_ROOM) {
      return sr_i_raise_library_call("qv_pmsg_build_conv_protocol_value", rc);
    }
    grow(capacity_ * 2);
  }
  put_slot(column, &slot);
  return 0;
}

void sr_i_row_builder::put_slot(uint32_t column, const void *p_slot) {
  std::memcpy(sr_i_row_slot(p_bytes_, column), p_slot, Sr_Row_Slot_Length);
}

void sr_i_row_builder::put_body(uint32_t column, const void *p_body, uint32_t length) {
  reserve_variable(length);
  if (length > 0) {
    std::memcpy(variable_part() + used_, p_body, length);
  }
  const qv_pmsg_value_anchor_t anchor{used_, length};
  put_slot(column, &anchor);
  used_ += length;
}

void sr_i_row_builder::copy_column(uint32_t column, const void *p_record) {
  const unsigned char *p_slot = sr_i_row_slot(p_record, column);
  if (!sr_i_is_variable_length(p_table_->p_columns[column].type)) {
    put_slot(column, p_slot);
    return;
  }
  const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(p_slot);
  put_body(column, sr_i_row_variable_part(p_table_, p_record) + anchor.offset, anchor.length);
}

void sr_i_row_builder::copy_default(uint32_t column) {
  const sr_column_t &definition = p_table_->p_columns[column];
  if (!sr_i_is_variable_length(definition.type)) {
    put_slot(column, &definition.default_value);
    return;
  }
  const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(&definition.default_value);
  put_body(column, sr_i_default_data(p_table_) + anchor.offset, anchor.length);
}

int32_t sr_i_place_row_record(sr_i_table_t *p_table, const sr_i_row_builder &builder,
                              void **pp_record, sr_i_record_metadata_t **pp_previous_free_record) {
  uint32_t actual_length = 0;
  if (const int32_t rc =
          sr_i_rb_find_suitable_record(&p_table->record_buffer_pool, builder.length(), pp_record,
                                       pp_previous_free_record, &actual_length);
      rc != 0) {
    return rc;
  }
  std::memcpy(*pp_record, builder.data(), builder.length());
  return 0;
}

qv_value_t sr_i_dup_nonscalar_value(qv_data_type_t type, const qv_value_t &from) {
  return sr_i_value_or_empty(type, from);
}

// ---- Change entries -------------------------------------------------------

namespace {

struct change_list {
  sr_i_change_entry_t **pp_head;
  sr_i_change_entry_t **pp_tail;
};

change_list list_for(sr_i_table_t *p_table, uint32_t deletion) {
  if (deletion != 0) {
    return {&p_table->p_delete_rows_change_list, &p_table->p_delete_rows_change_list_tail};
  }
  return {&p_table->p_rows_change_list, &p_table->p_rows_change_list_tail};
}

void unlink(change_list list, sr_i_change_entry_t *p_change) {
  if (p_change->p_prev != nullptr) {
    p_change->p_prev->p_next = p_change->p_next;
  } else {
    *list.pp_head = p_change->p_next;
  }
  if (p_change->p_next != nullptr) {
    p_change->p_next->p_prev = p_change->p_prev;
  } else {
    *list.pp_tail = p_change->p_prev;
  }
  p_change->p_next = nullptr;
  p_change->p_prev = nullptr;
}

void append(change_list list, sr_i_change_entry_t *p_change) {
  p_change->p_next = nullptr;
  p_change->p_prev = *list.pp_tail;
  if (*list.pp_tail != nullptr) {
    (*list.pp_tail)->p_next = p_change;
  } else {
    *list.pp_head = p_change;
  }
  *list.pp_tail = p_change;
}

}  // namespace

int32_t sr_i_common_add_change_entry(sr_i_table_t *p_table, sr_i_index_entry_t *p_index_entry,
                                     uint32_t deletion) {
  auto *p_change = static_cast<sr_i_change_entry_t *>(p_index_entry->p_pending_change);
  if (p_change != nullptr) {
    if (p_change->deletion == deletion) {
      return 0;
    }
    unlink(list_for(p_table, p_change->deletion), p_change);
  } else {
    p_change = sr_i_new_change_entry(p_table);
    if (p_change == nullptr) {
      return SR_E_NO_MEMORY;
    }
  }
  p_change->p_index_entry = p_index_entry;
  p_change->deletion = deletion;
  append(list_for(p_table, deletion), p_change);
  p_index_entry->p_pending_change = p_change;
  return 0;
}

void sr_i_remove_change_entry(sr_i_table_t *p_table, sr_i_change_entry_t *p_change) {
  unlink(list_for(p_table, p_change->deletion), p_change);
  p_change->p_index_entry->p_pending_change = nullptr;
  sr_i_free_change_entry(p_table, p_change);
}

// ---- Packed index and row states -------------------------------------------

void sr_i_remove_from_packed_index(sr_i_table_t *p_table, uint32_t packed) {
  const uint32_t last = p_table->total_applied_rows - 1;
  const uint32_t moved_row = p_table->p_rows_packed_index[last];
  p_table->p_rows_packed_index[packed] = moved_row;
  p_table->p_rows_fixed_index[moved_row].packed_index = packed;
  p_table->total_applied_rows = last;
}

sr_row_state_t sr_i_get_row_state_for_fixed_index(const sr_i_table_t *p_table,
                                                  uint32_t fixed_row_index) {
  const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[fixed_row_index];
  if (entry.p_applied != nullptr) {
    if (entry.p_committed == nullptr) {
      return SR_ROW_STATE_ADDED;
    }
    return entry.p_applied == entry.p_committed ? SR_ROW_STATE_COMMITTED : SR_ROW_STATE_UPDATED;
  }
  return entry.p_committed != nullptr ? SR_ROW_STATE_DELETED : SR_ROW_STATE_NO_ROW;
}

int32_t sr_i_establish_secondary_row_access(sr_i_table_t *p_table) {
  uint32_t found = 0;
  for (uint32_t position = 0;
       position < p_table->maximum_rows && found < p_table->total_committed_rows; ++position) {
    sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    if (entry.p_committed != nullptr) {
      p_table->p_rows_packed_index[found] = position;
      entry.packed_index = found++;
    }
  }
  sr_hash_table_t *p_hash_table = p_table->p_rows_hash_table;
  if (p_hash_table == nullptr) {
    return 0;
  }
  // Each insertion starts at its bucket head, a cache miss in a large
  // table: the keys a few rows ahead are hashed, and their heads asked for,
  // while the current row goes in.
  constexpr uint32_t Look_Ahead = 8;
  uint32_t buckets[Look_Ahead];
  const auto key_of = [p_table](uint32_t packed) {
    return sr_i_row_key(
        p_table, p_table->p_rows_fixed_index[p_table->p_rows_packed_index[packed]].p_committed);
  };
  const auto hash_ahead = [&](uint32_t packed) {
    uint32_t &bucket = buckets[packed % Look_Ahead];
    const int32_t rc = sr_i_hash_table_bucket(p_hash_table, key_of(packed), &bucket);
    if (rc == 0) {
      __builtin_prefetch(&p_hash_table->p_elements[bucket]);
    }
    return rc;
  };
  for (uint32_t packed = 0; packed < found && packed < Look_Ahead; ++packed) {
    if (const int32_t rc = hash_ahead(packed); rc != 0) {
      return rc;
    }
  }
  const auto key_qualifier = p_table->p_columns[0].qualifier;
  for (uint32_t packed = 0; packed < found; ++packed) {
    const uint32_t bucket = buckets[packed % Look_Ahead];
    if (packed + Look_Ahead < found) {
      if (const int32_t rc = hash_ahead(packed + Look_Ahead); rc != 0) {
        return rc;
      }
    }
    const uint32_t position = p_table->p_rows_packed_index[packed];
    sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    const int32_t rc = sr_i_hash_table_add_to_bucket(p_hash_table, bucket, key_of(packed), position,
                                                     &entry.p_hash_table_element, key_qualifier,
                                                     &entry.hash_index);
    if (rc != 0) {
      // A duplicate of a key under SR_PRIMARY_KEY reaches here unraised.
      return rc == SR_E_DUPLICATE_KEY ? sr_i_raise(SR_E_DUPLICATE_KEY) : rc;
    }
  }
  return 0;
}
