// cu_expression_numbers.cpp - the numeric rules of the expression language:
// exact comparison across signedness, widths and floating point, and
// arithmetic that never wraps silently.
//
// Integers are compared and computed by their mathematical values (in 128
// bits), so -1 < 4000000000u holds, unlike in C. A result must fit in
// [-2^63, 2^64): it stays unsigned when both operands were unsigned and it
// fits, signed otherwise when it fits, and anything else is an arithmetic
// fault that makes the row not match. Bitwise operations and shifts work on
// the 64-bit two's-complement pattern.

#include <cmath>
#include <cstdint>

#include "cu_i_expression.h"

namespace {

using wide_integer = __int128;

constexpr wide_integer Smallest_Signed = INT64_MIN;
constexpr wide_integer Largest_Unsigned = UINT64_MAX;

wide_integer wide(const cu_i_value &value) {
  return value.number == cu_i_number::unsigned_integer ? wide_integer(value.unsigned_integer)
                                                       : wide_integer(value.integer);
}

double to_double(const cu_i_value &value) {
  switch (value.number) {
    case cu_i_number::signed_integer:
      return static_cast<double>(value.integer);
    case cu_i_number::unsigned_integer:
      return static_cast<double>(value.unsigned_integer);
    case cu_i_number::floating:
      break;
  }
  return value.floating;
}

template <typename Number>
cu_i_order order_of(Number left, Number right) {
  return left < right ? cu_i_order::less : (right < left ? cu_i_order::greater : cu_i_order::equal);
}

// An integer against a double without rounding either: the double's integer
// part decides, and its fraction breaks a tie.
cu_i_order integer_against_double(wide_integer integer, double floating) {
  if (std::isnan(floating)) {
    return cu_i_order::unordered;
  }
  if (floating >= 18446744073709551616.0) {  // 2^64: above every integer we hold
    return cu_i_order::less;
  }
  if (floating < -9223372036854775808.0) {  // below -2^63
    return cu_i_order::greater;
  }
  const double whole = std::trunc(floating);
  const wide_integer whole_integer = static_cast<wide_integer>(whole);
  if (integer != whole_integer) {
    return order_of(integer, whole_integer);
  }
  const double fraction = floating - whole;
  return fraction > 0 ? cu_i_order::less : (fraction < 0 ? cu_i_order::greater : cu_i_order::equal);
}

cu_i_order reversed(cu_i_order order) {
  switch (order) {
    case cu_i_order::less:
      return cu_i_order::greater;
    case cu_i_order::greater:
      return cu_i_order::less;
    default:
      return order;
  }
}

// Stores an integer result, preferring unsigned when both operands were.
int32_t store_integer(cu_i_value &target, wide_integer result, bool prefer_unsigned) {
  const bool fits_signed = result >= Smallest_Signed && result <= INT64_MAX;
  const bool fits_unsigned = result >= 0 && result <= Largest_Unsigned;
  if (fits_unsigned && (prefer_unsigned || !fits_signed)) {
    target.unsigned_integer = static_cast<uint64_t>(result);
    target.number = cu_i_number::unsigned_integer;
    return CU_RESULT_OK;
  }
  if (!fits_signed) {
    return CU_RESULT_ARITHMETIC_FAULT;
  }
  target.integer = static_cast<int64_t>(result);
  target.number = cu_i_number::signed_integer;
  return CU_RESULT_OK;
}

int32_t floating_arithmetic(cu_i_operation operation, cu_i_value &left, double right) {
  const double value = to_double(left);
  double result = 0;
  switch (operation) {
    case cu_i_operation::multiply:
      result = value * right;
      break;
    case cu_i_operation::divide:
      if (right == 0) {
        return CU_RESULT_ARITHMETIC_FAULT;
      }
      result = value / right;
      break;
    case cu_i_operation::remainder:
      if (right == 0) {
        return CU_RESULT_ARITHMETIC_FAULT;
      }
      result = std::fmod(value, right);
      break;
    case cu_i_operation::add:
      result = value + right;
      break;
    default:  // the compiler admits no other operation on floats
      result = value - right;
      break;
  }
  left.floating = result;
  left.number = cu_i_number::floating;
  return CU_RESULT_OK;
}

int32_t shift(cu_i_operation operation, cu_i_value &left, const cu_i_value &right) {
  const wide_integer count = wide(right);
  if (count < 0 || count > 63) {
    return CU_RESULT_ARITHMETIC_FAULT;
  }
  const uint64_t bits = left.unsigned_integer;
  if (operation == cu_i_operation::shift_left) {
    left.unsigned_integer = bits << static_cast<int>(count);
  } else if (left.number == cu_i_number::signed_integer) {
    left.integer = left.integer >> static_cast<int>(count);  // arithmetic: the sign spreads
  } else {
    left.unsigned_integer = bits >> static_cast<int>(count);
  }
  return CU_RESULT_OK;
}

// Two signed operands whose result fits in 64 bits, computed without the
// 128-bit path. False when the wide path must decide (an overflow, a zero
// divisor, or the one quotient that does not fit: -2^63 / -1).
bool signed_arithmetic(cu_i_operation operation, cu_i_value &left, const cu_i_value &right) {
  int64_t result = 0;
  bool overflow = false;
  switch (operation) {
    case cu_i_operation::multiply:
      overflow = __builtin_mul_overflow(left.integer, right.integer, &result);
      break;
    case cu_i_operation::add:
      overflow = __builtin_add_overflow(left.integer, right.integer, &result);
      break;
    case cu_i_operation::subtract:
      overflow = __builtin_sub_overflow(left.integer, right.integer, &result);
      break;
    default:  // divide, remainder
      if (right.integer == 0 || (left.integer == INT64_MIN && right.integer == -1)) {
        return false;
      }
      result = operation == cu_i_operation::divide ? left.integer / right.integer
                                                   : left.integer % right.integer;
      break;
  }
  if (overflow) {
    return false;
  }
  left.integer = result;
  return true;
}

}  // namespace

