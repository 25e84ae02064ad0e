// cu_i_expression.h - the compiled form of a selection expression: a postfix
// program for a small stack machine, its constants and its compiled
// patterns. The compiler (cu_expression_compiler.cpp) builds it once; the
// evaluator (cu_expression_evaluator.cpp) runs it on encoded rows without
// changing it, which is what lets many threads share one compiled form.
// Also the values that live on the machine's stack and the numeric rules
// (cu_expression_numbers.cpp) that compiler and evaluator share.

#ifndef CU_I_EXPRESSION_H
#define CU_I_EXPRESSION_H

#include <regex.h>

#include <cstdint>
#include <deque>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "qv_cu.h"
#include "qv_cu_expression.h"

// The deepest evaluation stack a program may need; the evaluator keeps the
// stack in a fixed array, so evaluation never allocates.
constexpr uint32_t Cu_I_Max_Stack = 256;

// A compile failure, thrown inside the compiler and turned into its result
// code at the compiler's entry.
struct cu_i_compile_error {
  int32_t code;
};

// How a number on the stack is held. Integers of every stored width are
// widened to 64 bits; floats to double.
enum class cu_i_number : uint8_t { signed_integer, unsigned_integer, floating };

// One value on the evaluation stack (16 bytes): a number, or a byte range
// that points into the row or into the program's constants. Strings are
// followed by their NUL (at p_bytes[length]); a handle is 20 bytes in the
// layout of qv_resource_handle_t; arrays and structured values are their
// encoded bodies.
struct cu_i_value {
  union {
    int64_t integer;
    uint64_t unsigned_integer;
    double floating;
    const unsigned char *p_bytes;
  };
  uint32_t length;
  cu_i_number number;
};

enum class cu_i_comparison : uint8_t { equal, not_equal, less, less_equal, greater, greater_equal };

// What two operands of a comparison or a membership test are compared as.
enum class cu_i_compare_as : uint8_t { numbers, bytes, handles };

enum class cu_i_operation : uint8_t {
  push_constant,  // operand: constant index
  load_fixed,     // operand: slot index; data_type: a fixed-size type (2 to 7)
  load_variable,  // operand: slot index; data_type: a variable-length type (8 to 22)
  element,        // data_type: the array's type; pops index and array
  field,          // operand: the field's position; data_type: its declared type
  length,         // detail: 1 when the operand is an array or structured value (its count)
  negate,
  complement,
  logical_not,
  to_boolean,
  multiply,
  divide,
  remainder,
  add,
  subtract,
  shift_left,
  shift_right,
  bit_and,
  bit_xor,
  bit_or,
  compare,           // detail: cu_i_comparison; data_type: cu_i_compare_as
  compare_constant,  // as compare, with the right operand the constant `operand`
  match,             // operand: pattern index; detail: 1 for "does not match"
  in_array,          // data_type: the array's type; pops array and value
  in_list,        // operand: first entry of list_members; count: entries; detail: cu_i_compare_as
  in_projection,  // operand: field position; data_type: field type; pops array and value
  jump_if_false,  // operand: target; a false top becomes 0 and jumps, else it is popped
  jump_if_true,   // operand: target; a true top becomes 1 and jumps, else it is popped
};

struct cu_i_instruction {
  cu_i_operation operation;
  uint8_t detail;
  uint8_t data_type;
  uint32_t operand;
  uint32_t count;
};

// A regular expression compiled with regcomp; freed with it. `ready` says
// that regcomp succeeded (after a failure there is nothing to free).
struct cu_i_pattern {
  regex_t compiled;
  bool ready = false;
  cu_i_pattern() = default;
  cu_i_pattern(const cu_i_pattern &) = delete;
  cu_i_pattern &operator=(const cu_i_pattern &) = delete;
  ~cu_i_pattern() {
    if (ready) {
      regfree(&compiled);
    }
  }
};

// A comparison of one row value with a constant, decided for the value's
// stored type when the program was compiled (cu_expression_fusion.cpp), so
// that judging a row needs neither the stack nor the general number order.
enum class cu_i_fused_kind : uint8_t {
  // A 32- or 64-bit integer slot: the test holds when the value, as a 64-bit
  // pattern, lies in [low, low + span] (or outside it, when negated).
  signed_32,
  unsigned_32,
  signed_64,
  unsigned_64,
  // A float or double slot compared with `bound` by `comparison`.
  floating_32,
  floating_64,
  // A string or binary body equal to the constant's bytes (or different
  // from them, when negated).
  string_bytes,
  plain_bytes,
};

struct cu_i_fused_test {
  cu_i_fused_kind kind;
  cu_i_comparison comparison;  // floating kinds
  bool negated;                // integer and byte kinds
  uint32_t slot;
  uint64_t low;                  // integer kinds, in the value's two's-complement pattern
  uint64_t span;                 // integer kinds: the range's last value minus its first
  double bound;                  // floating kinds
  const unsigned char *p_bytes;  // byte kinds: the constant's bytes and their length
  uint32_t length;
};

struct cu_expression_struct_t {
  std::vector<cu_i_instruction> code;
  std::vector<cu_i_value> constants;
  // The bytes that string, binary and handle constants point into. A deque
  // never moves its elements, so those pointers stay valid as it grows.
  std::deque<std::string> constant_bytes;
  std::vector<uint32_t> list_members;  // constant indexes of the `in [...]` lists
  std::vector<std::unique_ptr<cu_i_pattern>> patterns;
  uint32_t stack_depth = 0;     // the most values the program holds at once
  bool reads_indirect = false;  // some variable is variable-length
  // The whole program as tests that must all hold, in program order, when
  // it has that shape; empty when only the stack machine can run it.
  std::vector<cu_i_fused_test> fused_tests;
  uint32_t first_slot_read = 0;  // the slot a batch asks the cache for ahead of time
};

