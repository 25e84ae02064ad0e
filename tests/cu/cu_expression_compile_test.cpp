// Compiling: every compile error code, the callback's questions, the limits
// on text and nesting, and the argument checks of the three functions.

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "cu_expression_test_table.h"

namespace {

// Each text fails to compile with `result` and leaves no expression.
template <typename... Texts>
void expect_compile_error(int32_t result, const Texts &...texts) {
  for (const std::string &text : {std::string(texts)...}) {
    test_table table = interfaces_table();
    cu_expression_t *p_expression = reinterpret_cast<cu_expression_t *>(&table);
    EXPECT_EQ(cu_comp_expr_1(text.c_str(), 0, &test_table::answer, &table, &p_expression), result)
        << text;
    EXPECT_EQ(p_expression, nullptr) << text;
  }
}

TEST(ExpressionCompile, ErrorsAreReportedByKind) {
  expect_compile_error(CU_RESULT_SYNTAX_ERROR, "Id ==", "(Id == 7", "Id == 7)", "Id = 7",
                       "Id == 7 Id", "", R"(Name == "eth0)", R"(Name == 'bad \q escape')",
                       R"(Name == '\x00')", "Id == 12abc", "Id == 0x", "Vlans[0 == 1", "Link. == 1",
                       "Id == 7 @");
  // The longest operator wins.
  expect_compile_error(CU_RESULT_SYNTAX_ERROR, "!~Id");
  // List entries are literals.
  expect_compile_error(CU_RESULT_SYNTAX_ERROR, "Id in [Count]");
  expect_compile_error(CU_RESULT_UNKNOWN_NAME, "Nope == 1", "Link.Nope == 1", "size(Name) == 1",
                       "infinity > 1");
  expect_compile_error(
      CU_RESULT_TYPE_MISMATCH, "Name == 1", "Name + 1 > 0", "Weight & 1", "Id << 1.5", "~Weight",
      "!Name", "-Name", "Name && 1", R"(Id =~ "7")", R"(Mac =~ "0x00")", "Vlans == 1", "Id[0] == 1",
      "Vlans[1.5] == 1", "Name.Field == 1", "Link.Media.Length == 1", "Addresses.Prefix[0] > 1",
      "Addresses[0].Gateway == Name", "Mac == Name", "Owner == Mac", "Link == Link", "len(Id) == 1",
      "Id in Aliases", "Link in Addresses", "Id in Count", "Id in ['7']");
  // The whole expression must be a number.
  expect_compile_error(CU_RESULT_TYPE_MISMATCH, "Name");
  // Patterns are literals.
  expect_compile_error(CU_RESULT_TYPE_MISMATCH, "Name =~ Path");
  // A projection is only for "in".
  expect_compile_error(CU_RESULT_TYPE_MISMATCH, "Addresses.Prefix > 1");
  expect_compile_error(
      CU_RESULT_BAD_LITERAL, R"(Mac == "0x123")", R"(Mac == "hello")", R"(Mac in ["0x00", "0xg0"])",
      R"(Owner == "0x1 0x2")", R"(Owner == "0x10000 0x0 0x0 0x0 0x0 0x0")",
      R"(Owner == "0x1 0x2 0x3 0x4 0x5 0x6 0x7")", R"(Owner == "0x1 0x2 0x3 0x4 0x5 0x123456789")",
      "Id == 18446744073709551616", "Id == 0x1FFFFFFFFFFFFFFFF", "Weight == 1e400",
      "-18446744073709551615 < Id");
  expect_compile_error(CU_RESULT_BAD_PATTERN, R"(Name =~ "(")", R"(Name =~ "(a)\1")",
                       R"(Name =~ "(a{200}){100}")",
                       R"x(Name =~ "((((((((((((((((a+)+)+)+)+)+)+)+)+)+)+)+)+)+)+)+)")x",
                       R"(Name =~ "x{99999999999999999999}")");
  // Each + doubles the piece.
  expect_compile_error(CU_RESULT_BAD_PATTERN, R"(Name =~ "a++++++++++++++++")");
  expect_compile_error(CU_RESULT_BAD_VARIABLE_TYPE, "Broken == 1");
}

TEST(ExpressionCompile, TheCallbackIsAskedAboutColumnsAndTheirFields) {
  test_table table = interfaces_table();
  compiled_expression expression;
  ASSERT_EQ(cu_comp_expr_1("Link.Speed > 1 && Addresses[0].Prefix == 24", 0, &test_table::answer,
                           &table, &expression.p_expression),
            0);
  const std::vector<test_table::question> expected = {{"Link", 4, CU_EXPR_NO_PARENT},
                                                      {"Speed", 5, 9},  // Link is column 9
                                                      {"Addresses", 9, CU_EXPR_NO_PARENT},
                                                      {"Prefix", 6, 20}};
  EXPECT_TRUE(table.questions == expected);
}

// "inf" and "nan" are literals only when the table has no column of that name.
TEST(ExpressionCompile, AColumnNamedInfWinsOverTheLiteral) {
  test_table table({{"inf", QV_INT32, {}}});
  const test_row row = encode_row({{QV_INT32, number<int32_t>(3)}});
  const outcome as_column = run(table, "inf == 3", row);
  EXPECT_EQ(as_column.compiled, 0);
  EXPECT_EQ(as_column.matched, 1u);
  const outcome as_literal = run(table, "nan != nan && inf < 4", row);
  EXPECT_EQ(as_literal.compiled, 0);
  EXPECT_EQ(as_literal.matched, 1u);
}

std::string nested(int depth, const std::string &core) {
  return std::string(depth, '(') + core + std::string(depth, ')');
}

TEST(ExpressionCompile, TextLengthAndNestingAreBounded) {
  const test_row row = interfaces_row();
  struct limit_case {
    std::string text;
    int32_t compiled;
  };
  std::string longest = "Id == 7";
  longest.resize(CU_EXPR_MAX_TEXT_BYTES, ' ');
  std::string unary_chain;
  for (int at = 0; at < CU_EXPR_MAX_NESTING; ++at) {
    unary_chain += "- ";
  }
  // Each level leaves eight operands waiting for the parenthesis to close.
  std::string wide;
  for (int at = 0; at < CU_EXPR_MAX_NESTING; ++at) {
    wide += "1 | 1 ^ 1 & 1 == 1 < 1 << 1 + 1 * (";
  }
  wide += "1" + std::string(CU_EXPR_MAX_NESTING, ')');
  const std::vector<limit_case> cases = {
      {longest, 0},
      {longest + " ", CU_RESULT_TOO_COMPLEX},
      {nested(CU_EXPR_MAX_NESTING, "Id == 7"), 0},
      {nested(CU_EXPR_MAX_NESTING + 1, "Id == 7"), CU_RESULT_TOO_COMPLEX},
      {"Vlans[" + nested(CU_EXPR_MAX_NESTING, "0") + "] == 10", CU_RESULT_TOO_COMPLEX},
      {unary_chain + "Id == 7", 0},
      {unary_chain + "- Id == 7", CU_RESULT_TOO_COMPLEX},
      {wide, CU_RESULT_TOO_COMPLEX}};
  for (const limit_case &one : cases) {
    test_table table = interfaces_table();
    const outcome result = run(table, one.text, row);
    EXPECT_EQ(result.compiled, one.compiled) << one.text.substr(0, 80);
    if (one.compiled == 0) {
      EXPECT_EQ(result.evaluated, 0);
      EXPECT_EQ(result.matched, 1u) << one.text.substr(0, 80);
    }
  }
}

int32_t throwing_callback(void *, const char *, uint32_t, uint32_t, cu_validate_data_t *) {
  throw std::runtime_error("callback failure");
}

TEST(ExpressionInterface, ArgumentsAreChecked) {
  test_table table = interfaces_table();
  cu_expression_t *p_expression = nullptr;
  EXPECT_EQ(cu_comp_expr_1(nullptr, 0, &test_table::answer, &table, &p_expression),
            CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(cu_comp_expr_1("Id == 7", 0, nullptr, &table, &p_expression), CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(cu_comp_expr_1("Id == 7", 0, &test_table::answer, &table, nullptr),
            CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(cu_comp_expr_1("Id == 7", 1, &test_table::answer, &table, &p_expression),
            CU_RESULT_BAD_FLAGS);
  EXPECT_EQ(cu_comp_expr_1("Id == 7", 0, &throwing_callback, nullptr, &p_expression),
            CU_RESULT_UNKNOWN_NAME);
  EXPECT_EQ(p_expression, nullptr);

  const test_row row = interfaces_row();
  compiled_expression fixed_only;
  compiled_expression reads_strings;
  ASSERT_EQ(cu_comp_expr_1("Id == 7", 0, &test_table::answer, &table, &fixed_only.p_expression), 0);
  ASSERT_EQ(
      cu_comp_expr_1("Name == 'eth0'", 0, &test_table::answer, &table, &reads_strings.p_expression),
      0);
  uint32_t matched = 99;
  EXPECT_EQ(cu_exec_expr_1(nullptr, 16, row.slots(), row.total_slots, &matched, nullptr),
            CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(matched, 0u);
  EXPECT_EQ(
      cu_exec_expr_1(fixed_only.p_expression, 16, row.slots(), row.total_slots, nullptr, nullptr),
      CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(
      cu_exec_expr_1(fixed_only.p_expression, 8, row.slots(), row.total_slots, &matched, nullptr),
      CU_RESULT_BAD_MODE);
  EXPECT_EQ(cu_exec_expr_1(reads_strings.p_expression, 16, row.slots(), row.total_slots, &matched,
                           nullptr),
            CU_RESULT_NULL_ARGUMENT);
  // Without variable-length variables the indirect area is not needed...
  EXPECT_EQ(
      cu_exec_expr_1(fixed_only.p_expression, 16, row.slots(), row.total_slots, &matched, nullptr),
      0);
  EXPECT_EQ(matched, 1u);
  // ...and a row without slots has no value to compare.
  EXPECT_EQ(cu_exec_expr_1(fixed_only.p_expression, 16, nullptr, 0, &matched, nullptr),
            CU_RESULT_VALUE_MISSING);
  EXPECT_EQ(matched, 0u);

  EXPECT_EQ(cu_free_expr_1(nullptr, 0), 0);
  EXPECT_EQ(cu_free_expr_1(fixed_only.p_expression, 1), CU_RESULT_BAD_FLAGS);
}

}  // namespace
