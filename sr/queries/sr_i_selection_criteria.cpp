// sr_i_selection_criteria.cpp - selection criteria from the caller's format
// to a row's verdict: the expansion of "$" replacement variables into
// literals of the expression language, the compilation of the expanded text
// against a table's columns (with the column callback the compiler asks for
// each name), and the evaluation of the compiled expression on one row
// record or, in one call, on a run of fixed-index entries. The expression
// language itself is libqv_cu's.

#include "queries/sr_i_selection_criteria.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_columns.h"

namespace {

// ---- The growing result ---------------------------------------------------

// The expanded text grows in steps of this many bytes; the first allocation
// is one step.
constexpr size_t Result_Growth_Bytes = 4096;

// The expanded criteria while they are built. The buffer comes from malloc
// because the caller releases the finished string with free.
class criteria_text {
 public:
  criteria_text() = default;
  criteria_text(const criteria_text &) = delete;
  criteria_text &operator=(const criteria_text &) = delete;
  ~criteria_text() { std::free(p_text_); }

  // The first allocation. Returns 0 or 12 (raised).
  int32_t start() {
    p_text_ = static_cast<char *>(std::malloc(Result_Growth_Bytes));
    if (p_text_ == nullptr) {
      return sr_i_raise_no_memory();
    }
    capacity_ = Result_Growth_Bytes;
    return 0;
  }

  // Room for `length` more bytes, growing by whole steps with one
  // reallocation. Returns 0 or 12 (raised).
  int32_t make_room(size_t length) {
    size_t capacity = capacity_;
    while (used_ + length > capacity) {
      capacity += Result_Growth_Bytes;
    }
    if (capacity == capacity_) {
      return 0;
    }
    char *p_grown = static_cast<char *>(std::realloc(p_text_, capacity));
    if (p_grown == nullptr) {
      return sr_i_raise_no_memory();
    }
    p_text_ = p_grown;
    capacity_ = capacity;
    return 0;
  }

  int32_t append(const char *p_bytes, size_t length) {
    if (const int32_t rc = make_room(length); rc != 0) {
      return rc;
    }
    std::memcpy(p_text_ + used_, p_bytes, length);
    used_ += length;
    return 0;
  }

  int32_t append(const char *p_string) { return append(p_string, std::strlen(p_string)); }

  [[gnu::format(printf, 2, 3)]] int32_t append_printf(const char *p_format, ...) {
    va_list arguments;
    va_start(arguments, p_format);
    const int32_t rc = append_vprintf(p_format, arguments);
    va_end(arguments);
    return rc;
  }

  // The binary's bytes as two lower-case hexadecimal digits each.
  int32_t append_hex(const unsigned char *p_bytes, size_t length) {
    static constexpr char Digits[] = "0123456789abcdef";
    if (const int32_t rc = make_room(2 * length); rc != 0) {
      return rc;
    }
    for (size_t at = 0; at < length; ++at) {
      p_text_[used_++] = Digits[p_bytes[at] >> 4];
      p_text_[used_++] = Digits[p_bytes[at] & 0xF];
    }
    return 0;
  }

  // Terminates the text and hands it over. Returns 0 or 12 (raised).
  int32_t finish(char **p_result) {
    if (const int32_t rc = append("", 1); rc != 0) {
      return rc;
    }
    *p_result = p_text_;
    p_text_ = nullptr;
    return 0;
  }

 private:
  int32_t append_vprintf(const char *p_format, va_list arguments) {
    va_list measuring;
    va_copy(measuring, arguments);
    const int length = std::vsnprintf(nullptr, 0, p_format, measuring);
    va_end(measuring);
    if (length < 0) {
      return sr_i_raise_internal();
    }
    // vsnprintf writes its own terminator behind the text; the room for it
    // is taken but not counted as used.
    if (const int32_t rc = make_room(static_cast<size_t>(length) + 1); rc != 0) {
      return rc;
    }
    std::vsnprintf(p_text_ + used_, static_cast<size_t>(length) + 1, p_format, arguments);
    used_ += static_cast<size_t>(length);
    return 0;
  }