// ---- Compiler and evaluator ---------------------------------------------

// Compiles `text` (already checked for length) into `compiled`. Returns 0
// or a compile result code; may throw std::bad_alloc.
int32_t cu_i_compile_expression(std::string_view text, cu_validate_callback_t callback,
                                void *p_token, std::unique_ptr<cu_expression_t> &compiled);

// Finds the fused tests of a compiled program (and the first slot it
// reads), leaving the tests empty when the program is of another shape.
// May throw std::bad_alloc.
void cu_i_fuse_tests(cu_expression_t &expression);

// Runs a program on one row of encoded slots: by its fused tests when it
// has them, otherwise on the stack machine. Returns 0 with *p_result set,
// or 6, 7 or 8 (with *p_result untouched).
int32_t cu_i_evaluate_encoded(const cu_expression_t &expression, const unsigned char *p_slots,
                              uint32_t total_slots, const unsigned char *p_indirect,
                              uint32_t *p_result) noexcept;

// The stack machine alone, whatever fused tests the program has; the same
// contract as cu_i_evaluate_encoded.
int32_t cu_i_interpret_encoded(const cu_expression_t &expression, const unsigned char *p_slots,
                               uint32_t total_slots, const unsigned char *p_indirect,
                               uint32_t *p_result) noexcept;

// Judges `total_rows` rows whose pointers lie `pointer_stride` bytes apart
// from `p_row_pointers`: a row's slots are at `values_offset` bytes from its
// pointer, its indirect area at `indirect_offset`. Writes 1 or 0 for each
// into `p_verdicts`; a null pointer and a row that cannot match give 0.
void cu_i_evaluate_rows(const cu_expression_t &expression, const unsigned char *p_row_pointers,
                        uint32_t pointer_stride, uint32_t total_rows, uint32_t values_offset,
                        uint32_t total_values, uint32_t indirect_offset,
                        unsigned char *p_verdicts) noexcept;

// ---- Literals and patterns (cu_expression_literals.cpp) -----------------

// "0x" followed by an even number of hexadecimal digits (none for an empty
// value): the bytes they spell. False for any other text.
bool cu_i_binary_from_text(std::string_view text, std::string &bytes);

// Six hexadecimal numbers, each with "0x", separated by white space: the two
// 16-bit halves of the header in storage order, then id1 to id4. Writes the
// 20 bytes of the handle. False for any other text.
bool cu_i_handle_from_text(std::string_view text, std::string &bytes);

// Compiles a POSIX extended regular expression for matching only. Returns 0,
// CU_RESULT_BAD_PATTERN or CU_RESULT_NO_MEMORY.
int32_t cu_i_compile_pattern(const std::string &text, std::unique_ptr<cu_i_pattern> &pattern);

// ---- Numbers (cu_expression_numbers.cpp) --------------------------------

enum class cu_i_order : uint8_t { less, equal, greater, unordered };

// Orders two numbers by their mathematical values, whatever their widths and
// signedness; a NaN is unordered with everything.
cu_i_order cu_i_compare_numbers(const cu_i_value &left, const cu_i_value &right);

// Whether `comparison` holds for two operands in that order.
inline bool cu_i_comparison_holds(cu_i_comparison comparison, cu_i_order order) {
  switch (comparison) {
    case cu_i_comparison::equal:
      return order == cu_i_order::equal;
    case cu_i_comparison::not_equal:
      return order != cu_i_order::equal;
    case cu_i_comparison::less:
      return order == cu_i_order::less;
    case cu_i_comparison::less_equal:
      return order == cu_i_order::less || order == cu_i_order::equal;
    case cu_i_comparison::greater:
      return order == cu_i_order::greater;
    case cu_i_comparison::greater_equal:
      return order == cu_i_order::greater || order == cu_i_order::equal;
  }
  return false;
}

// left = left <operation> right for the binary arithmetic, shift and bitwise
// operations. Returns 0 or CU_RESULT_ARITHMETIC_FAULT.
int32_t cu_i_arithmetic(cu_i_operation operation, cu_i_value &left, const cu_i_value &right);

// Unary minus in place. Returns 0 or CU_RESULT_ARITHMETIC_FAULT (an
// unsigned value above 2^63 has no negative).
int32_t cu_i_negate(cu_i_value &value);

// Bitwise complement of an integer in place, keeping its signedness.
void cu_i_complement(cu_i_value &value);

// Non-zero numbers are true, as in C (a NaN is true).
inline bool cu_i_is_true(const cu_i_value &value) {
  return value.number == cu_i_number::floating ? value.floating != 0.0 : value.integer != 0;
}

/* The value of a hexadecimal digit, or -1 for any other character. */
constexpr int cu_i_hex_digit_value(char character) {
  if (character >= '0' && character <= '9') {
    return character - '0';
  }
  if (character >= 'a' && character <= 'f') {
    return character - 'a' + 10;
  }
  if (character >= 'A' && character <= 'F') {
    return character - 'A' + 10;
  }
  return -1;
}

#endif  // CU_I_EXPRESSION_H
