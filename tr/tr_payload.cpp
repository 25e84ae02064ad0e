/*
 * tr_payload.cpp - the text of records: escaping, truncation at the payload
 * limit, and the payload of each record kind (values, strings, formatted
 * text, errors).
 *
 * A record must stay one line and a reader must be able to split it, so
 * control characters and backslashes are escaped (and quotes inside quoted
 * strings). Texts live in fixed caller-owned buffers: a record allocates
 * nothing, so it cannot fail for lack of memory or throw.
 */
#include <cstdio>
#include <cstring>

#include "tr_internal.h"

namespace {

constexpr char kNullText[] = "(null)";

/* The escape of one byte, or a count of 0 when the byte stands for itself. */
std::size_t escape_byte(unsigned char byte, bool quoted, bool escape_blanks, char *p_escape) {
  const char *p_short = nullptr;
  switch (byte) {
    case '\n':
      p_short = "\\n";
      break;
    case '\r':
      p_short = "\\r";
      break;
    case '\t':
      p_short = "\\t";
      break;
    case '\\':
      p_short = "\\\\";
      break;
    case '"':
      p_short = quoted ? "\\\"" : nullptr;
      break;
    default:
      break;
  }
  if (p_short != nullptr) {
    std::memcpy(p_escape, p_short, 2);
    return 2;
  }
  if (byte < 0x20 || byte == 0x7f || (escape_blanks && byte == ' ')) {
    static constexpr char kHexDigits[] = "0123456789abcdef";
    p_escape[0] = '\\';
    p_escape[1] = 'x';
    p_escape[2] = kHexDigits[byte >> 4];
    p_escape[3] = kHexDigits[byte & 0xf];
    return 4;
  }
  return 0;
}

void append_text(tr_i_text_t *p_text, const char *p_string) {
  tr_i_text_append(p_text, p_string, std::strlen(p_string));
}

void append_separator(tr_i_text_t *p_text) {
  if (p_text->length > 0) {
    tr_i_text_append(p_text, " ", 1);
  }
}

/* Items beyond TR_MAX_RECORD_ITEMS are not read from the arguments: a
 * count gone wrong must not walk far past the values actually passed. */
uint32_t items_to_read(uint32_t total_items) {
  return total_items < TR_MAX_RECORD_ITEMS ? total_items : TR_MAX_RECORD_ITEMS;
}

void mark_unread_items(tr_i_text_t *p_payload, uint32_t total_items, uint32_t total_read) {
  if (total_items > total_read) {
    p_payload->truncated = true;
  }
}

}  // namespace

void tr_i_text_append(tr_i_text_t *p_text, const char *p_bytes, std::size_t length) {
  if (p_text->truncated) {
    return;
  }
  if (length > p_text->capacity - p_text->length) {
    p_text->truncated = true;
    return;
  }
  std::memcpy(p_text->p_data + p_text->length, p_bytes, length);
  p_text->length += length;
}

void tr_i_text_append_escaped(tr_i_text_t *p_text, const char *p_bytes, std::size_t length,
                              bool quoted, bool escape_blanks) {
  for (std::size_t index = 0; index < length && !p_text->truncated; ++index) {
    char escape[4];
    const std::size_t escape_length =
        escape_byte(static_cast<unsigned char>(p_bytes[index]), quoted, escape_blanks, escape);
    if (escape_length == 0) {
      tr_i_text_append(p_text, &p_bytes[index], 1);
    } else {
      tr_i_text_append(p_text, escape, escape_length);
    }
  }
}

void tr_i_text_drop_incomplete_character(tr_i_text_t *p_text) {
  const auto byte_at = [p_text](std::size_t index) {
    return static_cast<unsigned char>(p_text->p_data[index]);
  };
  std::size_t lead = p_text->length;
  std::size_t continuations = 0;
  while (lead > 0 && continuations < 3 && (byte_at(lead - 1) & 0xc0) == 0x80) {
    --lead;
    ++continuations;
  }
  if (lead == 0) {
    return;
  }
  const unsigned char lead_byte = byte_at(lead - 1);
  const std::size_t expected = lead_byte >= 0xf0   ? 3
                               : lead_byte >= 0xe0 ? 2
                               : lead_byte >= 0xc0 ? 1
                                                   : 0;
  if (lead_byte >= 0xc0 && continuations < expected) {
    p_text->length = lead - 1;
  }
}

void tr_i_append_values(tr_i_text_t *p_payload, uint32_t total_values, va_list arguments) {
  const uint32_t total_to_read = items_to_read(total_values);
  for (uint32_t index = 0; index < total_to_read; ++index) {
    const uint32_t value = va_arg(arguments, uint32_t);
    char formatted[32];
    const int length = std::snprintf(formatted, sizeof(formatted), "%u(0x%x)", value, value);
    append_separator(p_payload);
    tr_i_text_append(p_payload, formatted, static_cast<std::size_t>(length));
  }
  mark_unread_items(p_payload, total_values, total_to_read);
}

void tr_i_append_strings(tr_i_text_t *p_payload, uint32_t total_strings, va_list arguments) {
  const uint32_t total_to_read = items_to_read(total_strings);
  for (uint32_t index = 0; index < total_to_read; ++index) {
    const char *p_string = va_arg(arguments, const char *);
    append_separator(p_payload);
    if (p_string == nullptr) {
      append_text(p_payload, kNullText);
      continue;
    }
    tr_i_text_append(p_payload, "\"", 1);
    tr_i_text_append_escaped(p_payload, p_string, std::strlen(p_string), true, false);
    tr_i_text_append(p_payload, "\"", 1);
  }
  mark_unread_items(p_payload, total_strings, total_to_read);
}

void tr_i_append_formatted(tr_i_text_t *p_payload, const char *p_format, va_list arguments) {
  /* Escaping only lengthens the text, so nothing beyond the payload limit
   * can ever be shown: format no further than that. */
  char formatted[TR_MAX_PAYLOAD_BYTES + 1];
  const int result = std::vsnprintf(formatted, sizeof(formatted), p_format, arguments);
  if (result < 0) {
    append_text(p_payload, "(format error)");
    return;
  }
  std::size_t length = static_cast<std::size_t>(result);
  const bool cut_by_format = length >= sizeof(formatted);
  if (cut_by_format) {
    length = sizeof(formatted) - 1;
  } else {
    /* The line ends the record; a newline the format ends with is not data. */
    while (length > 0 && formatted[length - 1] == '\n') {
      --length;
    }
  }
  tr_i_text_append_escaped(p_payload, formatted, length, false, false);
  if (cut_by_format) {
    p_payload->truncated = true;
  }
}

void tr_i_append_error(tr_i_text_t *p_payload, const char *p_function, uint32_t line,
                       const char *p_file, uint32_t flags) {
  const auto append_field = [p_payload](const char *p_name, const char *p_value) {
    append_text(p_payload, p_name);
    if (p_value == nullptr) {
      append_text(p_payload, kNullText);
    } else {
      tr_i_text_append_escaped(p_payload, p_value, std::strlen(p_value), false, true);
    }
  };
  append_field("function=", p_function);
  char formatted[32];
  int length = std::snprintf(formatted, sizeof(formatted), " line=%u", line);
  tr_i_text_append(p_payload, formatted, static_cast<std::size_t>(length));
  append_field(" file=", p_file);
  length = std::snprintf(formatted, sizeof(formatted), " flags=0x%x", flags);
  tr_i_text_append(p_payload, formatted, static_cast<std::size_t>(length));
}
