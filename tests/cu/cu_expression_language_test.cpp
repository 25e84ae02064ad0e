// The expression language on a row with a column of every type: each
// operator and comparison, structured-data fields and array elements, the
// literal forms that formatted criteria write ($i ... $rh: plain and fixed
// numbers, the shortest double with its exponent, inf and nan, quoted
// strings, hexadecimal binaries and handles), and the three results that
// mean "this row cannot match".

#include <gtest/gtest.h>

#include <string>

#include "cu_expression_test_table.h"

namespace {

constexpr uint32_t Match = 1, No_Match = 0;

// Each text compiles, and its evaluation on the row gives `evaluated` and
// `matched`.
template <typename... Texts>
void expect_outcome(int32_t evaluated, uint32_t matched, const Texts &...texts) {
  const test_row row = interfaces_row();
  for (const std::string &text : {std::string(texts)...}) {
    test_table table = interfaces_table();
    const outcome result = run(table, text, row);
    EXPECT_EQ(result.compiled, 0) << text;
    EXPECT_EQ(result.evaluated, evaluated) << text;
    EXPECT_EQ(result.matched, matched) << text;
  }
}

// Each text evaluates without fault, and the row matches it (Match) or not
// (No_Match).
template <typename... Texts>
void expect_row(uint32_t matched, const Texts &...texts) {
  expect_outcome(0, matched, texts...);
}

TEST(ExpressionValues, FixedColumnsCompareByValueAcrossWidthsAndSignedness) {
  expect_row(Match, "Id == 7", "Id < 8", "Id <= 7", "Count == 4000000000", "Count > Id",
             "Big < -4999999999", "Big == -5000000000", "Huge == 18446744073709551615",
             "Huge == 0xFFFFFFFFFFFFFFFF", "Huge > Big", "Ratio < 0.1000001", "Weight == 2.5",
             "Weight == 5 / 2.0", "Weight > 2", "Weight < Id", "Huge < 18446744073709551616.0",
             "Big < -4999999999.5", "-5000000000.5 < Big", "Weight < inf", "-inf < Big",
             "Weight != nan");
  // C would convert -1 to unsigned and say no.
  expect_row(Match, "-1 < Count");
  // The literal is rounded to the column's single precision.
  expect_row(Match, "Ratio == 0.1");
  // As $f and $d print numbers: six places, exponents, a signed nan.
  expect_row(Match, "Ratio == 0.100000", "Weight == 2.500000", "Big > -1e+10", "Huge < 1e+20",
             "Huge < 100000000000000000000.000000", "Weight != -nan");
  // No rounding of the integer to double.
  expect_row(Match, "9007199254740993 > 9007199254740992.0");
  expect_row(No_Match, "Id != 7", "Id > 7", "Id >= 8", "Huge == -1",
             "9007199254740993 == 9007199254740992.0", "Weight == nan", "nan < 1 || nan >= 1");
}

TEST(ExpressionValues, StringsBinariesAndHandles) {
  expect_row(Match, R"(Name == "eth0")", "Name == 'eth0'", R"(Name != "eth1")", R"(Name < "eth1")",
             R"(Name > "eth")", "'eth' < Name", R"(Path == 'C:\\temp\\\'x\'')",
             R"('\x65th0' == Name)", R"(Mac == "0x001122aabbcc")", R"(Mac == "0X001122AABBCC")",
             R"(Mac != "0x001122aabbcd")", R"(Mac > "0x0011")", R"("0x001122aabbcc" == Mac)",
             R"(Raw == "0x020009016869")", "len(Mac) == 6 && len(Raw) == 6 && len(Name) == 4",
             R"(Owner == "0x0001 0x0002 0x00000001 0x00000002 0x00000003 0xffffffff")",
             R"(Peers[1] == "0x0010 0x0000 0x00000009 0x00000009 0x00000009 0x00000009")",
             R"(Name =~ "^eth[0-9]+$")", R"(Name !~ "^wlan")", R"(Aliases[2] =~ "link$")",
             R"(Name =~ "^(e|x)+t{1,3}h[[:digit:]]{1,2}$" && Name =~ "^[^]a-d]+(0|1){,2}(x*)?$")",
             R"(Link.Media =~ "^cop" && Path =~ "\\temp")",
             R"(Path =~ "^([A-Z]+:)?(\\[a-z]+)+\\'x'$")");
  // Equality needs the same length as well as the same bytes: a prefix, a
  // longer value or the empty one is never equal, with the constant on
  // either side.
  expect_row(Match, R"(Name != "eth")", R"(Name != "eth00")", R"(Name != "")", R"("eth" != Name)",
             R"(Mac != "0x001122aabb")", R"(Mac != "0x")", R"(Aliases[1] != "uplink")");
  expect_row(No_Match, R"(Name == "eth")", R"(Name == "eth00")", R"(Name == "")",
             R"("eth" == Name)", R"("eth00" == Name)", R"(Mac == "0x001122aabb")",
             R"(Mac == "0x001122aabbcc00")", R"(Aliases[1] != "")");
  // Double quotes take backslashes as they are.
  expect_row(Match, R"(Path == "C:\temp\'x'")");
  // Handles compare by their identity words first.
  expect_row(Match, "Owner < Link.Peer");
  expect_row(No_Match, R"(Name >= "f")",
             R"(Owner == "0x0002 0x0001 0x00000001 0x00000002 0x00000003 0xffffffff")",
             R"(Name =~ "^wlan")", R"(Name =~ "ETH")");
}

