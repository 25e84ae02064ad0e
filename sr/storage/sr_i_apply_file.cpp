// sr_i_apply_file.cpp - apply, commit and abort of a table with a file.
//
// Apply writes the pending changes where no reader looks yet: appended
// behind the live commit record (changed rows, one deletion record, a new
// live commit record), or, when the file is mostly dead records, as a
// complete new file beside it (the rewrite file). Either way the file is
// flushed before apply returns. Commit then makes the new state the
// committed one with a single small step: the old commit record's type is
// overwritten with 0 (so the reader goes on to the new one), or the rewrite
// file is renamed onto the table file. A crash at any moment leaves the
// file at the old committed state or at the new one. Abort cuts the
// appended tail off again, or removes the rewrite file. The writer of the
// rewrite file also makes the file of a copy of a table.

#include <fcntl.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <utility>
#include <vector>

#include "frame/sr_i_errors.h"
#include "rows/sr_i_rows.h"
#include "storage/sr_i_commit_record.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"

namespace {

constexpr int Gathered_Records = 16;
// A gathered write stays well below the 2 GiB one call can take.
constexpr size_t Largest_Piece = size_t{64} << 20;
constexpr size_t Staging_Bytes = size_t{1} << 20;
constexpr uint32_t Large_File_Bytes = 16384;
constexpr uint32_t Least_Live_Percentage = 50;

// The length of a record in the pool, the pool's header included; on disk
// the same record is 8 bytes shorter.
uint32_t memory_record_length(void *p_record) {
  return sr_i_rb_record_header(p_record)->record_length;
}

// Collects records and writes them sixteen pieces to a gathered write. A
// record that lies right behind the one before in memory extends that
// piece. Rows are put in their disk form into the writer's staging buffer,
// back to back, so a rewrite of a large table takes a call per megabyte,
// and the buffer, written out whenever it is full, is all the memory the
// write needs whatever the table's size.
class record_writer {
 public:
  record_writer(int fd, const std::string &path) : fd_(fd), p_path_(path.c_str()) {}

  // Room for the disk form of a record of `length` bytes, which the caller
  // fills and then adds. 0 or 12, or the code of writing out what the
  // buffer held.
  int32_t stage(uint32_t length, unsigned char **pp_bytes) {
    if (staged_ + length > staging_capacity_) {
      if (const int32_t rc = finish(); rc != 0) {
        return rc;
      }
      staged_ = 0;
      if (length > staging_capacity_ || staging_ == nullptr) {
        const size_t capacity = std::max<size_t>(length, Staging_Bytes);
        staging_.reset(new (std::nothrow) unsigned char[capacity]);
        staging_capacity_ = staging_ != nullptr ? capacity : 0;
        if (staging_ == nullptr) {
          return sr_i_raise_no_memory();
        }
      }
    }
    *pp_bytes = staging_.get() + staged_;
    staged_ += length;
    return 0;
  }

  int32_t add(const void *p_bytes, uint32_t length) {
    batch_bytes_ += length;
    if (count_ > 0) {
      iovec &last = batch_[count_ - 1];
      if (static_cast<const unsigned char *>(last.iov_base) + last.iov_len == p_bytes &&
          last.iov_len + length <= Largest_Piece) {
        last.iov_len += length;
        return 0;
      }
    }
    batch_[count_] = {const_cast<void *>(p_bytes), length};
    return ++count_ == Gathered_Records ? flush_batch() : 0;
  }

  int32_t finish() { return count_ > 0 ? flush_batch() : 0; }

  uint32_t written() const { return written_; }

 private:
  int32_t flush_batch() {
    const int32_t rc = sr_i_writev(fd_, p_path_, batch_, count_, batch_bytes_, &written_);
    count_ = 0;
    batch_bytes_ = 0;
    return rc;
  }

