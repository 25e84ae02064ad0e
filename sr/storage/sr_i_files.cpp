// sr_i_files.cpp - the input and output primitives of table files and
// mount directories: opening close-on-exec, writing all of a buffer or a
// gathered vector, flushing files and directories, reading, seeking,
// truncating, the whole-file lock of a descriptor, renaming durably and
// removing side files. Every system call goes through the file-system door
// (Sr_File_System), so tests can make any one of them fail or be
// interrupted, and this is the one file that reads errno.
//
// An interrupted call is repeated after a pause, a bounded number of times,
// and the retries leave a development trace record on the way out. Each
// primitive raises its failure where it sees the errno, naming the file's
// filesystem when it is full and the system call otherwise, so no caller
// has to interpret errno again. A failed flush is also written to a
// diagnostic file in the working directory, so an administrator sees it
// even with tracing off.

#include "storage/sr_i_files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <string>
#include <type_traits>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_source_location.h"
#include "frame/sr_i_trace.h"
#include "qv_sr.h"
#include "storage/sr_i_system_calls.h"

namespace {

constexpr const char *Module_Version = SR_I_MODULE_VERSION;
constexpr useconds_t Retry_Pause_Microseconds = 10000;

// Runs `call` (a system call through the door: -1 on failure, or a null
// pointer for a call that returns one) again after a pause while it fails
// with EINTR and retries are left. `retries` counts the repeats; errno is
// as the last attempt left it.
template <typename Call>
auto call_retrying_interrupts(Call call, uint32_t &retries) {
  for (;;) {
    const auto result = call();
    bool failed;
    if constexpr (std::is_pointer_v<decltype(result)>) {
      failed = result == nullptr;
    } else {
      failed = result == -1;
    }
    if (!failed || errno != EINTR || retries == Sr_Interrupted_Call_Retries) {
      return result;
    }
    ++retries;
    Sr_File_System.usleep(Retry_Pause_Microseconds);
  }
}

// The development record of an interrupted call; errno is kept for the
// raising that may follow.
void trace_retries(uint32_t retries, sr_i_source_location where = sr_i_source_location::current()) {
  if (retries == 0) {
    return;
  }
  const int error_number = errno;
  tr_record_fmt_string_1(Sr_Trace_Component, TR_DEVELOPMENT_RECORD_ID, "DV|RET|%.3d|%u|%d",
                         static_cast<int>(where.line()), retries,
                         static_cast<int>(Sr_Interrupted_Call_Retries));
  errno = error_number;
}

// Raises the failure of `p_call` on the file `p_path` (null when the call
// cannot meet a full filesystem) as the code its errno stands for. The
// raising site is the primitive that called.
int32_t raise_failure(const char *p_call, int error_number, const char *p_path,
                      sr_i_source_location where = sr_i_source_location::current()) {
  if (error_number == EACCES) {
    return sr_i_raise(SR_E_ACCESS, where);
  }
  if (error_number == ENOSPC && p_path != nullptr) {
    return sr_i_raise_filesystem_full(p_path);
  }
  return sr_i_raise_system_call(p_call, error_number, where);
}

// Moves the vector past `written` bytes. A partly written entry is advanced
// in place; an entry written exactly to its end stays, with length 0, as
// the first entry of the next call.
void skip_written_bytes(struct iovec *&p_io_vector, int &count, size_t written) {
  while (written > p_io_vector->iov_len) {
    written -= p_io_vector->iov_len;
    ++p_io_vector;
    --count;
  }
  p_io_vector->iov_base = static_cast<char *>(p_io_vector->iov_base) + written;
  p_io_vector->iov_len -= written;
}

// The directory that holds `p_path`: everything before its last "/".
std::string directory_of(const char *p_path) {
  const std::string path = p_path;
  const size_t slash = path.find_last_of('/');
  if (slash == std::string::npos) {
    return ".";
  }
  return slash == 0 ? "/" : path.substr(0, slash);
}

// Opens without raising: -1 with errno as the last attempt left it.
int open_retrying(const char *p_path, int flags, mode_t mode) {
  // O_CLOEXEC rather than a later fcntl: a thread that forks and executes in
  // between would otherwise inherit the descriptor.
  uint32_t retries = 0;
  const int fd = call_retrying_interrupts(
      [&] { return Sr_File_System.open(p_path, flags | O_CLOEXEC, mode); }, retries);
  trace_retries(retries);
  return fd;
}

int32_t lock_whole_file(int fd, int command) {
  struct flock whole_file {};
  whole_file.l_type = F_WRLCK;
  whole_file.l_whence = SEEK_SET;
  whole_file.l_start = 0;
  whole_file.l_len = 0;
  whole_file.l_pid = 0;
  uint32_t retries = 0;
  const int locked = call_retrying_interrupts(
      [&] { return Sr_File_System.lock(fd, command, &whole_file); }, retries);
  trace_retries(retries);
  return locked;
}

}  // namespace

