/*
 * sr_i_errors.h - raising errors: one call where a failure is found records
 * the code and its message for the calling thread (through libqv_cu) and,
 * when the "Errors" trace category is on, an error trace record. Callers
 * further up pass the code on without raising again.
 *
 * The raising site (function, line, module path) is taken from the call
 * site by sr_i_source_location, so no call passes __LINE__ by hand.
 */
#ifndef SR_I_ERRORS_H
#define SR_I_ERRORS_H

#include <cstdint>
#include <string>

#include "frame/sr_i_source_location.h"
#include "qv_sr.h"

/* The catalog of the registry's messages and its message set. */
inline constexpr const char *Sr_Message_Catalog = "qv_sr.cat";
inline constexpr int32_t Sr_Message_Set = 1;

/* Numbers of the messages in set 1 of "qv_sr.cat" (indexes of
 * cu_mesgtbl_qv_sr_set) that carry inserts. */
enum sr_i_message_number : int32_t {
  SR_I_MESSAGE_SYSTEM_CALL = 1,
  SR_I_MESSAGE_LIBRARY_CALL = 2,
  SR_I_MESSAGE_NO_MEMORY = 3,
  SR_I_MESSAGE_INTERNAL = 6,
  SR_I_MESSAGE_INVALID_PATH = 9,
  SR_I_MESSAGE_INVALID_CRITERIA = 16,
  SR_I_MESSAGE_FILESYSTEM_FULL = 30,
  SR_I_MESSAGE_KEY_NOT_FOUND = 31,
};

/* The message number of a code whose message has no insert, or 0 when the
 * code has inserts (and needs its own raising function) or is unknown. */
constexpr int32_t sr_i_plain_message_number(int32_t code) {
  constexpr int32_t codes[] = {13,  14,  100, 101, 103, 104, 105, 106, 107, 108, 200, 201, 202,
                               203, 204, 205, 206, 207, 208, 209, 210, 211, 212, 213, 214, 215};
  constexpr int32_t numbers[] = {4,  5,  7,  8,  10, 11, 12, 13, 14, 15, 17, 18, 19,
                                 20, 21, 22, 23, 24, 25, 26, 27, 28, 29, 19, 19, 19};
  for (size_t at = 0; at < sizeof codes / sizeof codes[0]; ++at) {
    if (codes[at] == code) {
      return numbers[at];
    }
  }
  return 0;
}

/* A code whose message has no insert, checked when the program is compiled:
 * raising SR_E_SYSTEM_CALL through sr_i_raise does not build. */
struct sr_i_plain_code {
  int32_t code;
  consteval sr_i_plain_code(int32_t plain_code) : code(plain_code) {
    if (sr_i_plain_message_number(plain_code) == 0) {
      throw "this code has message inserts: use its own sr_i_raise_* function";
    }
  }
};

/* Each returns the code it raised. */
int32_t sr_i_raise(sr_i_plain_code code,
                   sr_i_source_location where = sr_i_source_location::current());
/* 10: a system or pthread call returned `error_number`. */
int32_t sr_i_raise_system_call(const char *p_call, int error_number,
                               sr_i_source_location where = sr_i_source_location::current());
/* 11: a companion library function (named without its "_1") returned `result`. */
int32_t sr_i_raise_library_call(const char *p_function, int32_t result,
                                sr_i_source_location where = sr_i_source_location::current());
/* 12 */
int32_t sr_i_raise_no_memory(sr_i_source_location where = sr_i_source_location::current());
/* 15 */
int32_t sr_i_raise_internal(sr_i_source_location where = sr_i_source_location::current());
/* 102: `p_path` may be null. */
int32_t sr_i_raise_invalid_path(const char *p_path,
                                sr_i_source_location where = sr_i_source_location::current());
/* 109: a replacement variable of the criteria format `p_criteria` (the
 * whole format is the insert) has no known type. */
int32_t sr_i_raise_invalid_criteria(const char *p_criteria,
                                    sr_i_source_location where = sr_i_source_location::current());

/*
 * 16: a write found the filesystem full. Names the filesystem holding
 * `p_path` from the mount table (Sr_Mount_Table_Path), or "UNKNOWN" when
 * the mount table cannot be read.
 */
int32_t sr_i_raise_filesystem_full(const char *p_path);

/* The mount table read by sr_i_raise_filesystem_full: "/etc/mtab"; tests
 * point it at a file of their own. */
extern const char *Sr_Mount_Table_Path;

/* The filesystem holding a path: its device and the directory it is
 * mounted over, "UNKNOWN" where the mount table does not say. */
struct sr_i_filesystem_t {
  std::string device;
  std::string directory;
};

/* Looks `p_path` up in the mount table at `p_mount_table`; false when the
 * table cannot be opened. */
bool get_filesystem_containing_file(const char *p_path, const char *p_mount_table,
                                    sr_i_filesystem_t &filesystem);

/*
 * 202 with the richer message 2605-213: no row of table `p_table_name`
 * (null: "(UNKNOWN_TABLE_NAME)") has the key `p_key` of type `type`.
 */
int32_t sr_i_raise_key_not_found(const char *p_table_name, const qv_value_t *p_key,
                                 qv_data_type_t type);

#endif /* SR_I_ERRORS_H */
