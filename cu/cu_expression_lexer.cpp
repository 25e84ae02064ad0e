// cu_expression_lexer.cpp - cuts criteria text into tokens: names, numbers,
// quoted strings and operators.
//
// Character classes are fixed ASCII ones, never the locale's, so the same
// text means the same thing in every process. Bytes above 0x7F may appear in
// names (column names in UTF-8) and in strings. Numbers are read with
// std::from_chars, which ignores LC_NUMERIC. A double-quoted string is taken
// byte for byte up to the next double quote, because that is how formatted
// criteria write strings, binaries and handles (without escaping); a
// single-quoted string takes backslash escapes.

#include <charconv>
#include <cstdint>
#include <system_error>

#include "cu_i_expression_lexer.h"

namespace {

bool is_digit(char character) {
  return character >= '0' && character <= '9';
}

bool starts_name(char character) {
  return (character >= 'a' && character <= 'z') || (character >= 'A' && character <= 'Z') ||
         character == '_' || static_cast<unsigned char>(character) >= 0x80;
}

bool continues_name(char character) {
  return starts_name(character) || is_digit(character);
}

bool is_space(char character) {
  return character == ' ' || character == '\t' || character == '\n' || character == '\r' ||
         character == '\f' || character == '\v';
}

[[noreturn]] void fail(int32_t code) {
  throw cu_i_compile_error{code};
}

cu_i_value integer_value(uint64_t magnitude) {
  cu_i_value value{};
  if (magnitude <= INT64_MAX) {
    value.integer = static_cast<int64_t>(magnitude);
    value.number = cu_i_number::signed_integer;
  } else {
    value.unsigned_integer = magnitude;
    value.number = cu_i_number::unsigned_integer;
  }
  return value;
}

struct symbol_spelling {
  std::string_view spelling;
  cu_i_symbol symbol;
};

// Two-character symbols first, so that the longest spelling wins ("!~x" is
// "!~" then x, never "!" and "~x").
constexpr symbol_spelling Symbols[] = {{"<<", cu_i_symbol::shift_left},
                                       {">>", cu_i_symbol::shift_right},
                                       {"<=", cu_i_symbol::less_equal},
                                       {">=", cu_i_symbol::greater_equal},
                                       {"==", cu_i_symbol::equal},
                                       {"!=", cu_i_symbol::not_equal},
                                       {"=~", cu_i_symbol::match},
                                       {"!~", cu_i_symbol::no_match},
                                       {"&&", cu_i_symbol::logical_and},
                                       {"||", cu_i_symbol::logical_or},
                                       {"(", cu_i_symbol::left_parenthesis},
                                       {")", cu_i_symbol::right_parenthesis},
                                       {"[", cu_i_symbol::left_bracket},
                                       {"]", cu_i_symbol::right_bracket},
                                       {",", cu_i_symbol::comma},
                                       {".", cu_i_symbol::dot},
                                       {"!", cu_i_symbol::exclamation},
                                       {"~", cu_i_symbol::tilde},
                                       {"*", cu_i_symbol::star},
                                       {"/", cu_i_symbol::slash},
                                       {"%", cu_i_symbol::percent},
                                       {"+", cu_i_symbol::plus},
                                       {"-", cu_i_symbol::minus},
                                       {"<", cu_i_symbol::less},
                                       {">", cu_i_symbol::greater},
                                       {"&", cu_i_symbol::ampersand},
                                       {"^", cu_i_symbol::caret},
                                       {"|", cu_i_symbol::bar}};

}  // namespace

void cu_i_lexer::next(cu_i_token &token) {
  while (position_ < source_.size() && is_space(source_[position_])) {
    ++position_;
  }
  token.symbol = cu_i_symbol::none;
  if (position_ == source_.size()) {
    token.kind = cu_i_token_kind::end;
    token.spelling = source_.substr(position_, 0);
    return;
  }
  const char first = source_[position_];
  if (is_digit(first)) {
    read_number(token);
  } else if (starts_name(first)) {
    const size_t start = position_;
    while (position_ < source_.size() && continues_name(source_[position_])) {
      ++position_;
    }
    token.kind = cu_i_token_kind::name;
    token.spelling = source_.substr(start, position_ - start);
  } else if (first == '"') {
    read_double_quoted(token);
  } else if (first == '\'') {
    read_single_quoted(token);
  } else {
    read_symbol(token);
  }
}