int32_t sr_i_open_file(const char *p_path, int flags, int *p_fd) {
  *p_fd = open_retrying(p_path, flags, Sr_File_Mode);
  if (*p_fd >= 0) {
    return 0;
  }
  if (errno == ENOENT) {
    return sr_i_raise(SR_E_NO_TABLE);
  }
  return raise_failure("open", errno, p_path);
}

void sr_i_close_file(int fd) {
  if (fd >= 0) {
    Sr_File_System.close(fd);
  }
}

int32_t sr_i_write(int fd, const char *p_path, const void *p_buffer, uint32_t length) {
  const char *p_next = static_cast<const char *>(p_buffer);
  uint32_t retries = 0;
  int32_t rc = 0;
  while (length > 0) {
    const ssize_t written =
        call_retrying_interrupts([&] { return Sr_File_System.write(fd, p_next, length); }, retries);
    // A write that moves nothing would be tried for ever.
    if (written <= 0) {
      rc = raise_failure("write", written == 0 ? EIO : errno, p_path);
      break;
    }
    p_next += written;
    length -= static_cast<uint32_t>(written);
  }
  trace_retries(retries);
  return rc;
}

int32_t sr_i_writev(int fd, const char *p_path, struct iovec *p_io_vector, int count,
                    uint32_t total_bytes, uint32_t *p_bytes_written) {
  uint32_t bytes_left = total_bytes;
  uint32_t retries = 0;
  int32_t rc = 0;
  for (;;) {
    const ssize_t written = call_retrying_interrupts(
        [&] { return Sr_File_System.writev(fd, p_io_vector, count); }, retries);
    if (written <= 0) {
      rc = raise_failure("writev", written == 0 ? EIO : errno, p_path);
      break;
    }
    *p_bytes_written += static_cast<uint32_t>(written);
    if (static_cast<uint32_t>(written) >= bytes_left) {
      break;
    }
    bytes_left -= static_cast<uint32_t>(written);
    skip_written_bytes(p_io_vector, count, static_cast<size_t>(written));
  }
  trace_retries(retries);
  return rc;
}

int32_t sr_i_flush_file(int fd, const char *p_path) {
  uint32_t retries = 0;
  const int flushed = call_retrying_interrupts(
      [fd] {
        const int result = Sr_File_System.fsync(fd);
        if (result == -1) {
          const int error_number = errno;
          sr_i_capture_errno("fdatasync", error_number,
                             static_cast<int>(sr_i_source_location::current().line()),
                             Module_Version);
          errno = error_number;
        }
        return result;
      },
      retries);
  trace_retries(retries);
  return flushed == -1 ? raise_failure("fdatasync", errno, p_path) : 0;
}

int32_t sr_i_read(int fd, void *p_buffer, uint32_t length, uint32_t *p_bytes_read) {
  char *p_next = static_cast<char *>(p_buffer);
  uint32_t retries = 0;
  int32_t rc = 0;
  *p_bytes_read = 0;
  while (*p_bytes_read < length) {
    const ssize_t got = call_retrying_interrupts(
        [&] { return Sr_File_System.read(fd, p_next, length - *p_bytes_read); }, retries);
    if (got == -1) {
      rc = sr_i_raise_system_call("read", errno);
      break;
    }
    if (got == 0) {
      break;
    }
    p_next += got;
    *p_bytes_read += static_cast<uint32_t>(got);
  }
  trace_retries(retries);
  return rc;
}

