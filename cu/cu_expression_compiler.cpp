// cu_expression_compiler.cpp - turns criteria text into the postfix program
// of cu_i_expression.h in one pass: a precedence-climbing parser that checks
// types as it goes and emits code for each operand as soon as it is read.
//
// Names are resolved through the caller's callback. Quoted literals take the
// type of what they are compared with (a binary's "0x..." text, a handle's
// six groups), so the compiler patches a literal's constant once it knows the
// other side. Recursion is bounded by CU_EXPR_MAX_NESTING and the stack the
// program needs by Cu_I_Max_Stack; long chains of operators at one level
// are loops, not recursion, so they cost neither.

#include <cxxabi.h>

#include <array>
#include <cfloat>
#include <cmath>
#include <cstring>
#include <limits>
#include <string>
#include <utility>

#include "cu_i_expression.h"
#include "cu_i_expression_lexer.h"

namespace {

// What an operand is, as far as the type rules care.
enum class value_class : uint8_t {
  integer,
  floating,
  string,
  binary,  // binaries and structured byte strings
  handle,
  structured,
  array,
  projection,  // a field of every element of a structured-data array: only for "in"
};

struct operand {
  value_class kind = value_class::integer;
  uint8_t data_type = 0;                   // the stored type when read from the row, else 0
  uint32_t fields_of = CU_EXPR_NO_PARENT;  // the column whose fields ".Name" reaches
  uint32_t field = 0;                      // projection: the field's position
  uint8_t field_type = 0;                  // projection: the field's type
  int64_t constant_at = -1;                // its push_constant when it is one constant
};

// The kind of each data type (2 to 22; the callback's answers are checked).
constexpr std::array<value_class, QV_DATA_TYPE_LIMIT> Classes = {
    value_class::integer, value_class::integer, value_class::integer,  value_class::integer,
    value_class::integer, value_class::integer, value_class::floating, value_class::floating,
    value_class::string,  value_class::binary,  value_class::handle,   value_class::structured,
    value_class::binary,  value_class::array,   value_class::array,    value_class::array,
    value_class::array,   value_class::array,   value_class::array,    value_class::array,
    value_class::array,   value_class::array,   value_class::array};

// Arrays 13 to 22 hold elements of types 2 to 11, in the same order.
uint8_t element_type_of(uint8_t array_type) {
  return static_cast<uint8_t>(array_type - (QV_INT32_ARRAY - QV_INT32));
}

bool is_numeric(value_class kind) {
  return kind == value_class::integer || kind == value_class::floating;
}

bool is_comparable(value_class kind) {
  return is_numeric(kind) || kind == value_class::string || kind == value_class::binary ||
         kind == value_class::handle;
}

// Two comparable classes that may meet in ==, < or "in"; when they may, how.
bool compare_as(value_class left, value_class right, cu_i_compare_as &how) {
  if (is_numeric(left) && is_numeric(right)) {
    how = cu_i_compare_as::numbers;
    return true;
  }
  if (left != right || !is_comparable(left)) {
    return false;
  }
  how = left == value_class::handle ? cu_i_compare_as::handles : cu_i_compare_as::bytes;
  return true;
}

void require(bool condition, int32_t code = CU_RESULT_TYPE_MISMATCH) {
  if (!condition) {
    throw cu_i_compile_error{code};
  }
}

// The binary operators, by binding strength (C's order), and what each
// compiles to. "in" is a name, not a symbol; it binds like "<".
enum class operator_kind : uint8_t {
  short_circuit,
  arithmetic,
  bitwise,
  comparison,
  match,
  membership
};

struct binary_operator {
  cu_i_symbol symbol;
  int level;
  operator_kind kind;
  cu_i_operation operation;    // arithmetic, bitwise and short-circuit operators
  cu_i_comparison comparison;  // comparisons; for a match, not_equal means "!~"
};

constexpr int Relational_Level = 7;

constexpr binary_operator Binary_Operators[] = {
    {cu_i_symbol::logical_or, 1, operator_kind::short_circuit, cu_i_operation::jump_if_true, {}},
    {cu_i_symbol::logical_and, 2, operator_kind::short_circuit, cu_i_operation::jump_if_false, {}},
    {cu_i_symbol::bar, 3, operator_kind::bitwise, cu_i_operation::bit_or, {}},
    {cu_i_symbol::caret, 4, operator_kind::bitwise, cu_i_operation::bit_xor, {}},
    {cu_i_symbol::ampersand, 5, operator_kind::bitwise, cu_i_operation::bit_and, {}},
    {cu_i_symbol::equal, 6, operator_kind::comparison, cu_i_operation::compare,
     cu_i_comparison::equal},
    {cu_i_symbol::not_equal, 6, operator_kind::comparison, cu_i_operation::compare,
     cu_i_comparison::not_equal},
    {cu_i_symbol::match, 6, operator_kind::match, cu_i_operation::match, cu_i_comparison::equal},
    {cu_i_symbol::no_match, 6, operator_kind::match, cu_i_operation::match,
     cu_i_comparison::not_equal},
    {cu_i_symbol::less, Relational_Level, operator_kind::comparison, cu_i_operation::compare,
     cu_i_comparison::less},
    {cu_i_symbol::less_equal, Relational_Level, operator_kind::comparison, cu_i_operation::compare,
     cu_i_comparison::less_equal},
    {cu_i_symbol::greater, Relational_Level, operator_kind::comparison, cu_i_operation::compare,
     cu_i_comparison::greater},
    {cu_i_symbol::greater_equal, Relational_Level, operator_kind::comparison,
     cu_i_operation::compare, cu_i_comparison::greater_equal},
    {cu_i_symbol::shift_left, 8, operator_kind::bitwise, cu_i_operation::shift_left, {}},
    {cu_i_symbol::shift_right, 8, operator_kind::bitwise, cu_i_operation::shift_right, {}},
    {cu_i_symbol::plus, 9, operator_kind::arithmetic, cu_i_operation::add, {}},
    {cu_i_symbol::minus, 9, operator_kind::arithmetic, cu_i_operation::subtract, {}},
    {cu_i_symbol::star, 10, operator_kind::arithmetic, cu_i_operation::multiply, {}},
    {cu_i_symbol::slash, 10, operator_kind::arithmetic, cu_i_operation::divide, {}},
    {cu_i_symbol::percent, 10, operator_kind::arithmetic, cu_i_operation::remainder, {}},
};

constexpr binary_operator Membership = {
    cu_i_symbol::none, Relational_Level, operator_kind::membership, cu_i_operation::in_array, {}};

// The binary operator a token is, or null.
const binary_operator *binary_operator_of(const cu_i_token &token) {
  if (token.kind == cu_i_token_kind::name) {
    return token.spelling == "in" ? &Membership : nullptr;
  }
  for (const binary_operator &candidate : Binary_Operators) {
    if (token.kind == cu_i_token_kind::symbol && candidate.symbol == token.symbol) {
      return &candidate;
    }
  }
  return nullptr;
}

class compiler {
 public:
  compiler(std::string_view text, cu_validate_callback_t callback, void *p_token,
           cu_expression_t &program)
      : lexer_(text), callback_(callback), p_token_(p_token), program_(program) {}

