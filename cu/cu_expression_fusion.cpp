// cu_expression_fusion.cpp - finds, in a finished program, the shape most
// criteria have: comparisons of one row value with a constant, joined by
// &&. Such a program becomes a list of fused tests (cu_i_expression.h) whose
// outcome for every value of the stored type is settled here, once:
//
//  - an integer slot compared with any number becomes a range of its own
//    type (Count > 2.5 is Count >= 3; Count > 5000000000 on a 32-bit column
//    holds for no value, Count != -1 on an unsigned one for every value), so
//    a row costs one subtraction and one unsigned comparison;
//  - a float slot is compared as a double with a double bound, which is
//    exact when the constant is a double or an integer a double holds; an
//    integer a double cannot hold leaves the program to the stack machine;
//  - a string or binary body tested for (in)equality with a constant.
//
// Two range tests of the same slot in a row are one range. The tests keep
// the program's order, so a row gives the stack machine's verdict and its
// result code (a value missing before a false test, or after it).

#include <cmath>

#include "cu_i_encoded_values.h"
#include "cu_i_expression.h"

namespace {

using wide_integer = __int128;

constexpr double Two_To_The_64 = 18446744073709551616.0;
constexpr double Minus_Two_To_The_63 = -9223372036854775808.0;

// A test while it is made: integer ranges keep exact bounds until
// neighbouring tests of the same slot have been merged.
struct candidate {
  cu_i_fused_test test{};
  wide_integer low = 0;
  wide_integer high = 0;
};

bool is_integer_kind(cu_i_fused_kind kind) {
  return kind == cu_i_fused_kind::signed_32 || kind == cu_i_fused_kind::unsigned_32 ||
         kind == cu_i_fused_kind::signed_64 || kind == cu_i_fused_kind::unsigned_64;
}

// The values an integer slot of `kind` can hold.
void domain_of(cu_i_fused_kind kind, wide_integer &smallest, wide_integer &largest) {
  switch (kind) {
    case cu_i_fused_kind::signed_32:
      smallest = INT32_MIN;
      largest = INT32_MAX;
      return;
    case cu_i_fused_kind::unsigned_32:
      smallest = 0;
      largest = UINT32_MAX;
      return;
    case cu_i_fused_kind::signed_64:
      smallest = INT64_MIN;
      largest = INT64_MAX;
      return;
    default:
      smallest = 0;
      largest = UINT64_MAX;
      return;
  }
}

// The comparison that holds for (b, a) when `comparison` holds for (a, b).
cu_i_comparison mirrored(cu_i_comparison comparison) {
  switch (comparison) {
    case cu_i_comparison::less:
      return cu_i_comparison::greater;
    case cu_i_comparison::less_equal:
      return cu_i_comparison::greater_equal;
    case cu_i_comparison::greater:
      return cu_i_comparison::less;
    case cu_i_comparison::greater_equal:
      return cu_i_comparison::less_equal;
    default:
      return comparison;
  }
}

// A test that holds for every value of the slot's type (or for none).
void hold_always(candidate &made, bool holds) {
  domain_of(made.test.kind, made.low, made.high);
  made.test.negated = !holds;
}

// value <comparison> constant for an integer slot, as a range of the slot's
// type. A double constant is first turned into an integer bound: its floor
// when it has a fraction (value < 2.5 is value <= 2), and the first integer
// outside every slot's type when it lies beyond them.
void make_integer_test(const cu_i_value &constant, cu_i_comparison comparison, candidate &made) {
  wide_integer bound = 0;
  bool fraction = false;
  if (constant.number == cu_i_number::floating) {
    const double floating = constant.floating;
    if (std::isnan(floating)) {
      hold_always(made, comparison == cu_i_comparison::not_equal);
      return;
    }
    if (floating >= Two_To_The_64) {
      bound = static_cast<wide_integer>(UINT64_MAX) + 1;
    } else if (floating < Minus_Two_To_The_63) {
      bound = static_cast<wide_integer>(INT64_MIN) - 1;
    } else {
      const double whole = std::floor(floating);
      bound = static_cast<wide_integer>(whole);
      fraction = whole != floating;
    }
  } else if (constant.number == cu_i_number::unsigned_integer) {
    bound = constant.unsigned_integer;
  } else {
    bound = constant.integer;
  }
  wide_integer smallest = 0;
  wide_integer largest = 0;
  domain_of(made.test.kind, smallest, largest);
  wide_integer low = smallest;
  wide_integer high = largest;
  bool negated = false;
  switch (comparison) {
    case cu_i_comparison::equal:
    case cu_i_comparison::not_equal:
      if (fraction) {  // no integer equals it
        hold_always(made, comparison == cu_i_comparison::not_equal);
        return;
      }
      low = bound;
      high = bound;
      negated = comparison == cu_i_comparison::not_equal;
      break;
    case cu_i_comparison::less:
      high = fraction ? bound : bound - 1;
      break;
    case cu_i_comparison::less_equal:
      high = bound;
      break;
    case cu_i_comparison::greater:
    case cu_i_comparison::greater_equal:
      low = fraction || comparison == cu_i_comparison::greater ? bound + 1 : bound;
      break;
  }
  low = low > smallest ? low : smallest;
  high = high < largest ? high : largest;
  if (low > high) {  // no value of the type lies in the range
    hold_always(made, negated);
    return;
  }
  made.low = low;
  made.high = high;
  made.test.negated = negated;
}

// value <comparison> constant for a float slot, as doubles. False when the
// constant is an integer that no double holds exactly.
bool make_floating_test(const cu_i_value &constant, cu_i_comparison comparison, candidate &made) {
  double bound = constant.floating;
  if (constant.number != cu_i_number::floating) {
    const wide_integer integer = constant.number == cu_i_number::unsigned_integer
                                     ? wide_integer(constant.unsigned_integer)
                                     : wide_integer(constant.integer);
    bound = static_cast<double>(integer);
    if (static_cast<wide_integer>(bound) != integer) {
      return false;
    }
  }
  made.test.bound = bound;
  made.test.comparison = comparison;
  return true;
}

// The test of a slot of stored `type` compared (as `how`) with a constant.
// False when no fused test expresses it.
bool make_test(uint8_t type, uint32_t slot, cu_i_compare_as how, cu_i_comparison comparison,
               const cu_i_value &constant, candidate &made) {
  made.test.slot = slot;
  switch (type) {
    case QV_INT32:
    case QV_UINT32:
    case QV_INT64:
    case QV_UINT64:
      made.test.kind = type == QV_INT32    ? cu_i_fused_kind::signed_32
                       : type == QV_UINT32 ? cu_i_fused_kind::unsigned_32
                       : type == QV_INT64  ? cu_i_fused_kind::signed_64
                                           : cu_i_fused_kind::unsigned_64;
      make_integer_test(constant, comparison, made);
      return how == cu_i_compare_as::numbers;
    case QV_FLOAT32:
    case QV_FLOAT64:
      made.test.kind =
          type == QV_FLOAT32 ? cu_i_fused_kind::floating_32 : cu_i_fused_kind::floating_64;
      return how == cu_i_compare_as::numbers && make_floating_test(constant, comparison, made);
    case QV_CHAR_PTR:
    case QV_BINARY_PTR:
    case QV_SBS_PTR:
      if (how != cu_i_compare_as::bytes ||
          (comparison != cu_i_comparison::equal && comparison != cu_i_comparison::not_equal)) {
        return false;
      }
      made.test.kind =
          type == QV_CHAR_PTR ? cu_i_fused_kind::string_bytes : cu_i_fused_kind::plain_bytes;
      made.test.negated = comparison == cu_i_comparison::not_equal;
      made.test.p_bytes = constant.p_bytes;
      made.test.length = constant.length;
      return true;
    default:
      return false;
  }
}

bool is_load(const cu_i_instruction &instruction) {
  return instruction.operation == cu_i_operation::load_fixed ||
         instruction.operation == cu_i_operation::load_variable;
}

// A comparison of a loaded value with a constant starting at `at`, in
// either order (Count > 3: load, compare_constant; 3 < Count: push_constant,
// load, compare). Steps `at` over it. False for anything else.
bool test_at(const cu_expression_t &expression, size_t &at, candidate &made) {
  const std::vector<cu_i_instruction> &code = expression.code;
  const size_t remaining = code.size() - at;
  const cu_i_instruction *p_first = &code[at];
  if (remaining >= 2 && is_load(p_first[0]) &&
      p_first[1].operation == cu_i_operation::compare_constant) {
    at += 2;
    return make_test(p_first[0].data_type, p_first[0].operand,
                     static_cast<cu_i_compare_as>(p_first[1].data_type),
                     static_cast<cu_i_comparison>(p_first[1].detail),
                     expression.constants[p_first[1].operand], made);
  }
  if (remaining >= 3 && p_first[0].operation == cu_i_operation::push_constant &&
      is_load(p_first[1]) && p_first[2].operation == cu_i_operation::compare) {
    at += 3;
    return make_test(p_first[1].data_type, p_first[1].operand,
                     static_cast<cu_i_compare_as>(p_first[2].data_type),
                     mirrored(static_cast<cu_i_comparison>(p_first[2].detail)),
                     expression.constants[p_first[0].operand], made);
  }
  return false;
}

// The whole program as: test, then for each further test a jump_if_false
// to just past it, the test, and the to_boolean that ends the && (how the
// compiler writes a && b && c, whatever the parentheses say about
// association on the left). False for any other program.
bool conjunction_of_tests(const cu_expression_t &expression, std::vector<candidate> &tests) {
  const std::vector<cu_i_instruction> &code = expression.code;
  size_t at = 0;
  if (code.empty() || !test_at(expression, at, tests.emplace_back())) {
    return false;
  }
  while (at < code.size()) {
    const cu_i_instruction &jump = code[at++];
    if (jump.operation != cu_i_operation::jump_if_false || at == code.size() ||
        !test_at(expression, at, tests.emplace_back()) || at == code.size() ||
        code[at++].operation != cu_i_operation::to_boolean || jump.operand != at) {
      return false;
    }
  }
  return true;
}

// Two ranges of one slot, one after the other and neither negated, hold
// together where the ranges overlap (count >= 10 && count < 20).
bool merged(candidate &earlier, const candidate &later) {
  if (!is_integer_kind(earlier.test.kind) || later.test.kind != earlier.test.kind ||
      later.test.slot != earlier.test.slot || earlier.test.negated || later.test.negated) {
    return false;
  }
  earlier.low = later.low > earlier.low ? later.low : earlier.low;
  earlier.high = later.high < earlier.high ? later.high : earlier.high;
  if (earlier.low > earlier.high) {
    hold_always(earlier, false);
  }
  return true;
}

}  // namespace

void cu_i_fuse_tests(cu_expression_t &expression) {
  expression.fused_tests.clear();
  for (const cu_i_instruction &instruction : expression.code) {
    if (is_load(instruction)) {
      expression.first_slot_read = instruction.operand;
      break;
    }
  }
  std::vector<candidate> tests;
  if (!conjunction_of_tests(expression, tests)) {
    return;
  }
  std::vector<candidate> kept;
  for (const candidate &test : tests) {
    if (kept.empty() || !merged(kept.back(), test)) {
      kept.push_back(test);
    }
  }
  for (candidate &test : kept) {
    if (is_integer_kind(test.test.kind)) {
      test.test.low = static_cast<uint64_t>(test.low);
      test.test.span = static_cast<uint64_t>(test.high - test.low);
    }
    expression.fused_tests.push_back(test.test);
  }
}
