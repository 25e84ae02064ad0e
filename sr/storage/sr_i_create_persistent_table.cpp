// sr_i_create_persistent_table.cpp - making a persistent table: the table
// in memory as for a transient one, then its first file. The file is
// written as the rewrite file (metadata record and an empty commit record),
// flushed and renamed onto the table's path, so that a table file either
// does not exist or is complete. The creator's lock, taken on the rewrite
// file before anything is written, moves with the rename onto the table
// file and keeps other writers out while the table is open.

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <vector>

#include "storage/sr_i_commit_record.h"
#include "tables/sr_i_create_table.h"
#include "frame/sr_i_errors.h"
#include "storage/sr_i_system_calls.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_storage.h"
#include "frame/sr_i_tree.h"

namespace {

constexpr const char Rewrite_Suffix[] = "rewrite";

// A failed creation: the rewrite file goes, then the table.
int32_t give_up(sr_i_table_t *p_table, int32_t rc) {
  sr_i_set_rewrite_path(p_table);
  Sr_File_System.unlink(p_table->p_file_path);
  sr_i_close_table(p_table);
  return rc;
}

// Writes the first file into the open rewrite file: metadata record and
// commit record in one gathered write, then a flush. Returns the bytes
// written through `*p_written`.
int32_t write_first_file(sr_i_table_t *p_table, uint32_t *p_written,
                         uint32_t *p_commit_record_length) {
  std::vector<unsigned char> metadata;
  std::vector<unsigned char> commit;
  if (const int32_t rc = sr_i_create_commit_record(p_table->p_application_metadata,
                                                   p_table->change_counter, commit);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_convert_metadata_memory_record_to_disk_record(p_table, metadata);
      rc != 0) {
    return rc;
  }
  // The commit record's type word must lie inside one disk sector.
  const uint32_t padding = sr_i_commit_record_padding(static_cast<uint32_t>(metadata.size()));
  iovec records[3] = {{metadata.data(), metadata.size()},
                      {const_cast<uint32_t *>(Sr_Commit_Record_Padding), padding},
                      {commit.data(), commit.size()}};
  const auto total = static_cast<uint32_t>(metadata.size() + padding + commit.size());
  int32_t rc = sr_i_writev(p_table->rewrite_file_fd, records, 3, total, p_written);
  if (rc == 0) {
    rc = sr_i_fdatasync(p_table->rewrite_file_fd);
  }
  if (rc == SR_E_FILESYSTEM_FULL) {
    return trace_filesystem_full_for_path(p_table->p_file_path);
  }
  *p_commit_record_length = static_cast<uint32_t>(commit.size());
  return rc;
}

}  // namespace

int32_t sr_i_set_file_paths(sr_i_table_t *p_table, const char *p_file_path,
                            const char *p_registry_path) {
  const size_t length = std::strlen(p_file_path);
  auto *p_paths = static_cast<char *>(std::malloc(length + sizeof Rewrite_Suffix + 1));
  char *p_registry_copy = p_registry_path != nullptr ? strdup(p_registry_path) : nullptr;
  if (p_paths == nullptr || (p_registry_path != nullptr && p_registry_copy == nullptr)) {
    std::free(p_paths);
    std::free(p_registry_copy);
    return sr_i_raise_no_memory();
  }
  std::memcpy(p_paths, p_file_path, length);
  p_paths[length] = '\0';
  std::memcpy(p_paths + length + 1, Rewrite_Suffix, sizeof Rewrite_Suffix);
  p_table->p_file_path = p_paths;
  p_table->file_path_length = static_cast<uint32_t>(length);
  p_table->p_persistent_table_registry_path = p_registry_copy;
  return 0;
}

int32_t sr_i_create_persistent_table(sr_i_tree_t *p_tree, const char *p_registry_path,
                                     const char *p_file_path, sr_column_t *p_columns,
                                     uint32_t total_columns, int32_t mode, uint32_t block_size,
                                     sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table) {
  sr_i_table_t *p_table = nullptr;
  if (const int32_t rc = sr_i_create_transient_table(p_tree, p_file_path, p_columns, total_columns,
                                                     mode, p_rows_hash_table, &p_table);
      rc != 0) {
    return rc;
  }
  p_table->block_size = block_size;
  if (const int32_t rc = sr_i_set_file_paths(p_table, p_file_path, p_registry_path); rc != 0) {
    sr_i_close_table(p_table);
    return rc;
  }

  sr_i_set_rewrite_path(p_table);
  p_table->rewrite_file_fd = sr_i_open_file(p_table->p_file_path, O_RDWR | O_CREAT, Sr_File_Mode);
  if (p_table->rewrite_file_fd < 0) {
    const int error_number = errno;
    if (error_number == EACCES) {
      sr_i_close_table(p_table);
      return sr_i_raise(SR_E_ACCESS);
    }
    if (error_number == ENOSPC) {
      return give_up(p_table, trace_filesystem_full_for_path(p_table->p_file_path));
    }
    sr_i_close_table(p_table);
    return sr_i_raise_system_call("open", error_number);
  }
  // Another process creating the same table holds this lock: it wins, and
  // its rewrite file is left alone. Any other failure leaves no file.
  if (sr_i_lock_file(p_table->rewrite_file_fd, false) != 0) {
    const int error_number = errno;
    if (error_number == EAGAIN || error_number == EACCES || error_number == EEXIST) {
      sr_i_close_table(p_table);
      return sr_i_raise(SR_E_TABLE_EXISTS);
    }
    return give_up(p_table, sr_i_raise_system_call("lockf", error_number));
  }
  struct stat status;
  sr_i_set_data_path(p_table);
  if (Sr_File_System.stat(p_table->p_file_path, &status) == 0 || errno != ENOENT) {
    return give_up(p_table, sr_i_raise(SR_E_TABLE_EXISTS));
  }

  uint32_t written = 0;
  uint32_t commit_record_length = 0;
  if (const int32_t rc = write_first_file(p_table, &written, &commit_record_length); rc != 0) {
    return give_up(p_table, rc);
  }
  sr_i_set_rewrite_path(p_table);
  const std::string rewrite_path = p_table->p_file_path;
  sr_i_set_data_path(p_table);
  if (Sr_File_System.rename(rewrite_path.c_str(), p_table->p_file_path) != 0) {
    const int error_number = errno;
    int32_t rc;
    if (error_number == EACCES) {
      rc = sr_i_raise(SR_E_ACCESS);
    } else if (error_number == ENOSPC) {
      Sr_File_System.unlink(p_table->p_file_path);
      rc = trace_filesystem_full_for_path(p_table->p_file_path);
    } else {
      rc = sr_i_raise_system_call("rename", error_number);
    }
    return give_up(p_table, rc);
  }
  p_table->file_fd = p_table->rewrite_file_fd;
  p_table->rewrite_file_fd = -1;
  p_table->file_length = written;
  p_table->disk_file_length = written;
  p_table->disk_commit_record_length = commit_record_length;
  p_table->disk_commit_record_offset = written - commit_record_length;
  p_table->disk_applied_commit_record_length = commit_record_length;
  p_table->disk_applied_commit_record_offset = written - commit_record_length;
  *pp_table = p_table;
  return 0;
}