  void compile() {
    advance();
    const operand result = parse_binary(1, 0);
    require(token_.kind == cu_i_token_kind::end, CU_RESULT_SYNTAX_ERROR);
    require(is_numeric(result.kind));  // the row matches when the value is not zero
    program_.stack_depth = static_cast<uint32_t>(deepest_);
  }

 private:
  void advance() { lexer_.next(token_); }

  bool at_symbol(cu_i_symbol symbol) const {
    return token_.kind == cu_i_token_kind::symbol && token_.symbol == symbol;
  }

  void expect(cu_i_symbol symbol) {
    require(at_symbol(symbol), CU_RESULT_SYNTAX_ERROR);
    advance();
  }

  static int nested(int depth) {
    require(depth < CU_EXPR_MAX_NESTING, CU_RESULT_TOO_COMPLEX);
    return depth + 1;
  }

  // ---- Emitting code ----------------------------------------------------

  size_t emit(cu_i_operation operation, int stack_effect, uint32_t operand_value = 0,
              uint8_t detail = 0, uint8_t data_type = 0, uint32_t count = 0) {
    program_.code.push_back(cu_i_instruction{operation, detail, data_type, operand_value, count});
    depth_ += stack_effect;
    if (depth_ > deepest_) {
      deepest_ = depth_;
      require(deepest_ <= Cu_I_Max_Stack, CU_RESULT_TOO_COMPLEX);
    }
    return program_.code.size() - 1;
  }

