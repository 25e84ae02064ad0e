// sr_i_metadata_record_file.cpp - the metadata record between memory and
// file. In memory the columns are sr_column_t with pointers into the
// record's variable area (default data, then each column's name followed by
// its structured-data definition); on disk each column is a 28-byte
// descriptor holding offsets into the same variable area, which is copied
// byte for byte. A record read from a file is checked completely before any
// of its offsets is followed.

#include <algorithm>
#include <cstring>
#include <new>

#include "frame/sr_i_errors.h"
#include "qv_cu.h"
#include "storage/sr_i_storage.h"
#include "tables/sr_i_columns.h"

namespace {

constexpr uint32_t Table_Information_Bytes = 16;  // byte order, 0, columns, variable columns
constexpr uint32_t Disk_Column_Bytes = 28;
constexpr uint32_t Disk_Header_Bytes = Sr_File_Record_Header_Length + Table_Information_Bytes;

uint32_t word_at(const unsigned char *p_bytes) {
  uint32_t word;
  std::memcpy(&word, p_bytes, sizeof word);
  return word;
}

void put_word(unsigned char *p_bytes, uint32_t word) {
  std::memcpy(p_bytes, &word, sizeof word);
}

bool is_structured(uint32_t type) {
  return type == QV_SD_PTR || type == QV_SD_PTR_ARRAY;
}

// The length of the NUL-terminated string at `offset` of `area`, or -1 when
// it does not end inside it.
int64_t string_length_at(std::span<const unsigned char> area, uint64_t offset) {
  if (offset >= area.size()) {
    return -1;
  }
  const void *p_end = std::memchr(area.data() + offset, 0, area.size() - offset);
  return p_end == nullptr ? -1 : static_cast<const unsigned char *>(p_end) - (area.data() + offset);
}

// Whether a packed structured-data definition lies whole inside `area`.
bool valid_structured_definition(std::span<const unsigned char> area, uint64_t offset) {
  if (offset + 4 > area.size()) {
    return false;
  }
  const uint32_t fields = word_at(area.data() + offset);
  offset += 4;
  for (uint32_t field = 0; field < fields; ++field) {
    if (offset + 4 > area.size()) {
      return false;
    }
    const uint32_t type = word_at(area.data() + offset);
    if (type >= QV_DATA_TYPE_LIMIT || (cu_dtc_table_1[type] & CU_DTC_VALID) == 0) {
      return false;
    }
    const int64_t name_length = string_length_at(area, offset + 4);
    if (name_length < 0) {
      return false;
    }
    offset += 4 + static_cast<uint64_t>(name_length) + 1;
  }
  return true;
}

// Checks one disk column descriptor against the variable area.
bool valid_disk_column(const unsigned char *p_descriptor, std::span<const unsigned char> area,
                       uint32_t default_area_end) {
  const uint32_t type = word_at(p_descriptor + 4);
  if (type >= QV_DATA_TYPE_LIMIT || (cu_dtc_table_1[type] & CU_DTC_VALID) == 0) {
    return false;
  }
  // Every qualifier a column can have: a base value and the modifier bits.
  constexpr uint32_t Qualifier_Bits =
      15 | SR_PROTECTED | SR_INVISIBLE | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED;
  if ((word_at(p_descriptor + 8) & ~Qualifier_Bits) != 0) {
    return false;
  }
  if (string_length_at(area, word_at(p_descriptor)) <= 0) {
    return false;
  }
  const uint32_t definition_offset = word_at(p_descriptor + 16);
  if (is_structured(type) != (definition_offset != 0) ||
      (definition_offset != 0 && !valid_structured_definition(area, definition_offset))) {
    return false;
  }
  if (sr_i_is_variable_length(static_cast<qv_data_type_t>(type))) {
    const uint64_t offset = word_at(p_descriptor + 20);
    const uint64_t length = word_at(p_descriptor + 24);
    if (offset + length > default_area_end) {
      return false;
    }
  }
  return true;
}

// Whether no two columns share a name (a table is never made with two).
bool distinct_names(std::span<const unsigned char> disk, std::span<const unsigned char> area,
                    uint32_t columns) {
  auto name_of = [&](uint32_t column) {
    const uint32_t offset = word_at(disk.data() + Disk_Header_Bytes + Disk_Column_Bytes * column);
    return reinterpret_cast<const char *>(area.data() + offset);
  };
  for (uint32_t first = 0; first < columns; ++first) {
    for (uint32_t second = first + 1; second < columns; ++second) {
      if (std::strcmp(name_of(first), name_of(second)) == 0) {
        return false;
      }
    }
  }
  return true;
}

}  // namespace

