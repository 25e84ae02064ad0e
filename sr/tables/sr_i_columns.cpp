// sr_i_columns.cpp - column definitions: the checks a table's columns must
// pass, the packing of variable-length default values through the value
// codec, and the metadata record that keeps the definitions in the table's
// record pool.
//
// The metadata record is one block: a 16-byte header (byte order, 0, column
// count, variable-length column count), the column array, the packed default
// values, then per column its name, followed for a structured-data column by
// its definition in packed form (field count, then per field its type and
// NUL-terminated name). The
// columns point into the record, so the table needs no other allocation
// for its schema.

#include <cctype>
#include <cstring>
#include <span>
#include <string_view>
#include <vector>

#include "frame/sr_i_errors.h"
#include "qv_pmsg.h"
#include "tables/sr_i_columns.h"

namespace {

constexpr size_t Longest_Column_Name = 255;
constexpr uint32_t Metadata_Header_Bytes = 16;
constexpr size_t First_Packing_Buffer = 4096;

bool is_structured(qv_data_type_t type) {
  return type == QV_SD_PTR || type == QV_SD_PTR_ARRAY;
}

// Whether one column may be part of a new table.
bool valid_column(const sr_column_t &column) {
  if (!sr_i_valid_column_name(column.name)) {
    return false;
  }
  if (column.type < QV_INT32 || column.type > QV_SD_PTR_ARRAY) {
    return false;
  }
  const uint32_t base = column.qualifier & 15u;
  if (base != SR_STANDARD && base != SR_PRIMARY_KEY && base != SR_PRIMARY_KEY_NOCHECK) {
    return false;
  }
  if (is_structured(column.type)) {
    if (column.sd_defn == nullptr) {
      return false;
    }
    for (uint32_t field = 0; field < column.sd_defn->number_of_fields; ++field) {
      if (column.sd_defn->field_def[field].name == nullptr) {
        return false;
      }
    }
  }
  const bool key = base == SR_PRIMARY_KEY || base == SR_PRIMARY_KEY_NOCHECK;
  return !key || (column.type <= QV_RSRC_HANDLE_PTR && column.type != QV_BINARY_PTR);
}

uint32_t structured_definition_bytes(const sr_sd_def_t *p_definition) {
  uint32_t bytes = 4;
  for (uint32_t field = 0; field < p_definition->number_of_fields; ++field) {
    bytes += 4 + static_cast<uint32_t>(std::strlen(p_definition->field_def[field].name)) + 1;
  }
  return bytes;
}

void put_word(unsigned char *&p_cursor, uint32_t word) {
  std::memcpy(p_cursor, &word, sizeof word);
  p_cursor += sizeof word;
}

char *put_string(unsigned char *&p_cursor, const char *p_text) {
  const size_t size = std::strlen(p_text) + 1;
  char *p_copy = reinterpret_cast<char *>(p_cursor);
  std::memcpy(p_copy, p_text, size);
  p_cursor += size;
  return p_copy;
}

}  // namespace

std::vector<sr_sd_field_def_t> sr_i_structured_definition_fields(const sr_sd_def_t *p_packed) {
  const auto *p_cursor = reinterpret_cast<const unsigned char *>(p_packed);
  uint32_t total_fields;
  std::memcpy(&total_fields, p_cursor, sizeof total_fields);
  p_cursor += sizeof total_fields;
  std::vector<sr_sd_field_def_t> fields(total_fields);
  for (sr_sd_field_def_t &field : fields) {
    uint32_t type;
    std::memcpy(&type, p_cursor, sizeof type);
    p_cursor += sizeof type;
    field.type = static_cast<qv_data_type_t>(type);
    field.name = reinterpret_cast<char *>(const_cast<unsigned char *>(p_cursor));
    p_cursor += std::strlen(field.name) + 1;
  }
  return fields;
}

bool sr_i_valid_column_name(const char *p_name) {
  if (p_name == nullptr) {
    return false;
  }
  const std::string_view name = p_name;
  if (name.empty() || name.size() > Longest_Column_Name ||
      !std::isalpha(static_cast<unsigned char>(name[0]))) {
    return false;
  }
  for (const char character : name.substr(1)) {
    const auto byte = static_cast<unsigned char>(character);
    if (std::isspace(byte) || !(std::isalnum(byte) || byte == '_')) {
      return false;
    }
  }
  return true;
}

void sr_i_swap_columns(sr_column_t *p_first, sr_column_t *p_second) {
  const sr_column_t first = *p_first;
  *p_first = *p_second;
  *p_second = first;
}

qv_value_t sr_i_value_or_empty(qv_data_type_t type, qv_value_t value) {
  if (!sr_i_is_variable_length(type) || value.ptr_char != nullptr) {
    return value;
  }
  switch (type) {
    case QV_CHAR_PTR:
      value.ptr_char = cu_ptr_empty_char_1;
      break;
    case QV_BINARY_PTR:
      value.ptr_binary = cu_ptr_empty_binary_1;
      break;
    case QV_RSRC_HANDLE_PTR:
      value.ptr_rsrc_handle = cu_ptr_invld_rsrc_hndl_1;
      break;
    case QV_SD_PTR:
      value.ptr_sd = cu_ptr_empty_sd_1;
      break;
    default:
      value.ptr_array = cu_ptr_empty_array_1;
      break;
  }
  return value;
}