int32_t sr_i_seek(int fd, uint32_t offset) {
  if (Sr_File_System.lseek(fd, offset, SEEK_SET) < 0) {
    return sr_i_raise_system_call("lseek64", errno);
  }
  return 0;
}

int32_t sr_i_seek_to_end(int fd, off_t *p_end) {
  *p_end = Sr_File_System.lseek(fd, 0, SEEK_END);
  if (*p_end < 0) {
    return sr_i_raise_system_call("lseek64", errno);
  }
  return 0;
}

int32_t sr_i_truncate(int fd, const char *p_path, uint32_t length) {
  uint32_t retries = 0;
  const int cut = call_retrying_interrupts(
      [&] { return Sr_File_System.ftruncate(fd, static_cast<off_t>(length)); }, retries);
  trace_retries(retries);
  return cut == -1 ? raise_failure("ftruncate", errno, p_path) : 0;
}

int32_t sr_i_lock_file(int fd) {
  if (lock_whole_file(fd, F_OFD_SETLKW) != 0) {
    return sr_i_raise_system_call("lockf", errno);
  }
  return 0;
}

int32_t sr_i_try_lock_file(int fd, bool *p_locked) {
  *p_locked = lock_whole_file(fd, F_OFD_SETLK) == 0;
  if (*p_locked || errno == EAGAIN || errno == EACCES) {
    return 0;
  }
  return sr_i_raise_system_call("lockf", errno);
}

bool sr_i_path_is_free(const char *p_path) {
  struct stat status {};
  return Sr_File_System.stat(p_path, &status) != 0 && errno == ENOENT;
}

int32_t sr_i_path_exists(const char *p_path, bool *p_exists) {
  struct stat status {};
  *p_exists = Sr_File_System.stat(p_path, &status) == 0;
  if (!*p_exists && errno != ENOENT) {
    return sr_i_raise_system_call("stat", errno);
  }
  return 0;
}

int32_t sr_i_is_same_file(int fd, const char *p_path, bool *p_same) {
  struct stat opened {};
  struct stat current {};
  *p_same = false;
  if (Sr_File_System.fstat(fd, &opened) != 0) {
    return sr_i_raise_system_call("fstat", errno);
  }
  if (Sr_File_System.stat(p_path, &current) != 0) {
    return errno == ENOENT ? 0 : sr_i_raise_system_call("stat", errno);
  }
  *p_same = opened.st_dev == current.st_dev && opened.st_ino == current.st_ino;
  return 0;
}

int32_t sr_i_is_on_file_system_of(int fd, const char *p_path, bool *p_same) {
  struct stat opened {};
  struct stat there {};
  *p_same = false;
  if (Sr_File_System.fstat(fd, &opened) != 0) {
    return sr_i_raise_system_call("fstat", errno);
  }
  if (Sr_File_System.stat(p_path, &there) != 0) {
    return sr_i_raise_system_call("stat", errno);
  }
  *p_same = opened.st_dev == there.st_dev;
  return 0;
}

// The durable renames and removals name the directory to flush before they
// change it: once a file has its new name or is gone, the caller must learn
// that it is, and nothing left may fail for want of memory.
int32_t sr_i_rename_durably(const char *p_from, const char *p_to, bool *p_renamed) {
  const std::string directory = directory_of(p_to);
  const bool renamed = Sr_File_System.rename(p_from, p_to) == 0;
  if (p_renamed != nullptr) {
    *p_renamed = renamed;
  }
  if (!renamed) {
    return errno == ENOENT ? sr_i_raise(SR_E_NO_TABLE) : raise_failure("rename", errno, p_to);
  }
  return sr_i_flush_directory(directory.c_str());
}

