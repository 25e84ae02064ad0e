/*
 * sr_i_files.h - the input and output primitives of table files and mount
 * directories, over the file-system door (sr_i_system_calls.h). Nothing
 * else in the library calls the door or reads errno.
 *
 * Every primitive raises its own failure, once, and returns the code:
 *   - 206 when the file system refuses access (EACCES, EPERM);
 *   - 16 for a full filesystem (ENOSPC), naming the filesystem that holds
 *     the file from the mount table (sr_i_raise_filesystem_full);
 *   - 10 for any other failure, naming the system call.
 * Callers pass the code on. An interrupted call (EINTR) is retried after
 * 10 ms, at most 100 times, and the retries are reported in a development
 * trace record "DV|RET|<line>|<retries>|100". Bytes written before a
 * failure stay written.
 */
#ifndef SR_I_FILES_H
#define SR_I_FILES_H

#include <dirent.h>
#include <sys/types.h>
#include <sys/uio.h>

#include <cstdint>

/* The number of retries of an interrupted call. */
inline constexpr uint32_t Sr_Interrupted_Call_Retries = 100;

/*
 * Opens `p_path` with `flags` (close-on-exec is added), creating it 0644
 * when the flags say so, and puts the descriptor in `*p_fd`. 0, 200 when
 * the file does not exist, 206, 16 or 10.
 */
int32_t sr_i_open_file(const char *p_path, int flags, int *p_fd);

/* Closes a descriptor; -1 is ignored. Closing ends the descriptor's lock. */
void sr_i_close_file(int fd);

/* A descriptor closed, and so its lock given up, when it goes; -1 holds
 * none. Whoever takes the descriptor over exchanges `fd` for -1. */
struct sr_i_descriptor {
  int fd = -1;
  sr_i_descriptor() = default;
  explicit sr_i_descriptor(int owned_fd) : fd(owned_fd) {}
  sr_i_descriptor(const sr_i_descriptor &) = delete;
  sr_i_descriptor &operator=(const sr_i_descriptor &) = delete;
  ~sr_i_descriptor() { sr_i_close_file(fd); }
};

/* Writes all `length` bytes of the file `p_path` open as `fd`, going on
 * after short writes. 0, 16 or 10. */
int32_t sr_i_write(int fd, const char *p_path, const void *p_buffer, uint32_t length);

/*
 * Writes the `count` entries of `p_io_vector` (`total_bytes` in all) to the
 * file `p_path` open as `fd`, going on after partial writes; the array is
 * changed in place as it is consumed. `*p_bytes_written` grows by every
 * byte written, also when the call fails. 0, 16 or 10.
 */
int32_t sr_i_writev(int fd, const char *p_path, struct iovec *p_io_vector, int count,
                    uint32_t total_bytes, uint32_t *p_bytes_written);

/*
 * Flushes the data and metadata of the file `p_path` open as `fd` to the
 * device (fsync). Every failure is first recorded in the diagnostic file
 * (sr_i_capture_errno). 0, 16 or 10; messages and the diagnostic file call
 * it "fdatasync", the name operators know the failure by.
 */
int32_t sr_i_flush_file(int fd, const char *p_path);

/*
 * Reads up to `length` bytes from the current offset; fewer only at the end
 * of the file. `*p_bytes_read` receives the count. 0 or 10.
 */
int32_t sr_i_read(int fd, void *p_buffer, uint32_t length, uint32_t *p_bytes_read);

/* Moves the file offset to `offset`. 0 or 10. */
int32_t sr_i_seek(int fd, uint32_t offset);

/* Moves the file offset to the end and puts that length in `*p_end`. 0 or
 * 10. */
int32_t sr_i_seek_to_end(int fd, off_t *p_end);

/* Cuts the file `p_path` open as `fd` to `length` bytes. 0 or 10. */
int32_t sr_i_truncate(int fd, const char *p_path, uint32_t length);

