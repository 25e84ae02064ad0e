// Damaged rows: a count, anchor or terminator inside a body that does not
// fit the body gives CU_RESULT_VALUE_MISSING, never a read outside the row
// (the AddressSanitizer build checks the reads; the indirect area is a block
// of exactly its own size).

#include <gtest/gtest.h>

#include <cstring>
#include <functional>
#include <string>
#include <vector>

#include "cu_expression_test_table.h"

namespace {

void put_u32(std::vector<unsigned char> &bytes, size_t offset, uint32_t value) {
  ASSERT_LE(offset + 4, bytes.size());
  std::memcpy(bytes.data() + offset, &value, sizeof value);
}

// Column positions in the interfaces row.
constexpr uint32_t Name = 6, Owner = 8, Link = 9, Vlans = 11, Aliases = 17, Peers = 19,
                   Addresses = 20;

struct damage_case {
  const char *what;
  std::function<void(test_row &)> damage;
  std::vector<std::string> texts;  // each must now give CU_RESULT_VALUE_MISSING
};

TEST(ExpressionHostileRows, DamagedBodiesGiveValueMissing) {
  const std::vector<damage_case> cases = {
      {"array count beyond its body",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Aliases), 1000); },
       {R"("wan" in Aliases)", R"(Aliases[0] == "wan")", "len(Aliases) > 0"}},
      {"element anchor outside the array",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Aliases) + 4, 0xFFFFFFF0u); },
       {R"(Aliases[0] == "wan")", R"("uplink" in Aliases)"}},
      {"element length past the array's end",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Aliases) + 4 + 16 + 4, 0x100); },
       {R"(Aliases[2] == "uplink")"}},
      {"empty string body without its NUL",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Aliases) + 4 + 8 + 4, 0); },
       {"Aliases[1] == ''"}},
      {"string without its terminating NUL",
       [](test_row &row) { row.indirect[row.body_offset(Name) + 4] = 'x'; },
       {R"(Name == "eth0")", R"(Name =~ "^eth")"}},
      {"structured count beyond its body",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Link), 0xFFFFFFFFu); },
       {"Link.Speed == 1000", "len(Link) > 0"}},
      {"field anchor past the structured value",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Link) + 16 + 8, 0x7FFFFFFF); },
       {R"(Link.Media == "copper")"}},
      {"handle of the wrong length",
       [](test_row &row) { put_u32(row.record, 4 + 8 * Owner + 4, 19); },
       {R"(Owner == "0x1 0x2 0x1 0x2 0x3 0xffffffff")"}},
      {"handle element of the wrong length",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Peers) + 4 + 4, 12); },
       {R"(Peers[0] == "0x0 0x0 0x1 0x0 0x0 0x0")"}},
      {"number array count beyond its body",
       [](test_row &row) { put_u32(row.indirect, row.body_offset(Vlans), 0x40000000); },
       {"Vlans[0] == 10", "len(Vlans) > 0", "10 in Vlans"}},
      {"field anchor of a structured element outside it",
       [](test_row &row) {
         uint32_t element;
         std::memcpy(&element, row.indirect.data() + row.body_offset(Addresses) + 4, 4);
         put_u32(row.indirect, row.body_offset(Addresses) + element + 8, 0xFFFF);
       },
       {R"("inet" in Addresses.Family)", R"(Addresses[0].Family == "inet")"}},
  };
  for (const damage_case &one : cases) {
    test_row row = interfaces_row();
    one.damage(row);
    for (const std::string &text : one.texts) {
      test_table table = interfaces_table();
      const outcome result = run(table, text, row);
      EXPECT_EQ(result.compiled, 0) << one.what << ": " << text;
      EXPECT_EQ(result.evaluated, CU_RESULT_VALUE_MISSING) << one.what << ": " << text;
    }
  }
}

// Every single byte of the variable part set to 0xFF, then to 0x00: the
// evaluator either reads a (changed) value or refuses the row.
TEST(ExpressionHostileRows, AnyDamagedByteIsReadSafely) {
  const std::vector<std::string> texts = {
      R"(Name =~ "^e" && Mac == "0x001122aabbcc")",
      R"(Owner == "0x1 0x2 0x1 0x2 0x3 0xffffffff" || Link.Peer in Peers)",
      R"(Link.Speed == 1000 && Link.Media == "copper" && 4 in Link.Lanes)",
      "Link.Lanes[2] == 4 && len(Raw) == 6",
      "Vlans[2] == -30 && 0 in Masks && -1 in Offsets && 0 in Sizes && 0.5 in Loads",
      R"(36.6 in Temps && "uplink" in Aliases && "0x0102" in Keys)",
      R"("inet6" in Addresses.Family || 24 in Addresses.Prefix || Addresses[1].Prefix == 64)",
      R"(Addresses[0].Gateway == "0x0a000001" && Path =~ "temp")",
  };
  std::vector<compiled_expression> expressions(texts.size());
  test_table table = interfaces_table();
  for (size_t at = 0; at < texts.size(); ++at) {
    ASSERT_EQ(cu_comp_expr_1(texts[at].c_str(), 0, &test_table::answer, &table,
                             &expressions[at].p_expression),
              0)
        << texts[at];
  }
  const test_row pristine = interfaces_row();
  for (const unsigned char filler : {0xFF, 0x00}) {
    for (size_t position = 0; position < pristine.indirect.size(); ++position) {
      test_row row = pristine;
      row.indirect[position] = filler;
      for (size_t at = 0; at < texts.size(); ++at) {
        uint32_t matched = 0;
        const int32_t result =
            cu_exec_expr_1(expressions[at].p_expression, CU_EXPR_MODE_ENCODED_SLOTS, row.slots(),
                           row.total_slots, &matched, row.indirect.data());
        EXPECT_TRUE(result == 0 || result == CU_RESULT_VALUE_MISSING ||
                    result == CU_RESULT_INDEX_OUT_OF_RANGE)
            << texts[at] << " with byte " << position << " = " << int{filler} << ": " << result;
      }
    }
  }
}

}  // namespace
