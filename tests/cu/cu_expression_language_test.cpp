// The expression language on a row with a column of every type: each
// operator and comparison, structured-data fields and array elements, the
// literal forms that formatted criteria write, and the three results that
// mean "this row cannot match".

#include <gtest/gtest.h>

#include <climits>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "cu_expression_test_table.h"

namespace {

struct match_case {
  const char *text;
  uint32_t matches;
};

void expect_matches(const std::vector<match_case> &cases) {
  const test_row row = interfaces_row();
  for (const match_case &one : cases) {
    test_table table = interfaces_table();
    const outcome result = run(table, one.text, row);
    EXPECT_EQ(result.compiled, 0) << one.text;
    EXPECT_EQ(result.evaluated, 0) << one.text;
    EXPECT_EQ(result.matched, one.matches) << one.text;
  }
}

TEST(ExpressionValues, FixedColumnsCompareByValueAcrossWidthsAndSignedness) {
  expect_matches(
      {{"Id == 7", 1},
       {"Id != 7", 0},
       {"Id < 8", 1},
       {"Id <= 7", 1},
       {"Id > 7", 0},
       {"Id >= 8", 0},
       {"Count == 4000000000", 1},
       {"Count > Id", 1},
       {"-1 < Count", 1},  // C would convert -1 to unsigned and say no
       {"Big < -4999999999", 1},
       {"Big == -5000000000", 1},
       {"Huge == 18446744073709551615", 1},
       {"Huge == 0xFFFFFFFFFFFFFFFF", 1},
       {"Huge > Big", 1},
       {"Huge == -1", 0},
       {"Ratio == 0.1", 1},  // the literal is rounded to the column's single precision
       {"Ratio < 0.1000001", 1},
       {"Weight == 2.5", 1},
       {"Weight == 5 / 2.0", 1},
       {"Weight > 2", 1},
       {"Weight < Id", 1},
       {"9007199254740993 > 9007199254740992.0", 1},  // no rounding of the integer to double
       {"9007199254740993 == 9007199254740992.0", 0},
       {"Huge < 18446744073709551616.0", 1},
       {"Big < -4999999999.5", 1},
       {"-5000000000.5 < Big", 1},
       {"Weight < inf", 1},
       {"-inf < Big", 1},
       {"Weight == nan", 0},
       {"Weight != nan", 1},
       {"nan < 1 || nan >= 1", 0}});
}

TEST(ExpressionValues, StringsBinariesAndHandles) {
  expect_matches(
      {{R"(Name == "eth0")", 1},
       {"Name == 'eth0'", 1},
       {R"(Name != "eth1")", 1},
       {R"(Name < "eth1")", 1},
       {R"(Name > "eth")", 1},
       {R"(Name >= "f")", 0},
       {"'eth' < Name", 1},
       {R"(Path == "C:\temp\'x'")", 1},  // double quotes take backslashes as they are
       {R"(Path == 'C:\\temp\\\'x\'')", 1},
       {R"('\x65th0' == Name)", 1},
       {R"(Mac == "0x001122aabbcc")", 1},
       {R"(Mac == "0X001122AABBCC")", 1},
       {R"(Mac != "0x001122aabbcd")", 1},
       {R"(Mac > "0x0011")", 1},
       {R"("0x001122aabbcc" == Mac)", 1},
       {R"(Raw == "0x020009016869")", 1},
       {"len(Mac) == 6 && len(Raw) == 6 && len(Name) == 4", 1},
       {R"(Owner == "0x0001 0x0002 0x00000001 0x00000002 0x00000003 0xffffffff")", 1},
       {R"(Owner == "0x0002 0x0001 0x00000001 0x00000002 0x00000003 0xffffffff")", 0},
       {"Owner < Link.Peer", 1},  // identity words decide first
       {R"(Peers[1] == "0x0010 0x0000 0x00000009 0x00000009 0x00000009 0x00000009")", 1},
       {R"(Name =~ "^eth[0-9]+$")", 1},
       {R"(Name =~ "^wlan")", 0},
       {R"(Name !~ "^wlan")", 1},
       {R"(Name =~ "ETH")", 0},
       {R"(Aliases[2] =~ "link$")", 1},
       {R"(Name =~ "^(e|x)+t{1,3}h[[:digit:]]{1,2}$" && Name =~ "^[^]a-d]+(0|1){,2}(x*)?$")", 1},
       {R"(Link.Media =~ "^cop" && Path =~ "\\temp")", 1},
       {R"(Path =~ "^([A-Z]+:)?(\\[a-z]+)+\\'x'$")", 1}});
}

