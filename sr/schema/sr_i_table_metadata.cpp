// sr_i_table_metadata.cpp - a description of an open table (name, row and
// column counts, change counter, and on request copies of the column
// definitions with decoded defaults), built for the caller in separate
// allocations that sr_i_free_table_metadata releases one by one.

#include "schema/sr_i_table_metadata.h"

#include <cstdlib>
#include <cstring>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "qv_pmsg.h"
#include "tables/sr_i_columns.h"

namespace {

// Frees what a column copy owns.
void free_column(sr_column_t &column) {
  std::free(column.name);
  if (column.sd_defn != nullptr) {
    for (uint32_t field = 0; field < column.sd_defn->number_of_fields; ++field) {
      std::free(column.sd_defn->field_def[field].name);
    }
    std::free(column.sd_defn);
  }
  if (sr_i_is_variable_length(column.type)) {
    std::free(column.default_value.ptr_char);
  }
}

// A caller's copy of a structured-data definition from its packed form: a
// count, then per field a type word and a NUL-terminated name.
int32_t copy_structured_definition(const void *p_packed, sr_sd_def_t *&p_definition) {
  const auto *p_cursor = static_cast<const unsigned char *>(p_packed);
  uint32_t total_fields;
  std::memcpy(&total_fields, p_cursor, sizeof total_fields);
  p_cursor += sizeof total_fields;
  p_definition = static_cast<sr_sd_def_t *>(
      std::calloc(1, sizeof(sr_sd_def_t) + total_fields * sizeof(sr_sd_field_def_t)));
  if (p_definition == nullptr) {
    return sr_i_raise_no_memory();
  }
  for (uint32_t field = 0; field < total_fields; ++field) {
    uint32_t type;
    std::memcpy(&type, p_cursor, sizeof type);
    p_cursor += sizeof type;
    const char *p_name = reinterpret_cast<const char *>(p_cursor);
    p_cursor += std::strlen(p_name) + 1;
    p_definition->field_def[field].type = static_cast<qv_data_type_t>(type);
    if ((p_definition->field_def[field].name = strdup(p_name)) == nullptr) {
      return sr_i_raise_no_memory();
    }
    p_definition->number_of_fields = field + 1;  // what the free call must release
  }
  return 0;
}

int32_t copy_column(const sr_i_table_t *p_table, const sr_column_t &stored, sr_column_t &copy) {
  copy.type = stored.type;
  copy.qualifier = stored.qualifier;
  copy.properties = stored.properties;
  copy.default_value = stored.default_value;
  if (sr_i_is_variable_length(stored.type)) {
    copy.default_value.ptr_char = nullptr;  // owned only once decoded
  }
  if ((copy.name = strdup(stored.name)) == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (stored.sd_defn != nullptr) {
    if (const int32_t rc = copy_structured_definition(stored.sd_defn, copy.sd_defn); rc != 0) {
      return rc;
    }
  }
  if (sr_i_is_variable_length(stored.type)) {
    qv_pmsg_value_t slot;
    std::memcpy(&slot, &stored.default_value, sizeof slot);
    const void *p_defaults = p_table->p_columns + p_table->total_columns;
    cu_iconv_t *p_conversion =
        p_table->p_tree ? p_table->p_tree->p_from_table_string_conversion_handle : nullptr;
    if (const int32_t rc = qv_pmsg_build_conv_packed_client_value_1(
            p_conversion, 0, stored.type, &copy.default_value, &slot, p_defaults, 0xFFFFFFFFu);
        rc != 0) {
      return sr_i_raise_library_call("qv_pmsg_build_conv_packed_client_value", rc);
    }
  }
  return 0;
}

}  // namespace

void sr_i_free_table_metadata(sr_table_metadata_t *p_metadata) {
  if (p_metadata->column_definitions != nullptr) {
    for (uint32_t column = 0; column < p_metadata->number_of_columns; ++column) {
      free_column(p_metadata->column_definitions[column]);
    }
    std::free(p_metadata->column_definitions);
  }
  std::free(p_metadata->name);
  std::free(p_metadata);
}

int32_t sr_i_get_table_metadata(const sr_i_table_t *p_table, int32_t all_metadata,
                                sr_table_metadata_t **p_p_metadata) {
  auto *p_metadata =
      static_cast<sr_table_metadata_t *>(std::calloc(1, sizeof(sr_table_metadata_t)));
  if (p_metadata == nullptr) {
    return sr_i_raise_no_memory();
  }
  p_metadata->number_of_columns = p_table->total_columns;
  p_metadata->number_of_rows = p_table->uncommitted_updates_visible ? p_table->total_applied_rows
                                                                    : p_table->total_committed_rows;
  p_metadata->table_change_counter = p_table->change_counter;
  const char *p_name = p_table->p_persistent_table_registry_path
                           ? p_table->p_persistent_table_registry_path
                           : (p_table->p_name ? p_table->p_name : "");
  if ((p_metadata->name = strdup(p_name)) == nullptr) {
    sr_i_free_table_metadata(p_metadata);
    return sr_i_raise_no_memory();
  }
  if (all_metadata != 0) {
    p_metadata->number_of_columns = 0;
    p_metadata->column_definitions =
        static_cast<sr_column_t *>(std::calloc(p_table->total_columns, sizeof(sr_column_t)));
    if (p_metadata->column_definitions == nullptr) {
      sr_i_free_table_metadata(p_metadata);
      return sr_i_raise_no_memory();
    }
    for (uint32_t column = 0; column < p_table->total_columns; ++column) {
      const sr_column_t &stored = p_table->p_columns[column];
      if (all_metadata != -1 && (stored.qualifier & SR_INVISIBLE) != 0) {
        continue;
      }
      // Counted before it is filled, so that a failure frees what it holds.
      sr_column_t &copy = p_metadata->column_definitions[p_metadata->number_of_columns++];
      if (const int32_t rc = copy_column(p_table, stored, copy); rc != 0) {
        sr_i_free_table_metadata(p_metadata);
        return rc;
      }
    }
  }
  *p_p_metadata = p_metadata;
  return 0;
}
