// sr_i_system_calls.cpp - the C library's calls behind Sr_File_System, the
// one door through which the registry reaches mount directories and table
// files. open and fcntl are variadic, so they are reached through small
// wrappers with the fixed signatures the door declares.

#include "storage/sr_i_system_calls.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

namespace {

int open_file(const char *p_path, int flags, mode_t mode) {
  return ::open(p_path, flags, mode);
}

int lock_record(int fd, int command, struct flock *p_lock) {
  return ::fcntl(fd, command, p_lock);
}

// Known when the program is compiled, so that both tables below are filled
// before any other initialiser of the library can reach the door.
constexpr sr_i_file_system_calls_t C_Library_Calls = {
    .mkdir = ::mkdir,
    .open = open_file,
    .close = ::close,
    .read = ::read,
    .write = ::write,
    .writev = ::writev,
    .fsync = ::fsync,
    .lseek = ::lseek,
    .ftruncate = ::ftruncate,
    .rename = ::rename,
    .unlink = ::unlink,
    .stat = ::stat,
    .fstat = ::fstat,
    .lock = lock_record,
    .opendir = ::opendir,
    .readdir = ::readdir,
    .closedir = ::closedir,
    .usleep = ::usleep,
};

}  // namespace

const sr_i_file_system_calls_t Sr_Default_File_System = C_Library_Calls;
sr_i_file_system_calls_t Sr_File_System = C_Library_Calls;