TEST(ExpressionValues, StructuredFieldsArrayElementsAndMembership) {
  expect_matches(
      {{"Link.Speed == 1000", 1},
       {"Link.Up && Link.Speed >= 1000", 1},
       {R"(Link.Media == "copper")", 1},
       {"Link.Lanes[2] == 4", 1},
       {"len(Link.Lanes) == 3 && len(Link) == 6", 1},
       {"4 in Link.Lanes", 1},
       {"3 in Link.Lanes", 0},
       {"Vlans[0] == 10", 1},
       {"Vlans[2] == -30", 1},
       {"Vlans[Id - 5] == -30", 1},
       {"-30 in Vlans", 1},
       {"30 in Vlans", 0},
       {"len(Vlans) == 3", 1},
       {"Masks[0] == 0xFFFFFF00", 1},
       {"Masks[0] & 0xFF == 0", 0},  // C precedence: & binds looser than ==
       {"(Masks[0] & 0xFF) == 0", 1},
       {"Offsets[1] == 1 << 40", 1},
       {"-1 in Offsets", 1},
       {"Sizes[1] == Huge", 1},
       {"18446744073709551615 in Sizes", 1},
       {"Loads[1] == 0.1", 1},
       {"0.1 in Loads", 1},
       {"Temps[0] == 36.6", 1},
       {"36.6 in Temps", 1},
       {R"("uplink" in Aliases)", 1},
       {R"("" in Aliases)", 1},
       {R"("lan" in Aliases)", 0},
       {"Aliases[1] == ''", 1},
       {R"("0x0102" in Keys)", 1},
       {R"(Keys[1] == "0x")", 1},
       {R"("0x0000 0x0000 0x00000001 0x00000000 0x00000000 0x00000000" in Peers)", 1},
       {"Link.Peer in Peers", 0},
       {"Addresses[0].Prefix == 24", 1},
       {R"(Addresses[1].Family == "inet6")", 1},
       {R"(Addresses[0].Gateway == "0x0a000001")", 1},
       {"64 in Addresses.Prefix", 1},  // the third address has no Prefix: it does not count
       {"32 in Addresses.Prefix", 0},
       {R"("inet6" in Addresses.Family)", 1},
       {"len(Addresses) == 3 && len(Addresses[2]) == 1", 1},
       {"Id in [1, 7, 9]", 1},
       {"Id in [1, 2]", 0},
       {"Id in []", 0},
       {R"(Name in ['lo', "eth0"])", 1},
       {R"(Mac in ["0x00", "0x001122aabbcc"])", 1},
       {"Big in [-5000000000]", 1},
       {"Ratio in [0.1]", 1},
       {"Weight in [2, 2.5]", 1},
       {R"(Owner in ["0x0001 0x0002 0x00000001 0x00000002 0x00000003 0xffffffff"])", 1}});
}

TEST(ExpressionValues, ArithmeticBitwiseAndPrecedence) {
  expect_matches(
      {{"Id * 2 + 1 == 15", 1},
       {"Id + 2 * 3 == 13", 1},
       {"(Id + 2) * 3 == 27", 1},
       {"Id / 2 == 3", 1},
       {"Id % 4 == 3", 1},
       {"-Id / 2 == -3", 1},
       {"-7 % 3 == -1", 1},
       {"7 / -2 == -3", 1},
       {"Weight % 1 == 0.5", 1},
       {"Id - 10 == -3", 1},
       {"Count - 4000000001 == -1", 1},  // unsigned minus unsigned may be negative
       {"Count + Count == 8000000000", 1},
       {"Huge - 1 == 18446744073709551614", 1},
       {"-9223372036854775808 / -1 == 9223372036854775808", 1},
       {"9223372036854775807 + 1 == 9223372036854775808", 1},  // signed overflow moves on
       {"1 << 63 < 0", 1},
       {"Huge >> 63 == 1", 1},
       {"-8 >> 1 == -4", 1},
       {"~0 == -1", 1},
       {"~Huge == 0", 1},
       {"(Id ^ 1) == 6", 1},
       {"(Id | 8) == 15", 1},
       {"(Id & 5) == 5", 1},
       {"Id << 2 == 28", 1},
       {"1 + 2 << 1 == 6", 1},
       {"Id < 8 == 1", 1},
       {"!Id", 0},
       {"!(Id - 7)", 1},
       {"!!Weight", 1},
       {"+Id == 7", 1},
       {"- -Id == 7", 1},
       {"Id", 1},
       {"Weight - 2.5", 0},
       {"0", 0}});
}

TEST(ExpressionValues, LogicalOperatorsShortCircuit) {
  expect_matches({
      {R"(Id == 7 && Name == "eth0")", 1},
      {R"(Id == 8 || Name == "eth0")", 1},
      {R"(Id == 8 && Name == "eth0")", 0},
      {"Id == 8 || Id == 9 || Id == 7", 1},
      {"Id == 7 && Weight", 1},
      {"(Id == 7) + (Weight > 2) == 2", 1},
      {"Weight && 0", 0},
      {"(Id && 5) == 1", 1},
      {"(0 || Weight) == 1", 1},
      {"Id == 8 && Id / 0", 0},        // the division is never reached
      {"Id == 7 || Vlans[9] == 0", 1}  // nor is the element
  });
}

// A long chain of one operator is a loop in the compiler and keeps the
// evaluation stack shallow, as machine-written criteria often are.
TEST(ExpressionValues, LongChainsCompileAndEvaluate) {
  std::string chain = "Id == 100000";
  for (int value = 1; value < 3000; ++value) {
    chain += " || Id == " + std::to_string(value * 2 + 1000);
  }
  expect_matches({{chain.c_str(), 0}, {(chain + " || Id == 7").c_str(), 1}});
}

