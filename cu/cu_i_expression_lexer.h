// cu_i_expression_lexer.h - the tokens of the expression language and the
// lexer that cuts criteria text into them (cu_expression_lexer.cpp).

#ifndef CU_I_EXPRESSION_LEXER_H
#define CU_I_EXPRESSION_LEXER_H

#include <cstddef>
#include <string>
#include <string_view>

#include "cu_i_expression.h"

enum class cu_i_token_kind : uint8_t {
  end,     // the end of the text
  name,    // a variable, field or function name, or the word "in"
  number,  // an integer or floating literal
  text,    // a quoted string
  symbol,  // an operator or punctuation
};

enum class cu_i_symbol : uint8_t {
  none,
  left_parenthesis,
  right_parenthesis,
  left_bracket,
  right_bracket,
  comma,
  dot,
  exclamation,  // !
  tilde,        // ~
  star,
  slash,
  percent,
  plus,
  minus,
  shift_left,
  shift_right,
  less,
  less_equal,
  greater,
  greater_equal,
  equal,        // ==
  not_equal,    // !=
  match,        // =~
  no_match,     // !~
  ampersand,    // &
  caret,        // ^
  bar,          // |
  logical_and,  // &&
  logical_or,   // ||
};

struct cu_i_token {
  cu_i_token_kind kind = cu_i_token_kind::end;
  cu_i_symbol symbol = cu_i_symbol::none;
  std::string_view spelling;  // the token as written
  std::string text;           // a quoted string's contents, escapes resolved
  cu_i_value number{};        // a number's value
};

class cu_i_lexer {
 public:
  explicit cu_i_lexer(std::string_view source) : source_(source) {}

  // Reads the next token. Throws cu_i_compile_error with
  // CU_RESULT_SYNTAX_ERROR or CU_RESULT_BAD_LITERAL.
  void next(cu_i_token &token);

 private:
  void read_number(cu_i_token &token);
  void read_double_quoted(cu_i_token &token);
  void read_single_quoted(cu_i_token &token);
  void read_symbol(cu_i_token &token);

  std::string_view source_;
  size_t position_ = 0;
};

#endif  // CU_I_EXPRESSION_LEXER_H
