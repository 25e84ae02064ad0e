/*
 * tr_internal.h - the internals of libqv_tr, shared by its source files and
 * by the white-box tests that link the static twin qv_tr_internal.
 *
 * Settings (tr_settings.cpp) are an immutable snapshot of the environment,
 * published once through an atomic pointer; registrations (tr_components.cpp)
 * are an append-only lock-free list; the trace file (tr_writer.cpp) is one
 * atomic descriptor. Nothing on the record path takes a lock, so a record
 * can be written from any thread, and from a child forked while another
 * thread was writing.
 * Functions that allocate may throw std::bad_alloc; the exported functions
 * in tr_record.cpp catch it.
 */
#ifndef TR_INTERNAL_H
#define TR_INTERNAL_H

#include <cstdarg>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "qv_tr.h"

/* One item of QV_TRACE_LEVELS. "*" as the component matches every
 * component; applies_to_every_category is set for "component=level" and
 * "component.*=level". */
typedef struct tr_i_level_setting_struct_t {
  std::string component;
  std::string category;
  bool applies_to_every_category;
  unsigned char level;
} tr_i_level_setting_t;

/* The process's settings as read from the environment. A snapshot never
 * changes once published; a replaced one is kept (p_previous) because a
 * reader may still hold it. */
typedef struct tr_i_settings_struct_t {
  std::vector<tr_i_level_setting_t> level_settings;
  std::string trace_file_path; /* empty: the default file */
  bool keep_development_records;
  const struct tr_i_settings_struct_t *p_previous;
} tr_i_settings_t;

/* --- Settings (tr_settings.cpp) --- */

/* Parses a QV_TRACE_LEVELS value; malformed items are left out. */
std::vector<tr_i_level_setting_t> tr_i_parse_level_settings(std::string_view text);

/* The level the settings give `p_category` (may be null: only settings for
 * every category apply) of `p_component`; 0 when none applies. */
unsigned char tr_i_level_for(const std::vector<tr_i_level_setting_t> &level_settings,
                             const char *p_component, const char *p_category);

/* The current settings, read from the environment on the first call. */
const tr_i_settings_t &tr_i_current_settings();

/* Reads the environment again, closes the trace file so that the next record
 * opens the one now named, and rewrites the levels of every registered
 * component. For tests and for moments when no other thread writes records:
 * a record racing with it may be lost. */
void tr_i_reload_settings();

/* --- Registrations (tr_components.cpp) --- */

/* Writes the levels of the categories and remembers the registration. */
void tr_i_register_component(const char *p_component, unsigned char *p_levels,
                             const tr_category_t *p_categories, uint32_t total_categories);

/* True once `p_component` has been registered in this process. */
bool tr_i_component_is_registered(const char *p_component);

/* Rewrites the levels of every registration from `settings`. */
void tr_i_apply_levels_to_registered_components(const tr_i_settings_t &settings);

/* The number of distinct registrations remembered. */
std::size_t tr_i_total_registrations();

/* --- Payload text (tr_payload.cpp) --- */

/* A bounded text in caller-owned storage. Appends that do not fit set
 * `truncated` and are dropped whole, so an escape sequence or a number is
 * never cut; every later append is ignored. */
typedef struct tr_i_text_struct_t {
  char *p_data;
  std::size_t capacity;
  std::size_t length;
  bool truncated;
} tr_i_text_t;

/* The longest component name written, in escaped bytes. */
constexpr std::size_t TR_I_MAX_COMPONENT_BYTES = 64;
constexpr char TR_I_TRUNCATION_MARKER[] = "[truncated]";

void tr_i_text_append(tr_i_text_t *p_text, const char *p_bytes, std::size_t length);
/* Appends `p_bytes` with control characters and backslashes escaped; with
 * `quoted`, also double quotes; with `escape_blanks`, also blanks. */
void tr_i_text_append_escaped(tr_i_text_t *p_text, const char *p_bytes, std::size_t length,
                              bool quoted, bool escape_blanks);
/* Removes a UTF-8 character left incomplete at the end by a truncation. */
void tr_i_text_drop_incomplete_character(tr_i_text_t *p_text);

/* The payloads of the record kinds; each reads its arguments from `arguments`. */
void tr_i_append_values(tr_i_text_t *p_payload, uint32_t total_values, va_list arguments);
void tr_i_append_strings(tr_i_text_t *p_payload, uint32_t total_strings, va_list arguments);
void tr_i_append_formatted(tr_i_text_t *p_payload, const char *p_format, va_list arguments);
void tr_i_append_error(tr_i_text_t *p_payload, const char *p_function, uint32_t line,
                       const char *p_file, uint32_t flags);

/* --- Record lines and the trace file (tr_writer.cpp) --- */

/* The prefix (time, pid.thread id, component, identifier, blanks) never
 * needs more than this many bytes. */
constexpr std::size_t TR_I_PREFIX_CAPACITY = 96 + TR_I_MAX_COMPONENT_BYTES;
constexpr std::size_t TR_I_LINE_CAPACITY =
    TR_I_PREFIX_CAPACITY + TR_MAX_PAYLOAD_BYTES + sizeof(TR_I_TRUNCATION_MARKER) + 1;

/* One record being built: the prefix, then the payload, whose text view
 * stops at TR_MAX_PAYLOAD_BYTES. */
typedef struct tr_i_line_struct_t {
  char data[TR_I_LINE_CAPACITY];
  std::size_t prefix_length;
  tr_i_text_t payload;
} tr_i_line_t;

/* Starts a record: writes the prefix and sets up the payload view. */
void tr_i_begin_line(tr_i_line_t *p_line, const char *p_component, uint32_t id);

/* Ends the line and writes it with one write(). Returns TR_RESULT_OK or
 * TR_RESULT_WRITE_FAILED (the file cannot be opened or the write failed;
 * counted in tr_i_total_lost_records). */
int32_t tr_i_write_line(tr_i_line_t *p_line);

/* The open trace file's descriptor, or -1 when none is open. */
int tr_i_trace_file_descriptor();

/* Forgets the trace file (closing it unless it is standard error). Same
 * caveat as tr_i_reload_settings. */
void tr_i_close_trace_file();

/* Records lost since the process started. */
uint64_t tr_i_total_lost_records();

#endif /* TR_INTERNAL_H */
