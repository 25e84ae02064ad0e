// cu_expression_evaluator.cpp - the stack machine: runs any compiled
// program on one row whose values are encoded slots and bodies, reading them
// where they lie. Programs of the commonest shape have fused tests as well
// (cu_expression_rows.cpp runs those); this runs all the others.
//
// The stack is a fixed array sized by Cu_I_Max_Stack, strings are compared
// in place (a stored string ends with its NUL, which regexec relies on), and
// nothing is copied or allocated. The layout is this library's reading of
// the encoded form (cu_i_encoded_values.h): top-level anchors count from the
// indirect area and are trusted, as the codec wrote them; anchors nested in
// a body count from that body and are checked against its length, so a
// damaged body gives CU_RESULT_VALUE_MISSING rather than a stray read.

#include <cstring>

#include "cu_i_encoded_values.h"
#include "cu_i_expression.h"

namespace {

[[gnu::always_inline]] inline cu_i_value boolean(bool truth) {
  cu_i_value value{};
  value.integer = truth ? 1 : 0;
  value.number = cu_i_number::signed_integer;
  return value;
}

// A number from an 8-byte slot or from a number array's element (a 32-bit
// number is read from its first four bytes only).
[[gnu::always_inline]] inline cu_i_value fixed_value(uint8_t type, const unsigned char *p_bytes) {
  cu_i_value value{};
  switch (type) {
    case QV_INT32:
      value.integer = static_cast<int32_t>(cu_i_load_u32(p_bytes));
      value.number = cu_i_number::signed_integer;
      break;
    case QV_UINT32:
      value.unsigned_integer = cu_i_load_u32(p_bytes);
      value.number = cu_i_number::unsigned_integer;
      break;
    case QV_INT64:
      value.integer = static_cast<int64_t>(cu_i_load_u64(p_bytes));
      value.number = cu_i_number::signed_integer;
      break;
    case QV_UINT64:
      value.unsigned_integer = cu_i_load_u64(p_bytes);
      value.number = cu_i_number::unsigned_integer;
      break;
    case QV_FLOAT32: {
      float single;
      std::memcpy(&single, p_bytes, sizeof single);
      value.floating = single;
      value.number = cu_i_number::floating;
      break;
    }
    default: {
      double floating;
      std::memcpy(&floating, p_bytes, sizeof floating);
      value.floating = floating;
      value.number = cu_i_number::floating;
      break;
    }
  }
  return value;
}

// A counted body (structured data, an array) whose count of `width`-byte
// entries fits in it.
bool count_fits(const unsigned char *p_body, uint32_t length, uint32_t width) {
  return length >= Cu_I_Count_Bytes &&
         uint64_t{cu_i_load_u32(p_body)} * width <= length - Cu_I_Count_Bytes;
}

// Makes a value of a variable-length type from its body, after checking that
// the body can be what the type says. Returns 0 or CU_RESULT_VALUE_MISSING.
[[gnu::always_inline]] inline int32_t body_value(uint8_t type, const unsigned char *p_body,
                                                 uint32_t length, cu_i_value &value) {
  value.p_bytes = p_body;
  value.length = length;
  bool shape_ok = false;
  switch (cu_i_layout_of(type)) {
    case cu_i_layout::string:
      shape_ok = length >= 1 && p_body[length - 1] == '\0';
      value.length = length - 1;  // the NUL stays behind the value
      break;
    case cu_i_layout::bytes:
      shape_ok = true;
      break;
    case cu_i_layout::handle:
      shape_ok = length == Cu_I_Handle_Bytes;
      break;
    case cu_i_layout::structured:
      shape_ok = count_fits(p_body, length, Cu_I_Element_Record_Bytes);
      break;
    case cu_i_layout::array32:
      shape_ok = count_fits(p_body, length, 4);
      break;
    case cu_i_layout::array64:
      shape_ok = count_fits(p_body, length, 8);
      break;
    case cu_i_layout::pointer_array:
      shape_ok = count_fits(p_body, length, Cu_I_Anchor_Bytes);
      break;
    default:
      break;
  }
  return shape_ok ? CU_RESULT_OK : CU_RESULT_VALUE_MISSING;
}

// A value whose slot lies inside an enclosing body (an element of structured
// data or of a pointer array): its anchor counts from that body.
int32_t nested_value(uint8_t type, const unsigned char *p_slot, const cu_i_value &enclosing,
                     cu_i_value &value) {
  if (cu_i_layout_of(type) == cu_i_layout::number) {
    value = fixed_value(type, p_slot);
    return CU_RESULT_OK;
  }
  const uint32_t offset = cu_i_load_u32(p_slot);
  const uint32_t length = cu_i_load_u32(p_slot + 4);
  if (offset > enclosing.length || length > enclosing.length - offset) {
    return CU_RESULT_VALUE_MISSING;
  }
  return body_value(type, enclosing.p_bytes + offset, length, value);
}

uint32_t count_of(const cu_i_value &counted) {
  return cu_i_load_u32(counted.p_bytes);
}

// Element `index` (below the count) of an array body.
int32_t element_value(uint8_t array_type, const cu_i_value &array, uint32_t index,
                      cu_i_value &value) {
  const uint8_t element_type = static_cast<uint8_t>(array_type - (QV_INT32_ARRAY - QV_INT32));
  const unsigned char *p_elements = array.p_bytes + Cu_I_Count_Bytes;
  switch (cu_i_layout_of(array_type)) {
    case cu_i_layout::array32:
      value = fixed_value(element_type, p_elements + uint64_t{index} * 4);
      return CU_RESULT_OK;
    case cu_i_layout::array64:
      value = fixed_value(element_type, p_elements + uint64_t{index} * 8);
      return CU_RESULT_OK;
    default:
      return nested_value(element_type, p_elements + uint64_t{index} * Cu_I_Anchor_Bytes, array,
                          value);
  }
}

// The element record (type, then slot) at `position`, below the count.
const unsigned char *record_of(const cu_i_value &structured, uint32_t position) {
  return structured.p_bytes + Cu_I_Count_Bytes + uint64_t{position} * Cu_I_Element_Record_Bytes;
}

// The element at `position` of a structured value, which must be of the type
// the field was declared with.
int32_t field_value(uint32_t position, uint8_t type, const cu_i_value &structured,
                    cu_i_value &value) {
  if (position >= count_of(structured)) {
    return CU_RESULT_VALUE_MISSING;
  }
  const unsigned char *p_record = record_of(structured, position);
  if (cu_i_load_u32(p_record) != type) {
    return CU_RESULT_VALUE_MISSING;
  }
  return nested_value(type, p_record + 4, structured, value);
}

int handle_order(const cu_i_value &left, const cu_i_value &right) {
  qv_resource_handle_t left_handle;
  qv_resource_handle_t right_handle;
  std::memcpy(&left_handle, left.p_bytes, sizeof left_handle);
  std::memcpy(&right_handle, right.p_bytes, sizeof right_handle);
  return cu_rsrc_hndl_cmp_1(&left_handle, &right_handle);
}

cu_i_order order_of(int difference) {
  return difference < 0 ? cu_i_order::less
                        : (difference > 0 ? cu_i_order::greater : cu_i_order::equal);
}

// Byte strings in lexicographic order, a prefix first.
cu_i_order bytes_order(const cu_i_value &left, const cu_i_value &right) {
  const uint32_t common = left.length < right.length ? left.length : right.length;
  const int difference = common == 0 ? 0 : std::memcmp(left.p_bytes, right.p_bytes, common);
  if (difference != 0) {
    return order_of(difference);
  }
  return left.length < right.length
             ? cu_i_order::less
             : (left.length > right.length ? cu_i_order::greater : cu_i_order::equal);
}

cu_i_order values_order(cu_i_compare_as how, const cu_i_value &left, const cu_i_value &right) {
  switch (how) {
    case cu_i_compare_as::numbers:
      if (left.number == cu_i_number::signed_integer &&
          right.number == cu_i_number::signed_integer) {
        return left.integer < right.integer
                   ? cu_i_order::less
                   : (left.integer > right.integer ? cu_i_order::greater : cu_i_order::equal);
      }
      return cu_i_compare_numbers(left, right);
    case cu_i_compare_as::bytes:
      return bytes_order(left, right);
    case cu_i_compare_as::handles:
      break;
  }
  return order_of(handle_order(left, right));
}

template <typename Number>
[[gnu::always_inline]] inline bool holds(cu_i_comparison comparison, Number left, Number right) {
  switch (comparison) {
    case cu_i_comparison::equal:
      return left == right;
    case cu_i_comparison::not_equal:
      return left != right;
    case cu_i_comparison::less:
      return left < right;
    case cu_i_comparison::less_equal:
      return left <= right;
    case cu_i_comparison::greater:
      return left > right;
    case cu_i_comparison::greater_equal:
      return left >= right;
  }
  return false;
}

// Whether two byte strings are equal: a length apart, they are not, and
// their bytes need not be read.
bool same_bytes(const cu_i_value &left, const cu_i_value &right) {
  return left.length == right.length &&
         (left.length == 0 || std::memcmp(left.p_bytes, right.p_bytes, left.length) == 0);
}

// The common cases directly: two signed integers or two doubles (the C
// operators on doubles treat a NaN as the language does: only != holds),
// and byte strings tested for equality.
[[gnu::always_inline]] inline bool comparison_holds(cu_i_compare_as how, cu_i_comparison comparison,
                                                    const cu_i_value &left,
                                                    const cu_i_value &right) {
  if (how == cu_i_compare_as::numbers && left.number == right.number) {
    if (left.number == cu_i_number::signed_integer) {
      return holds(comparison, left.integer, right.integer);
    }
    if (left.number == cu_i_number::floating) {
      return holds(comparison, left.floating, right.floating);
    }
  }
  if (how == cu_i_compare_as::bytes) {
    if (comparison == cu_i_comparison::equal) {
      return same_bytes(left, right);
    }
    if (comparison == cu_i_comparison::not_equal) {
      return !same_bytes(left, right);
    }
  }
  return cu_i_comparison_holds(comparison, values_order(how, left, right));
}

bool is_in_array(const cu_i_value &value, uint8_t array_type, const cu_i_value &array,
                 int32_t &result) {
  const uint8_t element_type = static_cast<uint8_t>(array_type - (QV_INT32_ARRAY - QV_INT32));
  const cu_i_compare_as how = element_type <= QV_FLOAT64           ? cu_i_compare_as::numbers
                              : element_type == QV_RSRC_HANDLE_PTR ? cu_i_compare_as::handles
                                                                   : cu_i_compare_as::bytes;
  const uint32_t count = count_of(array);
  for (uint32_t index = 0; index < count; ++index) {
    cu_i_value element;
    result = element_value(array_type, array, index, element);
    if (result != CU_RESULT_OK) {
      return false;
    }
    if (values_order(how, value, element) == cu_i_order::equal) {
      return true;
    }
  }
  return false;
}

// Elements that lack the field, or hold it with another type, do not count;
// a damaged element does.
bool is_in_projection(const cu_i_value &value, uint32_t position, uint8_t field_type,
                      const cu_i_value &array, int32_t &result) {
  const cu_i_compare_as how = field_type <= QV_FLOAT64           ? cu_i_compare_as::numbers
                              : field_type == QV_RSRC_HANDLE_PTR ? cu_i_compare_as::handles
                                                                 : cu_i_compare_as::bytes;
  const uint32_t count = count_of(array);
  for (uint32_t index = 0; index < count; ++index) {
    cu_i_value structured;
    result = element_value(QV_SD_PTR_ARRAY, array, index, structured);
    if (result != CU_RESULT_OK) {
      return false;
    }
    if (position >= count_of(structured) ||
        cu_i_load_u32(record_of(structured, position)) != field_type) {
      continue;
    }
    cu_i_value field;
    result = nested_value(field_type, record_of(structured, position) + 4, structured, field);
    if (result != CU_RESULT_OK) {
      return false;
    }
    if (values_order(how, value, field) == cu_i_order::equal) {
      return true;
    }
  }
  return false;
}

// The result of `comparison` (a compare_constant instruction) with `left` as
// its left operand.
[[gnu::always_inline]] inline cu_i_value compare_with_constant(const cu_i_instruction &comparison,
                                                               const cu_i_value &left,
                                                               const cu_i_value *p_constants) {
  return boolean(comparison_holds(static_cast<cu_i_compare_as>(comparison.data_type),
                                  static_cast<cu_i_comparison>(comparison.detail), left,
                                  p_constants[comparison.operand]));
}

// Whether the instruction at `p_next` (before `p_end`) is of `operation`.
[[gnu::always_inline]] inline bool next_is(const cu_i_instruction *p_next,
                                           const cu_i_instruction *p_end,
                                           cu_i_operation operation) {
  return p_next < p_end && p_next->operation == operation;
}

// Puts a value just loaded into `stack_top`, or, when the instruction at
// `p_next` compares it with a constant, the result of that comparison, and
// steps over a to_boolean after it. Returns the next instruction to run.
[[gnu::always_inline]] inline const cu_i_instruction *push_loaded(const cu_i_value &value,
                                                                  const cu_i_instruction *p_next,
                                                                  const cu_i_instruction *p_end,
                                                                  const cu_i_value *p_constants,
                                                                  cu_i_value &stack_top) {
  if (!next_is(p_next, p_end, cu_i_operation::compare_constant)) {
    stack_top = value;
    return p_next;
  }
  stack_top = compare_with_constant(*p_next++, value, p_constants);
  return next_is(p_next, p_end, cu_i_operation::to_boolean) ? p_next + 1 : p_next;
}

}  // namespace