cu_i_order cu_i_compare_numbers(const cu_i_value &left, const cu_i_value &right) {
  const bool left_floating = left.number == cu_i_number::floating;
  const bool right_floating = right.number == cu_i_number::floating;
  if (left_floating && right_floating) {
    if (std::isnan(left.floating) || std::isnan(right.floating)) {
      return cu_i_order::unordered;
    }
    return order_of(left.floating, right.floating);
  }
  if (left_floating) {
    return reversed(integer_against_double(wide(right), left.floating));
  }
  if (right_floating) {
    return integer_against_double(wide(left), right.floating);
  }
  return order_of(wide(left), wide(right));
}

int32_t cu_i_arithmetic(cu_i_operation operation, cu_i_value &left, const cu_i_value &right) {
  const bool both_unsigned =
      left.number == cu_i_number::unsigned_integer && right.number == cu_i_number::unsigned_integer;
  switch (operation) {
    case cu_i_operation::shift_left:
    case cu_i_operation::shift_right:
      return shift(operation, left, right);
    case cu_i_operation::bit_and:
    case cu_i_operation::bit_xor:
    case cu_i_operation::bit_or: {
      const uint64_t bits = right.unsigned_integer;
      if (operation == cu_i_operation::bit_and) {
        left.unsigned_integer &= bits;
      } else if (operation == cu_i_operation::bit_xor) {
        left.unsigned_integer ^= bits;
      } else {
        left.unsigned_integer |= bits;
      }
      left.number = both_unsigned ? cu_i_number::unsigned_integer : cu_i_number::signed_integer;
      return CU_RESULT_OK;
    }
    default:
      break;
  }
  if (left.number == cu_i_number::floating || right.number == cu_i_number::floating) {
    return floating_arithmetic(operation, left, to_double(right));
  }
  if (left.number == cu_i_number::signed_integer && right.number == cu_i_number::signed_integer &&
      signed_arithmetic(operation, left, right)) {
    return CU_RESULT_OK;
  }
  const wide_integer left_value = wide(left);
  const wide_integer right_value = wide(right);
  wide_integer result = 0;
  switch (operation) {
    case cu_i_operation::multiply:
      if (__builtin_mul_overflow(left_value, right_value, &result)) {
        return CU_RESULT_ARITHMETIC_FAULT;
      }
      break;
    case cu_i_operation::divide:
    case cu_i_operation::remainder:
      if (right_value == 0) {
        return CU_RESULT_ARITHMETIC_FAULT;
      }
      result =
          operation == cu_i_operation::divide ? left_value / right_value : left_value % right_value;
      break;
    case cu_i_operation::add:
      result = left_value + right_value;  // both within 65 bits: no overflow in 128
      break;
    default:
      result = left_value - right_value;
      break;
  }
  return store_integer(left, result, both_unsigned);
}

int32_t cu_i_negate(cu_i_value &value) {
  if (value.number == cu_i_number::floating) {
    value.floating = -value.floating;
    return CU_RESULT_OK;
  }
  return store_integer(value, -wide(value), false);
}

void cu_i_complement(cu_i_value &value) {
  value.unsigned_integer = ~value.unsigned_integer;
}
