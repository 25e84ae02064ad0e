// cu_expression_literals.cpp - the quoted literals that stand for values
// other than strings, and the regular expressions of =~ and !~.
//
// A binary value is written "0x" and two hexadecimal digits per byte; a
// resource handle as six hexadecimal groups (the header's two 16-bit halves
// in storage order, then id1 to id4). These are the forms that formatted
// criteria produce, so they are read back here exactly.
//
// Patterns are compiled once, with regcomp, when the expression is. Before
// that they are screened for what would let a short text cost a lot (see
// pattern_is_affordable).

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <vector>

#include "cu_i_expression.h"

namespace {

bool has_hex_prefix(std::string_view text) {
  return text.size() >= 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
}

bool is_space(char character) {
  return character == ' ' || character == '\t' || character == '\n' || character == '\r' ||
         character == '\f' || character == '\v';
}

// One group of a handle: "0x" and 1 to 8 hexadecimal digits.
bool read_group(std::string_view group, uint32_t &value) {
  if (!has_hex_prefix(group) || group.size() < 3 || group.size() > 10) {
    return false;
  }
  value = 0;
  for (size_t at = 2; at < group.size(); ++at) {
    const int digit = cu_i_hex_digit_value(group[at]);
    if (digit < 0) {
      return false;
    }
    value = (value << 4) | static_cast<uint32_t>(digit);
  }
  return true;
}

// The C library compiles a repeated piece by copying it: "x+" holds two
// copies of x, "x{2,5}" five, and repetitions nest, so "((x+)+)+" holds
// eight. Its compile time also explodes when a piece that can match the
// empty string is repeated ("(a*|b)+", "a*+", "(x?){50}"): every copy is
// reachable from every other without consuming input. So the screen below
// counts the atoms the compiled pattern will hold, refusing more than
// Max_Pattern_Atoms, and refuses repeating an empty-matching piece (which
// never adds anything: "(a*)+" matches what "a*" does) and back-references
// (exponential to match).
constexpr uint64_t Max_Pattern_Atoms = 16384;

uint64_t capped(uint64_t atoms) {
  return std::min(atoms, Max_Pattern_Atoms + 1);
}

// The index of the ']' that closes the bracket expression opening at `at`
// (or the pattern's size when none does).
size_t bracket_end(std::string_view pattern, size_t at) {
  size_t next = at + 1;
  if (next < pattern.size() && pattern[next] == '^') {
    ++next;
  }
  if (next < pattern.size() && pattern[next] == ']') {
    ++next;  // a ']' first in the list is one of its characters
  }
  while (next < pattern.size() && pattern[next] != ']') {
    const bool class_opens =
        pattern[next] == '[' && next + 1 < pattern.size() &&
        (pattern[next + 1] == ':' || pattern[next + 1] == '.' || pattern[next + 1] == '=');
    if (!class_opens) {
      ++next;
      continue;
    }
    const char kind = pattern[next + 1];  // "[:alpha:]", "[.-.]", "[=e=]"
    size_t close = next + 2;
    while (close + 1 < pattern.size() && !(pattern[close] == kind && pattern[close + 1] == ']')) {
      ++close;
    }
    next = close + 2;
  }
  return next;
}

// A bound "{m}", "{m,}", "{m,n}" or "{,n}" at `at`: how many copies it makes
// of its piece and its least count, with `end` set to its '}'. False when
// the brace opens no bound.
bool read_bound(std::string_view pattern, size_t at, size_t &end, uint64_t &copies,
                uint64_t &minimum) {
  size_t next = at + 1;
  auto read_number = [&](uint64_t &number) {
    const size_t first = next;
    for (number = 0; next < pattern.size() && pattern[next] >= '0' && pattern[next] <= '9';
         ++next) {
      number = capped(number * 10 + static_cast<uint64_t>(pattern[next] - '0'));
    }
    return next > first;
  };
  uint64_t maximum = 0;
  const bool has_minimum = read_number(minimum);
  bool open = false;
  if (next < pattern.size() && pattern[next] == ',') {
    ++next;
    open = !read_number(maximum);
  } else if (has_minimum) {
    maximum = minimum;
  } else {
    return false;
  }
  if (next >= pattern.size() || pattern[next] != '}') {
    return false;
  }
  end = next;
  // "{m,}" is m copies and a starred one.
  copies = open ? capped(minimum + 1) : std::max<uint64_t>(std::max(minimum, maximum), 1);
  return true;
}

// One parenthesised group (or the whole pattern) while it is being read.
struct pattern_group {
  uint64_t atoms = 0;           // of the pieces already passed
  bool branch_empty_ok = true;  // the current alternative so far can match ""
  bool any_branch_empty_ok = false;
  bool has_piece = false;  // the last piece, still open to a repetition:
  uint64_t piece_atoms = 0;
  bool piece_empty_ok = false;