int32_t sr_i_validate_columns(const sr_column_t *p_columns, uint32_t total_columns,
                              uint32_t &key_position) {
  if (total_columns == 0) {
    return sr_i_raise(SR_E_NO_COLUMNS);
  }
  // Every column is checked before the keys are counted: a bad definition
  // is reported before a key problem.
  uint32_t total_keys = 0;
  for (uint32_t column = 0; column < total_columns; ++column) {
    if (!valid_column(p_columns[column])) {
      return sr_i_raise(SR_E_INVALID_COLUMN);
    }
    const uint32_t base = p_columns[column].qualifier & 15u;
    if (base == SR_PRIMARY_KEY || base == SR_PRIMARY_KEY_NOCHECK) {
      ++total_keys;
      key_position = column;
    }
  }
  if (total_keys == 0) {
    return sr_i_raise(SR_E_KEY_EXPECTED);
  }
  if (total_keys > 1) {
    return sr_i_raise(SR_E_DUPLICATE_KEY);
  }
  for (uint32_t first = 0; first < total_columns; ++first) {
    for (uint32_t second = first + 1; second < total_columns; ++second) {
      if (std::strcmp(p_columns[first].name, p_columns[second].name) == 0) {
        return sr_i_raise(SR_E_DUPLICATE_COLUMN);
      }
    }
  }
  return 0;
}

int32_t sr_i_pack_variable_length_default_values(cu_iconv_t *p_conversion, sr_column_t *p_columns,
                                                 uint32_t total_columns,
                                                 std::vector<unsigned char> &packed,
                                                 uint32_t &total_variable_length_columns) {
  packed.assign(First_Packing_Buffer, 0);
  uint32_t used = 0;
  total_variable_length_columns = 0;
  for (uint32_t column = 0; column < total_columns; ++column) {
    sr_column_t &definition = p_columns[column];
    if (!sr_i_is_variable_length(definition.type)) {
      continue;
    }
    ++total_variable_length_columns;
    const qv_value_t value = sr_i_value_or_empty(definition.type, definition.default_value);
    qv_pmsg_value_t slot{};
    int32_t rc;
    while ((rc = qv_pmsg_build_conv_protocol_value_1(
                p_conversion, 0, definition.type, &value, &slot, packed.data(),
                static_cast<uint32_t>(packed.size()), &used)) == QV_PMSG_RESULT_NO_ROOM) {
      packed.resize(packed.size() * 2);
    }
    if (rc != 0) {
      return sr_i_raise_library_call("qv_pmsg_build_conv_protocol_value", rc);
    }
    static_assert(sizeof slot == sizeof definition.default_value);
    std::memcpy(&definition.default_value, &slot, sizeof slot);
  }
  packed.resize(used);
  return 0;
}

