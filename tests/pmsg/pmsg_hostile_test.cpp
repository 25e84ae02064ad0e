// Hostile input: truncated, corrupted and cunningly built encodings are
// refused with MALFORMED, never read outside their bounds (each body lies in
// a heap block of its exact size, so AddressSanitizer sees any stray read),
// and nesting is bounded the same way for encoding and decoding.

#include <gtest/gtest.h>

#include <cstring>
#include <memory>

#include "pmsg_i_format.h"
#include "pmsg_test_values.h"

namespace {

// A body alone in a heap block of exactly its size, anchored at offset 0.
struct exact_body {
  std::unique_ptr<unsigned char[]> bytes;
  qv_pmsg_value_t slot{};
  uint32_t length;

  exact_body(const unsigned char *p_source, uint32_t size)
      : bytes(new unsigned char[size]), length(size) {
    if (size != 0)
      std::memcpy(bytes.get(), p_source, size);
    slot.anchor = {0, size};
  }
  int32_t decode(int32_t type) {
    qv_value_t value{};
    int32_t result = qv_pmsg_build_conv_packed_client_value_1(nullptr, 0, as_type(type), &value,
                                                              &slot, bytes.get(), length);
    if (result == QV_PMSG_RESULT_OK)
      std::free(value.ptr_char);
    return result;
  }
  int32_t convert(int32_t type) {
    qv_pmsg_value_t foreign_slot{};
    foreign_slot.anchor = {__builtin_bswap32(slot.anchor.offset),
                           __builtin_bswap32(slot.anchor.length)};
    return pmsg_i_convert_value(foreign_slot.bytes, type, bytes.get(), length);
  }
};

exact_body body_of(const encoded_row &row) {
  return exact_body(row.area.data() + row.slots[0].anchor.offset, row.slots[0].anchor.length);
}

TEST(Hostile, TruncatedBodiesAreRefused) {
  value_arena arena;
  for (const auto &[type, value] : sample_values(arena)) {
    // Any prefix of a binary is a binary, and a byte string cut between
    // fields is a byte string; every other body says where it ends.
    if (is_fixed_type(type) || type == QV_BINARY_PTR || type == QV_SBS_PTR)
      continue;
    encoded_row row;
    ASSERT_EQ(append_value(row, type, value), 0);
    encoded_row foreign = row;
    to_other_byte_order(type, foreign.slots[0].bytes, foreign.area.data());
    for (uint32_t cut = 1; cut <= row.slots[0].anchor.length; ++cut) {
      uint32_t kept = row.slots[0].anchor.length - cut;
      exact_body local(row.area.data() + row.slots[0].anchor.offset, kept);
      EXPECT_EQ(local.decode(type), QV_PMSG_RESULT_MALFORMED)
          << "type " << type << " kept " << kept;
      exact_body other(foreign.area.data() + row.slots[0].anchor.offset, kept);
      EXPECT_EQ(other.convert(type), QV_PMSG_RESULT_MALFORMED)
          << "type " << type << " kept " << kept;
    }
  }
}

// Binaries accept any bytes, so only the anchor rules can refuse these.
TEST(Hostile, AnchorsOutsideTheirBoundsAreRefused) {
  value_arena arena;
  encoded_row row;
  ASSERT_EQ(
      append_value(row, QV_BINARY_PTR_ARRAY, arena.array({arena.binary("ab"), arena.binary("cd")})),
      0);
  exact_body body = body_of(row);
  ASSERT_EQ(body.length, 24u) << "count, two anchors, two 2-byte bodies";
  ASSERT_EQ(body.decode(QV_BINARY_PTR_ARRAY), QV_PMSG_RESULT_OK);

  // Top-level anchors past the area, one of them wrapping around 32 bits.
  for (qv_pmsg_value_anchor_t anchor :
       {qv_pmsg_value_anchor_t{1, body.length}, qv_pmsg_value_anchor_t{0xFFFFFFF8u, 16}}) {
    exact_body moved(body.bytes.get(), body.length);
    moved.slot.anchor = anchor;
    EXPECT_EQ(moved.decode(QV_BINARY_PTR), QV_PMSG_RESULT_MALFORMED);
    EXPECT_EQ(moved.convert(QV_BINARY_PTR), QV_PMSG_RESULT_MALFORMED);
  }

  // Nested anchors (words at 4 and 8 for the first body, 12 and 16 for the
  // second): into the fixed part, leaving a gap, past the body, overlapping
  // the previous body, ending early.
  using word_change = std::pair<uint32_t, uint32_t>;  // position, new word
  const std::vector<std::vector<word_change>> breakages = {
      {{4, 0}}, {{4, 21}, {8, 1}}, {{8, 0xFFFFFFF0u}}, {{12, 21}}, {{16, 3}}, {{16, 1}}};
  for (const auto &changes : breakages) {
    exact_body broken(body.bytes.get(), body.length);
    for (auto [at, word] : changes)
      std::memcpy(broken.bytes.get() + at, &word, 4);
    EXPECT_EQ(broken.decode(QV_BINARY_PTR_ARRAY), QV_PMSG_RESULT_MALFORMED)
        << "word at " << changes[0].first << " = " << changes[0].second;
  }
}

TEST(Hostile, CorruptedBodiesNeverCrash) {
  std::mt19937 random(4242);
  for (int round = 0; round < 3000; ++round) {
    value_arena arena;
    auto [type, value] = random_value(random, arena, QV_SD_PTR + (random() % 2) * 11);
    encoded_row row;
    ASSERT_EQ(append_value(row, type, value), 0);
    exact_body body = body_of(row);
    for (int flips = 1 + random() % 3; flips > 0 && body.length != 0; --flips) {
      body.bytes[random() % body.length] ^= static_cast<unsigned char>(1 + random() % 255);
    }
    int32_t result = body.decode(type);
    ASSERT_TRUE(result == QV_PMSG_RESULT_OK || result == QV_PMSG_RESULT_MALFORMED) << result;
    result = body.convert(type);
    ASSERT_TRUE(result == QV_PMSG_RESULT_OK || result == QV_PMSG_RESULT_MALFORMED) << result;
  }
}

// A chain of structured values, each holding the next as its one element.
qv_value_t nested_chain(value_arena &arena, int levels) {
  qv_value_t value = arena.structured({});
  while (--levels > 0)
    value = arena.structured({{QV_SD_PTR, value}});
  return value;
}

TEST(Hostile, NestingLimitIsTheSameForEncodingAndDecoding) {
  value_arena arena;
  const int deepest = QV_PMSG_MAX_NESTING + 1;  // levels 0 to the limit
  encoded_row row;
  ASSERT_EQ(append_value(row, QV_SD_PTR, nested_chain(arena, deepest)), QV_PMSG_RESULT_OK);
  EXPECT_EQ(body_of(row).decode(QV_SD_PTR), QV_PMSG_RESULT_OK);

  encoded_row too_deep;
  qv_value_t chain = nested_chain(arena, deepest + 1);
  EXPECT_EQ(append_value(too_deep, QV_SD_PTR, chain), QV_PMSG_RESULT_BAD_CLIENT_VALUE);
  uint32_t size = 0;
  EXPECT_EQ(qv_pmsg_size_conv_protocol_value_1(1, 0, QV_SD_PTR, &chain, &size),
            QV_PMSG_RESULT_BAD_CLIENT_VALUE);

  // The same chain built by hand: one more wrapper around the accepted one.
  exact_body accepted = body_of(row);
  std::vector<unsigned char> wrapper(16 + accepted.length);
  uint32_t header[4] = {1, QV_SD_PTR, 16, accepted.length};
  std::memcpy(wrapper.data(), header, 16);
  std::memcpy(wrapper.data() + 16, accepted.bytes.get(), accepted.length);
  exact_body hand_made(wrapper.data(), static_cast<uint32_t>(wrapper.size()));
  EXPECT_EQ(hand_made.decode(QV_SD_PTR), QV_PMSG_RESULT_MALFORMED);
}

}  // namespace