  void pass_piece() {
    if (has_piece) {
      atoms = capped(atoms + piece_atoms);
      branch_empty_ok = branch_empty_ok && piece_empty_ok;
      has_piece = false;
      piece_atoms = 0;
    }
  }
  void start_piece(uint64_t new_atoms, bool empty_ok) {
    pass_piece();
    has_piece = true;
    piece_atoms = new_atoms;
    piece_empty_ok = empty_ok;
  }
  void end_branch() {
    pass_piece();
    any_branch_empty_ok = any_branch_empty_ok || branch_empty_ok;
    branch_empty_ok = true;
  }
};

bool pattern_is_affordable(std::string_view pattern) {
  std::vector<pattern_group> groups(1);  // outermost first
  for (size_t at = 0; at < pattern.size(); ++at) {
    pattern_group &group = groups.back();
    const char character = pattern[at];
    uint64_t copies = 1;
    uint64_t minimum = 1;
    size_t end = at;
    if (character == '\\') {
      if (at + 1 < pattern.size() && pattern[at + 1] >= '1' && pattern[at + 1] <= '9') {
        return false;  // a back-reference
      }
      ++at;
      group.start_piece(1, false);
    } else if (character == '[') {
      at = bracket_end(pattern, at);
      group.start_piece(1, false);
    } else if (character == '(') {
      groups.emplace_back();
    } else if (character == ')' && groups.size() > 1) {
      group.end_branch();
      const uint64_t atoms = std::max<uint64_t>(group.atoms, 1);
      const bool empty_ok = group.any_branch_empty_ok;
      groups.pop_back();
      groups.back().start_piece(atoms, empty_ok);
    } else if (character == '|') {
      group.end_branch();
    } else if (character == '^' || character == '$') {
      group.start_piece(1, true);  // anchors match no character
    } else if ((character == '*' || character == '+' || character == '?' ||
                (character == '{' && read_bound(pattern, at, end, copies, minimum))) &&
               group.has_piece) {
      const bool repeats = character == '*' || character == '+' || copies > 1;
      if (repeats && group.piece_empty_ok) {
        return false;
      }
      group.piece_atoms = capped(group.piece_atoms * (character == '+' ? 2 : copies));
      group.piece_empty_ok =
          group.piece_empty_ok || character == '*' || character == '?' || minimum == 0;
      at = end;
    } else {
      group.start_piece(1, false);
    }
    if (groups.back().atoms + groups.back().piece_atoms > Max_Pattern_Atoms) {
      return false;
    }
  }
  uint64_t total = 0;
  for (pattern_group &group : groups) {
    group.pass_piece();
    total = capped(total + group.atoms);
  }
  return total <= Max_Pattern_Atoms;
}

}  // namespace

bool cu_i_binary_from_text(std::string_view text, std::string &bytes) {
  if (!has_hex_prefix(text) || text.size() % 2 != 0) {
    return false;
  }
  bytes.clear();
  for (size_t at = 2; at < text.size(); at += 2) {
    const int high = cu_i_hex_digit_value(text[at]);
    const int low = cu_i_hex_digit_value(text[at + 1]);
    if (high < 0 || low < 0) {
      return false;
    }
    bytes.push_back(static_cast<char>(high * 16 + low));
  }
  return true;
}

bool cu_i_handle_from_text(std::string_view text, std::string &bytes) {
  uint32_t groups[6] = {};
  size_t total_groups = 0;
  size_t at = 0;
  while (true) {
    while (at < text.size() && is_space(text[at])) {
      ++at;
    }
    if (at == text.size()) {
      break;
    }
    size_t end = at;
    while (end < text.size() && !is_space(text[end])) {
      ++end;
    }
    if (total_groups == 6 || !read_group(text.substr(at, end - at), groups[total_groups])) {
      return false;
    }
    ++total_groups;
    at = end;
  }
  if (total_groups != 6 || groups[0] > 0xFFFF || groups[1] > 0xFFFF) {
    return false;
  }
  const uint16_t halves[2] = {static_cast<uint16_t>(groups[0]), static_cast<uint16_t>(groups[1])};
  qv_resource_handle_t handle{};
  std::memcpy(&handle.header, halves, sizeof halves);
  handle.id = qv_resource_id_t{groups[2], groups[3], groups[4], groups[5]};
  bytes.assign(reinterpret_cast<const char *>(&handle), sizeof handle);
  return true;
}

int32_t cu_i_compile_pattern(const std::string &text, std::unique_ptr<cu_i_pattern> &pattern) {
  if (!pattern_is_affordable(text)) {
    return CU_RESULT_BAD_PATTERN;
  }
  auto compiled = std::make_unique<cu_i_pattern>();
  const int result = regcomp(&compiled->compiled, text.c_str(), REG_EXTENDED | REG_NOSUB);
  if (result != 0) {
    return result == REG_ESPACE ? CU_RESULT_NO_MEMORY : CU_RESULT_BAD_PATTERN;
  }
  compiled->ready = true;
  pattern = std::move(compiled);
  return CU_RESULT_OK;
}