  operand push_constant(const cu_i_value &value, value_class kind) {
    program_.constants.push_back(value);
    operand result;
    result.kind = kind;
    result.constant_at = static_cast<int64_t>(emit(
        cu_i_operation::push_constant, 1, static_cast<uint32_t>(program_.constants.size() - 1)));
    return result;
  }

  cu_i_value bytes_constant(std::string bytes) {
    const std::string &kept = program_.constant_bytes.emplace_back(std::move(bytes));
    cu_i_value value{};
    value.p_bytes = reinterpret_cast<const unsigned char *>(kept.data());
    value.length = static_cast<uint32_t>(kept.size());
    return value;
  }

  cu_i_value &constant_of(const operand &value) {
    return program_.constants[program_.code[static_cast<size_t>(value.constant_at)].operand];
  }

  // The operand is one constant and nothing has been emitted after it.
  bool is_last_constant(const operand &value) const {
    return value.constant_at >= 0 &&
           static_cast<size_t>(value.constant_at) + 1 == program_.code.size();
  }

  // Takes the last constant out of the code (a list entry, a pattern) and
  // returns its constant index.
  uint32_t take_last_constant() {
    const uint32_t index = program_.code.back().operand;
    program_.code.pop_back();
    --depth_;
    return index;
  }

  // A quoted literal compared with a binary or a handle is read as one.
  void give_literal_class(operand &literal, value_class target) {
    if (literal.constant_at < 0 || literal.kind != value_class::string ||
        (target != value_class::binary && target != value_class::handle)) {
      return;
    }
    const cu_i_value &text_value = constant_of(literal);
    const std::string_view text(reinterpret_cast<const char *>(text_value.p_bytes),
                                text_value.length);
    std::string bytes;
    const bool readable = target == value_class::binary ? cu_i_binary_from_text(text, bytes)
                                                        : cu_i_handle_from_text(text, bytes);
    require(readable, CU_RESULT_BAD_LITERAL);
    program_.constants.push_back(bytes_constant(std::move(bytes)));
    program_.code[static_cast<size_t>(literal.constant_at)].operand =
        static_cast<uint32_t>(program_.constants.size() - 1);
    literal.kind = target;
  }

  // A float literal compared with a single-precision value read from the
  // row is rounded to single precision first, so that Ratio == 0.1 finds the
  // 0.1 that was stored in a 32-bit float.
  void match_precision(operand &literal, uint8_t other_type) {
    if (other_type != QV_FLOAT32 || literal.constant_at < 0 ||
        literal.kind != value_class::floating) {
      return;
    }
    cu_i_value &value = constant_of(literal);
    if (std::fabs(value.floating) <= FLT_MAX) {
      value.floating = static_cast<double>(static_cast<float>(value.floating));
    }
  }

  // ---- Grammar ------------------------------------------------------------

  // Binary operators binding at least as tightly as `minimum_level`, left to right.
  operand parse_binary(int minimum_level, int depth) {
    operand left = parse_unary(depth);
    while (true) {
      const binary_operator *p_operator = binary_operator_of(token_);
      if (p_operator == nullptr || p_operator->level < minimum_level) {
        return left;
      }
      advance();
      if (p_operator->kind == operator_kind::membership) {
        left = parse_membership(left, depth);
      } else if (p_operator->kind == operator_kind::short_circuit) {
        left = parse_short_circuit(left, *p_operator, depth);
      } else {
        const operand right = parse_binary(p_operator->level + 1, depth);
        left = combine(left, *p_operator, right);
      }
    }
  }

