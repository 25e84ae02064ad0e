/*
 * sr_i_system_calls.h - the one door through which the registry calls the
 * file system. Every system call on mount directories and table files goes
 * through Sr_File_System, a table of function pointers that starts out as
 * the C library's calls; tests swap single entries to make any one call
 * fail (ENOSPC, EIO, EINTR ...), to count calls, or to simulate a power
 * loss, and restore them afterwards. Only the I/O primitives
 * (sr_i_files.h) call through it; the rest of the library calls them.
 */
#ifndef SR_I_SYSTEM_CALLS_H
#define SR_I_SYSTEM_CALLS_H

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/uio.h>
#include <unistd.h>

typedef struct sr_i_file_system_calls_struct_t {
  int (*mkdir)(const char *p_path, mode_t mode);
  int (*open)(const char *p_path, int flags, mode_t mode);
  int (*close)(int fd);
  ssize_t (*read)(int fd, void *p_buffer, size_t length);
  ssize_t (*write)(int fd, const void *p_buffer, size_t length);
  ssize_t (*writev)(int fd, const struct iovec *p_io_vector, int count);
  int (*fsync)(int fd);
  off_t (*lseek)(int fd, off_t offset, int whence);
  int (*ftruncate)(int fd, off_t length);
  int (*rename)(const char *p_from, const char *p_to);
  int (*unlink)(const char *p_path);
  int (*stat)(const char *p_path, struct stat *p_status);
  int (*fstat)(int fd, struct stat *p_status);
  /* fcntl for the record-lock commands (F_OFD_SETLK, F_OFD_SETLKW). */
  int (*lock)(int fd, int command, struct flock *p_lock);
  /* The names in a mount directory, for listing its tables. */
  DIR *(*opendir)(const char *p_path);
  struct dirent *(*readdir)(DIR *p_directory);
  int (*closedir)(DIR *p_directory);
  /* The pause between retries of an interrupted call. */
  int (*usleep)(useconds_t microseconds);
} sr_i_file_system_calls_t;

/* The calls in use; replaced only by tests, while no other thread runs. */
extern sr_i_file_system_calls_t Sr_File_System;
/* The C library's calls, for restoring Sr_File_System. */
extern const sr_i_file_system_calls_t Sr_Default_File_System;

/* Files are created 0644, directories 0755. */
inline constexpr mode_t Sr_File_Mode = 0644;
inline constexpr mode_t Sr_Directory_Mode = 0755;

#endif /* SR_I_SYSTEM_CALLS_H */