  int fd_;
  const char *p_path_;
  // Not cleared: every staged byte is written before it is read.
  std::unique_ptr<unsigned char[]> staging_;
  size_t staging_capacity_ = 0;
  size_t staged_ = 0;
  iovec batch_[Gathered_Records] = {};
  int count_ = 0;
  uint32_t batch_bytes_ = 0;
  uint32_t written_ = 0;
};

// Ends a write of records to `fd`: adds the commit record at file offset
// `offset`, behind the dead record that keeps its type word inside one disk
// sector when it needs one (the offset moves to the commit record's start),
// writes what the writer still holds and flushes the file.
int32_t finish_with_commit_record(record_writer &writer, uint32_t &offset,
                                  const std::vector<unsigned char> &commit_record, int fd,
                                  const std::string &path) {
  if (const uint32_t padding = sr_i_commit_record_padding(offset); padding != 0) {
    if (const int32_t rc = writer.add(Sr_Commit_Record_Padding, padding); rc != 0) {
      return rc;
    }
    offset += padding;
  }
  if (const int32_t rc =
          writer.add(commit_record.data(), static_cast<uint32_t>(commit_record.size()));
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = writer.finish(); rc != 0) {
    return rc;
  }
  return sr_i_flush_file(fd, path.c_str());
}

// The disk form of a row record: header, then the memory record's data.
// `replaced` is written over the row's first word when it is given.
void put_row_record(unsigned char *p_disk, void *p_record, const uint32_t *p_replaced) {
  const uint32_t disk_length = memory_record_length(p_record) - Sr_Memory_Record_Extra;
  const uint32_t header[3] = {disk_length, 0, Sr_Row_Record};
  std::memcpy(p_disk, header, sizeof header);
  std::memcpy(p_disk + sizeof header, p_record, disk_length - sizeof header);
  if (p_replaced != nullptr) {
    std::memcpy(p_disk + sizeof header, p_replaced, sizeof *p_replaced);
  }
}

// Appends the changed rows, a deletion record and the commit record behind
// the live commit record, and flushes.
int32_t append(sr_i_table_t *p_table, const std::vector<unsigned char> &commit_record) {
  sr_i_table_file_t &file = *p_table->p_file;
  const uint32_t start = file.commit_record.end();
  if (const int32_t rc = sr_i_seek(file.fd, start); rc != 0) {
    return rc;
  }
  std::vector<uint32_t> deletion;
  try {
    deletion.assign(4 + p_table->applied_deletions, 0);
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  record_writer writer(file.fd, file.path);
  uint32_t offset = start;
  for (auto *p_change = p_table->p_rows_change_list; p_change; p_change = p_change->p_next) {
    sr_i_index_entry_t *p_entry = p_change->p_index_entry;
    if (p_entry->p_applied == nullptr) {
      continue;
    }
    const uint32_t disk_length = memory_record_length(p_entry->p_applied) - Sr_Memory_Record_Extra;
    unsigned char *p_disk = nullptr;
    if (const int32_t rc = writer.stage(disk_length, &p_disk); rc != 0) {
      return rc;
    }
    put_row_record(p_disk, p_entry->p_applied, nullptr);
    p_entry->applied_file_offset = offset;
    sr_i_rb_record_header(p_entry->p_applied)->disk_table_offset = offset;
    if (const int32_t rc = writer.add(p_disk, disk_length); rc != 0) {
      return rc;
    }
    offset += disk_length;
  }
  // Rows added and deleted within the transaction never reached the file.
  uint32_t deleted = 0;
  for (auto *p_change = p_table->p_delete_rows_change_list; p_change; p_change = p_change->p_next) {
    if (p_change->p_index_entry->p_committed != nullptr) {
      deletion[4 + deleted++] = p_change->p_index_entry->file_offset;
    }
  }
  if (deleted > 0) {
    const uint32_t length = (deleted + 4) * 4;
    deletion[0] = length;
    deletion[2] = Sr_Deletion_Record;
    deletion[3] = deleted;
    if (const int32_t rc = writer.add(deletion.data(), length); rc != 0) {
      return rc;
    }
    offset += length;
  }
  if (const int32_t rc =
          finish_with_commit_record(writer, offset, commit_record, file.fd, file.path);
      rc != 0) {
    return rc;
  }
  file.applied_commit_record = {
      start + writer.written() - static_cast<uint32_t>(commit_record.size()),
      static_cast<uint32_t>(commit_record.size())};
  if (const uint32_t end = start + writer.written(); end > file.length) {
    file.length = end;
  }
  return 0;
}

// Removes a rewrite file that will not be committed.
void discard_rewrite_file(sr_i_table_file_t &file) {
  sr_i_close_file(file.rewrite_fd);
  file.rewrite_fd = -1;
  sr_i_discard_file(file.rewrite_path.c_str());
  file.rewrite_length = 0;
}

// Writes the metadata record, every live row of the applied view and the
// commit record as a complete table file to `fd`, and flushes it; the
// file's length goes to `*p_length` and the commit record's place to
// `*p_commit_record`. With `record_offsets` each row remembers where it now
// lies, as the table's own rewrite needs; a copy leaves the table as it is.
int32_t write_image(const sr_i_table_t *p_table, int fd, const std::string &path,
                    const std::vector<unsigned char> &commit_record, bool record_offsets,
                    uint32_t *p_length, sr_i_record_place_t *p_commit_record) {
  std::vector<unsigned char> metadata;
  if (const int32_t rc = sr_i_convert_metadata_memory_record_to_disk_record(p_table, metadata);
      rc != 0) {
    return rc;
  }
  const uint32_t live_rows = p_table->total_applied_rows - p_table->applied_deletions;
  record_writer writer(fd, path);
  if (const int32_t rc = writer.add(metadata.data(), static_cast<uint32_t>(metadata.size()));
      rc != 0) {
    return rc;
  }
  auto offset = static_cast<uint32_t>(metadata.size());
  uint32_t seen = 0;
  const uint32_t no_earlier_version = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows && seen < live_rows; ++position) {
    sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    if (entry.p_applied == nullptr) {
      continue;
    }
    ++seen;
    const uint32_t disk_length = memory_record_length(entry.p_applied) - Sr_Memory_Record_Extra;
    unsigned char *p_disk = nullptr;
    if (const int32_t rc = writer.stage(disk_length, &p_disk); rc != 0) {
      return rc;
    }
    put_row_record(p_disk, entry.p_applied, &no_earlier_version);
    if (record_offsets) {
      entry.applied_file_offset = offset;
      sr_i_rb_record_header(entry.p_applied)->disk_table_offset = offset;
    }
    if (const int32_t rc = writer.add(p_disk, disk_length); rc != 0) {
      return rc;
    }
    offset += disk_length;
  }
  if (const int32_t rc = finish_with_commit_record(writer, offset, commit_record, fd, path);
      rc != 0) {
    return rc;
  }
  *p_commit_record = {offset, static_cast<uint32_t>(commit_record.size())};
  *p_length = writer.written();
  return 0;
}

// Writes the live rows into the rewrite file.
int32_t write_rewrite_file(sr_i_table_t *p_table, const std::vector<unsigned char> &commit_record) {
  sr_i_table_file_t &file = *p_table->p_file;
  return write_image(p_table, file.rewrite_fd, file.rewrite_path, commit_record, true,
                     &file.rewrite_length, &file.applied_commit_record);
}

// Writes a complete new file beside the table file.
int32_t rewrite(sr_i_table_t *p_table, const std::vector<unsigned char> &commit_record) {
  sr_i_table_file_t &file = *p_table->p_file;
  if (const int32_t rc =
          sr_i_open_file(file.rewrite_path.c_str(), O_RDWR | O_CREAT, &file.rewrite_fd);
      rc != 0) {
    return rc;
  }
  int32_t rc = sr_i_lock_file(file.rewrite_fd);
  if (rc == 0) {
    rc = write_rewrite_file(p_table, commit_record);
  }
  if (rc != 0) {
    discard_rewrite_file(file);
  }
  return rc;
}

// Writes the type word of the committed commit record.
int32_t write_commit_record_type(const sr_i_table_file_t &file, uint32_t type) {
  if (const int32_t rc = sr_i_seek(file.fd, file.commit_record.offset + 8); rc != 0) {
    return rc;
  }
  return sr_i_write(file.fd, file.path.c_str(), &type, sizeof type);
}

// Kills the old commit record, so that readers go on to the one apply
// appended. When the flush fails it is unknown whether the 0 reached the
// disk, so the record is made live again before the failure is returned.
int32_t commit_appended(sr_i_table_file_t &file) {
  if (const int32_t rc = write_commit_record_type(file, Sr_Dead_Record); rc != 0) {
    return rc;
  }
  const int32_t flush_rc = sr_i_flush_file(file.fd, file.path.c_str());
  if (flush_rc == 0) {
    return 0;
  }
  if (const int32_t rc = write_commit_record_type(file, Sr_Live_Commit_Record); rc != 0) {
    return rc;
  }
  sr_i_flush_file(file.fd, file.path.c_str());
  return flush_rc;
}

// Renames the rewrite file onto the table file. A failed rename leaves the
// rewrite file in place, complete and flushed: the commit can be tried
// again, or the abort removes it. Once renamed, the new file is the table's
// whatever else fails: `*p_committed` says so.
int32_t commit_rewritten(sr_i_table_file_t &file, bool *p_committed) {
  const int32_t rc = sr_i_rename_durably(file.rewrite_path.c_str(), file.path.c_str(), p_committed);
  if (!*p_committed) {
    return rc;
  }
  sr_i_close_file(file.fd);
  file.fd = std::exchange(file.rewrite_fd, -1);
  file.length = std::exchange(file.rewrite_length, 0);
  return rc;
}

}  // namespace

