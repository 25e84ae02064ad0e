// Round trips: every type, empty and nested values, relocated bodies, one
// block per decoded value. (Random values, in areas too small at first, make
// the round trip through the other byte order in pmsg_byte_order_test.)

#include <gtest/gtest.h>
#include <malloc.h>

#include <cstring>

#include "pmsg_test_values.h"

namespace {

// Every sample in one row, behind other bytes at an odd place: sizing agrees
// with encoding, each body is anchored where it was written and decodes to
// the value given, also once the registry has moved it to another record by
// copying its bytes and rewriting only the top-level anchor.
TEST(RoundTrip, EveryTypeSurvivesInOneRowAndWhenMoved) {
  value_arena arena;
  auto values = sample_values(arena);
  encoded_row row;
  row.area.assign(64, 0xEE);
  row.used = 37;
  for (const auto &[type, value] : values) {
    uint32_t offset_before = row.used;
    ASSERT_EQ(append_value(row, type, value), QV_PMSG_RESULT_OK) << "type " << type;
    uint32_t size = 0;
    ASSERT_EQ(qv_pmsg_size_conv_protocol_value_1(1, 0, as_type(type), &value, &size), 0);
    EXPECT_EQ(row.used - offset_before, size) << "sizing disagrees with encoding, type " << type;
    if (!is_fixed_type(type)) {
      EXPECT_EQ(row.slots.back().anchor.offset, offset_before);
      EXPECT_EQ(row.slots.back().anchor.length, size);
    }
  }
  for (size_t index = 0; index < values.size(); ++index) {
    const auto &[type, value] = values[index];
    decoded_value decoded, moved_decoded;
    ASSERT_EQ(decode_slot(row, index, type, decoded), QV_PMSG_RESULT_OK);
    EXPECT_TRUE(values_equal(type, value, decoded.value));
    if (is_fixed_type(type)) {
      continue;
    }
    const qv_pmsg_value_anchor_t anchor = row.slots[index].anchor;
    encoded_row moved;
    moved.used = 5 + anchor.length;
    moved.area.assign(moved.used, 0x11);
    std::memcpy(moved.area.data() + 5, row.area.data() + anchor.offset, anchor.length);
    moved.slots = {row.slots[index]};
    moved.slots[0].anchor.offset = 5;
    ASSERT_EQ(decode_slot(moved, 0, type, moved_decoded), QV_PMSG_RESULT_OK) << "type " << type;
    EXPECT_TRUE(values_equal(type, value, moved_decoded.value));
  }
}

TEST(RoundTrip, FixedValuesStayInTheSlot) {
  qv_value_t value{};
  value.val_int64 = -1;
  value.val_int32 = -2;  // the upper half of the union keeps stale bits
  qv_pmsg_value_t slot;
  std::memset(&slot, 0xAA, sizeof slot);
  ASSERT_EQ(
      qv_pmsg_build_conv_protocol_value_1(nullptr, 0, QV_INT32, &value, &slot, nullptr, 0, nullptr),
      QV_PMSG_RESULT_OK);
  EXPECT_EQ(slot.val_int32, -2);
  EXPECT_EQ(slot.anchor.length, 0u) << "the slot's last four bytes are zero";
  qv_value_t decoded{};
  decoded.val_int64 = -1;
  ASSERT_EQ(
      qv_pmsg_build_conv_packed_client_value_1(nullptr, 0, QV_INT32, &decoded, &slot, nullptr, 0),
      QV_PMSG_RESULT_OK);
  EXPECT_EQ(decoded.val_int64, int64_t{0xFFFFFFFE});
}

TEST(RoundTrip, NullPointersInsideValuesBecomeEmptyValues) {
  value_arena arena;
  qv_value_t null_pointer{};
  qv_value_t structured = arena.structured({{QV_CHAR_PTR, null_pointer},
                                            {QV_RSRC_HANDLE_PTR, null_pointer},
                                            {QV_BINARY_PTR, null_pointer},
                                            {QV_SD_PTR, null_pointer},
                                            {QV_SBS_PTR, null_pointer},
                                            {QV_SD_PTR_ARRAY, null_pointer}});
  qv_value_t strings = arena.array({null_pointer, arena.string("x")});
  encoded_row row;
  ASSERT_EQ(append_value(row, QV_SD_PTR, structured), 0);
  ASSERT_EQ(append_value(row, QV_CHAR_PTR_ARRAY, strings), 0);
  ASSERT_EQ(append_value(row, QV_CHAR_PTR, null_pointer), 0);
  decoded_value first, second, third;
  ASSERT_EQ(decode_slot(row, 0, QV_SD_PTR, first), 0);
  ASSERT_EQ(decode_slot(row, 1, QV_CHAR_PTR_ARRAY, second), 0);
  ASSERT_EQ(decode_slot(row, 2, QV_CHAR_PTR, third), 0);
  EXPECT_TRUE(values_equal(QV_SD_PTR, structured, first.value));
  EXPECT_EQ(first.value.ptr_sd->elements[1].value.ptr_rsrc_handle->id.id4, 0xFFFFFFFFu);
  EXPECT_STREQ(second.value.ptr_array->elements[0].ptr_char, "");
  EXPECT_STREQ(third.value.ptr_char, "");
}

// Every piece of a decoded value lies in the block its top pointer owns, so
// one free() releases it (in the sanitizer build a separate piece would
// also show up as a leak).
TEST(RoundTrip, DecodedValueIsOneBlock) {
  value_arena arena;
  qv_value_t inner = arena.structured({{QV_CHAR_PTR_ARRAY, arena.array({arena.string("x")})}});
  encoded_row row;
  ASSERT_EQ(append_value(row, QV_SD_PTR_ARRAY, arena.array({inner, inner})), 0);
  decoded_value decoded;
  ASSERT_EQ(decode_slot(row, 0, QV_SD_PTR_ARRAY, decoded), 0);
  auto *p_start = reinterpret_cast<const char *>(decoded.value.ptr_array);
  const char *p_end = p_start + malloc_usable_size(decoded.value.ptr_array);
  const char *p_deepest = decoded.value.ptr_array->elements[1]
                              .ptr_sd->elements[0]
                              .value.ptr_array->elements[0]
                              .ptr_char;
  EXPECT_STREQ(p_deepest, "x");
  EXPECT_TRUE(p_deepest > p_start && p_deepest < p_end);
}

}  // namespace
