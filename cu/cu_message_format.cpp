// cu_message_format.cpp - renders message texts with printf conversions,
// positional ("%2$s") or sequential ("%s").
//
// The built-in default text of a message is trusted: its conversions decide
// the number and types of the arguments. A translated catalog text is not:
// it is used only when every conversion it holds matches an argument of the
// default text, so that a faulty translation can never make us read an
// argument with the wrong type. Each conversion is rendered by snprintf on
// its own, from a copy of the argument, which gives printf's exact output
// without relying on the C library's handling of positional arguments.

#include <cstdio>
#include <cstring>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "cu_i_message.h"

namespace {

// How an argument is read from the argument list.
enum class argument_kind {
  integer,
  long_integer,
  long_long_integer,
  size,
  floating,
  long_floating,
  string,
  pointer
};

// One conversion of a text: where it is, which argument it names, and the
// conversion without its position ("%-8.3lld" for "%2$-8.3lld").
struct conversion {
  size_t start;
  size_t end;
  size_t position;  // 1-based
  argument_kind kind;
  std::string directive;  // the conversion without its position, for snprintf
};

// A parsed text: its conversions in order, or nothing when a conversion is
// unusable (unknown letter, "*" width, mixed positional and sequential).
using parsed_text = std::optional<std::vector<conversion>>;

// Parses the length modifier and conversion letter at `at`; returns the
// argument kind or nothing for an unsupported conversion.
std::optional<argument_kind> read_kind(std::string_view text, size_t &at) {
  std::string_view length;
  static constexpr std::string_view lengths[] = {"hh", "ll", "h", "l", "q", "j", "z", "t", "L"};
  for (std::string_view candidate : lengths) {
    if (text.substr(at, candidate.size()) == candidate) {
      length = candidate;
      break;
    }
  }
  at += length.size();
  if (at >= text.size()) {
    return std::nullopt;
  }
  const char letter = text[at++];
  switch (letter) {
    case 'd':
    case 'i':
    case 'u':
    case 'x':
    case 'X':
    case 'o':
    case 'c':
      if (length == "ll" || length == "q" || length == "j") {
        return argument_kind::long_long_integer;
      }
      if (length == "l") {
        return argument_kind::long_integer;
      }
      if (length == "z" || length == "t") {
        return argument_kind::size;
      }
      if (length == "L") {
        return std::nullopt;
      }
      return argument_kind::integer;
    case 'f':
    case 'F':
    case 'e':
    case 'E':
    case 'g':
    case 'G':
    case 'a':
    case 'A':
      if (length == "L") {
        return argument_kind::long_floating;
      }
      return (length.empty() || length == "l") ? std::optional{argument_kind::floating}
                                               : std::nullopt;
    case 's':
      return length.empty() ? std::optional{argument_kind::string} : std::nullopt;
    case 'p':
      return length.empty() ? std::optional{argument_kind::pointer} : std::nullopt;
    default:
      return std::nullopt;
  }
}

parsed_text parse(std::string_view text) {
  std::vector<conversion> conversions;
  bool positional = false;
  bool sequential = false;
  size_t next_sequential = 1;
  for (size_t at = 0; at < text.size(); ++at) {
    if (text[at] != '%') {
      continue;
    }
    if (at + 1 < text.size() && text[at + 1] == '%') {
      ++at;
      continue;
    }
    conversion item{at, 0, 0, argument_kind::integer, "%"};
    size_t cursor = at + 1;
    size_t digits_end = cursor;
    while (digits_end < text.size() && text[digits_end] >= '0' && text[digits_end] <= '9') {
      ++digits_end;
    }
    if (digits_end > cursor && digits_end < text.size() && text[digits_end] == '$') {
      if (digits_end - cursor > 2) {
        return std::nullopt;
      }
      for (size_t digit = cursor; digit < digits_end; ++digit) {
        item.position = item.position * 10 + static_cast<size_t>(text[digit] - '0');
      }
      if (item.position == 0) {
        return std::nullopt;
      }
      cursor = digits_end + 1;
      positional = true;
    } else {
      item.position = next_sequential++;
      sequential = true;
    }
    const size_t directive_start = cursor;
    while (cursor < text.size() && std::strchr("-+ #0'", text[cursor]) != nullptr) {
      ++cursor;
    }
    while (cursor < text.size() &&
           ((text[cursor] >= '0' && text[cursor] <= '9') || text[cursor] == '.')) {
      ++cursor;
    }
    std::optional<argument_kind> kind = read_kind(text, cursor);
    if (!kind || positional == sequential) {
      return std::nullopt;
    }
    item.kind = *kind;
    item.directive.append(text.substr(directive_start, cursor - directive_start));
    item.end = cursor;
    conversions.push_back(std::move(item));
    at = cursor - 1;
  }
  return conversions;
}

// One argument, copied out of the argument list.
struct argument {
  argument_kind kind = argument_kind::integer;
  long long integer = 0;
  long double floating = 0;
  const void *pointer = nullptr;
};

// The kinds of arguments 1..n named by a default text, or nothing when
// an argument is missing in between or named with two different kinds.
std::optional<std::vector<argument_kind>> argument_kinds(const std::vector<conversion> &text) {
  std::vector<std::optional<argument_kind>> kinds;
  for (const conversion &item : text) {
    if (kinds.size() < item.position) {
      kinds.resize(item.position);
    }
    std::optional<argument_kind> &slot = kinds[item.position - 1];
    if (slot && *slot != item.kind) {
      return std::nullopt;
    }
    slot = item.kind;
  }
  std::vector<argument_kind> result;
  for (const std::optional<argument_kind> &kind : kinds) {
    if (!kind) {
      return std::nullopt;
    }
    result.push_back(*kind);
  }
  return result;
}

std::vector<argument> read_arguments(const std::vector<argument_kind> &kinds, va_list list) {
  std::vector<argument> values;
  for (argument_kind kind : kinds) {
    argument value;
    value.kind = kind;
    switch (kind) {
      case argument_kind::integer:
        value.integer = va_arg(list, int);
        break;
      case argument_kind::long_integer:
        value.integer = va_arg(list, long);
        break;
      case argument_kind::long_long_integer:
        value.integer = va_arg(list, long long);
        break;
      case argument_kind::size:
        value.integer = static_cast<long long>(va_arg(list, size_t));
        break;
      case argument_kind::floating:
        value.floating = va_arg(list, double);
        break;
      case argument_kind::long_floating:
        value.floating = va_arg(list, long double);
        break;
      case argument_kind::string:
        value.pointer = va_arg(list, const char *);
        break;
      case argument_kind::pointer:
        value.pointer = va_arg(list, const void *);
        break;
    }
    values.push_back(value);
  }
  return values;
}

// Renders one conversion of the given argument by snprintf.
void append_conversion(std::string &out, const conversion &item, const argument &value) {
  char buffer[512];
  const char *directive = item.directive.c_str();
  int length = 0;
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
  switch (value.kind) {
    case argument_kind::integer:
      length = std::snprintf(buffer, sizeof buffer, directive, static_cast<int>(value.integer));
      break;
    case argument_kind::long_integer:
      length = std::snprintf(buffer, sizeof buffer, directive, static_cast<long>(value.integer));
      break;
    case argument_kind::long_long_integer:
      length = std::snprintf(buffer, sizeof buffer, directive, value.integer);
      break;
    case argument_kind::size:
      length = std::snprintf(buffer, sizeof buffer, directive, static_cast<size_t>(value.integer));
      break;
    case argument_kind::floating:
      length = std::snprintf(buffer, sizeof buffer, directive, static_cast<double>(value.floating));
      break;
    case argument_kind::long_floating:
      length = std::snprintf(buffer, sizeof buffer, directive, value.floating);
      break;
    case argument_kind::string: {
      const char *text = value.pointer ? static_cast<const char *>(value.pointer) : "(null)";
      // A string may be longer than the buffer; print it through its own size.
      const int needed = std::snprintf(nullptr, 0, directive, text);
      if (needed > 0) {
        std::string piece(static_cast<size_t>(needed) + 1, '\0');
        std::snprintf(piece.data(), piece.size(), directive, text);
        piece.pop_back();
        out += piece;
      }
      return;
    }
    case argument_kind::pointer:
      length = std::snprintf(buffer, sizeof buffer, directive, value.pointer);
      break;
  }
#pragma GCC diagnostic pop
  if (length > 0) {
    out.append(buffer, std::min(static_cast<size_t>(length), sizeof buffer - 1));
  }
}

// Appends text with "%%" turned into "%".
void append_literal(std::string &out, std::string_view text) {
  for (size_t at = 0; at < text.size(); ++at) {
    out += text[at];
    if (text[at] == '%' && at + 1 < text.size() && text[at + 1] == '%') {
      ++at;
    }
  }
}

std::string render(std::string_view text, const std::vector<conversion> &conversions,
                   const std::vector<argument> &values) {
  std::string out;
  size_t at = 0;
  for (const conversion &item : conversions) {
    append_literal(out, text.substr(at, item.start - at));
    append_conversion(out, item, values[item.position - 1]);
    at = item.end;
  }
  append_literal(out, text.substr(at));
  return out;
}

// True when every conversion of a preferred text names an existing argument
// of the same kind.
bool fits(const std::vector<conversion> &conversions, const std::vector<argument> &values) {
  for (const conversion &item : conversions) {
    if (item.position > values.size() || values[item.position - 1].kind != item.kind) {
      return false;
    }
  }
  return true;
}

}  // namespace

std::string cu_i_format_message(const char *p_preferred_text, const char *p_default_text,
                                va_list arguments) {
  const std::string_view default_text = p_default_text ? p_default_text : "";
  const parsed_text default_conversions = parse(default_text);
  std::optional<std::vector<argument_kind>> kinds;
  if (default_conversions) {
    kinds = argument_kinds(*default_conversions);
  }
  if (!kinds) {
    return std::string(default_text);
  }
  const std::vector<argument> values = read_arguments(*kinds, arguments);
  if (p_preferred_text != nullptr) {
    const std::string_view preferred_text = p_preferred_text;
    const parsed_text preferred_conversions = parse(preferred_text);
    if (preferred_conversions && fits(*preferred_conversions, values)) {
      return render(preferred_text, *preferred_conversions, values);
    }
  }
  return render(default_text, *default_conversions, values);
}
