/*
 * qv_tr.h - the trace library libqv_tr.
 *
 * A library registers a component (a short name such as "_SRA") with its
 * trace categories and an array of per-category levels. The trace library
 * fills the levels from the environment at registration; the component then
 * tests a level before each record it writes, so that a program with tracing
 * off pays for one byte comparison per call and nothing more.
 *
 * Environment (read once per process, when the first component registers or
 * the first record is written, whichever comes first):
 *   QV_TRACE_LEVELS  comma-separated settings "component.category=level",
 *                    "component=level" (every category of the component) or
 *                    "*=level" (every component); "*.category=level" and
 *                    "component.*=level" work too. Levels are 0 to 255,
 *                    0 meaning off; later settings override earlier ones.
 *                    Names compare exactly (case matters); blanks around
 *                    names, "=" and levels are ignored. A malformed item (no
 *                    "=", an empty name, a level that is not a decimal number
 *                    from 0 to 255) is skipped and the rest still apply.
 *                    A category no setting names gets level 0.
 *                    Example: "_SRA.API=1,_SRA.Errors=2".
 *   QV_TRACE_FILE    the file records are appended to, created with mode
 *                    0644 (less the umask) when the first record is written;
 *                    default "/tmp/qv_trace.<pid>.log", named after the
 *                    process that writes the first record. "-" means
 *                    standard error. If the file cannot be opened, that
 *                    record and every later one are dropped with
 *                    TR_RESULT_WRITE_FAILED; the open is not retried.
 *   QV_TRACE_DEVELOPMENT  when exactly "1", development records (those
 *                    written with tr_record_fmt_string_1 and identifier
 *                    0xFFFFFFFF) are kept; otherwise they are dropped.
 *
 * Every record is one line:
 *   <UTC time with microseconds> <pid>.<thread id> <component> <id> <payload>
 * for example
 *   2024-05-01T09:30:00.123456Z 4242.4243 _SRA 6 206(0xce)
 * The thread id is the kernel's (gettid). The identifier is decimal. A record
 * without payload (tr_record_id_1) ends after the identifier. Payloads:
 *   values   each value as <decimal>(0x<hex>), separated by one blank;
 *   strings  each string in double quotes, separated by one blank; a null
 *            string is (null), without quotes;
 *   format   the formatted text, trailing newlines removed;
 *   error    function=<name> line=<decimal> file=<path> flags=0x<hex>.
 * In components and payloads, control characters and the backslash are
 * escaped (\n, \r, \t, \\, \xHH; inside quotes also \"), so that a record
 * stays one line; blanks are escaped (\x20) in the component and the error
 * fields, whose ends are blanks; other bytes, UTF-8 included, are written as
 * they are. A component is cut at 64 bytes. A payload is cut after
 * TR_MAX_PAYLOAD_BYTES bytes, never inside an escape or a UTF-8 character,
 * and then ends with "[truncated]"; at most TR_MAX_RECORD_ITEMS values or
 * strings of one record are read.
 *
 * Whether a record is written does not depend on the levels: the caller tests
 * its level before calling. The one exception is the development rule above.
 * A record of a component that never registered is still written (a missing
 * registration should not hide records), but the call returns
 * TR_RESULT_NOT_REGISTERED so that the mistake can be found.
 *
 * All functions are thread-safe and keep the caller's errno. A line is
 * written with one write() on a descriptor opened with O_APPEND, so lines of
 * concurrent threads and processes never interleave (standard error gives
 * that promise only for lines up to PIPE_BUF bytes when it is a pipe). A
 * failing write is counted and reported with TR_RESULT_WRITE_FAILED, never
 * fatal. After fork, the child keeps appending to the file the parent opened;
 * its lines carry its own pid.
 * The functions return 0 or one of the TR_RESULT_* codes below.
 */
#ifndef QV_TR_H
#define QV_TR_H

#include <stdint.h>