  char *p_text_ = nullptr;
  size_t used_ = 0;
  size_t capacity_ = 0;
};

// ---- Replacement variables ------------------------------------------------

enum class variable_type {
  unknown,
  int32,
  int64,
  uint32,
  uint64,
  float_fixed, /* $f: printed with %f */
  float_short, /* $d: printed with %g */
  string,
  binary,
  resource_handle
};

// Type letters are taken in either case; the locale plays no part.
char lower_ascii(char letter) {
  return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter - 'A' + 'a') : letter;
}

// The variable whose type letters start at `p_letters`, and how many letters
// it has (also for an unknown one, which ends the expansion anyway).
variable_type read_variable_type(const char *p_letters, size_t *p_letter_count) {
  *p_letter_count = 1;
  switch (lower_ascii(p_letters[0])) {
    case 'i':
      return variable_type::int32;
    case 'l':
      return variable_type::int64;
    case 'f':
      return variable_type::float_fixed;
    case 'd':
      return variable_type::float_short;
    case 's':
      return variable_type::string;
    case 'b':
      return variable_type::binary;
    case 'u':
      *p_letter_count = 2;
      switch (lower_ascii(p_letters[1])) {
        case 'i':
          return variable_type::uint32;
        case 'l':
          return variable_type::uint64;
        default:
          return variable_type::unknown;
      }
    case 'r':
      *p_letter_count = 2;
      return lower_ascii(p_letters[1]) == 'h' ? variable_type::resource_handle
                                              : variable_type::unknown;
    default:
      return variable_type::unknown;
  }
}

// A null pointer argument stands for the type's empty value, as it does
// when a row is stored.
int32_t append_string(criteria_text &text, char *p_argument) {
  qv_value_t value{};
  value.ptr_char = p_argument;
  const char *p_string = sr_i_value_or_empty(QV_CHAR_PTR, value).ptr_char;
  if (const int32_t rc = text.append("\""); rc != 0) {
    return rc;
  }
  if (const int32_t rc = text.append(p_string); rc != 0) {
    return rc;
  }
  return text.append("\"");
}

int32_t append_binary(criteria_text &text, qv_binary_t *p_argument) {
  qv_value_t value{};
  value.ptr_binary = p_argument;
  const qv_binary_t *p_binary = sr_i_value_or_empty(QV_BINARY_PTR, value).ptr_binary;
  if (const int32_t rc = text.append("\"0x"); rc != 0) {
    return rc;
  }
  if (const int32_t rc = text.append_hex(p_binary->data, p_binary->length); rc != 0) {
    return rc;
  }
  return text.append("\"");
}

// The header word's two 16-bit halves in storage order, then the identity.
int32_t append_resource_handle(criteria_text &text, qv_resource_handle_t *p_argument) {
  qv_value_t value{};
  value.ptr_rsrc_handle = p_argument;
  const qv_resource_handle_t *p_handle =
      sr_i_value_or_empty(QV_RSRC_HANDLE_PTR, value).ptr_rsrc_handle;
  uint16_t halves[2];
  std::memcpy(halves, &p_handle->header, sizeof halves);
  return text.append_printf("\"0x%04x 0x%04x 0x%08x 0x%08x 0x%08x 0x%08x\"", unsigned{halves[0]},
                            unsigned{halves[1]}, p_handle->id.id1, p_handle->id.id2,
                            p_handle->id.id3, p_handle->id.id4);
}

// Takes the variable's argument and appends it as a literal.
int32_t append_value(criteria_text &text, variable_type type, va_list *p_arguments) {
  switch (type) {
    case variable_type::int32:
      return text.append_printf("%-d", va_arg(*p_arguments, int32_t));
    case variable_type::int64:
      return text.append_printf("%-lld", static_cast<long long>(va_arg(*p_arguments, int64_t)));
    case variable_type::uint32:
      return text.append_printf("%-u", va_arg(*p_arguments, uint32_t));
    case variable_type::uint64:
      return text.append_printf("%-llu",
                                static_cast<unsigned long long>(va_arg(*p_arguments, uint64_t)));
    case variable_type::float_fixed:
      return text.append_printf("%-f", va_arg(*p_arguments, double));
    case variable_type::float_short:
      return text.append_printf("%-g", va_arg(*p_arguments, double));
    case variable_type::string:
      return append_string(text, va_arg(*p_arguments, char *));
    case variable_type::binary:
      return append_binary(text, va_arg(*p_arguments, qv_binary_t *));
    case variable_type::resource_handle:
      return append_resource_handle(text, va_arg(*p_arguments, qv_resource_handle_t *));
    case variable_type::unknown:
      break;
  }
  return sr_i_raise_internal();
}