namespace {

// The in-memory form of a structured-data definition, as the metadata
// record keeps it: a field count, then per field its type and its name with
// its NUL.
std::vector<unsigned char> pack_structured_definition(const sr_sd_def_t *p_definition) {
  std::vector<unsigned char> packed(structured_definition_bytes(p_definition));
  unsigned char *p_cursor = packed.data();
  put_word(p_cursor, p_definition->number_of_fields);
  for (uint32_t field = 0; field < p_definition->number_of_fields; ++field) {
    put_word(p_cursor, static_cast<uint32_t>(p_definition->field_def[field].type));
    put_string(p_cursor, p_definition->field_def[field].name);
  }
  return packed;
}

// The length of a definition in that form, read from the form itself.
uint32_t packed_structured_definition_bytes(const void *p_packed) {
  const auto *p_bytes = static_cast<const unsigned char *>(p_packed);
  uint32_t total_fields;
  std::memcpy(&total_fields, p_bytes, sizeof total_fields);
  uint32_t bytes = 4;
  for (uint32_t field = 0; field < total_fields; ++field) {
    bytes +=
        4 +
        static_cast<uint32_t>(std::strlen(reinterpret_cast<const char *>(p_bytes + bytes + 4))) + 1;
  }
  return bytes;
}

// Reserves the table's metadata record in its empty pool and writes it:
// header, the column array, the packed defaults, then each column's name
// followed by its structured-data definition in packed form (the order the
// table file keeps them in). The table's p_columns and each column's name
// and sd_defn then point into the record.
int32_t write_metadata_record(
    sr_i_table_t *p_table, const sr_column_t *p_columns, uint32_t total_columns,
    uint32_t total_variable_length_columns, std::span<const unsigned char> packed_defaults,
    std::span<const std::span<const unsigned char>> structured_definitions) {
  uint32_t length = Metadata_Header_Bytes + static_cast<uint32_t>(packed_defaults.size()) +
                    total_columns * static_cast<uint32_t>(sizeof(sr_column_t));
  for (uint32_t column = 0; column < total_columns; ++column) {
    length += static_cast<uint32_t>(std::strlen(p_columns[column].name)) + 1 +
              static_cast<uint32_t>(structured_definitions[column].size());
  }
  void *p_data = nullptr;
  if (const int32_t rc =
          sr_i_reserve_record(&p_table->record_buffer_pool, length, SR_I_RECORD_METADATA, &p_data);
      rc != 0) {
    return rc;
  }
  // The column array is read in place, so it must be aligned; the metadata
  // record is the first record of a fresh pool, which guarantees it.
  if (reinterpret_cast<uintptr_t>(p_data) % alignof(sr_column_t) != 0) {
    return sr_i_raise_internal();
  }
  auto *p_cursor = static_cast<unsigned char *>(p_data);
  const uint16_t byte_order_probe = 0xFEFF;
  unsigned char first_byte;
  std::memcpy(&first_byte, &byte_order_probe, 1);
  put_word(p_cursor, first_byte == 0xFE ? 1 : 0);
  put_word(p_cursor, 0);
  put_word(p_cursor, total_columns);
  put_word(p_cursor, total_variable_length_columns);

  auto *p_stored_columns = reinterpret_cast<sr_column_t *>(p_cursor);
  std::memcpy(p_stored_columns, p_columns, total_columns * sizeof(sr_column_t));
  p_cursor += total_columns * sizeof(sr_column_t);
  if (!packed_defaults.empty()) {
    std::memcpy(p_cursor, packed_defaults.data(), packed_defaults.size());
    p_cursor += packed_defaults.size();
  }
  for (uint32_t column = 0; column < total_columns; ++column) {
    sr_column_t &stored = p_stored_columns[column];
    stored.name = put_string(p_cursor, p_columns[column].name);
    const std::span<const unsigned char> definition = structured_definitions[column];
    if (definition.empty()) {
      stored.sd_defn = nullptr;
      continue;
    }
    stored.sd_defn = reinterpret_cast<sr_sd_def_t *>(p_cursor);
    std::memcpy(p_cursor, definition.data(), definition.size());
    p_cursor += definition.size();
  }
  p_table->p_metadata_record_data = p_data;
  p_table->p_columns = p_stored_columns;
  p_table->total_columns = total_columns;
  p_table->total_variable_length_columns = total_variable_length_columns;
  return 0;
}

}  // namespace

int32_t sr_i_build_metadata_record(sr_i_table_t *p_table, const sr_column_t *p_columns,
                                   uint32_t total_columns, uint32_t total_variable_length_columns,
                                   const std::vector<unsigned char> &packed_defaults) {
  std::vector<std::vector<unsigned char>> packed_definitions(total_columns);
  std::vector<std::span<const unsigned char>> definitions(total_columns);
  for (uint32_t column = 0; column < total_columns; ++column) {
    if (is_structured(p_columns[column].type)) {
      packed_definitions[column] = pack_structured_definition(p_columns[column].sd_defn);
      definitions[column] = packed_definitions[column];
    }
  }
  return write_metadata_record(p_table, p_columns, total_columns, total_variable_length_columns,
                               packed_defaults, definitions);
}

int32_t sr_i_build_selected_metadata_record(sr_i_table_t *p_table, const sr_i_table_t *p_source,
                                            std::span<const uint32_t> source_columns) {
  const auto total_columns = static_cast<uint32_t>(source_columns.size());
  std::vector<sr_column_t> columns(total_columns);
  std::vector<unsigned char> packed_defaults;
  std::vector<std::span<const unsigned char>> definitions(total_columns);
  uint32_t total_variable_length_columns = 0;
  // The source's packed defaults follow its column array.
  const auto *p_source_defaults =
      reinterpret_cast<const unsigned char *>(p_source->p_columns + p_source->total_columns);
  for (uint32_t column = 0; column < total_columns; ++column) {
    sr_column_t &definition = columns[column] = p_source->p_columns[source_columns[column]];
    if (definition.sd_defn != nullptr) {
      definitions[column] = {reinterpret_cast<const unsigned char *>(definition.sd_defn),
                             packed_structured_definition_bytes(definition.sd_defn)};
    }
    if (!sr_i_is_variable_length(definition.type)) {
      continue;
    }
    // A default body refers to nothing outside itself: it moves by its
    // anchor's offset alone.
    ++total_variable_length_columns;
    qv_pmsg_value_anchor_t anchor;
    std::memcpy(&anchor, &definition.default_value, sizeof anchor);
    const unsigned char *p_body = p_source_defaults + anchor.offset;
    anchor.offset = static_cast<uint32_t>(packed_defaults.size());
    packed_defaults.insert(packed_defaults.end(), p_body, p_body + anchor.length);
    std::memcpy(&definition.default_value, &anchor, sizeof anchor);
  }
  return write_metadata_record(p_table, columns.data(), total_columns,
                               total_variable_length_columns, packed_defaults, definitions);
}
