// sr_i_create_persistent_table.cpp - making a persistent table: the table
// in memory as for a transient one, then its first file. The file is
// written as the rewrite file (metadata record and an empty commit record),
// flushed and renamed onto the table's path, so that a table file either
// does not exist or is complete. The creator's lock, taken on the rewrite
// file before anything is written, moves with the rename onto the table
// file and keeps other writers out while the table is open.

#include <fcntl.h>

#include <utility>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "storage/sr_i_commit_record.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"
#include "tables/sr_i_create_table.h"

namespace {

// A failed creation: the rewrite file goes, then the table.
int32_t give_up(sr_i_table_t *p_table, int32_t rc) {
  sr_i_discard_file(p_table->p_file->rewrite_path.c_str());
  sr_i_close_table(p_table);
  return rc;
}

// Writes the first file into the open rewrite file: metadata record and
// commit record in one gathered write, then a flush. The commit record goes
// to `*p_commit_record`, where it lies in the file.
int32_t write_first_file(sr_i_table_t *p_table, sr_i_record_place_t *p_commit_record) {
  sr_i_table_file_t &file = *p_table->p_file;
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
  uint32_t written = 0;
  if (const int32_t rc =
          sr_i_writev(file.rewrite_fd, file.rewrite_path.c_str(), records, 3, total, &written);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_flush_file(file.rewrite_fd, file.rewrite_path.c_str()); rc != 0) {
    return rc;
  }
  *p_commit_record = {written - static_cast<uint32_t>(commit.size()),
                      static_cast<uint32_t>(commit.size())};
  return 0;
}

}  // namespace

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
  if (const int32_t rc = sr_i_attach_table_file(p_table, p_file_path, p_registry_path); rc != 0) {
    sr_i_close_table(p_table);
    return rc;
  }
  sr_i_table_file_t &file = *p_table->p_file;
  if (const int32_t rc =
          sr_i_open_file(file.rewrite_path.c_str(), O_RDWR | O_CREAT, &file.rewrite_fd);
      rc != 0) {
    // An open that found the filesystem full may still have made the file.
    if (rc == SR_E_FILESYSTEM_FULL) {
      return give_up(p_table, rc);
    }
    sr_i_close_table(p_table);
    return rc;
  }
  // Another process creating the same table holds this lock: it wins, and
  // its rewrite file is left alone. Any other failure leaves no file.
  bool locked = false;
  if (const int32_t rc = sr_i_try_lock_file(file.rewrite_fd, &locked); rc != 0) {
    return give_up(p_table, rc);
  }
  if (!locked) {
    sr_i_close_table(p_table);
    return sr_i_raise(SR_E_TABLE_EXISTS);
  }
  if (!sr_i_path_is_free(file.path.c_str())) {
    return give_up(p_table, sr_i_raise(SR_E_TABLE_EXISTS));
  }

  sr_i_record_place_t commit_record;
  if (const int32_t rc = write_first_file(p_table, &commit_record); rc != 0) {
    return give_up(p_table, rc);
  }
  // The table exists for other processes from the rename on; it is made only
  // when the directory entry is durable too, so a failure after the rename
  // removes the new file again.
  bool renamed = false;
  if (const int32_t rc =
          sr_i_rename_durably(file.rewrite_path.c_str(), file.path.c_str(), &renamed);
      rc != 0) {
    if (renamed) {
      sr_i_discard_file(file.path.c_str());
    }
    return give_up(p_table, rc);
  }
  file.fd = std::exchange(file.rewrite_fd, -1);
  file.length = commit_record.end();
  file.commit_record = commit_record;
  file.applied_commit_record = commit_record;
  *pp_table = p_table;
  return 0;
}