// Walks the format, copying plain text and replacing each variable.
int32_t expand(criteria_text &text, const char *p_format, va_list *p_arguments) {
  const char *p_at = p_format;
  while (*p_at != '\0') {
    if (*p_at != '$') {
      const size_t plain = std::strcspn(p_at, "$");
      if (const int32_t rc = text.append(p_at, plain); rc != 0) {
        return rc;
      }
      p_at += plain;
      continue;
    }
    // "$" before a quote is no variable: both characters stay as they are.
    if (p_at[1] == '"' || p_at[1] == '\'') {
      if (const int32_t rc = text.append(p_at, 2); rc != 0) {
        return rc;
      }
      p_at += 2;
      continue;
    }
    size_t letter_count = 0;
    const variable_type type = read_variable_type(p_at + 1, &letter_count);
    if (type == variable_type::unknown) {
      return sr_i_raise_invalid_criteria(p_format);
    }
    if (const int32_t rc = append_value(text, type, p_arguments); rc != 0) {
      return rc;
    }
    p_at += 1 + letter_count;
  }
  return 0;
}

// ---- Structured-data definitions in the metadata record -------------------

// Looks a field up in a column's packed structured-data definition: a u32
// field count, then per field a u32 type and the NUL-terminated name, with
// no alignment.
bool find_structured_field(const sr_sd_def_t *p_definition, const char *p_name,
                           cu_validate_data_t *p_return_data) {
  const auto *p_cursor = reinterpret_cast<const unsigned char *>(p_definition);
  uint32_t total_fields = 0;
  std::memcpy(&total_fields, p_cursor, sizeof total_fields);
  p_cursor += sizeof total_fields;
  for (uint32_t field = 0; field < total_fields; ++field) {
    uint32_t type = 0;
    std::memcpy(&type, p_cursor, sizeof type);
    p_cursor += sizeof type;
    const char *p_field_name = reinterpret_cast<const char *>(p_cursor);
    if (std::strcmp(p_field_name, p_name) == 0) {
      p_return_data->type = static_cast<qv_data_type_t>(type);
      p_return_data->id = field;
      return true;
    }
    p_cursor += std::strlen(p_field_name) + 1;
  }
  return false;
}

// What the evaluator answers for a row that cannot match: an arithmetic
// fault, a missing value or an index out of range.
bool means_no_match(int32_t result) {
  return result == CU_RESULT_ARITHMETIC_FAULT || result == CU_RESULT_VALUE_MISSING ||
         result == CU_RESULT_INDEX_OUT_OF_RANGE;
}

}  // namespace

int32_t sr_i_select_printf(char **p_result, const char *p_selection_criteria, va_list ap) {
  *p_result = nullptr;
  criteria_text text;
  if (const int32_t rc = text.start(); rc != 0) {
    return rc;
  }
  va_list arguments;
  va_copy(arguments, ap);
  int32_t rc = expand(text, p_selection_criteria, &arguments);
  va_end(arguments);
  if (rc == 0) {
    rc = text.finish(p_result);
  }
  return rc;
}

