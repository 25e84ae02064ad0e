// sr_fuzz_packed.cpp - takes arbitrary bytes as a packed table buffer
// received from another machine: converts it, counts and names its tables,
// unpacks each into a fresh tree, reads every value of every row, looks
// each row up by its key, and packs the table again. Whatever the bytes,
// every call must succeed or refuse with a code, and nothing may be read or
// written outside the buffer's stated length.
//
// The caller of the library promises that the buffer is as long as its
// header says, so the input's own size is written into the header's length
// word, in the byte order its architecture byte names; everything else,
// slot 2's copy of the length included, is the fuzzer's. Seeds in
// corpus/sr_packed/ are buffers packed by the registry in this machine's
// byte order and the same tables written in the other byte order by the
// tests' reference writer (tests/sr/sr_packed_test_support.cpp).

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "qv_pmsg.h"
#include "qv_sr.h"

namespace {

bool is_variable_length(qv_data_type_t type) {
  return type >= QV_CHAR_PTR;
}

void check(bool condition) {
  if (!condition) {
    std::abort();
  }
}

// Every value of every row by packed index, then each row by its key.
void read_table(sr_opaque_handle_t table) {
  sr_table_metadata_t *p_metadata = nullptr;
  check(sr_get_table_metadata_1(table, -1, &p_metadata) == 0);
  const uint32_t total_columns = p_metadata->number_of_columns;
  std::vector<const char *> names(total_columns);
  for (uint32_t column = 0; column < total_columns; ++column) {
    names[column] = p_metadata->column_definitions[column].name;
  }
  for (uint32_t row = 0; row < p_metadata->number_of_rows; ++row) {
    std::vector<qv_value_t> values(total_columns);
    std::vector<qv_value_t *> results(total_columns);
    for (uint32_t column = 0; column < total_columns; ++column) {
      results[column] = &values[column];
    }
    const int32_t rc = sr_get_fields_by_index_1(table, static_cast<int32_t>(row), names.data(),
                                                results.data(), total_columns);
    check(rc == 0 || rc == SR_E_LIBRARY_CALL || rc == SR_E_INVALID_COLUMN);
    qv_value_t key{};
    if (sr_get_field_by_index_1(table, static_cast<int32_t>(row), names[0], &key) == 0) {
      qv_value_t found{};
      const int32_t key_rc = sr_get_field_by_key_1(table, key, names[0], &found);
      check(key_rc == 0 || key_rc == SR_E_NO_ROW_FOR_KEY || key_rc == SR_E_LIBRARY_CALL);
      if (key_rc == 0 && is_variable_length(p_metadata->column_definitions[0].type)) {
        std::free(found.ptr_char);
      }
      if (is_variable_length(p_metadata->column_definitions[0].type)) {
        std::free(key.ptr_char);
      }
    }
    // Values handed back before a failing column are the caller's too.
    for (uint32_t column = 0; column < total_columns; ++column) {
      if (is_variable_length(p_metadata->column_definitions[column].type)) {
        std::free(values[column].ptr_char);
      }
    }
  }
  sr_free_table_metadata_1(p_metadata);
}

void unpack_and_read(const void *p_buffer) {
  uint32_t total_tables = 0;
  if (sr_get_total_packed_tables_1(p_buffer, &total_tables) != 0) {
    return;
  }
  sr_opaque_handle_t tree = nullptr;
  check(sr_open_tree_1(&tree, 0, 0) == 0);
  for (uint32_t index = 0; index < total_tables; ++index) {
    const char *p_name = nullptr;
    const int32_t name_rc = sr_get_packed_table_name_1(p_buffer, index, &p_name);
    check(name_rc == 0 || name_rc == SR_E_TABLE_UNREADABLE);
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_unpack_table_1(p_buffer, 0, nullptr, nullptr, tree, index, &table);
    check(rc != SR_E_INTERNAL);
    if (rc != 0) {
      continue;
    }
    read_table(table);
    const uint32_t visible = 0, all_rows = 0;
    void *p_again = nullptr;
    check(sr_pack_tables_1(1, &table, &visible, &all_rows, nullptr, &p_again) == 0);
    uint32_t total_again = 0;
    check(sr_get_total_packed_tables_1(p_again, &total_again) == 0 && total_again == 1);
    std::free(p_again);
  }
  sr_close_tree_1(tree);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  if (size < sizeof(qv_pmsg_header_t) || size > UINT32_MAX) {
    return 0;
  }
  // A block of exactly the input's size, so that the sanitizer sees a read
  // or write past it.
  auto *p_buffer = static_cast<unsigned char *>(std::malloc(size));
  std::memcpy(p_buffer, p_data, size);
  auto length = static_cast<uint32_t>(size);
  if (p_buffer[5] != QV_PMSG_ARCH_LOCAL) {
    length = __builtin_bswap32(length);
  }
  std::memcpy(p_buffer, &length, sizeof length);
  const int32_t rc = sr_convert_packed_table_buffer_1(p_buffer, 0, 0);
  check(rc == 0 || rc == SR_E_TABLE_UNREADABLE);
  if (rc == 0) {
    unpack_and_read(p_buffer);
  }
  std::free(p_buffer);
  return 0;
}