int32_t sr_i_remove_file_durably(const char *p_path, bool *p_removed) {
  const std::string directory = directory_of(p_path);
  const bool removed = Sr_File_System.unlink(p_path) == 0;
  if (p_removed != nullptr) {
    *p_removed = removed;
  }
  if (!removed) {
    return errno == ENOENT ? sr_i_raise(SR_E_NO_TABLE) : raise_failure("unlink", errno, p_path);
  }
  return sr_i_flush_directory(directory.c_str());
}

int32_t sr_i_flush_directory(const char *p_directory) {
  const int fd = open_retrying(p_directory, O_RDONLY | O_DIRECTORY, 0);
  if (fd < 0) {
    return raise_failure("open", errno, p_directory);
  }
  const int32_t rc = sr_i_flush_file(fd, p_directory);
  sr_i_close_file(fd);
  return rc;
}

int32_t sr_i_make_directory(const char *p_path) {
  if (Sr_File_System.mkdir(p_path, Sr_Directory_Mode) != 0) {
    return errno == EEXIST ? 0 : raise_failure("mkdir", errno, p_path);
  }
  return sr_i_flush_directory(directory_of(p_path).c_str());
}

void sr_i_discard_file(const char *p_path) {
  Sr_File_System.unlink(p_path);
}

void sr_i_discard_abandoned_file(const char *p_path) {
  const int fd = open_retrying(p_path, O_RDWR, 0);
  if (fd < 0) {
    return;
  }
  // The lock is only had when no descriptor anywhere holds it; the name
  // is checked again under it, since the writer may have renamed the file
  // away just before.
  struct stat opened {};
  struct stat named {};
  if (lock_whole_file(fd, F_OFD_SETLK) == 0 && Sr_File_System.fstat(fd, &opened) == 0 &&
      Sr_File_System.stat(p_path, &named) == 0 && opened.st_dev == named.st_dev &&
      opened.st_ino == named.st_ino) {
    Sr_File_System.unlink(p_path);
  }
  sr_i_close_file(fd);
}

sr_i_directory_reader::~sr_i_directory_reader() {
  if (p_directory_ != nullptr) {
    // Nothing was written through it: a failing close loses nothing.
    Sr_File_System.closedir(p_directory_);
  }
}

int32_t sr_i_directory_reader::open(const char *p_path) {
  uint32_t retries = 0;
  p_directory_ = call_retrying_interrupts([&] { return Sr_File_System.opendir(p_path); }, retries);
  trace_retries(retries);
  if (p_directory_ != nullptr) {
    return 0;
  }
  // The directory is no table file: a full filesystem has nothing to do
  // with reading it.
  return raise_failure("opendir", errno, nullptr);
}

int32_t sr_i_directory_reader::next(const char **pp_name) {
  // readdir reports its end and its failure alike, by a null result; only
  // errno, cleared first, tells them apart.
  errno = 0;
  const struct dirent *p_entry = Sr_File_System.readdir(p_directory_);
  if (p_entry != nullptr) {
    *pp_name = p_entry->d_name;
    return 0;
  }
  *pp_name = nullptr;
  return errno == 0 ? 0 : sr_i_raise_system_call("readdir", errno);
}

void sr_i_capture_errno(const char *p_function, int error_number, int line, const char *p_version) {
  char name[32];
  std::snprintf(name, sizeof name, "reginfo_pid.%u", static_cast<unsigned>(getpid()));
  const int fd = open_retrying(name, O_WRONLY | O_CREAT | O_TRUNC, Sr_File_Mode);
  if (fd < 0) {
    return;
  }
  char line_text[512];
  const int length =
      std::snprintf(line_text, sizeof line_text, "function(%s) errno(%d) line(%d) sccsid(%s)\n",
                    p_function, error_number, line, p_version);
  if (length > 0) {
    // A diagnostic that cannot be written is let go: the flush's own
    // failure is what the caller reports.
    [[maybe_unused]] const ssize_t written = Sr_File_System.write(
        fd, line_text, std::min(static_cast<size_t>(length), sizeof line_text - 1));
  }
  Sr_File_System.close(fd);
}