TEST(ExpressionValues, StructuredFieldsArrayElementsAndMembership) {
  expect_row(Match, "Link.Speed == 1000", "Link.Up && Link.Speed >= 1000",
             R"(Link.Media == "copper")", "Link.Lanes[2] == 4",
             "len(Link.Lanes) == 3 && len(Link) == 6", "4 in Link.Lanes", "Vlans[0] == 10",
             "Vlans[2] == -30", "Vlans[Id - 5] == -30", "-30 in Vlans", "len(Vlans) == 3",
             "Masks[0] == 0xFFFFFF00", "(Masks[0] & 0xFF) == 0", "Offsets[1] == 1 << 40",
             "-1 in Offsets", "Sizes[1] == Huge", "18446744073709551615 in Sizes",
             "Loads[1] == 0.1", "0.1 in Loads", "Temps[0] == 36.6", "36.6 in Temps",
             R"("uplink" in Aliases)", R"("" in Aliases)", "Aliases[1] == ''",
             R"("0x0102" in Keys)", R"(Keys[1] == "0x")",
             R"("0x0000 0x0000 0x00000001 0x00000000 0x00000000 0x00000000" in Peers)",
             "Addresses[0].Prefix == 24", R"(Addresses[1].Family == "inet6")",
             R"(Addresses[0].Gateway == "0x0a000001")", R"("inet6" in Addresses.Family)",
             "len(Addresses) == 3 && len(Addresses[2]) == 1", "Id in [1, 7, 9]",
             R"(Name in ['lo', "eth0"])", R"(Mac in ["0x00", "0x001122aabbcc"])",
             "Big in [-5000000000]", "Ratio in [0.1]", "Weight in [2, 2.5]",
             R"(Owner in ["0x0001 0x0002 0x00000001 0x00000002 0x00000003 0xffffffff"])");
  // The third address has no Prefix: it does not count.
  expect_row(Match, "64 in Addresses.Prefix");
  expect_row(No_Match, "3 in Link.Lanes", "30 in Vlans", R"("lan" in Aliases)",
             "Link.Peer in Peers", "32 in Addresses.Prefix", "Id in [1, 2]", "Id in []");
  // C precedence: & binds looser than ==.
  expect_row(No_Match, "Masks[0] & 0xFF == 0");
}

