// sr_i_files.cpp - the input and output primitives of table files: opening
// close-on-exec, writing all of a buffer or a gathered vector, flushing,
// reading, and the whole-file lock of a descriptor. Every system call goes
// through the file-system door (Sr_File_System), so tests can make any one
// of them fail or be interrupted.
//
// An interrupted call is repeated after a pause, a bounded number of times,
// and the retries leave a development trace record on the way out. A full
// filesystem comes back as 16 without a message, because only the caller
// knows which file to name; every other failure is raised here as 10. A
// failed flush is also written to a diagnostic file in the working
// directory, so an administrator sees it even with tracing off.

#include "storage/sr_i_files.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>

#include "qv_sr.h"
#include "frame/sr_i_errors.h"
#include "storage/sr_i_system_calls.h"
#include "frame/sr_i_source_location.h"
#include "frame/sr_i_trace.h"

namespace {

constexpr const char *Module_Version = SR_I_MODULE_VERSION;
constexpr useconds_t Retry_Pause_Microseconds = 10000;

// Runs `call` (a system call through the door, -1 on failure) again after
// a pause while it fails with EINTR and retries are left. `retries` counts
// the repeats; errno is as the last attempt left it.
template <typename Call>
auto call_retrying_interrupts(Call call, uint32_t &retries) {
  for (;;) {
    const auto result = call();
    if (result != -1 || errno != EINTR || retries == Sr_Interrupted_Call_Retries) {
      return result;
    }
    ++retries;
    Sr_File_System.usleep(Retry_Pause_Microseconds);
  }
}

// The development record of an interrupted call; errno is kept for the
// callers that hand it back.
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

// The code of a failed write or flush: 16 for a full filesystem, which the
// caller reports naming its file; anything else is raised as 10 from the
// calling primitive.
int32_t write_failure(const char *p_call, int error_number,
                      sr_i_source_location where = sr_i_source_location::current()) {
  if (error_number == ENOSPC) {
    return SR_E_FILESYSTEM_FULL;
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

}  // namespace

int sr_i_open_file(const char *p_path, int flags, mode_t mode) {
  // O_CLOEXEC rather than a later fcntl: a thread that forks and executes in
  // between would otherwise inherit the descriptor.
  uint32_t retries = 0;
  const int fd = call_retrying_interrupts(
      [&] { return Sr_File_System.open(p_path, flags | O_CLOEXEC, mode); }, retries);
  trace_retries(retries);
  return fd;
}

int32_t sr_i_write(int fd, const void *p_buffer, uint32_t length) {
  const char *p_next = static_cast<const char *>(p_buffer);
  uint32_t retries = 0;
  int32_t rc = 0;
  while (length > 0) {
    const ssize_t written =
        call_retrying_interrupts([&] { return Sr_File_System.write(fd, p_next, length); }, retries);
    // A write that moves nothing would be tried for ever.
    if (written <= 0) {
      rc = write_failure("write", written == 0 ? EIO : errno);
      break;
    }
    p_next += written;
    length -= static_cast<uint32_t>(written);
  }
  trace_retries(retries);
  return rc;
}

int32_t sr_i_writev(int fd, struct iovec *p_io_vector, int count, uint32_t total_bytes,
                    uint32_t *p_bytes_written) {
  uint32_t bytes_left = total_bytes;
  uint32_t retries = 0;
  int32_t rc = 0;
  for (;;) {
    const ssize_t written = call_retrying_interrupts(
        [&] { return Sr_File_System.writev(fd, p_io_vector, count); }, retries);
    if (written <= 0) {
      rc = write_failure("writev", written == 0 ? EIO : errno);
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

int32_t sr_i_fdatasync(int fd) {
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
  const int32_t rc = flushed == -1 ? write_failure("fdatasync", errno) : 0;
  trace_retries(retries);
  return rc;
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

int sr_i_lock_file(int fd, bool wait) {
  struct flock whole_file {};
  whole_file.l_type = F_WRLCK;
  whole_file.l_whence = SEEK_SET;
  whole_file.l_start = 0;
  whole_file.l_len = 0;
  whole_file.l_pid = 0;
  const int command = wait ? F_OFD_SETLKW : F_OFD_SETLK;
  uint32_t retries = 0;
  const int locked = call_retrying_interrupts(
      [&] { return Sr_File_System.lock(fd, command, &whole_file); }, retries);
  trace_retries(retries);
  return locked;
}

void sr_i_capture_errno(const char *p_function, int error_number, int line, const char *p_version) {
  char name[32];
  std::snprintf(name, sizeof name, "reginfo_pid.%u", static_cast<unsigned>(getpid()));
  // "e": the diagnostic descriptor is close-on-exec like every other one.
  FILE *p_file = std::fopen(name, "we");
  if (p_file == nullptr) {
    return;
  }
  std::fprintf(p_file, "function(%s) errno(%d) line(%d) sccsid(%s)\n", p_function, error_number,
               line, p_version);
  std::fclose(p_file);
}
