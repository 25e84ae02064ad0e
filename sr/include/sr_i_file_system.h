/*
 * sr_i_file_system.h - the one door through which the registry calls the
 * file system. Every system call on mount directories and table files goes
 * through Sr_File_System, a table of function pointers that starts out as
 * the C library's calls; tests swap single entries to make any one call
 * fail (ENOSPC, EIO, EINTR ...) and restore them afterwards.
 */
#ifndef SR_I_FILE_SYSTEM_H
#define SR_I_FILE_SYSTEM_H

#include <sys/types.h>

typedef struct sr_i_file_system_calls_struct_t {
  int (*mkdir)(const char *p_path, mode_t mode);
} sr_i_file_system_calls_t;

/* The calls in use; replaced only by tests, while no other thread runs. */
extern sr_i_file_system_calls_t Sr_File_System;
/* The C library's calls, for restoring Sr_File_System. */
extern const sr_i_file_system_calls_t Sr_Default_File_System;

/* Files are created 0644, directories 0755. */
inline constexpr mode_t Sr_File_Mode = 0644;
inline constexpr mode_t Sr_Directory_Mode = 0755;

#endif /* SR_I_FILE_SYSTEM_H */