int32_t sr_i_convert_metadata_memory_record_to_disk_record(const sr_i_table_t *p_table,
                                                           std::vector<unsigned char> &disk) {
  const uint32_t columns = p_table->total_columns;
  const auto *p_memory = static_cast<const unsigned char *>(p_table->p_metadata_record_data);
  const uint32_t memory_length =
      sr_i_rb_record_header(p_table->p_metadata_record_data)->record_length -
      Sr_Record_Header_Length;
  const auto *p_memory_area = reinterpret_cast<const unsigned char *>(p_table->p_columns + columns);
  const uint32_t area_length = memory_length - static_cast<uint32_t>(p_memory_area - p_memory);
  const uint32_t disk_length = Disk_Header_Bytes + Disk_Column_Bytes * columns + area_length;
  try {
    disk.assign(disk_length, 0);
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  put_word(&disk[0], disk_length);
  put_word(&disk[8], Sr_Metadata_Record);
  std::memcpy(&disk[Sr_File_Record_Header_Length], p_memory, Table_Information_Bytes);
  for (uint32_t column = 0; column < columns; ++column) {
    const sr_column_t &definition = p_table->p_columns[column];
    unsigned char *p_descriptor = &disk[Disk_Header_Bytes + Disk_Column_Bytes * column];
    put_word(p_descriptor,
             static_cast<uint32_t>(reinterpret_cast<const unsigned char *>(definition.name) -
                                   p_memory_area));
    put_word(p_descriptor + 4, static_cast<uint32_t>(definition.type));
    put_word(p_descriptor + 8, static_cast<uint32_t>(definition.qualifier));
    put_word(p_descriptor + 12, static_cast<uint32_t>(definition.properties));
    if (definition.sd_defn != nullptr) {
      put_word(p_descriptor + 16,
               static_cast<uint32_t>(reinterpret_cast<const unsigned char *>(definition.sd_defn) -
                                     p_memory_area));
    }
    std::memcpy(p_descriptor + 20, &definition.default_value, 8);
  }
  std::memcpy(&disk[Disk_Header_Bytes + Disk_Column_Bytes * columns], p_memory_area, area_length);
  return 0;
}

int32_t sr_i_convert_metadata_disk_record_to_memory_record(sr_i_table_t *p_table,
                                                           std::span<const unsigned char> disk) {
  if (disk.size() < Disk_Header_Bytes || word_at(disk.data()) != disk.size() ||
      word_at(disk.data() + 8) != Sr_Metadata_Record) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  const unsigned char *p_information = disk.data() + Sr_File_Record_Header_Length;
  const uint32_t columns = word_at(p_information + 8);
  const uint32_t variable_columns = word_at(p_information + 12);
  if (columns == 0 || uint64_t{Disk_Column_Bytes} * columns > disk.size() - Disk_Header_Bytes) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  const std::span<const unsigned char> area =
      disk.subspan(Disk_Header_Bytes + size_t{Disk_Column_Bytes} * columns);
  // The default data runs from the start of the area to the first name.
  uint32_t default_area_end = static_cast<uint32_t>(area.size());
  for (uint32_t column = 0; column < columns; ++column) {
    default_area_end = std::min(
        default_area_end, word_at(disk.data() + Disk_Header_Bytes + Disk_Column_Bytes * column));
  }
  // A type word becomes a qv_data_type_t only once it is known to be one.
  uint32_t counted_variable_columns = 0;
  for (uint32_t column = 0; column < columns; ++column) {
    const unsigned char *p_descriptor =
        disk.data() + Disk_Header_Bytes + Disk_Column_Bytes * column;
    if (!valid_disk_column(p_descriptor, area, default_area_end)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    if (sr_i_is_variable_length(static_cast<qv_data_type_t>(word_at(p_descriptor + 4)))) {
      ++counted_variable_columns;
    }
  }
  if (counted_variable_columns != variable_columns || !distinct_names(disk, area, columns)) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }

  const uint32_t memory_length = Table_Information_Bytes +
                                 static_cast<uint32_t>(sizeof(sr_column_t)) * columns +
                                 static_cast<uint32_t>(area.size());
  void *p_data = nullptr;
  if (const int32_t rc = sr_i_reserve_record(&p_table->record_buffer_pool, memory_length,
                                             SR_I_RECORD_METADATA, &p_data);
      rc != 0) {
    return rc;
  }
  // The column array is read in place: it must be aligned, which the first
  // record of a fresh pool is.
  if (reinterpret_cast<uintptr_t>(p_data) % alignof(sr_column_t) != 0) {
    return sr_i_raise_internal();
  }
  auto *p_memory = static_cast<unsigned char *>(p_data);
  std::memcpy(p_memory, p_information, Table_Information_Bytes);
  auto *p_columns = reinterpret_cast<sr_column_t *>(p_memory + Table_Information_Bytes);
  auto *p_memory_area = reinterpret_cast<unsigned char *>(p_columns + columns);
  std::memcpy(p_memory_area, area.data(), area.size());
  for (uint32_t column = 0; column < columns; ++column) {
    const unsigned char *p_descriptor =
        disk.data() + Disk_Header_Bytes + Disk_Column_Bytes * column;
    sr_column_t &definition = p_columns[column];
    definition = sr_column_t{};
    definition.name = reinterpret_cast<char *>(p_memory_area + word_at(p_descriptor));
    definition.type = static_cast<qv_data_type_t>(word_at(p_descriptor + 4));
    definition.qualifier = static_cast<sr_qualifier_t>(word_at(p_descriptor + 8));
    definition.properties = static_cast<int32_t>(word_at(p_descriptor + 12));
    if (const uint32_t offset = word_at(p_descriptor + 16); offset != 0) {
      definition.sd_defn = reinterpret_cast<sr_sd_def_t *>(p_memory_area + offset);
    }
    std::memcpy(&definition.default_value, p_descriptor + 20, 8);
  }
  p_table->p_metadata_record_data = p_data;
  p_table->p_columns = p_columns;
  p_table->total_columns = columns;
  p_table->total_variable_length_columns = variable_columns;
  return 0;
}
