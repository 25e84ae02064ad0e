// sr_i_add_row.cpp - adding a row: the record is built from the caller's
// named values and the columns' defaults, given an index entry (the lowest
// free one, or a deleted row of the same key, which comes back at its old
// position), entered in the key hash table and queued as a pending addition.
// A failure leaves the table exactly as it was.

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "qv_cu.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_hash_table.h"

namespace {

bool key_is_checked(const sr_i_table_t *p_table) {
  return (p_table->p_columns[0].qualifier & 15) == SR_PRIMARY_KEY;
}

// Without a hash table a checked key is compared with every live row of the
// applied view, in fixed-index order. The new entry already holds its
// record, so when it lies before the last live row the scan meets the new
// row itself and refuses the key.
bool key_taken_by_scan(const sr_i_table_t *p_table, const qv_value_t *p_key) {
  const uint32_t live_rows = p_table->total_applied_rows - p_table->applied_deletions;
  const qv_data_type_t key_type = p_table->p_columns[0].type;
  uint32_t seen = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows && seen < live_rows; ++position) {
    const void *p_record = p_table->p_rows_fixed_index[position].p_applied;
    if (p_record == nullptr) {
      continue;
    }
    ++seen;
    if (sr_i_compare_values(p_key, sr_i_row_slot(p_record, 0), key_type,
                            sr_i_row_variable_part(p_table, p_record)) == 0) {
      return true;
    }
  }
  return false;
}

// Adding a key to the hash table reads three places one after the other:
// the bucket head, the first element of its chain and that element's key
// inside an older row's record. In a large table each is a cache miss. When
// the stored key will be byte for byte the caller's (no string conversion
// applies), its bucket is known before the record is built, and each of
// the three loads is started one stage of the building ahead, so that the
// duplicate check finds them at hand. Every step is only a hint.
class bucket_warmer {
 public:
  // As soon as the caller's key is known: hashes it and asks for its bucket.
  void start(const sr_i_table_t *p_table, const qv_value_t &key, const cu_iconv_t *p_conversion) {
    p_hash_table_ = p_table->p_rows_hash_table;
    const qv_data_type_t type = p_table->p_columns[0].type;
    const bool strings_converted = cu_iconv_is_unchanged_1(p_conversion) == 0;
    if (p_hash_table_ == nullptr || (type == QV_CHAR_PTR && strings_converted) ||
        (sr_i_is_variable_length(type) && type != QV_CHAR_PTR && type != QV_RSRC_HANDLE_PTR)) {
      return;
    }
    const qv_value_t stored = sr_i_value_or_empty(type, key);
    known_ =
        sr_i_hash_table_try_bucket(p_hash_table_, sr_i_client_key_pointer(type, stored), &bucket_);
    if (known_) {
      __builtin_prefetch(&p_hash_table_->p_elements[bucket_]);
    }
  }

  // One step further along the chain: the first element, then its key.
  void follow() {
    if (!known_) {
      return;
    }
    if (p_head_ == nullptr) {
      p_head_ = p_hash_table_->p_elements[bucket_];
      if (p_head_ != nullptr) {
        __builtin_prefetch(p_head_);
      }
    } else {
      __builtin_prefetch(p_head_->p_key_value);
    }
  }

  const uint32_t *bucket() const { return known_ ? &bucket_ : nullptr; }

 private:
  const sr_hash_table_t *p_hash_table_ = nullptr;
  const sr_hash_table_element_t *p_head_ = nullptr;
  uint32_t bucket_ = 0;
  bool known_ = false;
};

// Takes the row's hash element out again, when it has one.
void remove_hash_element(sr_i_table_t *p_table, sr_i_index_entry_t *p_entry) {
  if (p_table->p_rows_hash_table != nullptr && p_entry->p_hash_table_element != nullptr) {
    sr_i_hash_table_remove_element(p_table->p_rows_hash_table, p_entry->hash_index,
                                   p_entry->p_hash_table_element);
  }
}

}  // namespace

