// sr_fuzz_table_file.cpp - opens arbitrary bytes as a table file. The
// reader checks every length and offset against the bytes it read, so
// whatever a file holds, opening it must fail with a code or give a table
// whose metadata and every row, in every column, can be read; it must never
// crash or read outside what it was given. Seeds in corpus/sr/ are files
// the registry wrote itself ("table_*") and damaged ones the reader once
// mishandled ("damaged_*").
//
// The input is written as the one table file of a mount directory made once
// per process (on tmpfs where there is one) and opened read-only by a fresh
// tree, as another program would open it.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "qv_sr.h"

namespace {

std::filesystem::path Mount_Directory;

void remove_mount_directory() {
  std::error_code ignored;
  std::filesystem::remove_all(Mount_Directory, ignored);
}

const std::filesystem::path &mount_directory() {
  if (Mount_Directory.empty()) {
    const std::filesystem::path base = std::filesystem::exists("/dev/shm")
                                           ? std::filesystem::path("/dev/shm")
                                           : std::filesystem::temp_directory_path();
    std::string pattern = (base / "qv_fuzz_sr_XXXXXX").string();
    if (mkdtemp(pattern.data()) == nullptr) {
      std::perror("mkdtemp");
      std::abort();
    }
    Mount_Directory = pattern;
    std::atexit(remove_mount_directory);
  }
  return Mount_Directory;
}

bool write_table_file(const std::filesystem::path &file, const uint8_t *p_data, size_t size) {
  FILE *p_file = std::fopen(file.c_str(), "wb");
  if (p_file == nullptr) {
    return false;
  }
  const bool written = std::fwrite(p_data, 1, size, p_file) == size;
  return std::fclose(p_file) == 0 && written;
}

bool is_variable_length(qv_data_type_t type) {
  return type >= QV_CHAR_PTR;
}

bool has_key(const sr_table_metadata_t &metadata) {
  const uint32_t qualifier = metadata.column_definitions[0].qualifier & 15;
  return qualifier == SR_PRIMARY_KEY || qualifier == SR_PRIMARY_KEY_NOCHECK;
}

// The type of the value read for column `column` by its name: a file may
// repeat a name, and a name reads the first column that has it.
qv_data_type_t type_read_by_name(const sr_table_metadata_t &metadata, uint32_t column) {
  const sr_column_t *p_columns = metadata.column_definitions;
  for (uint32_t first = 0; first < column; ++first) {
    if (std::strcmp(p_columns[first].name, p_columns[column].name) == 0) {
      return p_columns[first].type;
    }
  }
  return p_columns[column].type;
}

// Reads every row by packed index, all columns at once (a value handed back
// before a failing column is the caller's too), and looks each row up again
// by its key.
void read_every_row(sr_opaque_handle_t table, const sr_table_metadata_t &metadata) {
  const uint32_t columns = metadata.number_of_columns;
  if (columns == 0) {
    return;
  }
  std::vector<const char *> names(columns);
  std::vector<qv_value_t> values(columns);
  std::vector<qv_value_t *> results(columns);
  for (uint32_t column = 0; column < columns; ++column) {
    names[column] = metadata.column_definitions[column].name;
    results[column] = &values[column];
  }
  for (uint32_t row = 0; row < metadata.number_of_rows; ++row) {
    // Every byte zeroed: a union's value-initialisation may leave the bytes
    // beyond its first member as they were.
    std::memset(values.data(), 0, columns * sizeof(qv_value_t));
    const int32_t rc = sr_get_fields_by_index_1(table, static_cast<int32_t>(row), names.data(),
                                                results.data(), columns);
    if (rc == 0 && has_key(metadata)) {
      uint32_t fixed_row_index = 0;
      sr_get_fixed_row_index_for_key_1(table, values[0], &fixed_row_index);
    }
    for (uint32_t column = 0; column < columns; ++column) {
      if (is_variable_length(type_read_by_name(metadata, column))) {
        std::free(values[column].ptr_char);
      }
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  const std::filesystem::path &directory = mount_directory();
  if (!write_table_file(directory / "t", p_data, size)) {
    std::abort();
  }
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0) {
    std::abort();
  }
  if (sr_mount_local_tree_1(tree, "/disk", directory.c_str(), 0) != 0) {
    std::abort();
  }
  sr_opaque_handle_t table = nullptr;
  if (sr_open_table_1(tree, "/disk/t", 1, &table) == 0) {
    sr_table_metadata_t *p_metadata = nullptr;
    if (sr_get_table_metadata_1(table, -1, &p_metadata) == 0) {
      read_every_row(table, *p_metadata);
      sr_free_table_metadata_1(p_metadata);
    }
    sr_close_table_1(table);
  }
  sr_close_tree_1(tree);
  return 0;
}