uint32_t sr_i_rewrite_wanted(const sr_i_table_t *p_table) {
  if (p_table->p_file == nullptr) {
    return 0;
  }
  const uint32_t length = p_table->p_file->length;
  if (length <= Large_File_Bytes) {
    return 0;
  }
  const uint32_t percentage = p_table->record_buffer_pool.used_bytes * 100u / length;
  return percentage < Least_Live_Percentage ? 1 : 0;
}

int32_t sr_i_apply_to_file(sr_i_table_t *p_table, uint32_t rewrite_file, uint32_t *p_applied) {
  std::vector<unsigned char> commit_record;
  if (const int32_t rc = sr_i_create_commit_record(p_table->p_application_metadata,
                                                   p_table->applied_change_counter, commit_record);
      rc != 0) {
    return rc;
  }
  if (rewrite_file != 0) {
    *p_applied = Sr_Applied_By_Rewrite;
    return rewrite(p_table, commit_record);
  }
  *p_applied = Sr_Applied_In_Place;
  return append(p_table, commit_record);
}

int32_t sr_i_commit_file(sr_i_table_t *p_table, uint32_t applied, bool *p_committed) {
  sr_i_table_file_t &file = *p_table->p_file;
  *p_committed = false;
  int32_t rc;
  if (applied == Sr_Applied_By_Rewrite) {
    rc = commit_rewritten(file, p_committed);
  } else {
    rc = commit_appended(file);
    *p_committed = rc == 0;
  }
  if (*p_committed) {
    file.commit_record = file.applied_commit_record;
  }
  return rc;
}

void sr_i_abort_file(sr_i_table_t *p_table, uint32_t applied) {
  sr_i_table_file_t &file = *p_table->p_file;
  if (applied == Sr_Applied_By_Rewrite) {
    discard_rewrite_file(file);
  } else if (applied == Sr_Applied_In_Place) {
    const uint32_t committed_end = file.commit_record.end();
    if (sr_i_truncate(file.fd, file.path.c_str(), committed_end) == 0) {
      file.length = committed_end;
    }
    sr_i_flush_file(file.fd, file.path.c_str());
  }
  file.applied_commit_record = file.commit_record;
}

int32_t sr_i_write_table_file(const sr_i_table_t *p_table, int fd, const std::string &path) {
  std::vector<unsigned char> commit_record;
  if (const int32_t rc = sr_i_create_commit_record(p_table->p_application_metadata,
                                                   p_table->change_counter, commit_record);
      rc != 0) {
    return rc;
  }
  uint32_t length = 0;
  sr_i_record_place_t commit_record_place;
  return write_image(p_table, fd, path, commit_record, false, &length, &commit_record_place);
}