int32_t sr_i_add_row_raw(sr_i_table_t *p_table, void *p_record_data,
                         const qv_value_t *p_input_key_value,
                         sr_i_index_entry_t **pp_new_index_entry,
                         sr_hash_table_element_t **pp_existing_hash_table_element,
                         const uint32_t *p_known_bucket) {
  *pp_existing_hash_table_element = nullptr;
  sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_table);
  if (p_entry == nullptr) {
    if (const int32_t rc = sr_i_grow_index(p_table, p_table->maximum_rows); rc != 0) {
      return rc;
    }
    p_entry = sr_i_rows_free_chain_remove(p_table);
  }
  p_entry->p_applied = p_record_data;

  if (p_table->p_rows_hash_table == nullptr) {
    if (key_is_checked(p_table) && key_taken_by_scan(p_table, p_input_key_value)) {
      sr_i_rows_free_chain_insert(p_table, p_entry);
      return sr_i_raise(SR_E_DUPLICATE_KEY);
    }
    *pp_new_index_entry = p_entry;
    return 0;
  }

  const uint32_t position = sr_i_fixed_position(p_table, p_entry);
  const void *p_key = sr_i_row_key(p_table, p_record_data);
  const sr_qualifier_t qualifier = p_table->p_columns[0].qualifier;
  sr_hash_table_element_t *p_element = nullptr;
  const int32_t rc =
      p_known_bucket != nullptr
          ? sr_i_hash_table_add_to_bucket(p_table->p_rows_hash_table, *p_known_bucket, p_key,
                                          position, &p_element, qualifier, &p_entry->hash_index)
          : sr_i_hash_table_add(p_table->p_rows_hash_table, p_key, position, &p_entry->hash_index,
                                &p_element, qualifier);
  if (rc == 0) {
    p_entry->p_hash_table_element = p_element;
    *pp_new_index_entry = p_entry;
    return 0;
  }
  sr_i_rows_free_chain_insert(p_table, p_entry);
  if (rc != SR_E_DUPLICATE_KEY) {
    return rc;
  }
  // The key's row is live: a duplicate. Deleted: it comes back.
  sr_i_index_entry_t *p_existing = &p_table->p_rows_fixed_index[p_element->row_index];
  if (p_existing->p_applied != nullptr) {
    return sr_i_raise(SR_E_DUPLICATE_KEY);
  }
  p_existing->p_applied = p_record_data;
  *pp_new_index_entry = p_existing;
  *pp_existing_hash_table_element = p_element;
  return 0;
}

int32_t sr_i_add_row(sr_i_table_t *p_table, const char *const *p_column_names,
                     const qv_value_t *const *p_p_values, uint32_t total_values) {
  if (p_table->ready_for_commit != 0) {
    return sr_i_raise(SR_E_APPLIED_UNCOMMITTED);
  }
  if (total_values > 0 && (p_column_names == nullptr || p_p_values == nullptr)) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  cu_iconv_t *p_conversion =
      p_table->p_tree != nullptr ? p_table->p_tree->p_to_table_string_conversion_handle : nullptr;
  sr_i_row_builder builder(p_table);
  bucket_warmer warmer;
  const qv_value_t *p_key = nullptr;
  uint32_t values_used = 0;
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    const int32_t named =
        sr_i_find_named_value(p_table->p_columns[column].name, p_column_names, total_values);
    if (named < 0) {
      if (column == 0) {
        return sr_i_raise(SR_E_KEY_EXPECTED);
      }
      builder.copy_default(column);
      continue;
    }
    ++values_used;
    const qv_value_t *p_value = p_p_values[named];
    if (column == 0) {
      p_key = p_value;
    }
    if (p_value == nullptr) {
      if (column == 0) {
        continue;  // refused below, once every name is accounted for
      }
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    if (column == 0) {
      warmer.start(p_table, *p_value, p_conversion);
    }
    if (const int32_t rc = builder.put_value(column, *p_value, p_conversion); rc != 0) {
      return rc;
    }
  }
  warmer.follow();
  if (values_used != total_values) {
    return sr_i_raise(SR_E_NO_COLUMNS);
  }
  if (p_key == nullptr) {
    return sr_i_raise(SR_E_KEY_EXPECTED);
  }

  void *p_record = nullptr;
  sr_i_record_metadata_t *p_previous_free = nullptr;
  if (const int32_t rc = sr_i_place_row_record(p_table, builder, &p_record, &p_previous_free);
      rc != 0) {
    return rc;
  }
  warmer.follow();
  sr_i_index_entry_t *p_entry = nullptr;
  sr_hash_table_element_t *p_revived_element = nullptr;
  if (const int32_t rc =
          sr_i_add_row_raw(p_table, p_record, p_key, &p_entry, &p_revived_element, warmer.bucket());
      rc != 0) {
    return rc;
  }
  const bool revived = p_revived_element != nullptr;
  // Taking the record and queueing the change are the last steps that can
  // fail; either failure gives the row back here: a revived row loses its
  // record again, a new one leaves the hash table and frees its entry.
  int32_t rc = sr_i_rb_allocate_record(&p_table->record_buffer_pool, p_record, p_previous_free,
                                       builder.length(), SR_I_RECORD_ROW);
  const bool record_taken = rc == 0;
  if (record_taken) {
    // A revived row keeps its pending deletion's entry, so only a new row
    // can fail here.
    rc = sr_i_add_change_entry(p_table, p_entry);
  }
  if (rc != 0) {
    if (revived) {
      p_entry->p_applied = nullptr;
    } else {
      remove_hash_element(p_table, p_entry);
      sr_i_rows_free_chain_insert(p_table, p_entry);
    }
    if (record_taken) {
      sr_i_rb_free_record(&p_table->record_buffer_pool, p_record);
    }
    return rc;
  }
  sr_i_set_row_header_word(p_record, p_entry->p_committed != nullptr ? p_entry->file_offset : 0);
  if (revived) {
    if (p_table->applied_deletions > 0) {
      --p_table->applied_deletions;
    }
    return 0;
  }
  p_entry->packed_index = p_table->total_applied_rows;
  p_table->p_rows_packed_index[p_table->total_applied_rows++] =
      sr_i_fixed_position(p_table, p_entry);
  return 0;
}