struct cannot_match_case {
  const char *text;
  int32_t result;
};

TEST(ExpressionValues, RowsThatCannotMatchGiveSixSevenOrEight) {
  const std::vector<cannot_match_case> cases = {
      {"Id / 0 == 1", CU_RESULT_ARITHMETIC_FAULT},
      {"Id % (Id - 7)", CU_RESULT_ARITHMETIC_FAULT},
      {"Weight / 0 > 1", CU_RESULT_ARITHMETIC_FAULT},
      {"Weight % 0", CU_RESULT_ARITHMETIC_FAULT},
      {"1 << 64", CU_RESULT_ARITHMETIC_FAULT},
      {"Id >> -1", CU_RESULT_ARITHMETIC_FAULT},
      {"Huge + 1 > 0", CU_RESULT_ARITHMETIC_FAULT},
      {"Big * Big * Big > 0", CU_RESULT_ARITHMETIC_FAULT},
      {"-Huge < 0", CU_RESULT_ARITHMETIC_FAULT},
      {"-9223372036854775808 - 1 < 0", CU_RESULT_ARITHMETIC_FAULT},
      {"0 - Huge - Huge < 0", CU_RESULT_ARITHMETIC_FAULT},
      {"Link.Legacy == 1", CU_RESULT_VALUE_MISSING},  // stored with another type
      {"Link.Extra == 1", CU_RESULT_VALUE_MISSING},   // not stored at all
      {"Ghost == 1", CU_RESULT_VALUE_MISSING},        // beyond the row's slots
      {"Addresses[2].Prefix == 24", CU_RESULT_VALUE_MISSING},
      {"Vlans[3] == 0", CU_RESULT_INDEX_OUT_OF_RANGE},
      {"Vlans[-1] == 0", CU_RESULT_INDEX_OUT_OF_RANGE},
      {"Vlans[Huge] == 0", CU_RESULT_INDEX_OUT_OF_RANGE},
      {"Aliases[3] == ''", CU_RESULT_INDEX_OUT_OF_RANGE},
      {"Addresses[3].Prefix == 0", CU_RESULT_INDEX_OUT_OF_RANGE},
      {"Link.Lanes[3] == 0", CU_RESULT_INDEX_OUT_OF_RANGE}};
  const test_row row = interfaces_row();
  for (const cannot_match_case &one : cases) {
    test_table table = interfaces_table();
    const outcome result = run(table, one.text, row);
    EXPECT_EQ(result.compiled, 0) << one.text;
    EXPECT_EQ(result.evaluated, one.result) << one.text;
    EXPECT_EQ(result.matched, 0u) << one.text;
  }
}

// ---- The literals formatted criteria write ($i ... $rh) -----------------

template <typename... Arguments>
std::string format(const char *p_format, Arguments... arguments) {
  char text[512];
  std::snprintf(text, sizeof text, p_format, arguments...);
  return text;
}

TEST(ExpressionFormattedLiterals, EveryReplacementVariableKindParsesAndMatches) {
  const unsigned char mac[] = {0x00, 0x11, 0x22, 0xaa, 0xbb, 0xcc};
  std::string mac_text = "Mac == \"0x";
  for (unsigned char byte : mac) {
    mac_text += format("%.2x", byte);
  }
  mac_text += "\" && Keys[1] == \"0x\"";  // an empty binary writes no digit pairs
  const qv_resource_handle_t owner = {0x00020001u, {1, 2, 3, 0xFFFFFFFFu}};
  uint16_t halves[2];
  std::memcpy(halves, &owner.header, sizeof halves);  // storage order
  const std::vector<std::pair<const char *, std::string>> cases = {
      {"$i", format("Vlans[2] == %-d && Id == %-d", -30, 7)},
      {"$l", format("Big == %-lld", -5000000000LL)},
      {"$ui", format("Count == %-u", 4000000000u)},
      {"$ul", format("Huge == %-llu", ULLONG_MAX)},
      {"$f", format("Ratio == %-f && Weight == %-f", 0.1, 2.5)},
      {"$d", format("Weight == %-g && Temps[0] == %-g && Weight < %-g && Weight != %-g && "
                    "Weight != %-g && Big > %-g",
                    2.5, 36.6, INFINITY, NAN, -NAN, -1e10)},
      {"$s", format(R"(Name == "%s" && Path == "%s")", "eth0", "C:\\temp\\'x'")},
      {"$b", mac_text},
      {"$rh", format(R"(Owner == "0x%04x 0x%04x 0x%08x 0x%08x 0x%08x 0x%08x")", halves[0],
                     halves[1], owner.id.id1, owner.id.id2, owner.id.id3, owner.id.id4)}};
  const test_row row = interfaces_row();
  for (const auto &[kind, text] : cases) {
    test_table table = interfaces_table();
    const outcome result = run(table, text, row);
    EXPECT_EQ(result.compiled, 0) << kind << ": " << text;
    EXPECT_EQ(result.evaluated, 0) << kind << ": " << text;
    EXPECT_EQ(result.matched, 1u) << kind << ": " << text;
  }
}

}  // namespace