// Decimal or 0x hexadecimal integers up to 2^64 - 1 (signed when they fit
// in 63 bits), and decimal floating literals with a digit before the point.
void cu_i_lexer::read_number(cu_i_token &token) {
  const size_t start = position_;
  const char *p_text = source_.data();
  const size_t size = source_.size();
  bool floating = false;
  uint64_t magnitude = 0;
  if (p_text[position_] == '0' && position_ + 1 < size &&
      (p_text[position_ + 1] == 'x' || p_text[position_ + 1] == 'X')) {
    position_ += 2;
    if (position_ == size || cu_i_hex_digit_value(p_text[position_]) < 0) {
      fail(CU_RESULT_SYNTAX_ERROR);
    }
    for (int digit; position_ < size && (digit = cu_i_hex_digit_value(p_text[position_])) >= 0;
         ++position_) {
      if (magnitude > (UINT64_MAX >> 4)) {
        fail(CU_RESULT_BAD_LITERAL);
      }
      magnitude = (magnitude << 4) | static_cast<uint64_t>(digit);
    }
  } else {
    while (position_ < size && is_digit(p_text[position_])) {
      ++position_;
    }
    if (position_ + 1 < size && p_text[position_] == '.' && is_digit(p_text[position_ + 1])) {
      floating = true;
      for (++position_; position_ < size && is_digit(p_text[position_]); ++position_) {
      }
    }
    if (position_ < size && (p_text[position_] == 'e' || p_text[position_] == 'E')) {
      size_t exponent = position_ + 1;
      if (exponent < size && (p_text[exponent] == '+' || p_text[exponent] == '-')) {
        ++exponent;
      }
      if (exponent < size && is_digit(p_text[exponent])) {
        floating = true;
        for (position_ = exponent; position_ < size && is_digit(p_text[position_]); ++position_) {
        }
      }
    }
    if (floating) {
      double value = 0;
      const auto [p_end, error] =
          std::from_chars(p_text + start, p_text + position_, value, std::chars_format::general);
      if (error != std::errc() || p_end != p_text + position_) {
        fail(CU_RESULT_BAD_LITERAL);
      }
      token.number = cu_i_value{};
      token.number.floating = value;
      token.number.number = cu_i_number::floating;
    } else {
      const auto [p_end, error] = std::from_chars(p_text + start, p_text + position_, magnitude);
      if (error != std::errc() || p_end != p_text + position_) {
        fail(CU_RESULT_BAD_LITERAL);
      }
    }
  }
  if (position_ < size && continues_name(p_text[position_])) {
    fail(CU_RESULT_SYNTAX_ERROR);  // "12abc", "0x1g", "1e5x"
  }
  if (!floating) {
    token.number = integer_value(magnitude);
  }
  token.kind = cu_i_token_kind::number;
  token.spelling = source_.substr(start, position_ - start);
}

void cu_i_lexer::read_double_quoted(cu_i_token &token) {
  const size_t start = position_;
  const size_t close = source_.find('"', start + 1);
  if (close == std::string_view::npos) {
    fail(CU_RESULT_SYNTAX_ERROR);
  }
  position_ = close + 1;
  token.kind = cu_i_token_kind::text;
  token.spelling = source_.substr(start, position_ - start);
  token.text.assign(source_.substr(start + 1, close - start - 1));
}

// Escapes: \\ \' \" \n \r \t and \xHH (two hexadecimal digits, not 00).
void cu_i_lexer::read_single_quoted(cu_i_token &token) {
  const size_t start = position_;
  token.text.clear();
  for (++position_;; ++position_) {
    if (position_ >= source_.size()) {
      fail(CU_RESULT_SYNTAX_ERROR);
    }
    char character = source_[position_];
    if (character == '\'') {
      break;
    }
    if (character == '\\') {
      if (++position_ >= source_.size()) {
        fail(CU_RESULT_SYNTAX_ERROR);
      }
      switch (source_[position_]) {
        case '\\':
        case '\'':
        case '"':
          character = source_[position_];
          break;
        case 'n':
          character = '\n';
          break;
        case 'r':
          character = '\r';
          break;
        case 't':
          character = '\t';
          break;
        case 'x': {
          const int high =
              position_ + 1 < source_.size() ? cu_i_hex_digit_value(source_[position_ + 1]) : -1;
          const int low =
              position_ + 2 < source_.size() ? cu_i_hex_digit_value(source_[position_ + 2]) : -1;
          if (high < 0 || low < 0 || (high == 0 && low == 0)) {
            fail(CU_RESULT_SYNTAX_ERROR);
          }
          character = static_cast<char>(high * 16 + low);
          position_ += 2;
          break;
        }
        default:
          fail(CU_RESULT_SYNTAX_ERROR);
      }
    }
    token.text.push_back(character);
  }
  ++position_;
  token.kind = cu_i_token_kind::text;
  token.spelling = source_.substr(start, position_ - start);
}

void cu_i_lexer::read_symbol(cu_i_token &token) {
  const std::string_view rest = source_.substr(position_);
  for (const symbol_spelling &candidate : Symbols) {
    if (rest.starts_with(candidate.spelling)) {
      token.kind = cu_i_token_kind::symbol;
      token.symbol = candidate.symbol;
      token.spelling = rest.substr(0, candidate.spelling.size());
      position_ += candidate.spelling.size();
      return;
    }
  }
  fail(CU_RESULT_SYNTAX_ERROR);  // a lone "=", or a character the language does not use
}