  // a && b: when a is false the result is 0 and b is not evaluated.
  operand parse_short_circuit(const operand &left, const binary_operator &logical, int depth) {
    require(is_numeric(left.kind));
    const size_t jump = emit(logical.operation, -1);
    const operand right = parse_binary(logical.level + 1, depth);
    require(is_numeric(right.kind));
    emit(cu_i_operation::to_boolean, 0);
    program_.code[jump].operand = static_cast<uint32_t>(program_.code.size());
    return operand{};
  }

  operand combine(const operand &left, const binary_operator &binary, const operand &right) {
    switch (binary.kind) {
      case operator_kind::arithmetic: {
        require(is_numeric(left.kind) && is_numeric(right.kind));
        emit(binary.operation, -1);
        operand result;
        result.kind = left.kind == value_class::floating || right.kind == value_class::floating
                          ? value_class::floating
                          : value_class::integer;
        return result;
      }
      case operator_kind::bitwise:
        require(left.kind == value_class::integer && right.kind == value_class::integer);
        emit(binary.operation, -1);
        return operand{};
      case operator_kind::match:
        return compile_match(left, right, binary.comparison == cu_i_comparison::not_equal);
      default:
        return compile_comparison(left, right, binary.comparison);
    }
  }

  operand compile_comparison(operand left, operand right, cu_i_comparison comparison) {
    give_literal_class(left, right.kind);
    give_literal_class(right, left.kind);
    match_precision(left, right.data_type);
    match_precision(right, left.data_type);
    cu_i_compare_as how;
    require(compare_as(left.kind, right.kind, how));
    if (is_last_constant(right)) {  // Age > 30: the constant need not go on the stack
      emit(cu_i_operation::compare_constant, 0, take_last_constant(),
           static_cast<uint8_t>(comparison), static_cast<uint8_t>(how));
    } else {
      emit(cu_i_operation::compare, -1, 0, static_cast<uint8_t>(comparison),
           static_cast<uint8_t>(how));
    }
    return operand{};
  }

  // The pattern must be a quoted literal: it is compiled here, once.
  operand compile_match(const operand &left, const operand &right, bool negated) {
    require(left.kind == value_class::string && right.kind == value_class::string &&
            is_last_constant(right));
    const cu_i_value &text = program_.constants[take_last_constant()];
    std::unique_ptr<cu_i_pattern> pattern;
    const int32_t result = cu_i_compile_pattern(
        std::string(reinterpret_cast<const char *>(text.p_bytes), text.length), pattern);
    require(result == CU_RESULT_OK, result);
    program_.patterns.push_back(std::move(pattern));
    emit(cu_i_operation::match, 0, static_cast<uint32_t>(program_.patterns.size() - 1),
         negated ? 1 : 0);
    return operand{};
  }

  // value in [literal, ...] | value in ArrayVariable | value in SdArray.Field
  operand parse_membership(operand left, int depth) {
    if (at_symbol(cu_i_symbol::left_bracket)) {
      return parse_list(left, depth);
    }
    const operand right = parse_binary(Relational_Level + 1, depth);
    uint8_t element_type = 0;
    cu_i_operation operation = cu_i_operation::in_array;
    if (right.kind == value_class::array) {
      element_type = element_type_of(right.data_type);
    } else {
      require(right.kind == value_class::projection);
      element_type = right.field_type;
      operation = cu_i_operation::in_projection;
    }
    give_literal_class(left, Classes[element_type]);
    match_precision(left, element_type);
    cu_i_compare_as how;
    require(compare_as(left.kind, Classes[element_type], how));
    emit(operation, -1, operation == cu_i_operation::in_array ? 0 : right.field, 0,
         operation == cu_i_operation::in_array ? right.data_type : element_type);
    return operand{};
  }

