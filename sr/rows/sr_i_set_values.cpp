// sr_i_set_values.cpp - setting column values of an existing row, named by
// fixed index, packed index or key. A set never edits a record in place: it
// builds a new record from the row's applied record and the caller's values,
// takes it from the pool, queues the row's pending update and only then
// lets the new record replace the applied one. The committed record stays
// untouched until commit.
//
// Relies on the row builder and change entries of sr_i_rows, the record
// buffer pool and the key lookup of sr_i_get_values.

#include <cstring>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "rows/sr_i_row_operations.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_record_buffer_pool.h"

namespace {

/*
 * Fills `builder` column by column: a named column takes the caller's value
 * (105 for a protected one), an unnamed one keeps its value in `p_current`
 * or, when so qualified, returns to its default. 105 when not every caller
 * value was used (a name unknown or given twice); 11 from the codec.
 */
int32_t build_new_record(const sr_i_table_t *p_table, const void *p_current,
                         const char *const *p_column_names, const qv_value_t *const *p_p_values,
                         uint32_t total_values, sr_i_row_builder &builder) {
  cu_iconv_t *p_conversion =
      p_table->p_tree != nullptr ? p_table->p_tree->p_to_table_string_conversion_handle : nullptr;
  uint32_t total_used = 0;
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    const sr_column_t &definition = p_table->p_columns[column];
    const int32_t named = sr_i_find_named_value(definition.name, p_column_names, total_values);
    if (named >= 0) {
      if ((definition.qualifier & SR_PROTECTED) != 0) {
        return sr_i_raise(SR_E_INVALID_COLUMN);
      }
      if (const int32_t rc = builder.put_value(column, *p_p_values[named], p_conversion); rc != 0) {
        return rc;
      }
      ++total_used;
    } else if ((definition.qualifier & SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED) != 0) {
      builder.copy_default(column);
    } else {
      builder.copy_column(column, p_current);
    }
  }
  if (total_used != total_values) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  return 0;
}

/*
 * Makes `p_record` (allocated, change entry queued) the row's applied
 * record. The record it replaces is freed unless it is the committed one;
 * for a row never committed the hash element points into it, so the
 * element follows the key into the new record first.
 */
void replace_applied_record(sr_i_table_t *p_table, sr_i_index_entry_t *p_entry, void *p_record) {
  void *p_old = p_entry->p_applied;
  if (p_old != p_entry->p_committed) {
    if (p_entry->p_committed == nullptr && p_table->p_rows_hash_table != nullptr) {
      p_entry->p_hash_table_element->p_key_value = sr_i_row_key(p_table, p_record);
    }
    sr_i_rb_free_record(&p_table->record_buffer_pool, p_old);
  }
  p_entry->p_applied = p_record;
}

}  // namespace

int32_t sr_i_set_values_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                        const char *const *p_column_names,
                                        const qv_value_t *const *p_p_values,
                                        uint32_t total_values) {
  if (p_table->ready_for_commit != 0) {
    return sr_i_raise(SR_E_APPLIED_UNCOMMITTED);
  }
  if (fixed_row_index >= p_table->maximum_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  sr_i_index_entry_t *p_entry = &p_table->p_rows_fixed_index[fixed_row_index];
  if (p_entry->p_applied == nullptr) {
    return sr_i_raise(SR_E_ROW_DELETED);
  }

  sr_i_row_builder builder(p_table);
  if (const int32_t rc = build_new_record(p_table, p_entry->p_applied, p_column_names, p_p_values,
                                          total_values, builder);
      rc != 0) {
    return rc;
  }
  builder.set_header_word(p_entry->file_offset);

  void *p_record = nullptr;
  sr_i_record_metadata_t *p_previous_free = nullptr;
  if (const int32_t rc = sr_i_place_row_record(p_table, builder, &p_record, &p_previous_free);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc =
          sr_i_rb_allocate_record(&p_table->record_buffer_pool, p_record, p_previous_free,
                                  builder.length(), SR_I_RECORD_ROW);
      rc != 0) {
    return rc;
  }
  // The change entry is the last step that can fail: until it is queued the
  // row still holds its old record, and the new one simply goes back.
  if (const int32_t rc = sr_i_add_change_entry(p_table, p_entry); rc != 0) {
    sr_i_rb_free_record(&p_table->record_buffer_pool, p_record);
    return rc;
  }
  replace_applied_record(p_table, p_entry, p_record);
  return 0;
}

int32_t sr_i_set_value_for_fixed_index(sr_i_table_t *p_table, uint32_t fixed_row_index,
                                       const char *p_column_name, const qv_value_t *p_value) {
  const char *const p_column_names[] = {p_column_name};
  const qv_value_t *const p_p_values[] = {p_value};
  return sr_i_set_values_for_fixed_index(p_table, fixed_row_index, p_column_names, p_p_values, 1);
}

int32_t sr_i_set_values_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                         const char *const *p_column_names,
                                         const qv_value_t *const *p_p_values,
                                         uint32_t total_values) {
  if (row_index >= p_table->total_applied_rows) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  return sr_i_set_values_for_fixed_index(p_table, p_table->p_rows_packed_index[row_index],
                                         p_column_names, p_p_values, total_values);
}

int32_t sr_i_set_value_for_packed_index(sr_i_table_t *p_table, uint32_t row_index,
                                        const char *p_column_name, const qv_value_t *p_value) {
  const char *const p_column_names[] = {p_column_name};
  const qv_value_t *const p_p_values[] = {p_value};
  return sr_i_set_values_for_packed_index(p_table, row_index, p_column_names, p_p_values, 1);
}

int32_t sr_i_set_values_for_key(sr_i_table_t *p_table, qv_value_t row_key,
                                const char *const *p_column_names,
                                const qv_value_t *const *p_p_values, uint32_t total_values) {
  uint32_t fixed_row_index = 0;
  if (const int32_t rc = sr_i_get_fixed_row_index_for_key(p_table, row_key, &fixed_row_index);
      rc != 0) {
    return rc;
  }
  return sr_i_set_values_for_fixed_index(p_table, fixed_row_index, p_column_names, p_p_values,
                                         total_values);
}

int32_t sr_i_set_value_for_key(sr_i_table_t *p_table, qv_value_t row_key, const char *p_column_name,
                               const qv_value_t *p_value) {
  const char *const p_column_names[] = {p_column_name};
  const qv_value_t *const p_p_values[] = {p_value};
  return sr_i_set_values_for_key(p_table, row_key, p_column_names, p_p_values, 1);
}
