// Byte order: the buffer header tells whether values need conversion, and
// converting values written in the other byte order gives exactly the
// encoding this machine writes.

#include <gtest/gtest.h>

#include <cstring>

#include "pmsg_test_values.h"

namespace {

qv_pmsg_header_t header_of(uint32_t length, uint8_t version, uint8_t architecture) {
  return {length, version, architecture, 2, 0};
}

// This machine's header needs no conversion; the other order's header is
// converted, once, and so becomes this machine's; anything else is refused
// and left untouched.
TEST(ByteOrder, TheHeaderSaysWhetherValuesNeedConversion) {
  EXPECT_EQ(QV_PMSG_ARCH_LOCAL, QV_PMSG_ARCH_LITTLE_ENDIAN)
      << "the build machines are little-endian";
  const qv_pmsg_header_t local = header_of(1000, QV_PMSG_VERSION, QV_PMSG_ARCH_LOCAL);
  const struct {
    qv_pmsg_header_t header;
    int32_t result, required;
    qv_pmsg_header_t after;
  } cases[] = {
      {local, QV_PMSG_RESULT_OK, 0, local},
      {header_of(__builtin_bswap32(1000), QV_PMSG_VERSION, QV_PMSG_ARCH_BIG_ENDIAN),
       QV_PMSG_RESULT_OK, 1, local},
      {header_of(7, 1, QV_PMSG_ARCH_BIG_ENDIAN), QV_PMSG_RESULT_MALFORMED, -1,
       header_of(7, 1, QV_PMSG_ARCH_BIG_ENDIAN)},
      {header_of(7, 0, 0), QV_PMSG_RESULT_MALFORMED, -1, header_of(7, 0, 0)},
      {header_of(7, 0, 3), QV_PMSG_RESULT_MALFORMED, -1, header_of(7, 0, 3)},
  };
  for (const auto &one : cases) {
    qv_pmsg_header_t header = one.header;
    int32_t required = -1, converted = -1;
    EXPECT_EQ(qv_pmsg_cnv_required_1(&header, &required, &converted), one.result);
    EXPECT_EQ(std::memcmp(&header, &one.after, sizeof header), 0) << header.qv_pmsg_length;
    if (one.result == QV_PMSG_RESULT_OK) {
      EXPECT_EQ(required, one.required);
      EXPECT_EQ(converted, one.required);
    }
  }
}

// A row written on the other machine: each slot converted with the row's
// indirect area gives back this machine's bytes, and the values decode.
void expect_other_order_converts_back(const std::vector<std::pair<int32_t, qv_value_t>> &values) {
  encoded_row row;
  for (const auto &[type, value] : values) {
    ASSERT_EQ(append_value(row, type, value), QV_PMSG_RESULT_OK);
  }
  encoded_row foreign = row;
  for (size_t index = 0; index < values.size(); ++index) {
    to_other_byte_order(values[index].first, foreign.slots[index].bytes, foreign.area.data());
  }
  for (size_t index = 0; index < values.size(); ++index) {
    ASSERT_EQ(qv_pmsg_convert_pmsg_value_1(&foreign.slots[index], as_type(values[index].first),
                                           foreign.area.data()),
              QV_PMSG_RESULT_OK)
        << "type " << values[index].first;
    EXPECT_EQ(std::memcmp(&foreign.slots[index], &row.slots[index], 8), 0);
  }
  ASSERT_TRUE(foreign.area == row.area) << "the converted bodies differ from the local ones";
  for (size_t index = 0; index < values.size(); ++index) {
    decoded_value decoded;
    ASSERT_EQ(decode_slot(foreign, index, values[index].first, decoded), 0);
    EXPECT_TRUE(values_equal(values[index].first, values[index].second, decoded.value));
  }
}

// The samples, then random rows, written on the other machine.
TEST(ByteOrder, ValuesFromTheOtherOrderConvertToThisMachinesBytes) {
  value_arena arena;
  auto values = sample_values(arena);
  expect_other_order_converts_back(values);

  // The swap must really change the samples' counts and numbers, or the
  // check above would pass with a converter that does nothing.
  encoded_row row;
  ASSERT_EQ(append_value(row, QV_SD_PTR, values[11].second), 0);
  std::vector<unsigned char> local = row.area;
  to_other_byte_order(QV_SD_PTR, row.slots[0].bytes, row.area.data());
  EXPECT_NE(local, row.area);

  std::mt19937 random(77);
  for (int round = 0; round < 200; ++round) {
    value_arena random_arena;
    std::vector<std::pair<int32_t, qv_value_t>> random_values;
    for (int column = 0; column < 5; ++column) {
      random_values.push_back(random_value(random, random_arena));
    }
    SCOPED_TRACE(round);
    expect_other_order_converts_back(random_values);
  }
}

}  // namespace
