// cu_expression_test_table.h - what the expression tests share: a table of
// columns answering the compiler's callback as the registry does, client
// values (built as the codec tests build them) encoded with libqv_pmsg into
// a row record laid out like the
// registry's (a 4-byte header word, then the slots, so that slots are not
// 8-byte aligned; the variable part in a block of its own size), and one
// realistic row with a column of every type.

#ifndef CU_EXPRESSION_TEST_TABLE_H
#define CU_EXPRESSION_TEST_TABLE_H

#include <cstdint>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "pmsg_test_values.h"
#include "qv_cu.h"
#include "qv_cu_expression.h"
#include "qv_pmsg.h"

struct test_column {
  std::string name;
  qv_data_type_t type;
  std::vector<std::pair<std::string, qv_data_type_t>> fields;  // of a structured column
};

// The callback's view of a table; records every question it is asked.
class test_table {
 public:
  explicit test_table(std::vector<test_column> columns) : columns_(std::move(columns)) {}

  struct question {
    std::string name;
    uint32_t length;
    uint32_t parent_id;
    bool operator==(const question &) const = default;
  };
  std::vector<question> questions;

  static int32_t answer(void *p_token, const char *p_name, uint32_t length, uint32_t parent_id,
                        cu_validate_data_t *p_data);

 private:
  std::vector<test_column> columns_;
};

// Owns a compiled expression.
struct compiled_expression {
  cu_expression_t *p_expression = nullptr;
  compiled_expression() = default;
  compiled_expression(const compiled_expression &) = delete;
  compiled_expression &operator=(const compiled_expression &) = delete;
  ~compiled_expression() { cu_free_expr_1(p_expression, 0); }
};

// A fixed-size value: number<int32_t>(-30), number<float>(0.1f).
template <typename Number>
qv_value_t number(Number value) {
  qv_value_t result{};
  std::memcpy(&result, &value, sizeof value);
  return result;
}

struct test_row {
  std::vector<unsigned char> record;    // header word, then the slots
  std::vector<unsigned char> indirect;  // the variable part, exactly as long as the bodies
  uint32_t total_slots = 0;
  const unsigned char *slots() const { return record.data() + 4; }
  // Where slot `index`'s body lies in `indirect`.
  uint32_t body_offset(uint32_t index) const;
};

// A row as the batch call reads it: one block with the 4-byte header word,
// the slots, and the indirect area right after them.
struct laid_out_row {
  std::vector<unsigned char> bytes;
  uint32_t total_slots = 0;
  const unsigned char *slots() const { return bytes.data() + 4; }
  uint32_t indirect_offset() const { return 4 + 8 * total_slots; }
  const unsigned char *indirect() const { return bytes.data() + indirect_offset(); }
};
laid_out_row lay_out(const test_row &row);

// Encodes the cells with qv_pmsg_build_conv_protocol_value_1 (a failure is
// reported as a test failure).
test_row encode_row(const std::vector<std::pair<int32_t, qv_value_t>> &cells);

// The "interfaces" table: a column of every type 2 to 22 (see the .cpp).
test_table interfaces_table();
// Its one row.
test_row interfaces_row();

// Compiling and evaluating in one go.
struct outcome {
  int32_t compiled;
  int32_t evaluated;
  uint32_t matched;
};
outcome run(test_table &table, const std::string &text, const test_row &row);

#endif  // CU_EXPRESSION_TEST_TABLE_H