int32_t sr_i_compile_expression(const char *p_selection_criteria, sr_i_table_t *p_table,
                                cu_expression_t **p_compiled_expression,
                                cu_iconv_t *p_string_conversion_handle) {
  *p_compiled_expression = nullptr;
  // Criteria only make sense for a table of a tree: the tree's handle puts
  // the text into the code set the column names and strings are stored in.
  if (p_string_conversion_handle == nullptr) {
    return sr_i_raise_internal();
  }
  char *p_converted = nullptr;
  if (const int32_t rc =
          cu_iconv_str_1(p_string_conversion_handle, p_selection_criteria, &p_converted);
      rc != 0) {
    return rc == CU_RESULT_NO_MEMORY ? sr_i_raise_no_memory()
                                     : sr_i_raise_library_call("cu_iconv_str", rc);
  }
  const int32_t rc =
      cu_comp_expr_1(p_converted, 0, sr_i_validate_column_callback, p_table, p_compiled_expression);
  std::free(p_converted);
  if (rc != 0) {
    return rc == CU_RESULT_NO_MEMORY ? sr_i_raise_no_memory()
                                     : sr_i_raise_library_call("cu_comp_expr", rc);
  }
  return 0;
}

int32_t sr_i_validate_column_callback(void *p_token, const char *p_name, uint32_t /*length*/,
                                      uint32_t parent_id, cu_validate_data_t *p_return_data) {
  const auto *p_table = static_cast<const sr_i_table_t *>(p_token);
  if (parent_id == CU_EXPR_NO_PARENT) {
    const int32_t column = sr_i_find_column(p_table, p_name);
    if (column < 0) {
      return -1;
    }
    p_return_data->type = p_table->p_columns[column].type;
    p_return_data->id = static_cast<uint32_t>(column);
    return 0;
  }
  if (parent_id >= p_table->total_columns) {
    return -1;
  }
  const sr_sd_def_t *p_definition = p_table->p_columns[parent_id].sd_defn;
  if (p_definition == nullptr || !find_structured_field(p_definition, p_name, p_return_data)) {
    return -1;
  }
  return 0;
}

int32_t sr_i_evaluation_failure(int32_t evaluation_result, bool *p_matches) {
  if (means_no_match(evaluation_result)) {
    *p_matches = false;
    return 0;
  }
  return sr_i_raise_library_call("cu_exec_expr", evaluation_result);
}

sr_i_table_criteria::~sr_i_table_criteria() {
  if (p_expression_ != nullptr) {
    cu_free_expr_1(p_expression_, 0);
  }
}

int32_t sr_i_table_criteria::compile(sr_i_table_t *p_table, const char *p_criteria) {
  if (p_criteria == nullptr) {
    return 0;
  }
  // A table outside a tree has no conversion handle, and compiling refuses.
  cu_iconv_t *p_conversion =
      p_table->p_tree != nullptr ? p_table->p_tree->p_to_table_string_conversion_handle : nullptr;
  return sr_i_compile_expression(p_criteria, p_table, &p_expression_, p_conversion);
}

int32_t sr_i_table_criteria::judge(const sr_i_table_t *p_table, const sr_i_index_entry_t *p_entries,
                                   uint32_t total, bool applied, unsigned char *p_verdicts) const {
  if (p_expression_ == nullptr) {
    std::memset(p_verdicts, 1, total);
    return 0;
  }
  // The evaluator reads each entry's record pointer in place, one entry's
  // size after the other, and finds slots and the variable part where a row
  // record keeps them.
  const void *p_first_pointer = applied ? &p_entries->p_applied : &p_entries->p_committed;
  const int32_t rc = cu_exec_expr_rows_1(
      p_expression_, CU_EXPR_MODE_ENCODED_SLOTS, p_first_pointer, sizeof(sr_i_index_entry_t), total,
      Sr_Row_Header_Length, p_table->total_columns, sr_i_row_fixed_length(p_table), p_verdicts);
  if (rc != 0) {
    return sr_i_raise_library_call("cu_exec_expr_rows", rc);
  }
  return 0;
}

int32_t sr_i_expand_criteria(const char *p_selection_criteria, va_list ap,
                             sr_i_expanded_criteria &expanded) {
  if (p_selection_criteria == nullptr) {
    expanded.reset();
    return 0;
  }
  char *p_expanded = nullptr;
  if (const int32_t rc = sr_i_select_printf(&p_expanded, p_selection_criteria, ap); rc != 0) {
    return rc;
  }
  expanded.reset(p_expanded);
  return 0;
}