  operand parse_list(const operand &left, int depth) {
    const int inner = nested(depth);
    advance();
    require(is_comparable(left.kind));
    cu_i_compare_as how = cu_i_compare_as::numbers;
    const uint32_t first = static_cast<uint32_t>(program_.list_members.size());
    uint32_t count = 0;
    if (!at_symbol(cu_i_symbol::right_bracket)) {
      while (true) {
        operand entry = parse_binary(1, inner);
        require(is_last_constant(entry), CU_RESULT_SYNTAX_ERROR);  // entries are literals
        give_literal_class(entry, left.kind);
        match_precision(entry, left.data_type);
        require(compare_as(left.kind, entry.kind, how));
        program_.list_members.push_back(take_last_constant());
        ++count;
        if (!at_symbol(cu_i_symbol::comma)) {
          break;
        }
        advance();
      }
    }
    expect(cu_i_symbol::right_bracket);
    if (count == 0) {
      compare_as(left.kind, left.kind, how);
    }
    emit(cu_i_operation::in_list, 0, first, static_cast<uint8_t>(how), 0, count);
    return operand{};
  }

  operand parse_unary(int depth) {
    if (token_.kind != cu_i_token_kind::symbol ||
        (token_.symbol != cu_i_symbol::minus && token_.symbol != cu_i_symbol::plus &&
         token_.symbol != cu_i_symbol::exclamation && token_.symbol != cu_i_symbol::tilde)) {
      return parse_postfix(parse_primary(depth), depth);
    }
    const cu_i_symbol symbol = token_.symbol;
    advance();
    operand value = parse_unary(nested(depth));
    switch (symbol) {
      case cu_i_symbol::minus:
        require(is_numeric(value.kind));
        if (is_last_constant(value)) {  // -5 is a literal, down to -2^63
          require(cu_i_negate(constant_of(value)) == CU_RESULT_OK, CU_RESULT_BAD_LITERAL);
          return value;
        }
        emit(cu_i_operation::negate, 0);
        value.data_type = 0;
        value.constant_at = -1;
        return value;
      case cu_i_symbol::plus:
        require(is_numeric(value.kind));
        return value;
      case cu_i_symbol::exclamation:
        require(is_numeric(value.kind));
        emit(cu_i_operation::logical_not, 0);
        return operand{};
      default:
        require(value.kind == value_class::integer);
        emit(cu_i_operation::complement, 0);
        return operand{};
    }
  }

  // Indexes and field names after an operand: Ports[0], Link.Speed, Nics[1].Mac.
  operand parse_postfix(operand value, int depth) {
    while (true) {
      if (at_symbol(cu_i_symbol::left_bracket)) {
        require(value.kind == value_class::array);
        const int inner = nested(depth);
        advance();
        const operand index = parse_binary(1, inner);
        require(index.kind == value_class::integer);
        expect(cu_i_symbol::right_bracket);
        emit(cu_i_operation::element, -1, 0, 0, value.data_type);
        const uint8_t element_type = element_type_of(value.data_type);
        operand element;
        element.kind = Classes[element_type];
        element.data_type = element_type;
        element.fields_of = element_type == QV_SD_PTR ? value.fields_of : CU_EXPR_NO_PARENT;
        value = element;
      } else if (at_symbol(cu_i_symbol::dot)) {
        advance();
        require(token_.kind == cu_i_token_kind::name, CU_RESULT_SYNTAX_ERROR);
        const bool whole_array =
            value.kind == value_class::array && value.data_type == QV_SD_PTR_ARRAY;
        // Only a column's structured data has named fields: the names of a
        // field's own fields are nobody's to answer.
        require((value.kind == value_class::structured || whole_array) &&
                value.fields_of != CU_EXPR_NO_PARENT);
        cu_validate_data_t answer{};
        require(resolve(token_.spelling, value.fields_of, answer), CU_RESULT_UNKNOWN_NAME);
        advance();
        const uint8_t type = static_cast<uint8_t>(answer.type);
        operand result;
        if (whole_array) {
          result.kind = value_class::projection;
          result.field = answer.id;
          result.field_type = type;
        } else {
          emit(cu_i_operation::field, 0, answer.id, 0, type);
          result.kind = Classes[type];
          result.data_type = type;
        }
        value = result;
      } else {
        return value;
      }
    }
  }

