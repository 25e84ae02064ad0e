/*
 * sr_i_files.h - the input and output primitives of table files, over the
 * file-system door (sr_i_system_calls.h).
 *
 * An interrupted call (EINTR) is retried after 10 ms, at most 100 times,
 * and the retries are reported in a development trace record
 * "DV|RET|<line>|<retries>|100". A full filesystem is returned as 16 with
 * no error raised: the caller reports it through
 * trace_filesystem_full_for_path, naming the file. Any other failure is
 * raised as 10 naming the system call. Bytes written before a failure stay
 * written.
 */
#ifndef SR_I_FILES_H
#define SR_I_FILES_H

#include <sys/types.h>
#include <sys/uio.h>

#include <cstdint>

/* The number of retries of an interrupted call. */
inline constexpr uint32_t Sr_Interrupted_Call_Retries = 100;

/*
 * Opens a file, close-on-exec, retrying interrupted opens. Returns the
 * descriptor, or -1 with errno as open left it; nothing is raised: the
 * caller decides what the errno means.
 */
int sr_i_open_file(const char *p_path, int flags, mode_t mode);

/* Writes all `length` bytes, going on after short writes. 0, 16 or 10. */
int32_t sr_i_write(int fd, const void *p_buffer, uint32_t length);

/*
 * Writes the `count` entries of `p_io_vector` (`total_bytes` in all),
 * going on after partial writes; the array is changed in place as it is
 * consumed. `*p_bytes_written` grows by every byte written, also when the
 * call fails. 0, 16 or 10.
 */
int32_t sr_i_writev(int fd, struct iovec *p_io_vector, int count, uint32_t total_bytes,
                    uint32_t *p_bytes_written);

/*
 * Flushes the file's data and metadata to the device. Every failure is
 * first recorded in the diagnostic file (sr_i_capture_errno). 0, 16 or 10
 * (the message names "fdatasync").
 */
int32_t sr_i_fdatasync(int fd);

/*
 * Reads up to `length` bytes from the current offset; fewer only at the end
 * of the file. `*p_bytes_read` receives the count. 0 or 10 ("read").
 */
int32_t sr_i_read(int fd, void *p_buffer, uint32_t length, uint32_t *p_bytes_read);

/*
 * Takes a lock over the whole file that belongs to this descriptor (an
 * open-file-description lock: it lives exactly as long as the descriptor,
 * whatever else the process opens or closes). `wait`: block until it is
 * granted; otherwise fail at once when another descriptor holds it.
 * Write locks need a descriptor open for writing. Returns 0, or -1 with
 * errno (EAGAIN or EACCES when held elsewhere); nothing is raised.
 */
int sr_i_lock_file(int fd, bool wait);

/*
 * Records a failed flush for the administrator in "reginfo_pid.<pid>" in
 * the working directory (created or truncated): one line
 * "function(<name>) errno(<n>) line(<line>) sccsid(<version>)". A file that
 * cannot be written is ignored.
 */
void sr_i_capture_errno(const char *p_function, int error_number, int line,
                        const char *p_version);

#endif /* SR_I_FILES_H */