int32_t cu_i_interpret_encoded(const cu_expression_t &expression, const unsigned char *p_slots,
                               uint32_t total_slots, const unsigned char *p_indirect,
                               uint32_t *p_result) noexcept {
  cu_i_value stack[Cu_I_Max_Stack];
  size_t top = 0;  // values on the stack
  const cu_i_instruction *const p_code = expression.code.data();
  const cu_i_instruction *const p_end = p_code + expression.code.size();
  const cu_i_value *const p_constants = expression.constants.data();
  int32_t result = CU_RESULT_OK;
  // Two sequences are run in one step, with the same outcome as one
  // instruction after the other: a value compared with a constant right
  // after it is loaded (Column > 30, the commonest criteria) never goes on
  // the stack, and the to_boolean that follows a comparison (the right side
  // of && and ||) is skipped, since a comparison leaves 0 or 1 already.
  const cu_i_instruction *p_at = p_code;
  while (p_at < p_end) {
    const cu_i_instruction &instruction = *p_at++;
    switch (instruction.operation) {
      case cu_i_operation::push_constant:
        stack[top++] = p_constants[instruction.operand];
        break;
      case cu_i_operation::load_fixed: {
        if (instruction.operand >= total_slots) {
          return CU_RESULT_VALUE_MISSING;
        }
        const cu_i_value value = fixed_value(
            instruction.data_type, p_slots + uint64_t{instruction.operand} * Cu_I_Slot_Bytes);
        p_at = push_loaded(value, p_at, p_end, p_constants, stack[top++]);
        break;
      }
      case cu_i_operation::load_variable: {
        if (instruction.operand >= total_slots) {
          return CU_RESULT_VALUE_MISSING;
        }
        const unsigned char *p_slot = p_slots + uint64_t{instruction.operand} * Cu_I_Slot_Bytes;
        cu_i_value value;
        result = body_value(instruction.data_type, p_indirect + cu_i_load_u32(p_slot),
                            cu_i_load_u32(p_slot + 4), value);
        if (result != CU_RESULT_OK) {
          return result;
        }
        p_at = push_loaded(value, p_at, p_end, p_constants, stack[top++]);
        break;
      }
      case cu_i_operation::element: {
        const cu_i_value index = stack[--top];
        const cu_i_value array = stack[top - 1];
        if (index.number == cu_i_number::signed_integer
                ? index.integer < 0 || index.integer >= count_of(array)
                : index.unsigned_integer >= count_of(array)) {
          return CU_RESULT_INDEX_OUT_OF_RANGE;
        }
        result = element_value(instruction.data_type, array,
                               static_cast<uint32_t>(index.unsigned_integer), stack[top - 1]);
        if (result != CU_RESULT_OK) {
          return result;
        }
        break;
      }
      case cu_i_operation::field: {
        const cu_i_value structured = stack[top - 1];
        result =
            field_value(instruction.operand, instruction.data_type, structured, stack[top - 1]);
        if (result != CU_RESULT_OK) {
          return result;
        }
        break;
      }
      case cu_i_operation::length: {
        cu_i_value &value = stack[top - 1];
        const uint32_t length = instruction.detail != 0 ? count_of(value) : value.length;
        value.unsigned_integer = length;
        value.number = cu_i_number::unsigned_integer;
        break;
      }
      case cu_i_operation::negate:
        if (cu_i_negate(stack[top - 1]) != CU_RESULT_OK) {
          return CU_RESULT_ARITHMETIC_FAULT;
        }
        break;
      case cu_i_operation::complement:
        cu_i_complement(stack[top - 1]);
        break;
      case cu_i_operation::logical_not:
        stack[top - 1] = boolean(!cu_i_is_true(stack[top - 1]));
        break;
      case cu_i_operation::to_boolean:
        stack[top - 1] = boolean(cu_i_is_true(stack[top - 1]));
        break;
      case cu_i_operation::multiply:
      case cu_i_operation::divide:
      case cu_i_operation::remainder:
      case cu_i_operation::add:
      case cu_i_operation::subtract:
      case cu_i_operation::shift_left:
      case cu_i_operation::shift_right:
      case cu_i_operation::bit_and:
      case cu_i_operation::bit_xor:
      case cu_i_operation::bit_or:
        --top;
        if (cu_i_arithmetic(instruction.operation, stack[top - 1], stack[top]) != CU_RESULT_OK) {
          return CU_RESULT_ARITHMETIC_FAULT;
        }
        break;
      case cu_i_operation::compare:
        --top;
        stack[top - 1] = boolean(comparison_holds(
            static_cast<cu_i_compare_as>(instruction.data_type),
            static_cast<cu_i_comparison>(instruction.detail), stack[top - 1], stack[top]));
        break;
      case cu_i_operation::compare_constant:
        stack[top - 1] = compare_with_constant(instruction, stack[top - 1], p_constants);
        break;
      case cu_i_operation::match: {
        const char *p_text = reinterpret_cast<const char *>(stack[top - 1].p_bytes);
        const bool matched = regexec(&expression.patterns[instruction.operand]->compiled, p_text, 0,
                                     nullptr, 0) == 0;
        stack[top - 1] = boolean(matched != (instruction.detail != 0));
        break;
      }
      case cu_i_operation::in_array: {
        const cu_i_value array = stack[--top];
        const bool found = is_in_array(stack[top - 1], instruction.data_type, array, result);
        if (result != CU_RESULT_OK) {
          return result;
        }
        stack[top - 1] = boolean(found);
        break;
      }
      case cu_i_operation::in_projection: {
        const cu_i_value array = stack[--top];
        const bool found = is_in_projection(stack[top - 1], instruction.operand,
                                            instruction.data_type, array, result);
        if (result != CU_RESULT_OK) {
          return result;
        }
        stack[top - 1] = boolean(found);
        break;
      }
      case cu_i_operation::in_list: {
        const auto how = static_cast<cu_i_compare_as>(instruction.detail);
        bool found = false;
        for (uint32_t entry = 0; entry < instruction.count && !found; ++entry) {
          const cu_i_value &member =
              p_constants[expression.list_members[instruction.operand + entry]];
          found = values_order(how, stack[top - 1], member) == cu_i_order::equal;
        }
        stack[top - 1] = boolean(found);
        break;
      }
      case cu_i_operation::jump_if_false:
      case cu_i_operation::jump_if_true: {
        const bool truth = cu_i_is_true(stack[top - 1]);
        if (truth == (instruction.operation == cu_i_operation::jump_if_true)) {
          stack[top - 1] = boolean(truth);
          p_at = p_code + instruction.operand;
        } else {
          --top;
        }
        break;
      }
    }
  }
  *p_result = cu_i_is_true(stack[0]) ? 1 : 0;
  return CU_RESULT_OK;
}
