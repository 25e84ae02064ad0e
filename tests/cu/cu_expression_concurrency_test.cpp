// One compiled expression evaluated by several threads at once (the
// ThreadSanitizer build checks that nothing is written while they share it),
// each thread getting the answers a single thread gets.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <thread>
#include <vector>

#include "cu_expression_test_table.h"

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
  compiled_expression expression;
  ASSERT_EQ(cu_comp_expr_1(R"(Age > 30 && Name =~ "^[a-m]" && (5 in Scores || Age % 2 == 0))", 0,
                           &test_table::answer, &table, &expression.p_expression),
            0);

  auto evaluate_all = [&](std::vector<uint32_t> &answers) {
    answers.assign(rows.size(), 2);
    for (size_t index = 0; index < rows.size(); ++index) {
      if (cu_exec_expr_1(expression.p_expression, CU_EXPR_MODE_ENCODED_SLOTS, rows[index].slots(),
                         rows[index].total_slots, &answers[index],
                         rows[index].indirect.data()) != 0) {
        answers[index] = 3;
      }
    }
  };
  // What one thread gets (the language tests hold it right): some rows
  // match, some do not, none fails.
  std::vector<uint32_t> expected;
  evaluate_all(expected);
  const auto matches = std::count(expected.begin(), expected.end(), 1u);
  const auto misses = std::count(expected.begin(), expected.end(), 0u);
  ASSERT_TRUE(matches > 0 && misses > 0 && matches + misses == std::ssize(rows));

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
