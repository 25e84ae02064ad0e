// sr_i_packed_columns.cpp - column definitions into and out of a packed
// buffer: the client value that the codec encodes as a table's column
// metadata, built from the table's metadata record, and the sr_column_t
// array rebuilt from the decoded value when the table is unpacked.
//
// Defaults are decoded from the metadata record without string conversion
// and travel in the stored form; the unpacked table encodes them again
// without conversion, so they arrive byte for byte.

#include "packed/sr_i_packed_columns.h"

#include <cstring>

#include "frame/sr_i_errors.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_columns.h"

namespace {

enum column_element : uint32_t {
  NAME = 0,
  TYPE = 1,
  QUALIFIER = 2,
  PROPERTIES = 3,
  FIELD_TYPES = 4,
  FIELD_NAMES = 5,
  DEFAULT_VALUE = 6,
  TOTAL_ELEMENTS = 7,
};

constexpr qv_data_type_t Element_Types[DEFAULT_VALUE] = {
    QV_CHAR_PTR, QV_UINT32, QV_UINT32, QV_INT32, QV_UINT32_ARRAY, QV_CHAR_PTR_ARRAY};

bool is_structured(qv_data_type_t type) {
  return type == QV_SD_PTR || type == QV_SD_PTR_ARRAY;
}

// The bits a qualifier may have: a base in the low four, and the modifiers.
constexpr uint32_t Qualifier_Bits =
    15u | SR_PROTECTED | SR_INVISIBLE | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED;

bool is_key(uint32_t qualifier) {
  const uint32_t base = qualifier & 15u;
  return base == SR_PRIMARY_KEY || base == SR_PRIMARY_KEY_NOCHECK;
}

size_t array_bytes(uint32_t total_elements) {
  return sizeof(qv_array_t) + total_elements * sizeof(qv_value_t);
}

}  // namespace

template <typename T>
T *sr_i_packed_column_metadata::new_block(size_t bytes) {
  blocks_.push_back(std::make_unique<unsigned char[]>(bytes));
  return reinterpret_cast<T *>(blocks_.back().get());
}

int32_t sr_i_packed_column_metadata::build(const sr_i_table_t *p_table) {
  auto *p_columns = new_block<qv_array_t>(array_bytes(p_table->total_columns));
  p_columns->element_count = p_table->total_columns;
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    const sr_column_t &definition = p_table->p_columns[column];
    std::vector<sr_sd_field_def_t> fields;
    if (definition.sd_defn != nullptr) {
      fields = sr_i_structured_definition_fields(definition.sd_defn);
    }
    const auto total_fields = static_cast<uint32_t>(fields.size());
    auto *p_field_types = new_block<qv_array_t>(array_bytes(total_fields));
    auto *p_field_names = new_block<qv_array_t>(array_bytes(total_fields));
    p_field_types->element_count = total_fields;
    p_field_names->element_count = total_fields;
    for (uint32_t field = 0; field < total_fields; ++field) {
      p_field_types->elements[field].val_uint32 = static_cast<uint32_t>(fields[field].type);
      p_field_names->elements[field].ptr_char = fields[field].name;
    }
    qv_value_t default_value = definition.default_value;
    if (sr_i_is_variable_length(definition.type)) {
      qv_pmsg_value_t slot;
      std::memcpy(&slot, &definition.default_value, sizeof slot);
      if (const int32_t rc = qv_pmsg_build_conv_packed_client_value_1(
              nullptr, 0, definition.type, &default_value, &slot, sr_i_default_data(p_table),
              QV_PMSG_LENGTH_UNBOUNDED);
          rc != 0) {
        return sr_i_raise_library_call("qv_pmsg_build_conv_packed_client_value", rc);
      }
      decoded_defaults_.emplace_back(default_value.ptr_char);
    }
    auto *p_structured = new_block<qv_structured_data_t>(
        sizeof(qv_structured_data_t) + TOTAL_ELEMENTS * sizeof(qv_structured_data_element_t));
    p_structured->element_count = TOTAL_ELEMENTS;
    qv_structured_data_element_t *p_elements = p_structured->elements;
    for (uint32_t element = 0; element < DEFAULT_VALUE; ++element) {
      p_elements[element].data_type = Element_Types[element];
    }
    p_elements[NAME].value.ptr_char = definition.name;
    p_elements[TYPE].value.val_uint32 = static_cast<uint32_t>(definition.type);
    p_elements[QUALIFIER].value.val_uint32 = static_cast<uint32_t>(definition.qualifier);
    p_elements[PROPERTIES].value.val_int32 = definition.properties;
    p_elements[FIELD_TYPES].value.ptr_array = p_field_types;
    p_elements[FIELD_NAMES].value.ptr_array = p_field_names;
    p_elements[DEFAULT_VALUE].data_type = definition.type;
    p_elements[DEFAULT_VALUE].value = default_value;
    p_columns->elements[column].ptr_sd = p_structured;
  }
  value_.ptr_array = p_columns;
  return 0;
}

