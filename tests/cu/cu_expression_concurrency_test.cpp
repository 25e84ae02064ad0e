// One compiled expression evaluated by several threads at once, row by row
// and in batches, by fused tests and on the stack machine (the
// ThreadSanitizer build checks that nothing is written while they share
// it), each thread getting the answers a single thread gets.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include "cu_expression_test_table.h"
#include "cu_i_expression.h"

namespace {

TEST(ExpressionConcurrency, ThreadsShareOneCompiledExpression) {
  test_table table(
      {{"Age", QV_INT32, {}}, {"Name", QV_CHAR_PTR, {}}, {"Scores", QV_FLOAT64_ARRAY, {}}});
  std::vector<test_row> rows;
  for (int index = 0; index < 400; ++index) {
    value_arena values;
    const std::string name = std::string(1, static_cast<char>('a' + index % 26)) + "user";
    rows.push_back(encode_row(
        {{QV_INT32, number<int32_t>(index % 90)},
         {QV_CHAR_PTR, values.string(name)},
         {QV_FLOAT64_ARRAY, values.array({number<double>(index % 7), number<double>(2.5)})}}));
  }
  // One program of the shape the compiler fuses, one only the stack
  // machine runs.
  compiled_expression fused;
  compiled_expression general;
  ASSERT_EQ(cu_comp_expr_1("Age >= 10 && Age < 60 && Name != 'buser'", 0, &test_table::answer,
                           &table, &fused.p_expression),
            0);
  ASSERT_EQ(cu_comp_expr_1(R"(Age > 30 && Name =~ "^[a-m]" && (5 in Scores || Age % 2 == 0))", 0,
                           &test_table::answer, &table, &general.p_expression),
            0);
  std::vector<laid_out_row> laid_out_rows;
  std::vector<const void *> pointers;
  for (const test_row &row : rows) {
    laid_out_rows.push_back(lay_out(row));
  }
  for (const laid_out_row &row : laid_out_rows) {
    pointers.push_back(row.bytes.data());
  }

  // Row by row and in one batch call, for both programs: 0 or 1 for each
  // row, 3 for a failed call.
  auto evaluate_all = [&](std::vector<uint32_t> &answers) {
    answers.clear();
    for (const compiled_expression *p_compiled : {&fused, &general}) {
      for (const test_row &row : rows) {
        uint32_t answer = 2;
        if (cu_exec_expr_1(p_compiled->p_expression, CU_EXPR_MODE_ENCODED_SLOTS, row.slots(),
                           row.total_slots, &answer, row.indirect.data()) != 0) {
          answer = 3;
        }
        answers.push_back(answer);
      }
      std::vector<unsigned char> verdicts(rows.size(), 2);
      const bool called =
          cu_exec_expr_rows_1(p_compiled->p_expression, CU_EXPR_MODE_ENCODED_SLOTS, pointers.data(),
                              sizeof(void *), static_cast<uint32_t>(rows.size()), 4,
                              laid_out_rows[0].total_slots, laid_out_rows[0].indirect_offset(),
                              verdicts.data()) == 0;
      for (const unsigned char verdict : verdicts) {
        answers.push_back(called ? verdict : 3);
      }
    }
  };
  // What one thread gets (the language tests hold it right): some rows
  // match, some do not, none fails.
  std::vector<uint32_t> expected;
  evaluate_all(expected);
  const auto matches = std::count(expected.begin(), expected.end(), 1u);
  const auto misses = std::count(expected.begin(), expected.end(), 0u);
  ASSERT_TRUE(matches > 0 && misses > 0 && matches + misses == std::ssize(expected));
  ASSERT_FALSE(fused.p_expression->fused_tests.empty());
  ASSERT_TRUE(general.p_expression->fused_tests.empty());

  constexpr int Threads = 8;
  std::vector<std::vector<uint32_t>> answers(Threads);
  std::vector<std::thread> threads;
  for (int thread = 0; thread < Threads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < 20; ++round) {
        evaluate_all(answers[thread]);
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  for (int thread = 0; thread < Threads; ++thread) {
    EXPECT_EQ(answers[thread], expected) << "thread " << thread;
  }
}

}  // namespace
