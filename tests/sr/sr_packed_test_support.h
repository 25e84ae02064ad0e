// sr_packed_test_support.h - a packed table buffer written the way another
// machine would write it, following docs/packed-buffer-format.md and
// docs/value-encoding.md with the codec's encoder and the codec tests'
// byte-order rewriter, and none of the registry's packing code: the
// reference the tests and the fuzz seeds check the library against.

#ifndef SR_PACKED_TEST_SUPPORT_H
#define SR_PACKED_TEST_SUPPORT_H

#include <cstdint>
#include <string>
#include <vector>

#include "pmsg_test_values.h"
#include "qv_sr.h"

namespace sr_test {

// One table of a buffer: its columns (the key first), its rows (one value
// per column, in column order) and what its fixed metadata says.
struct packed_table_description {
  std::string name;
  std::vector<sr_column_t> columns;
  std::vector<std::vector<qv_value_t>> rows;
  uint64_t change_counter = 1;
};

// The key hash and comparison the packed tests unpack string-keyed tables
// with: a hash over 64 buckets and strcmp.
uint32_t string_hash_64(const void *p_key);
int32_t compare_strings(const void *p_stored, const void *p_key);

// The whole buffer, in this machine's byte order or in the other one.
std::vector<unsigned char> write_packed_buffer(const std::vector<packed_table_description> &tables,
                                               bool other_byte_order);

}  // namespace sr_test

#endif  // SR_PACKED_TEST_SUPPORT_H