  operand parse_primary(int depth) {
    if (token_.kind == cu_i_token_kind::number) {
      const cu_i_value number = token_.number;
      advance();
      return push_constant(number, number.number == cu_i_number::floating ? value_class::floating
                                                                          : value_class::integer);
    }
    if (token_.kind == cu_i_token_kind::text) {
      const cu_i_value text = bytes_constant(std::move(token_.text));
      advance();
      return push_constant(text, value_class::string);
    }
    if (at_symbol(cu_i_symbol::left_parenthesis)) {
      const int inner = nested(depth);
      advance();
      const operand value = parse_binary(1, inner);
      expect(cu_i_symbol::right_parenthesis);
      return value;
    }
    require(token_.kind == cu_i_token_kind::name, CU_RESULT_SYNTAX_ERROR);
    const std::string name(token_.spelling);
    advance();
    if (at_symbol(cu_i_symbol::left_parenthesis)) {
      return parse_function(name, depth);
    }
    return load_variable(name);
  }

  // len(x): the bytes of a string or binary, the elements of an array or a
  // structured value.
  operand parse_function(const std::string &name, int depth) {
    require(name == "len", CU_RESULT_UNKNOWN_NAME);
    const int inner = nested(depth);
    advance();
    const operand argument = parse_binary(1, inner);
    expect(cu_i_symbol::right_parenthesis);
    const bool counted =
        argument.kind == value_class::array || argument.kind == value_class::structured;
    require(counted || argument.kind == value_class::string ||
            argument.kind == value_class::binary);
    emit(cu_i_operation::length, 0, 0, counted ? 1 : 0);
    return operand{};
  }

  operand load_variable(const std::string &name) {
    cu_validate_data_t answer{};
    if (!resolve(name, CU_EXPR_NO_PARENT, answer)) {
      // inf and nan are what printf writes for those doubles; a variable of
      // that name wins.
      require(name == "inf" || name == "nan", CU_RESULT_UNKNOWN_NAME);
      cu_i_value value{};
      value.floating = name == "inf" ? std::numeric_limits<double>::infinity()
                                     : std::numeric_limits<double>::quiet_NaN();
      value.number = cu_i_number::floating;
      return push_constant(value, value_class::floating);
    }
    const auto type = static_cast<uint8_t>(answer.type);
    if (type <= QV_FLOAT64) {
      emit(cu_i_operation::load_fixed, 1, answer.id, 0, type);
    } else {
      emit(cu_i_operation::load_variable, 1, answer.id, 0, type);
      program_.reads_indirect = true;
    }
    operand result;
    result.kind = Classes[type];
    result.data_type = type;
    if (type == QV_SD_PTR || type == QV_SD_PTR_ARRAY) {
      result.fields_of = answer.id;
    }
    return result;
  }

  // Asks the callback about a name. False when it does not know it (a
  // callback that throws is taken as not knowing it).
  bool resolve(std::string_view name, uint32_t parent, cu_validate_data_t &answer) {
    const std::string terminated(name);
    int32_t result = -1;
    try {
      result = callback_(p_token_, terminated.c_str(), static_cast<uint32_t>(terminated.size()),
                         parent, &answer);
    } catch (const abi::__forced_unwind &) {
      throw;  // thread cancellation must unwind through
    } catch (...) {
      return false;
    }
    if (result != 0) {
      return false;
    }
    // Read as a plain integer: a C callback may store any number there.
    int32_t type;
    std::memcpy(&type, &answer.type, sizeof type);
    require(type >= QV_INT32 && type <= QV_SD_PTR_ARRAY, CU_RESULT_BAD_VARIABLE_TYPE);
    return true;
  }

  cu_i_lexer lexer_;
  cu_i_token token_;
  cu_validate_callback_t callback_;
  void *p_token_;
  cu_expression_t &program_;
  int64_t depth_ = 0;    // values on the stack after the code emitted so far
  int64_t deepest_ = 0;  // the most at any point
};

}  // namespace

int32_t cu_i_compile_expression(std::string_view text, cu_validate_callback_t callback,
                                void *p_token, std::unique_ptr<cu_expression_t> &compiled) {
  auto program = std::make_unique<cu_expression_t>();
  try {
    compiler(text, callback, p_token, *program).compile();
  } catch (const cu_i_compile_error &error) {
    return error.code;
  }
  cu_i_fuse_tests(*program);
  compiled = std::move(program);
  return CU_RESULT_OK;
}
