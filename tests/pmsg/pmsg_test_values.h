// pmsg_test_values.h - what the codec tests share (and the expression tests
// build their rows with): building client values, comparing them deeply,
// making random ones, encoding with the caller's grow-and-retry loop, and
// producing the other byte order's encoding by following
// docs/value-encoding.md independently of the library's code.

#ifndef PMSG_TEST_VALUES_H
#define PMSG_TEST_VALUES_H

#include <gtest/gtest.h>

#include <cstdint>
#include <random>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "qv_pmsg.h"

inline qv_data_type_t as_type(int32_t number) {
  return static_cast<qv_data_type_t>(number);
}

bool is_fixed_type(int32_t type);

// Owns every piece of the client values it builds.
class value_arena {
 public:
  value_arena() = default;
  value_arena(const value_arena &) = delete;
  value_arena &operator=(const value_arena &) = delete;
  ~value_arena();

  struct field {
    int8_t type;
    int8_t serial;
    std::string data;
  };

  void *allocate(size_t bytes);  // zero-filled
  qv_value_t string(std::string_view text);
  qv_value_t binary(std::string_view bytes);
  qv_value_t handle(uint32_t header, uint32_t id1, uint32_t id2, uint32_t id3, uint32_t id4);
  qv_value_t structured(const std::vector<std::pair<int32_t, qv_value_t>> &elements);
  qv_value_t array(const std::vector<qv_value_t> &elements);
  qv_value_t byte_string(const std::vector<field> &fields);

 private:
  std::vector<void *> blocks_;
};

qv_value_t number32(uint32_t bits);
qv_value_t number64(uint64_t bits);

// One sample value of every type 2 to 22, nested and empty ones included.
std::vector<std::pair<int32_t, qv_value_t>> sample_values(value_arena &arena);

// A random value of `type` (a random type 2..22 when type is 0).
std::pair<int32_t, qv_value_t> random_value(std::mt19937 &random, value_arena &arena,
                                            int32_t type = 0, int depth = 0);

// Deep equality; a null pointer in `expected` stands for the type's empty value.
testing::AssertionResult values_equal(int32_t type, const qv_value_t &expected,
                                      const qv_value_t &actual);

// A slot and an indirect area holding one or more encoded values.
struct encoded_row {
  std::vector<qv_pmsg_value_t> slots;
  std::vector<unsigned char> area;
  uint32_t used = 0;  // the running offset
};

// Appends a value the way the registry does: on NO_ROOM, which must leave
// the slot and the offset as they were, the area is doubled and the call
// repeated. Returns the final result code.
int32_t append_value(encoded_row &row, int32_t type, const qv_value_t &value,
                     cu_iconv_t *p_conversion = nullptr);

// Decodes slot `index` of the row bounded by the used bytes; the decoded
// block is released when the holder goes.
struct decoded_value {
  qv_value_t value{};
  bool owns_block = false;
  ~decoded_value();
};
int32_t decode_slot(const encoded_row &row, size_t index, int32_t type, decoded_value &out,
                    cu_iconv_t *p_conversion = nullptr);

// Rewrites an encoded value (slot and body, host order) into the other
// byte order, as a machine of that order would have written it.
void to_other_byte_order(int32_t type, unsigned char *p_slot, unsigned char *p_area);

#endif  // PMSG_TEST_VALUES_H
