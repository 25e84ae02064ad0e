// Result codes: what each kind of bad call returns, that NO_ROOM means
// exactly "the area is too small", and that strings go through the caller's
// conversion handle, a failed conversion failing the call.

#include <gtest/gtest.h>

#include <cstring>

#include "pmsg_test_values.h"

extern "C" int pmsg_c_interface_round_trip(void);

namespace {

TEST(Results, HeaderWorksFromC) {
  EXPECT_EQ(pmsg_c_interface_round_trip(), 0);
}

// An unknown type is 2, unknown flags 7, a missing pointer 1.
TEST(Results, BadArgumentsAreNamed) {
  value_arena arena;
  qv_value_t text = arena.string("x"), value{};
  qv_pmsg_value_t slot{};
  unsigned char area[16];
  uint32_t offset = 0, length = 0;
  auto size = [&](int32_t type, uint32_t flags, uint32_t *p_length) {
    return qv_pmsg_size_conv_protocol_value_1(1, flags, as_type(type), &text, p_length);
  };
  auto encode = [&](int32_t type, uint32_t flags, unsigned char *p_area, uint32_t *p_offset) {
    return qv_pmsg_build_conv_protocol_value_1(nullptr, flags, as_type(type), &text, &slot, p_area,
                                               16, p_offset);
  };
  auto decode = [&](int32_t type, uint32_t flags, unsigned char *p_area) {
    return qv_pmsg_build_conv_packed_client_value_1(nullptr, flags, as_type(type), &value, &slot,
                                                    p_area, 16);
  };
  for (int32_t bad_type : {0, 1, QV_DATA_TYPE_LIMIT}) {
    EXPECT_EQ(size(bad_type, 0, &length), 2);
    EXPECT_EQ(encode(bad_type, 0, area, &offset), 2);
    EXPECT_EQ(decode(bad_type, 0, area), 2);
    EXPECT_EQ(qv_pmsg_convert_pmsg_value_1(&slot, as_type(bad_type), area), 2);
  }
  EXPECT_EQ(size(QV_CHAR_PTR, 1, &length), 7);
  EXPECT_EQ(encode(QV_CHAR_PTR, 4, area, &offset), 7);
  EXPECT_EQ(decode(QV_CHAR_PTR, 2, area), 7);
  EXPECT_EQ(size(QV_CHAR_PTR, 0, nullptr), 1);
  EXPECT_EQ(encode(QV_CHAR_PTR, 0, area, nullptr), 1);
  EXPECT_EQ(encode(QV_CHAR_PTR, 0, nullptr, &offset), 1);
  EXPECT_EQ(decode(QV_CHAR_PTR, 0, nullptr), 1);
  EXPECT_EQ(qv_pmsg_convert_pmsg_value_1(&slot, QV_CHAR_PTR, nullptr), 1);
  EXPECT_EQ(qv_pmsg_cnv_required_1(nullptr, nullptr, nullptr), 1);
  EXPECT_EQ(offset, 0u);
}

TEST(Results, NoRoomOnlyWhenTheAreaIsTooSmall) {
  value_arena arena;
  qv_value_t value = arena.array({arena.string("abc"), arena.string("de")});
  uint32_t needed = 0;
  ASSERT_EQ(qv_pmsg_size_conv_protocol_value_1(1, 0, QV_CHAR_PTR_ARRAY, &value, &needed), 0);
  ASSERT_EQ(needed, 4u + 2 * 8 + 4 + 3) << "count, two anchors, two strings with their NULs";
  std::vector<unsigned char> area(10 + needed);
  qv_pmsg_value_t slot{};
  uint32_t offset = 10;
  EXPECT_EQ(qv_pmsg_build_conv_protocol_value_1(nullptr, 0, QV_CHAR_PTR_ARRAY, &value, &slot,
                                                area.data(), 9 + needed, &offset),
            5);
  EXPECT_EQ(offset, 10u);
  EXPECT_EQ(slot.val_uint64, 0u);
  uint32_t past_the_end = 11 + needed;
  EXPECT_EQ(qv_pmsg_build_conv_protocol_value_1(nullptr, 0, QV_CHAR_PTR_ARRAY, &value, &slot,
                                                area.data(), 10 + needed, &past_the_end),
            5);
  EXPECT_EQ(qv_pmsg_build_conv_protocol_value_1(nullptr, 0, QV_CHAR_PTR_ARRAY, &value, &slot,
                                                area.data(), 10 + needed, &offset),
            0);
  EXPECT_EQ(offset, 10 + needed);

  // A body of no bytes fits into no area at all.
  qv_value_t empty = arena.binary("");
  uint32_t zero = 0;
  EXPECT_EQ(qv_pmsg_build_conv_protocol_value_1(nullptr, 0, QV_BINARY_PTR, &empty, &slot, nullptr,
                                                0, &zero),
            0);
  EXPECT_EQ(slot.anchor.length, 0u);
}

TEST(Results, ClientValuesThatCannotBeEncoded) {
  value_arena arena;
  qv_value_t negative = arena.byte_string({});
  negative.ptr_sbs->length = -4;
  qv_value_t overrun = arena.byte_string({{QV_INT32, 0, "abcd"}});
  overrun.ptr_sbs->length = 6;  // the field says 4 data bytes, only 2 are counted
  qv_value_t bad_element = arena.structured({{QV_INT32, number32(1)}, {QV_NONE, number32(2)}});
  struct {
    int32_t type;
    qv_value_t value;
    int32_t code;
  } cases[] = {{QV_SBS_PTR, negative, 4}, {QV_SBS_PTR, overrun, 4}, {QV_SD_PTR, bad_element, 2}};
  for (const auto &one : cases) {
    encoded_row row;
    EXPECT_EQ(append_value(row, one.type, one.value), one.code);
    EXPECT_EQ(row.used, 0u);
    uint32_t size = 0;
    EXPECT_EQ(qv_pmsg_size_conv_protocol_value_1(1, 0, as_type(one.type), &one.value, &size),
              one.code);
  }
}

// Strings go through the caller's handle: Latin-1 in and out around the
// stored UTF-8; ASCII, which has holes, to make a conversion fail, which
// fails the whole value and touches nothing.
TEST(StringConversion, EveryStringGoesThroughTheHandleAndAFailureFailsTheCall) {
  cu_iconv_t *p_handles[4] = {};
  const std::pair<const char *, uint32_t> code_sets[4] = {{"ISO-8859-1", CU_ICONV_TO_STORED},
                                                          {"ISO-8859-1", CU_ICONV_FROM_STORED},
                                                          {"ANSI_X3.4-1968", CU_ICONV_TO_STORED},
                                                          {"ANSI_X3.4-1968", CU_ICONV_FROM_STORED}};
  for (int at = 0; at < 4; ++at) {
    ASSERT_EQ(cu_iconv_open_1(code_sets[at].first, code_sets[at].second, &p_handles[at]), 0);
  }
  const auto [p_to_stored, p_from_stored, p_from_ascii, p_to_ascii] = p_handles;
  value_arena arena;
  qv_value_t latin1 = arena.string("caf\xE9");
  qv_value_t structured = arena.structured(
      {{QV_CHAR_PTR, latin1}, {QV_CHAR_PTR_ARRAY, arena.array({latin1, arena.string("\xFC")})}});
  encoded_row row;
  ASSERT_EQ(append_value(row, QV_CHAR_PTR, latin1, p_to_stored), 0);
  ASSERT_EQ(append_value(row, QV_SD_PTR, structured, p_to_stored), 0);
  EXPECT_EQ(row.slots[0].anchor.length, 6u);
  EXPECT_EQ(std::memcmp(row.area.data(), "caf\xC3\xA9", 6), 0) << "stored as UTF-8";

  decoded_value stored, text, nested, untouched;
  ASSERT_EQ(decode_slot(row, 0, QV_CHAR_PTR, stored), 0);
  EXPECT_STREQ(stored.value.ptr_char, "caf\xC3\xA9");
  ASSERT_EQ(decode_slot(row, 0, QV_CHAR_PTR, text, p_from_stored), 0);
  EXPECT_STREQ(text.value.ptr_char, "caf\xE9");
  ASSERT_EQ(decode_slot(row, 1, QV_SD_PTR, nested, p_from_stored), 0);
  EXPECT_TRUE(values_equal(QV_SD_PTR, structured, nested.value));

  untouched.value.val_uint64 = 0x1234;
  EXPECT_EQ(decode_slot(row, 0, QV_CHAR_PTR, untouched, p_to_ascii),
            QV_PMSG_RESULT_CONVERSION_FAILED);
  EXPECT_EQ(untouched.value.val_uint64, 0x1234u);
  encoded_row failed;
  EXPECT_EQ(append_value(failed, QV_CHAR_PTR_ARRAY,
                         arena.array({arena.string("ok"), arena.string("caf\xE9")}), p_from_ascii),
            QV_PMSG_RESULT_CONVERSION_FAILED);
  EXPECT_EQ(failed.used, 0u);
  for (cu_iconv_t *p_handle : p_handles) {
    cu_iconv_close_1(p_handle);
  }
}

}  // namespace
