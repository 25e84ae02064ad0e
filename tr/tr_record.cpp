/*
 * tr_record.cpp - the exported functions of libqv_tr: registration and the
 * five record calls.
 *
 * Each one checks its pointers, builds the line through tr_writer.cpp and
 * tr_payload.cpp, and returns a code. None lets an exception out (the only
 * ones possible are allocation failures while reading the settings or
 * remembering a registration), and none changes errno: a component often
 * traces an error just before it reports the errno that caused it.
 */
#include <cerrno>
#include <cstdarg>

#include "tr_internal.h"

namespace {

/* Gives errno back to the caller on every way out of an exported function. */
class errno_keeper {
 public:
  errno_keeper() : saved_(errno) {}
  ~errno_keeper() { errno = saved_; }
  errno_keeper(const errno_keeper &) = delete;
  errno_keeper &operator=(const errno_keeper &) = delete;

 private:
  int saved_;
};

/* Writes the line; a record of a component that never registered is kept
 * but reported, so the missing registration shows up. */
int32_t finish_record(tr_i_line_t *p_line, const char *p_component) {
  const int32_t result = tr_i_write_line(p_line);
  if (result == TR_RESULT_OK && !tr_i_component_is_registered(p_component)) {
    return TR_RESULT_NOT_REGISTERED;
  }
  return result;
}

}  // namespace

extern "C" {

QV_TR_EXPORT int32_t tr_register_component_1(const char *p_component, unsigned char *p_levels,
                                             const tr_category_t *p_categories,
                                             uint32_t total_categories) {
  if (p_component == nullptr || p_levels == nullptr ||
      (p_categories == nullptr && total_categories > 0)) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  try {
    tr_i_register_component(p_component, p_levels, p_categories, total_categories);
    return TR_RESULT_OK;
  } catch (...) {
    return TR_RESULT_NO_MEMORY;
  }
}

QV_TR_EXPORT int32_t tr_record_id_1(const char *p_component, uint32_t id) {
  if (p_component == nullptr) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  try {
    tr_i_line_t line;
    tr_i_begin_line(&line, p_component, id);
    return finish_record(&line, p_component);
  } catch (...) {
    return TR_RESULT_NO_MEMORY;
  }
}

QV_TR_EXPORT int32_t tr_record_values_32_1(const char *p_component, uint32_t id,
                                           uint32_t total_values, ...) {
  if (p_component == nullptr) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  va_list arguments;
  va_start(arguments, total_values);
  int32_t result;
  try {
    tr_i_line_t line;
    tr_i_begin_line(&line, p_component, id);
    tr_i_append_values(&line.payload, total_values, arguments);
    result = finish_record(&line, p_component);
  } catch (...) {
    result = TR_RESULT_NO_MEMORY;
  }
  va_end(arguments);
  return result;
}

QV_TR_EXPORT int32_t tr_record_strings_1(const char *p_component, uint32_t id,
                                         uint32_t total_strings, ...) {
  if (p_component == nullptr) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  va_list arguments;
  va_start(arguments, total_strings);
  int32_t result;
  try {
    tr_i_line_t line;
    tr_i_begin_line(&line, p_component, id);
    tr_i_append_strings(&line.payload, total_strings, arguments);
    result = finish_record(&line, p_component);
  } catch (...) {
    result = TR_RESULT_NO_MEMORY;
  }
  va_end(arguments);
  return result;
}

QV_TR_EXPORT int32_t tr_record_fmt_string_1(const char *p_component, uint32_t id,
                                            const char *p_format, ...) {
  if (p_component == nullptr || p_format == nullptr) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  int32_t result;
  va_list arguments;
  va_start(arguments, p_format);
  try {
    if (id == TR_DEVELOPMENT_RECORD_ID && !tr_i_current_settings().keep_development_records) {
      result = TR_RESULT_OK;
    } else {
      tr_i_line_t line;
      tr_i_begin_line(&line, p_component, id);
      tr_i_append_formatted(&line.payload, p_format, arguments);
      result = finish_record(&line, p_component);
    }
  } catch (...) {
    result = TR_RESULT_NO_MEMORY;
  }
  va_end(arguments);
  return result;
}

QV_TR_EXPORT int32_t tr_record_error_1(const char *p_component, uint32_t id, const char *p_function,
                                       uint32_t line, const char *p_file, uint32_t flags) {
  if (p_component == nullptr) {
    return TR_RESULT_NULL_ARGUMENT;
  }
  errno_keeper keeper;
  try {
    tr_i_line_t record_line;
    tr_i_begin_line(&record_line, p_component, id);
    tr_i_append_error(&record_line.payload, p_function, line, p_file, flags);
    return finish_record(&record_line, p_component);
  } catch (...) {
    return TR_RESULT_NO_MEMORY;
  }
}

}  // extern "C"
