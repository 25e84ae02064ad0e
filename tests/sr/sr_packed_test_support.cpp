// sr_packed_test_support.cpp - the reference writer of packed buffers.

#include "sr_packed_test_support.h"

#include <cstring>

namespace sr_test {
namespace {

constexpr uint32_t Record_Header_Bytes = 20;

uint32_t swapped(uint32_t word, bool other_byte_order) {
  return other_byte_order ? __builtin_bswap32(word) : word;
}

void put_bytes(std::vector<unsigned char> &bytes, const void *p_bytes, size_t length) {
  if (length == 0) {
    return;  // an empty part may come from an empty vector, whose data() is null
  }
  const size_t end = bytes.size();
  bytes.resize(end + length);
  std::memcpy(bytes.data() + end, p_bytes, length);
}

void put_word(std::vector<unsigned char> &bytes, uint32_t word, bool other_byte_order) {
  word = swapped(word, other_byte_order);
  put_bytes(bytes, &word, sizeof word);
}

void put_slot(std::vector<unsigned char> &bytes, const qv_pmsg_value_t &slot) {
  put_bytes(bytes, &slot, sizeof slot);
}

// A row as a pool record: header (length, link, type 2 for a row, disk
// offset), the row's header word, the slots, the variable part.
std::string row_record(const packed_table_description &table, const std::vector<qv_value_t> &row,
                       bool other_byte_order) {
  encoded_row encoded;
  for (size_t column = 0; column < table.columns.size(); ++column) {
    EXPECT_EQ(append_value(encoded, table.columns[column].type, row[column]), 0);
  }
  if (other_byte_order) {
    for (size_t column = 0; column < table.columns.size(); ++column) {
      to_other_byte_order(table.columns[column].type,
                          reinterpret_cast<unsigned char *>(&encoded.slots[column]),
                          encoded.area.data());
    }
  }
  std::vector<unsigned char> bytes;
  const auto length =
      static_cast<uint32_t>(Record_Header_Bytes + 4 + 8 * table.columns.size() + encoded.used);
  put_word(bytes, length, other_byte_order);
  put_word(bytes, 0, other_byte_order);
  put_word(bytes, 0, other_byte_order);
  put_word(bytes, 2, other_byte_order);
  put_word(bytes, 0, other_byte_order);
  put_word(bytes, 0, other_byte_order);
  for (const qv_pmsg_value_t &slot : encoded.slots) {
    put_slot(bytes, slot);
  }
  put_bytes(bytes, encoded.area.data(), encoded.used);
  return {bytes.begin(), bytes.end()};
}

qv_value_t column_value(value_arena &arena, const sr_column_t &column) {
  std::vector<qv_value_t> field_types, field_names;
  if (column.sd_defn != nullptr) {
    for (uint32_t field = 0; field < column.sd_defn->number_of_fields; ++field) {
      field_types.push_back(number32(column.sd_defn->field_def[field].type));
      field_names.push_back(arena.string(column.sd_defn->field_def[field].name));
    }
  }
  return arena.structured({{QV_CHAR_PTR, arena.string(column.name)},
                           {QV_UINT32, number32(column.type)},
                           {QV_UINT32, number32(column.qualifier)},
                           {QV_INT32, number32(static_cast<uint32_t>(column.properties))},
                           {QV_UINT32_ARRAY, arena.array(field_types)},
                           {QV_CHAR_PTR_ARRAY, arena.array(field_names)},
                           {column.type, column.default_value}});
}

}  // namespace

std::vector<unsigned char> write_packed_buffer(const std::vector<packed_table_description> &tables,
                                               bool other_byte_order) {
  value_arena arena;
  encoded_row indirect;
  std::vector<int32_t> types;
  for (const packed_table_description &table : tables) {
    std::vector<qv_value_t> columns, rows;
    for (const sr_column_t &column : table.columns) {
      columns.push_back(column_value(arena, column));
    }
    std::vector<std::string> records;
    for (const std::vector<qv_value_t> &row : table.rows) {
      records.push_back(row_record(table, row, other_byte_order));
      rows.push_back(arena.binary(records.back()));
    }
    const qv_value_t fixed =
        arena.structured({{QV_CHAR_PTR, arena.string(table.name)},
                          {QV_UINT32, number32(static_cast<uint32_t>(table.rows.size()))},
                          {QV_UINT32, number32(static_cast<uint32_t>(table.columns.size()))},
                          {QV_UINT64, number64(table.change_counter)},
                          {QV_INT32, number32(0)}});
    const std::pair<int32_t, qv_value_t> values[] = {{QV_CHAR_PTR, arena.string(table.name)},
                                                     {QV_SD_PTR, fixed},
                                                     {QV_SD_PTR_ARRAY, arena.array(columns)},
                                                     {QV_BINARY_PTR_ARRAY, arena.array(rows)}};
    for (const auto &[type, value] : values) {
      EXPECT_EQ(append_value(indirect, type, value), 0);
      types.push_back(type);
    }
  }
  if (other_byte_order) {
    for (size_t slot = 0; slot < types.size(); ++slot) {
      to_other_byte_order(types[slot], reinterpret_cast<unsigned char *>(&indirect.slots[slot]),
                          indirect.area.data());
    }
  }
  const auto total_tables = static_cast<uint32_t>(tables.size());
  const uint32_t length = (4 * total_tables + 5) * 8 + indirect.used;
  const uint8_t local = QV_PMSG_ARCH_LOCAL;
  const uint8_t other =
      local == QV_PMSG_ARCH_LITTLE_ENDIAN ? QV_PMSG_ARCH_BIG_ENDIAN : QV_PMSG_ARCH_LITTLE_ENDIAN;
  std::vector<unsigned char> buffer;
  put_word(buffer, length, other_byte_order);
  const uint8_t header_bytes[] = {0, other_byte_order ? other : local, 2, 0};
  put_bytes(buffer, header_bytes, sizeof header_bytes);
  for (const uint32_t number : {0u, 1u, length, total_tables}) {
    put_word(buffer, number, other_byte_order);
    put_word(buffer, 0, false);
  }
  for (const qv_pmsg_value_t &slot : indirect.slots) {
    put_slot(buffer, slot);
  }
  put_bytes(buffer, indirect.area.data(), indirect.used);
  return buffer;
}

uint32_t string_hash_64(const void *p_key) {
  uint32_t hash = 0;
  for (const char *p_char = static_cast<const char *>(p_key); *p_char != '\0'; ++p_char) {
    hash = hash * 31 + static_cast<unsigned char>(*p_char);
  }
  return hash % 64;
}

int32_t compare_strings(const void *p_stored, const void *p_key) {
  return std::strcmp(static_cast<const char *>(p_stored), static_cast<const char *>(p_key));
}

}  // namespace sr_test