/*
 * Takes a write lock over the whole file that belongs to this descriptor
 * (an open-file-description lock: it lives exactly as long as the
 * descriptor, whatever else the process opens or closes), waiting while
 * another descriptor holds it. Needs a descriptor open for writing. 0 or
 * 10.
 */
int32_t sr_i_lock_file(int fd);

/* The same lock, without waiting: `*p_locked` is false when another
 * descriptor holds it. 0 or 10. */
int32_t sr_i_try_lock_file(int fd, bool *p_locked);

/* Whether nothing is at `p_path`: only a lookup that finds no such name
 * says so. A name that cannot be examined is not taken for free, and
 * nothing is raised: the caller reports the name as taken. */
bool sr_i_path_is_free(const char *p_path);

/* Whether anything is at `p_path` now. 0 or 10. */
int32_t sr_i_path_exists(const char *p_path, bool *p_exists);

/* Whether `fd` is the file at `p_path` now (false when nothing is there
 * any more). 0 or 10. */
int32_t sr_i_is_same_file(int fd, const char *p_path, bool *p_same);

/* Whether the file open as `fd` lies on the file system that holds
 * `p_path`, so that a rename can carry it there. 0 or 10. */
int32_t sr_i_is_on_file_system_of(int fd, const char *p_path, bool *p_same);

/*
 * Renames `p_from` onto `p_to` and flushes the directory of `p_to`, so that
 * the new name survives a power loss: until the directory is flushed the
 * file system may still hold the old entry. 0, 200 when `p_from` does not
 * exist, 206, 16 or 10; when the rename succeeded and only the flush
 * failed, `*p_renamed` (if given) is true, since the file is in place for
 * every reader now.
 */
int32_t sr_i_rename_durably(const char *p_from, const char *p_to, bool *p_renamed = nullptr);

/* Removes the file `p_path` and flushes its directory, so that the removal
 * survives a power loss. 0, 200 when there is no such file, 206, 16 or 10.
 * When only the flush failed, `*p_removed` (if given) is true: the file is
 * gone for every reader now. */
int32_t sr_i_remove_file_durably(const char *p_path, bool *p_removed = nullptr);

/* Flushes the directory `p_directory`: the names created, renamed or
 * removed in it become durable. 0, 206, 16 or 10. */
int32_t sr_i_flush_directory(const char *p_directory);

/* Makes the directory `p_path` 0755, or finds it made, and makes its entry
 * durable in its parent. 0, 206, 16 or 10. */
int32_t sr_i_make_directory(const char *p_path);

/* Removes the file `p_path` if it is there, raising nothing: for side files
 * that are given up while another failure is being reported, or that may
 * well not exist. */
void sr_i_discard_file(const char *p_path);

/* Removes the side file `p_path` only when nobody holds its lock: a file
 * left by a writer that is gone, not one a live writer (in this process or
 * another) is still writing. Raises nothing. */
void sr_i_discard_abandoned_file(const char *p_path);

/*
 * The names in a directory, in the order the directory gives them, "." and
 * ".." included; the directory is closed with the object, whatever path
 * the caller leaves by.
 */
class sr_i_directory_reader {
 public:
  sr_i_directory_reader() = default;
  ~sr_i_directory_reader();
  sr_i_directory_reader(const sr_i_directory_reader &) = delete;
  sr_i_directory_reader &operator=(const sr_i_directory_reader &) = delete;

  /* Opens the directory `p_path`. 0, 206, or 10 naming "opendir". */
  int32_t open(const char *p_path);

  /* Puts the next name in `*pp_name`, valid until the next call, or null
   * after the last one. 0, or 10 naming "readdir". */
  int32_t next(const char **pp_name);

 private:
  DIR *p_directory_ = nullptr;
};

/*
 * Records a failed flush for the administrator in "reginfo_pid.<pid>" in
 * the working directory (created or truncated): one line
 * "function(<name>) errno(<n>) line(<line>) sccsid(<version>)". A file that
 * cannot be written is ignored.
 */
void sr_i_capture_errno(const char *p_function, int error_number, int line, const char *p_version);

#endif /* SR_I_FILES_H */
