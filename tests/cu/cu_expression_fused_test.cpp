// The fused tests the compiler makes of comparisons with constants, and the
// batch call that runs them, against the stack machine, which evaluates
// every program the general way. Every comparison operator, with the column
// on either side, on every numeric column type, with constants at and beyond
// each type's limits, across signedness, fractions, NaN, infinities and
// signed zeros; strings and binaries equal, prefixes, longer and empty;
// conjunctions where a missing value or a damaged string comes before or
// after a false test. Each row must get the same result code and verdict
// from both, and the same verdict from the batch call. Then the batch call's
// own arguments.

#include <gtest/gtest.h>

#include <algorithm>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <limits>
#include <random>
#include <string>
#include <vector>

#include "cu_expression_test_table.h"
#include "cu_i_expression.h"

namespace {

// Column positions are slot indexes; Late is the last column, so a row
// evaluated with one slot fewer lacks it.
test_table typed_table() {
  return test_table({{"I32", QV_INT32, {}},
                     {"U32", QV_UINT32, {}},
                     {"I64", QV_INT64, {}},
                     {"U64", QV_UINT64, {}},
                     {"F32", QV_FLOAT32, {}},
                     {"F64", QV_FLOAT64, {}},
                     {"Name", QV_CHAR_PTR, {}},
                     {"Raw", QV_BINARY_PTR, {}},
                     {"Late", QV_INT32, {}}});
}
constexpr uint32_t Name_Column = 6;

constexpr double Nan = std::numeric_limits<double>::quiet_NaN();
constexpr double Infinity = std::numeric_limits<double>::infinity();

// Values at the edges of each type; row k takes the k-th of each list
// (cycling), so the lists' different lengths mix them.
const std::vector<int32_t> Int32_Values = {INT32_MIN, INT32_MIN + 1, -1,       0, 1,
                                           7,         INT32_MAX - 1, INT32_MAX};
const std::vector<uint32_t> Uint32_Values = {0, 1, 7, 2147483648u, UINT32_MAX - 1, UINT32_MAX};
const std::vector<int64_t> Int64_Values = {INT64_MIN, INT64_MIN + 1,    -4294967296, -1, 0,
                                           1,         9007199254740993, INT64_MAX};
const std::vector<uint64_t> Uint64_Values = {
    0, 1, 7, 9007199254740993u, 9223372036854775808u, UINT64_MAX - 1, UINT64_MAX};
const std::vector<float> Float_Values = {-INFINITY, -FLT_MAX, -1.5f, -0.0f,
                                         0.0f,      0.1f,     2.5f,  16777216.0f,
                                         FLT_MAX,   INFINITY, NAN,   -2147483648.0f};
const std::vector<double> Double_Values = {-Infinity,
                                           -1e300,
                                           -9223372036854775808.0,
                                           -2.5,
                                           -0.0,
                                           0.0,
                                           0.1,
                                           2.5,
                                           9007199254740992.0,
                                           18446744073709551616.0,
                                           Infinity,
                                           Nan,
                                           4294967295.0};
const std::vector<std::string> Name_Values = {"", "a", "ab", "abc", "b", "eth0", "ab\x01"};
const std::vector<std::string> Raw_Values = {"", std::string(1, '\0'), std::string("\x00\x01", 2),
                                             "\x01", "ab"};
const std::vector<int32_t> Late_Values = {0, 5, -5};

constexpr size_t Total_Rows = 13;  // the longest list

template <typename Value>
const Value &cycled(const std::vector<Value> &values, size_t row) {
  return values[row % values.size()];
}

// Every row, then every row again with its Name without the NUL that ends
// a stored string (a damaged body, which no comparison of it may pass).
std::vector<laid_out_row> typed_rows() {
  std::vector<laid_out_row> rows;
  for (size_t row = 0; row < Total_Rows; ++row) {
    value_arena values;
    rows.push_back(lay_out(encode_row({
        {QV_INT32, number(cycled(Int32_Values, row))},
        {QV_UINT32, number(cycled(Uint32_Values, row))},
        {QV_INT64, number(cycled(Int64_Values, row))},
        {QV_UINT64, number(cycled(Uint64_Values, row))},
        {QV_FLOAT32, number(cycled(Float_Values, row))},
        {QV_FLOAT64, number(cycled(Double_Values, row))},
        {QV_CHAR_PTR, values.string(cycled(Name_Values, row))},
        {QV_BINARY_PTR, values.binary(cycled(Raw_Values, row))},
        {QV_INT32, number(cycled(Late_Values, row))},
    })));
  }
  for (size_t row = 0; row < Total_Rows; ++row) {
    laid_out_row damaged = rows[row];
    uint32_t offset;
    uint32_t length;
    std::memcpy(&offset, damaged.slots() + 8 * Name_Column, sizeof offset);
    std::memcpy(&length, damaged.slots() + 8 * Name_Column + 4, sizeof length);
    damaged.bytes[damaged.indirect_offset() + offset + length - 1] = 'x';
    rows.push_back(std::move(damaged));
  }
  return rows;
}

const char *const Comparisons[] = {"==", "!=", "<", "<=", ">", ">="};

const char *const Number_Literals[] = {"0",
                                       "1",
                                       "-1",
                                       "7",
                                       "2147483647",
                                       "2147483648",
                                       "-2147483648",
                                       "-2147483649",
                                       "4294967295",
                                       "4294967296",
                                       "9223372036854775807",
                                       "9223372036854775808",
                                       "-9223372036854775808",
                                       "18446744073709551615",
                                       "9007199254740993",
                                       "16777217",
                                       "2.5",
                                       "-2.5",
                                       "0.5",
                                       "1.5",
                                       "0.1",
                                       "-0.0",
                                       "0.0",
                                       "1e300",
                                       "-1e300",
                                       "inf",
                                       "-inf",
                                       "nan",
                                       "-nan",
                                       "18446744073709551616.0",
                                       "-9223372036854777856.0",
                                       "9223372036854775808.0",
                                       "4294967295.5",
                                       "-2147483648.5",
                                       "2147483647.5",
                                       "9007199254740992.0",
                                       "-4294967296.0",
                                       "1e19"};

const char *const Name_Literals[] = {"''", "'a'", "'ab'", "'abc'", "'abcd'", "'b'", "'eth0'"};
const char *const Raw_Literals[] = {"'0x'",   "'0x00'",   "'0x0001'",
                                    "'0x01'", "'0x6162'", "'0x616263'"};

// What one text does on every row, by both evaluators and by the batch.
struct differential {
  int compiled = 0;
  int fused = 0;  // of those compiled, how many have fused tests

