// sr_i_add_row.cpp - adding a row: the record is built from the caller's
// named values and the columns' defaults, given an index entry (the lowest
// free one, or a deleted row of the same key, which comes back at its old
// position), entered in the key hash table and queued as a pending addition.
// A failure leaves the table exactly as it was.

#include "qv_cu.h"
#include "sr_i_errors.h"
#include "sr_i_hash_table.h"
#include "sr_i_row_operations.h"
#include "sr_i_rows.h"
#include "sr_i_tree.h"

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
                         sr_hash_table_element_t **pp_existing_hash_table_element) {
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
  sr_hash_table_element_t *p_element = nullptr;
  const int32_t rc = sr_i_hash_table_add(
      p_table->p_rows_hash_table, sr_i_row_key(p_table, p_record_data), position,
      &p_entry->hash_index, &p_element, p_table->p_columns[0].qualifier);
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
    if (const int32_t rc = builder.put_value(column, *p_value, p_conversion); rc != 0) {
      return rc;
    }
  }
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
  sr_i_index_entry_t *p_entry = nullptr;
  sr_hash_table_element_t *p_revived_element = nullptr;
  if (const int32_t rc = sr_i_add_row_raw(p_table, p_record, p_key, &p_entry, &p_revived_element);
      rc != 0) {
    return rc;
  }
  const bool revived = p_revived_element != nullptr;
  if (const int32_t rc =
          sr_i_rb_allocate_record(&p_table->record_buffer_pool, p_record, p_previous_free,
                                  builder.length(), SR_I_RECORD_ROW);
      rc != 0) {
    if (revived) {
      p_entry->p_applied = nullptr;
    } else {
      remove_hash_element(p_table, p_entry);
      sr_i_rows_free_chain_insert(p_table, p_entry);
    }
    return rc;
  }
  // A revived row keeps its pending deletion's entry, so only a new row can
  // fail here.
  if (const int32_t rc = sr_i_add_change_entry(p_table, p_entry); rc != 0) {
    if (revived) {
      p_entry->p_applied = nullptr;
    } else {
      remove_hash_element(p_table, p_entry);
      sr_i_rows_free_chain_insert(p_table, p_entry);
    }
    sr_i_rb_free_record(&p_table->record_buffer_pool, p_record);
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