TEST(ExpressionValues, ArithmeticBitwiseAndPrecedence) {
  expect_row(Match, "Id * 2 + 1 == 15", "Id + 2 * 3 == 13", "(Id + 2) * 3 == 27", "Id / 2 == 3",
             "Id % 4 == 3", "-Id / 2 == -3", "-7 % 3 == -1", "7 / -2 == -3", "Weight % 1 == 0.5",
             "Id - 10 == -3", "Count + Count == 8000000000", "Huge - 1 == 18446744073709551614",
             "-9223372036854775808 / -1 == 9223372036854775808", "1 << 63 < 0", "Huge >> 63 == 1",
             "-8 >> 1 == -4", "~0 == -1", "~Huge == 0", "(Id ^ 1) == 6", "(Id | 8) == 15",
             "(Id & 5) == 5", "Id << 2 == 28", "1 + 2 << 1 == 6", "Id < 8 == 1", "!(Id - 7)",
             "!!Weight", "+Id == 7", "- -Id == 7", "Id");
  // Unsigned minus unsigned may be negative.
  expect_row(Match, "Count - 4000000001 == -1");
  // Signed overflow moves on.
  expect_row(Match, "9223372036854775807 + 1 == 9223372036854775808");
  expect_row(No_Match, "!Id", "Weight - 2.5", "0");
}

TEST(ExpressionValues, LogicalOperatorsShortCircuit) {
  expect_row(Match, R"(Id == 7 && Name == "eth0")", R"(Id == 8 || Name == "eth0")",
             "Id == 8 || Id == 9 || Id == 7", "Id == 7 && Weight", "(Id == 7) + (Weight > 2) == 2",
             "(Id && 5) == 1", "(0 || Weight) == 1");
  // A comparison's 0 or 1 is a number like any other, also where && or ||
  // ends with it.
  expect_row(Match, "(Id > 3) * 5 == 5", "(Id > 9) * 5 == 0", "(Id == 7 && Id > 3) * 2 == 2",
             R"((Id == 8 || Name != "eth0") + 1 == 1)", "Id > 3 == 1", "(Id > 3) - (Id > 9) == 1");
  // The element past the end is never read.
  expect_row(Match, "Id == 7 || Vlans[9] == 0");
  expect_row(No_Match, R"(Id == 8 && Name == "eth0")", "Weight && 0");
  // The division is never reached.
  expect_row(No_Match, "Id == 8 && Id / 0");
}

// A long chain of one operator is a loop in the compiler and keeps the
// evaluation stack shallow, as machine-written criteria often are.
TEST(ExpressionValues, LongChainsCompileAndEvaluate) {
  std::string chain = "Id == 100000";
  for (int value = 1; value < 3000; ++value) {
    chain += " || Id == " + std::to_string(value * 2 + 1000);
  }
  expect_row(No_Match, chain);
  expect_row(Match, chain + " || Id == 7");
}

// Rows that cannot match: an arithmetic fault, a value the row does not
// hold, an index out of range.
TEST(ExpressionValues, RowsThatCannotMatchGiveSixSevenOrEight) {
  expect_outcome(CU_RESULT_ARITHMETIC_FAULT, No_Match, "Id / 0 == 1", "Id % (Id - 7)",
                 "Weight / 0 > 1", "Weight % 0", "1 << 64", "Id >> -1", "Huge + 1 > 0",
                 "Big * Big * Big > 0", "-Huge < 0", "-9223372036854775808 - 1 < 0",
                 "0 - Huge - Huge < 0");
  // Link.Legacy is stored with another type, Link.Extra not at all, and
  // Ghost lies beyond the row's slots.
  expect_outcome(CU_RESULT_VALUE_MISSING, No_Match, "Link.Legacy == 1", "Link.Extra == 1",
                 "Ghost == 1", "Addresses[2].Prefix == 24");
  expect_outcome(CU_RESULT_INDEX_OUT_OF_RANGE, No_Match, "Vlans[3] == 0", "Vlans[-1] == 0",
                 "Vlans[Huge] == 0", "Aliases[3] == ''", "Addresses[3].Prefix == 0",
                 "Link.Lanes[3] == 0");
}

}  // namespace