  void check(const std::string &text, const std::vector<laid_out_row> &rows) {
    test_table table = typed_table();
    compiled_expression expression;
    if (cu_comp_expr_1(text.c_str(), 0, &test_table::answer, &table, &expression.p_expression) !=
        0) {
      return;
    }
    ++compiled;
    const cu_expression_t &program = *expression.p_expression;
    fused += program.fused_tests.empty() ? 0 : 1;
    // Each row whole and without its last slot (Late missing).
    for (const uint32_t missing : {0u, 1u}) {
      std::vector<const void *> pointers;
      std::vector<unsigned char> expected_verdicts;
      for (size_t row = 0; row < rows.size(); ++row) {
        const laid_out_row &laid = rows[row];
        const uint32_t total_slots = laid.total_slots - missing;
        uint32_t general = 99;
        uint32_t fast = 99;
        const int32_t general_result =
            cu_i_interpret_encoded(program, laid.slots(), total_slots, laid.indirect(), &general);
        const int32_t fast_result =
            cu_exec_expr_1(expression.p_expression, CU_EXPR_MODE_ENCODED_SLOTS, laid.slots(),
                           total_slots, &fast, laid.indirect());
        ASSERT_EQ(fast_result, general_result)
            << text << " on row " << row << " missing " << missing;
        if (general_result == 0) {
          ASSERT_EQ(fast, general) << text << " on row " << row << " missing " << missing;
        }
        pointers.push_back(laid.bytes.data());
        expected_verdicts.push_back(general_result == 0 && general == 1 ? 1 : 0);
      }
      // The batch call with the row layout: slots at 4, the indirect area
      // after the slots (all rows have as many slots).
      std::vector<unsigned char> verdicts(rows.size(), 7);
      ASSERT_EQ(cu_exec_expr_rows_1(
                    expression.p_expression, CU_EXPR_MODE_ENCODED_SLOTS, pointers.data(),
                    sizeof(void *), static_cast<uint32_t>(rows.size()), 4,
                    rows[0].total_slots - missing, rows[0].indirect_offset(), verdicts.data()),
                0);
      ASSERT_EQ(verdicts, expected_verdicts) << text << " missing " << missing;
    }
  }
};

TEST(ExpressionFusedTests, NumericComparisonsAgreeWithTheStackMachine) {
  const std::vector<laid_out_row> rows = typed_rows();
  differential numbers;
  for (const char *column : {"I32", "U32", "I64", "U64", "F32", "F64", "Late"}) {
    for (const char *comparison : Comparisons) {
      for (const char *literal : Number_Literals) {
        numbers.check(std::string(column) + " " + comparison + " " + literal, rows);
        numbers.check(std::string(literal) + " " + comparison + " " + column, rows);
        if (HasFatalFailure()) {
          return;
        }
      }
    }
  }
  // Every literal compiles, and every comparison is fused but those of a
  // float column with the three integers no double holds (2^63 - 1,
  // 2^64 - 1 and 2^53 + 1; on either side, six operators, two columns).
  EXPECT_EQ(numbers.compiled, static_cast<int>(7 * 6 * std::size(Number_Literals) * 2));
  EXPECT_EQ(numbers.fused, numbers.compiled - 3 * 6 * 2 * 2);
}

TEST(ExpressionFusedTests, StringAndBinaryComparisonsAgreeWithTheStackMachine) {
  const std::vector<laid_out_row> rows = typed_rows();
  differential bytes;
  for (const char *comparison : Comparisons) {
    for (const char *literal : Name_Literals) {
      bytes.check(std::string("Name ") + comparison + " " + literal, rows);
      bytes.check(std::string(literal) + " " + comparison + " Name", rows);
    }
    for (const char *literal : Raw_Literals) {
      bytes.check(std::string("Raw ") + comparison + " " + literal, rows);
      bytes.check(std::string(literal) + " " + comparison + " Raw", rows);
    }
  }
  // Equality and inequality are fused; the orderings run on the stack
  // machine alone.
  EXPECT_EQ(bytes.compiled, 6 * (7 + 6) * 2);
  EXPECT_EQ(bytes.fused, 2 * (7 + 6) * 2);
}

// Random criteria of two to four comparisons joined by && and ||, some
// parenthesised, with the same seed on every run: conjunctions written
// left to right are fused (and the merged ranges of one column with them);
// every other shape must be left to the stack machine, or agree with it.
TEST(ExpressionFusedTests, ConjunctionsAgreeWithTheStackMachine) {
  const std::vector<laid_out_row> rows = typed_rows();
  const std::vector<std::string> terms = {
      "I32 > -1",      "I32 <= 7",          "I32 != 0",     "7 > I32",        "U32 >= 7",
      "U32 < -1",      "I64 > 2.5",         "I64 < 1e19",   "U64 != 1",       "U64 >= 1.5",
      "F32 < 0.1",     "F32 == -0.0",       "F64 != nan",   "F64 >= -inf",    "Late > 0",
      "Late == 5",     "Late < 2147483648", "Name != 'ab'", "Name == 'eth0'", "'' == Name",
      "Raw != '0x01'", "Raw == '0x'",       "I32 >= 0",     "I32 < 5"};
  std::mt19937 random(17);
  auto pick = [&](size_t limit) { return static_cast<size_t>(random() % limit); };
  differential conjunctions;
  differential others;
  for (int round = 0; round < 600; ++round) {
    const size_t total_terms = 2 + pick(3);
    const bool only_and = round % 2 == 0;
    std::string text = terms[pick(terms.size())];
    for (size_t term = 1; term < total_terms; ++term) {
      const std::string next = terms[pick(terms.size())];
      const char *joint = only_and || pick(2) == 0 ? " && " : " || ";
      switch (only_and ? pick(2) : pick(4)) {
        case 0:
          text += joint + next;
          break;
        case 1:
          text = "(" + text + ")" + joint + next;
          break;
        case 2:
          text = next + joint + "(" + text + ")";
          break;
        default:
          text = "!(" + text + ")" + joint + next;
          break;
      }
    }
    (only_and ? conjunctions : others).check(text, rows);
    if (HasFatalFailure()) {
      return;
    }
  }
  EXPECT_EQ(conjunctions.fused, conjunctions.compiled);
  EXPECT_EQ(conjunctions.compiled, 300);
  // Nesting on the right, ||, and ! are not conjunctions of the program's
  // shape; a few of these texts still are (all && on the left).
  EXPECT_GT(others.compiled - others.fused, 200);
}

TEST(ExpressionFusedTests, RangesOfOneColumnAreMergedOnlyWhenTheyFollowEachOther) {
  test_table table = typed_table();
  auto fused_tests_of = [&](const char *text) {
    compiled_expression expression;
    EXPECT_EQ(cu_comp_expr_1(text, 0, &test_table::answer, &table, &expression.p_expression), 0)
        << text;
    return expression.p_expression != nullptr ? expression.p_expression->fused_tests.size()
                                              : size_t{99};
  };
  EXPECT_EQ(fused_tests_of("I32 >= 10 && I32 < 20"), 1u);
  EXPECT_EQ(fused_tests_of("I32 >= 10 && I32 < 20 && I32 != 15"), 2u);  // != is not a range
  EXPECT_EQ(fused_tests_of("I32 >= 10 && Late > 0 && I32 < 20"), 3u);
  EXPECT_EQ(fused_tests_of("I32 > 5 && I32 < 3"), 1u);  // no value: a test that never holds
  EXPECT_EQ(fused_tests_of("Name != 'a' && I32 >= 10 && I32 < 20"), 2u);
}

// The batch call: its argument checks (nothing written on a fault), null
// row pointers, pointers that are members of larger structures, and a
// program the stack machine runs.
TEST(ExpressionFusedTests, TheBatchCallChecksItsArgumentsAndReadsPointersByStride) {
  const std::vector<laid_out_row> rows = typed_rows();
  test_table table = typed_table();
  compiled_expression fused;
  compiled_expression general;
  ASSERT_EQ(cu_comp_expr_1("I32 >= 0 && Name != 'a'", 0, &test_table::answer, &table,
                           &fused.p_expression),
            0);
  ASSERT_EQ(cu_comp_expr_1("I32 % 2 == 1 || Name =~ '^a'", 0, &test_table::answer, &table,
                           &general.p_expression),
            0);
  ASSERT_FALSE(fused.p_expression->fused_tests.empty());
  ASSERT_TRUE(general.p_expression->fused_tests.empty());

  const laid_out_row &row = rows[5];  // I32 7, Name "eth0"
  const void *pointers[1] = {row.bytes.data()};
  const uint32_t slots = row.total_slots;
  const uint32_t indirect = row.indirect_offset();
  unsigned char verdicts[4] = {7, 7, 7, 7};
  EXPECT_EQ(cu_exec_expr_rows_1(nullptr, 16, pointers, 8, 1, 4, slots, indirect, verdicts),
            CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(
      cu_exec_expr_rows_1(fused.p_expression, 16, nullptr, 8, 1, 4, slots, indirect, verdicts),
      CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(
      cu_exec_expr_rows_1(fused.p_expression, 16, pointers, 8, 1, 4, slots, indirect, nullptr),
      CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(
      cu_exec_expr_rows_1(fused.p_expression, 8, pointers, 8, 1, 4, slots, indirect, verdicts),
      CU_RESULT_BAD_MODE);
  EXPECT_EQ(verdicts[0], 7);
  // No rows: nothing is read or written, and null arrays are fine.
  EXPECT_EQ(cu_exec_expr_rows_1(fused.p_expression, 16, nullptr, 8, 0, 4, slots, indirect, nullptr),
            0);

  // Pointers inside structures 24 bytes apart, some null: a null pointer
  // is a row that does not match, in either kind of program.
  struct entry {
    uint64_t before;
    const void *p_row;
    uint64_t after;
  };
  const entry entries[4] = {{1, row.bytes.data(), 2},
                            {3, nullptr, 4},
                            {5, rows[1].bytes.data(), 6},  // I32 INT32_MIN + 1
                            {7, row.bytes.data(), 8}};
  EXPECT_EQ(cu_exec_expr_rows_1(fused.p_expression, 16, &entries[0].p_row, sizeof(entry), 4, 4,
                                slots, indirect, verdicts),
            0);
  EXPECT_EQ(std::vector<unsigned char>(verdicts, verdicts + 4),
            (std::vector<unsigned char>{1, 0, 0, 1}));
  std::fill(verdicts, verdicts + 4, 7);
  EXPECT_EQ(cu_exec_expr_rows_1(general.p_expression, 16, &entries[0].p_row, sizeof(entry), 4, 4,
                                slots, indirect, verdicts),
            0);
  EXPECT_EQ(std::vector<unsigned char>(verdicts, verdicts + 4),
            (std::vector<unsigned char>{1, 0, 1, 1}));

  // Rows with fewer slots than a test reads do not match.
  std::fill(verdicts, verdicts + 4, 7);
  EXPECT_EQ(cu_exec_expr_rows_1(fused.p_expression, 16, &entries[0].p_row, sizeof(entry), 4, 4,
                                Name_Column, indirect, verdicts),
            0);
  EXPECT_EQ(std::vector<unsigned char>(verdicts, verdicts + 4),
            (std::vector<unsigned char>{0, 0, 0, 0}));
}

}  // namespace