namespace {

// Whether one decoded column value has the shape the packer writes.
bool column_holds_together(const qv_structured_data_t *p_column) {
  if (p_column->element_count != TOTAL_ELEMENTS) {
    return false;
  }
  const qv_structured_data_element_t *p_elements = p_column->elements;
  for (uint32_t element = 0; element < DEFAULT_VALUE; ++element) {
    if (p_elements[element].data_type != Element_Types[element]) {
      return false;
    }
  }
  if ((p_elements[QUALIFIER].value.val_uint32 & ~Qualifier_Bits) != 0) {
    return false;
  }
  const uint32_t type = p_elements[TYPE].value.val_uint32;
  const uint32_t total_fields = p_elements[FIELD_TYPES].value.ptr_array->element_count;
  const qv_array_t *p_field_types = p_elements[FIELD_TYPES].value.ptr_array;
  for (uint32_t field = 0; field < total_fields; ++field) {
    const uint32_t field_type = p_field_types->elements[field].val_uint32;
    if (field_type < QV_INT32 || field_type > QV_SD_PTR_ARRAY) {
      return false;
    }
  }
  return type == static_cast<uint32_t>(p_elements[DEFAULT_VALUE].data_type) &&
         total_fields == p_elements[FIELD_NAMES].value.ptr_array->element_count &&
         (total_fields == 0 || is_structured(static_cast<qv_data_type_t>(type)));
}

}  // namespace

int32_t sr_i_unpack_column_definitions(qv_array_t *p_column_metadata,
                                       sr_i_unpacked_columns &columns) {
  columns.p_metadata_.reset(p_column_metadata);
  const uint32_t total_columns = p_column_metadata->element_count;
  if (total_columns == 0) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  columns.columns_.assign(total_columns, sr_column_t{});
  for (uint32_t column = 0; column < total_columns; ++column) {
    const qv_structured_data_t *p_column = p_column_metadata->elements[column].ptr_sd;
    if (!column_holds_together(p_column)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    const qv_structured_data_element_t *p_elements = p_column->elements;
    sr_column_t &definition = columns.columns_[column];
    definition.name = p_elements[NAME].value.ptr_char;
    definition.type = p_elements[DEFAULT_VALUE].data_type;
    definition.qualifier = static_cast<sr_qualifier_t>(p_elements[QUALIFIER].value.val_uint32);
    definition.properties = p_elements[PROPERTIES].value.val_int32;
    definition.default_value = p_elements[DEFAULT_VALUE].value;
    // The rows carry the key in their first slot: a key anywhere else
    // would make the new table read every row in the wrong columns.
    if (is_key(definition.qualifier) != (column == 0)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    if (!is_structured(definition.type)) {
      continue;
    }
    const qv_array_t *p_types = p_elements[FIELD_TYPES].value.ptr_array;
    const qv_array_t *p_names = p_elements[FIELD_NAMES].value.ptr_array;
    const uint32_t total_fields = p_types->element_count;
    columns.definitions_.push_back(std::make_unique<unsigned char[]>(
        sizeof(sr_sd_def_t) + total_fields * sizeof(sr_sd_field_def_t)));
    auto *p_definition = reinterpret_cast<sr_sd_def_t *>(columns.definitions_.back().get());
    p_definition->number_of_fields = total_fields;
    for (uint32_t field = 0; field < total_fields; ++field) {
      p_definition->field_def[field].type =
          static_cast<qv_data_type_t>(p_types->elements[field].val_uint32);
      p_definition->field_def[field].name = p_names->elements[field].ptr_char;
    }
    definition.sd_defn = p_definition;
  }
  return 0;
}