#if defined(__GNUC__)
#define QV_TR_EXPORT __attribute__((visibility("default")))
/* Lets the compiler check formats against their arguments. */
#define QV_TR_PRINTF_LIKE(format_index, first_argument) \
  __attribute__((format(printf, format_index, first_argument)))
#else
#define QV_TR_EXPORT
#define QV_TR_PRINTF_LIKE(format_index, first_argument)
#endif

#ifdef __cplusplus
extern "C" {
#endif

#define TR_RESULT_OK 0
#define TR_RESULT_NULL_ARGUMENT 1  /* a required pointer was null */
#define TR_RESULT_NOT_REGISTERED 2 /* the component was never registered */
#define TR_RESULT_WRITE_FAILED 3   /* the trace file could not be opened or written */
#define TR_RESULT_NO_MEMORY 4      /* memory for the settings or the registration ran out */

/* The longest payload of a record, in bytes, before "[truncated]". */
#define TR_MAX_PAYLOAD_BYTES 4096u
/* The most values or strings one record reads from its arguments. */
#define TR_MAX_RECORD_ITEMS 64u

/* The identifier of development records. */
#define TR_DEVELOPMENT_RECORD_ID 0xFFFFFFFFu

/* One trace category of a component: its number (its index in the levels
 * array) and its name, as used in QV_TRACE_LEVELS. */
typedef struct tr_category_struct_t {
  uint32_t category_id;
  const char *p_name;
} tr_category_t;

/*
 * Registers `p_component` with `total_categories` categories. The library
 * writes each category's level into p_levels[category_id] from
 * QV_TRACE_LEVELS, now and whenever the component is registered again, with
 * relaxed atomic byte stores, so the component may read its levels without a
 * lock (with relaxed atomic loads) from any thread. Registering again, also
 * from racing threads, is harmless and adds nothing. p_levels and
 * p_categories must stay valid for the life of the process; p_categories may
 * be null only when total_categories is 0; category_id must be an index
 * inside p_levels.
 * Returns 0, TR_RESULT_NULL_ARGUMENT (p_component or p_levels null, or
 * p_categories null with categories) or TR_RESULT_NO_MEMORY.
 */
QV_TR_EXPORT int32_t tr_register_component_1(const char *p_component, unsigned char *p_levels,
                                             const tr_category_t *p_categories,
                                             uint32_t total_categories);

/* The record calls below return 0; TR_RESULT_NULL_ARGUMENT when
 * p_component (or p_format) is null, and nothing is written;
 * TR_RESULT_WRITE_FAILED when the record was lost; TR_RESULT_NOT_REGISTERED
 * when it was written for a component that never registered. */

/* A record of the identifier alone. */
QV_TR_EXPORT int32_t tr_record_id_1(const char *p_component, uint32_t id);

/* A record of `total_values` unsigned 32-bit values (passed as uint32_t). */
QV_TR_EXPORT int32_t tr_record_values_32_1(const char *p_component, uint32_t id,
                                           uint32_t total_values, ...);

/* A record of `total_strings` strings (const char *; null prints "(null)"). */
QV_TR_EXPORT int32_t tr_record_strings_1(const char *p_component, uint32_t id,
                                         uint32_t total_strings, ...);

/* A record whose payload is formatted by printf rules from `p_format` and
 * the arguments. With the identifier TR_DEVELOPMENT_RECORD_ID it is a
 * development record, kept only when QV_TRACE_DEVELOPMENT is "1". */
QV_TR_EXPORT int32_t tr_record_fmt_string_1(const char *p_component, uint32_t id,
                                            const char *p_format, ...) QV_TR_PRINTF_LIKE(3, 4);

/* A record of an error raised in `p_function` at `line` of `p_file`. */
QV_TR_EXPORT int32_t tr_record_error_1(const char *p_component, uint32_t id, const char *p_function,
                                       uint32_t line, const char *p_file, uint32_t flags);

#ifdef __cplusplus
}
#endif

#endif /* QV_TR_H */
