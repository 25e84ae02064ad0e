// sr_i_target_lock.cpp - the two file locks a persistent target is written
// under: the mount directory's ",Lock" file, which serialises the copies
// and moves of every process into that directory, and the target file's own
// lock, which keeps out a writer of the target. Both are
// open-file-description locks over the whole file, like a table's: they
// belong to the descriptor, so closing another descriptor of the same file
// elsewhere in the process cannot drop them.

#include <fcntl.h>

#include "namespace/sr_i_namespace.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_table_file.h"

namespace {

// The ",Lock" file beside `target_file`. A registry path component cannot
// begin with ",", so no table file is ever named so.
std::string lock_file_of(const std::string &target_file) {
  return target_file.substr(0, target_file.rfind('/') + 1) + ",Lock";
}

}  // namespace

sr_i_target_lock::~sr_i_target_lock() {
  sr_i_close_file(target_fd_);
  sr_i_close_file(lock_fd_);
}

int32_t sr_i_target_lock::lock(const std::string &target_file, const sr_i_table_t *p_open_target) {
  const std::string lock_file = lock_file_of(target_file);
  if (const int32_t rc = sr_i_open_file(lock_file.c_str(), O_RDWR | O_CREAT, &lock_fd_); rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_lock_file(lock_fd_); rc != 0) {
    return rc;
  }
  // A table open here for writing holds its file's lock on its own
  // descriptor; a second descriptor of this process would wait for it for
  // ever.
  int fd = -1;
  if (p_open_target != nullptr && p_open_target->p_file != nullptr &&
      (p_open_target->mode & Sr_Mode_Writable) != 0) {
    fd = p_open_target->p_file->fd;
  } else {
    // No file is made for a missing target: a copy that fails or is killed
    // must not leave an empty table file behind. The ",Lock" file keeps
    // other copies out until the new file is renamed into place.
    const int32_t rc = sr_i_open_file(target_file.c_str(), O_RDWR, &target_fd_);
    if (rc == SR_E_NO_TABLE) {
      return 0;  // the message is replaced by the outcome of the copy
    }
    if (rc != 0) {
      return rc;
    }
    fd = target_fd_;
  }
  if (const int32_t rc = sr_i_lock_file(fd); rc != 0) {
    return rc;
  }
  holds_target_ = true;
  off_t end = 0;
  if (const int32_t rc = sr_i_seek_to_end(fd, &end); rc != 0) {
    return rc;
  }
  target_length_ = static_cast<uint64_t>(end);
  return 0;
}
