// sr_i_open_persistent_table.cpp - loading a persistent table from its file
// at its committed state.
//
// The whole file is read at once. The records are replayed in file order up
// to the first live commit record: a row record adds a row or replaces the
// row whose current record starts at its replaced offset, a deletion record
// removes the rows whose current records start at the listed offsets, dead
// records are skipped, and the live commit record brings the change counter
// and the application metadata. Whatever lies behind that record was
// written by an apply that was never committed and is not looked at.
//
// Every length and offset is checked against the bytes read before it is
// used, so a damaged or hostile file fails with 14, 213, 214 or 215 and is
// never read out of bounds.

#include <fcntl.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <new>
#include <span>
#include <utility>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "rows/sr_i_rows.h"
#include "schema/sr_i_application_metadata.h"
#include "storage/sr_i_commit_record.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_prefault.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"

namespace {

// Room read beyond the measured length, to notice a file that grew.
constexpr uint32_t Read_Margin = 4096;
constexpr uint32_t Rows_Without_Estimate = 100;

// The file as read: its bytes are not cleared before the read fills them,
// since a large table's file is tens of megabytes.
struct file_image {
  std::unique_ptr<unsigned char[]> buffer;
  uint32_t size = 0;
  std::span<const unsigned char> bytes() const { return {buffer.get(), size}; }
};

uint32_t word_at(std::span<const unsigned char> bytes, size_t offset) {
  uint32_t word;
  std::memcpy(&word, bytes.data() + offset, sizeof word);
  return word;
}

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
};

// Opens (and for writing locks) the table file, unless a descriptor that
// holds the lock was handed over. A writer that waited for the lock may
// find that the holder replaced the file (a rewrite renames a new file over
// it) while it waited: it opens the new one.
int32_t open_table_file(sr_i_table_file_t &file, bool writable) {
  if (file.fd >= 0) {
    return 0;
  }
  for (;;) {
    if (const int32_t rc =
            sr_i_open_file(file.path.c_str(), writable ? O_RDWR : O_RDONLY, &file.fd);
        rc != 0) {
      return rc;
    }
    if (!writable) {
      return 0;
    }
    // A writer waits here for another process's writer to close the table.
    if (const int32_t rc = sr_i_lock_file(file.fd); rc != 0) {
      return rc;
    }
    bool same = false;
    if (const int32_t rc = sr_i_is_same_file(file.fd, file.path.c_str(), &same); rc != 0 || same) {
      return rc;
    }
    sr_i_close_file(std::exchange(file.fd, -1));
  }
}

// Reads the whole file; a read that fills the buffer means the file grew
// meanwhile, and it is measured and read again.
int32_t read_whole_file(int fd, file_image &image) {
  for (;;) {
    off_t end = 0;
    if (const int32_t rc = sr_i_seek_to_end(fd, &end); rc != 0) {
      return rc;
    }
    if (end < Sr_Shortest_Table_File || end > off_t{UINT32_MAX - Read_Margin}) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    if (const int32_t rc = sr_i_seek(fd, 0); rc != 0) {
      return rc;
    }
    const auto capacity = static_cast<uint32_t>(end) + Read_Margin;
    try {
      image.buffer = std::make_unique_for_overwrite<unsigned char[]>(capacity);
    } catch (const std::bad_alloc &) {
      return sr_i_raise_no_memory();
    }
    sr_i_prefault(image.buffer.get(), capacity);
    uint32_t read = 0;
    if (const int32_t rc = sr_i_read(fd, image.buffer.get(), capacity, &read); rc != 0) {
      return rc;
    }
    if (read < capacity) {
      image.size = read;
      return read < Sr_Shortest_Table_File ? sr_i_raise(SR_E_TABLE_UNREADABLE) : 0;
    }
  }
}

// Where the committed state ends, and how many records lead there.
struct committed_extent {
  uint32_t commit_record_offset = 0;
  uint32_t memory_length = 0;  // the records behind the metadata record, in memory form
  uint32_t row_records = 0;
};

// Checks every record header up to the first live commit record.
int32_t find_committed_extent(std::span<const unsigned char> bytes, uint32_t first_record,
                              committed_extent &extent) {
  const auto size = static_cast<uint32_t>(bytes.size());
  for (uint32_t offset = first_record;;) {
    if (offset == size) {
      return sr_i_raise(SR_E_NO_COMMIT_RECORD);
    }
    if (size - offset < Sr_File_Record_Header_Length) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    const uint32_t length = word_at(bytes, offset);
    const uint32_t type = word_at(bytes, offset + 8);
    if (length < Sr_File_Record_Header_Length || length > size - offset ||
        (type != Sr_Dead_Record && type != Sr_Row_Record && type != Sr_Deletion_Record &&
         type != Sr_Live_Commit_Record)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    extent.memory_length += length + Sr_Memory_Record_Extra;
    extent.row_records += type == Sr_Row_Record ? 1 : 0;
    if (type == Sr_Live_Commit_Record) {
      extent.commit_record_offset = offset;
      return 0;
    }
    offset += length;
  }
}

// Whether a row record's slots and bodies lie inside it, and the bodies that
// are read in place (strings, resource handles) are whole.
bool valid_row_record(const sr_i_table_t *p_table, const unsigned char *p_row, uint32_t length) {
  const uint32_t fixed = sr_i_row_fixed_length(p_table);
  if (length < fixed) {
    return false;
  }
  const uint32_t variable_length = length - fixed;
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    const qv_data_type_t type = p_table->p_columns[column].type;
    if (!sr_i_is_variable_length(type)) {
      continue;
    }
    const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(sr_i_row_slot(p_row, column));
    if (uint64_t{anchor.offset} + anchor.length > variable_length) {
      return false;
    }
    const unsigned char *p_body = p_row + fixed + anchor.offset;
    if (type == QV_CHAR_PTR && (anchor.length == 0 || p_body[anchor.length - 1] != 0)) {
      return false;
    }
    if (type == QV_RSRC_HANDLE_PTR && anchor.length != sizeof(qv_resource_handle_t)) {
      return false;
    }
  }
  return true;
}

// Replays the records of the committed state into the table.
class replay {
 public:
  replay(sr_i_table_t *p_table, std::span<const unsigned char> bytes)
      : p_table_(p_table), bytes_(bytes) {}

  int32_t run(uint32_t first_record, uint32_t row_records) {
    try {
      current_records_.reserve(row_records);
    } catch (const std::bad_alloc &) {
      return sr_i_raise_no_memory();
    }
    for (uint32_t offset = first_record;;) {
      const uint32_t length = word_at(bytes_, offset);
      int32_t rc = 0;
      switch (word_at(bytes_, offset + 8)) {
        case Sr_Row_Record:
          rc = row(offset, length);
          break;
        case Sr_Deletion_Record:
          rc = deletion(offset, length);
          break;
        case Sr_Live_Commit_Record:
          return commit(offset, length);
        default:
          break;  // a dead commit record
      }
      if (rc != 0) {
        return rc;
      }
      offset += length;
    }
  }

 private:
  int32_t row(uint32_t offset, uint32_t length) {
    const unsigned char *p_row = bytes_.data() + offset + Sr_File_Record_Header_Length;
    const uint32_t row_length = length - Sr_File_Record_Header_Length;
    if (!valid_row_record(p_table_, p_row, row_length)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    const uint32_t replaced = word_at(bytes_, offset + Sr_File_Record_Header_Length);
    sr_i_index_entry_t *p_entry = nullptr;
    if (replaced != 0) {
      current_record *p_current = find_current(replaced);
      if (p_current == nullptr) {
        return sr_i_raise(SR_E_NO_REPLACED_ROW);
      }
      p_entry = &p_table_->p_rows_fixed_index[p_current->position];
      p_current->position = Gone;
      sr_i_rb_free_record(&p_table_->record_buffer_pool, p_entry->p_committed);
    } else {
      p_entry = sr_i_rows_free_chain_remove(p_table_);
      if (p_entry == nullptr) {
        if (const int32_t rc = sr_i_grow_index(p_table_, p_table_->maximum_rows); rc != 0) {
          return rc;
        }
        p_entry = sr_i_rows_free_chain_remove(p_table_);
      }
      ++p_table_->total_applied_rows;
    }
    void *p_record = nullptr;
    if (const int32_t rc = sr_i_reserve_record(&p_table_->record_buffer_pool, row_length,
                                               SR_I_RECORD_ROW, &p_record);
        rc != 0) {
      return rc;
    }
    std::memcpy(p_record, p_row, row_length);
    sr_i_rb_record_header(p_record)->disk_table_offset = offset;
    p_entry->p_applied = p_record;
    p_entry->p_committed = p_record;
    p_entry->file_offset = offset;
    p_entry->applied_file_offset = 0;
    // Reserved for every row record of the file, so this cannot allocate.
    current_records_.push_back({offset, sr_i_fixed_position(p_table_, p_entry)});
    return 0;
  }

  int32_t deletion(uint32_t offset, uint32_t length) {
    if (length < Sr_File_Record_Header_Length + 4) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    const uint32_t count = word_at(bytes_, offset + Sr_File_Record_Header_Length);
    if (uint64_t{count} * 4 > length - Sr_File_Record_Header_Length - 4) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    for (uint32_t at = 0; at < count; ++at) {
      const uint32_t deleted = word_at(bytes_, offset + Sr_File_Record_Header_Length + 4 + 4 * at);
      current_record *p_current = find_current(deleted);
      if (p_current == nullptr) {
        return sr_i_raise(SR_E_NO_DELETED_ROW);
      }
      sr_i_index_entry_t *p_entry = &p_table_->p_rows_fixed_index[p_current->position];
      p_current->position = Gone;
      sr_i_rb_free_record(&p_table_->record_buffer_pool, p_entry->p_committed);
      sr_i_rows_free_chain_insert(p_table_, p_entry);
      --p_table_->total_applied_rows;
    }
    return 0;
  }

  int32_t commit(uint32_t offset, uint32_t length) {
    const std::span<const unsigned char> record(bytes_.data() + offset, length);
    if (const int32_t rc = sr_i_open_commit_record(record, p_table_->p_application_metadata,
                                                   &p_table_->change_counter);
        rc != 0) {
      return rc;
    }
    p_table_->applied_change_counter = p_table_->change_counter;
    p_table_->p_file->commit_record = {offset, length};
    p_table_->p_file->applied_commit_record = {offset, length};
    return 0;
  }

  // Where a row's current record starts in the file, and the row's fixed
  // index. Records are replayed in ascending file order, so appending keeps
  // the list sorted and a lookup is a binary search; a record replaced or
  // deleted keeps its place, marked gone.
  struct current_record {
    uint32_t file_offset;
    uint32_t position;
  };
  static constexpr uint32_t Gone = UINT32_MAX;

  current_record *find_current(uint32_t file_offset) {
    const auto at = std::lower_bound(
        current_records_.begin(), current_records_.end(), file_offset,
        [](const current_record &record, uint32_t offset) { return record.file_offset < offset; });
    if (at == current_records_.end() || at->file_offset != file_offset || at->position == Gone) {
      return nullptr;
    }
    return &*at;
  }

  sr_i_table_t *p_table_;
  std::span<const unsigned char> bytes_;
  std::vector<current_record> current_records_;
};

// The table's row index and pool, sized from the file so that its rows and
// about a hundred more fit without growing. The parts the load fills, the
// image's room and an index entry per row record, are mapped in advance.
int32_t size_table(sr_i_table_t *p_table, const committed_extent &extent) {
  const uint32_t per_row = p_table->total_columns * 8 + 20;
  uint32_t maximum_rows = extent.memory_length / per_row;
  if (maximum_rows == 0) {
    maximum_rows = Rows_Without_Estimate;
  }
  if (const int32_t rc = sr_i_establish_rows_index(p_table, maximum_rows); rc != 0) {
    return rc;
  }
  sr_i_prefault(p_table->p_rows_fixed_index,
                size_t{std::min(extent.row_records, maximum_rows)} * sizeof(sr_i_index_entry_t));
  const uint64_t growth =
      uint64_t{p_table->total_variable_length_columns * 100u + (p_table->total_columns + 3) * 8u} *
      100u;
  const uint64_t wanted = extent.memory_length + growth;
  if (wanted > UINT32_MAX / 2) {
    return sr_i_raise_no_memory();
  }
  void *p_room = nullptr;
  if (const int32_t rc =
          sr_i_rb_make_room(&p_table->record_buffer_pool, static_cast<uint32_t>(wanted), &p_room);
      rc != 0) {
    return rc;
  }
  sr_i_prefault(p_room, extent.memory_length);
  return 0;
}

int32_t load(sr_i_table_t *p_table, bool writable) {
  sr_i_table_file_t &file = *p_table->p_file;
  if (const int32_t rc = open_table_file(file, writable); rc != 0) {
    return rc;
  }
  file_image image;
  if (const int32_t rc = read_whole_file(file.fd, image); rc != 0) {
    return rc;
  }
  const std::span<const unsigned char> bytes = image.bytes();
  file.length = static_cast<uint32_t>(bytes.size());
  const uint32_t metadata_length = word_at(bytes, 0);
  if (metadata_length > bytes.size()) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  if (const int32_t rc = sr_i_convert_metadata_disk_record_to_memory_record(
          p_table, std::span<const unsigned char>(bytes.data(), metadata_length));
      rc != 0) {
    return rc;
  }
  committed_extent extent;
  if (const int32_t rc = find_committed_extent(bytes, metadata_length, extent); rc != 0) {
    return rc;
  }
  if (const int32_t rc = size_table(p_table, extent); rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_open_key_hash_and_metadata(p_table); rc != 0) {
    return rc;
  }
  if (const int32_t rc = replay(p_table, bytes).run(metadata_length, extent.row_records); rc != 0) {
    return rc;
  }
  p_table->total_committed_rows = p_table->total_applied_rows;
  return sr_i_establish_secondary_row_access(p_table);
}

}  // namespace

int32_t sr_i_open_persistent_table(sr_i_tree_t *p_tree, const char *p_registry_path,
                                   const char *p_file_path, int32_t mode, uint32_t block_size,
                                   sr_hash_table_t *p_rows_hash_table, sr_i_table_t **pp_table,
                                   int locked_fd) {
  sr_i_descriptor handed_over(locked_fd);
  if (p_file_path == nullptr) {
    sr_i_hash_table_close(p_rows_hash_table);
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  sr_i_table_t *p_table = sr_i_create_null_table();
  if (p_table == nullptr) {
    sr_i_hash_table_close(p_rows_hash_table);
    return SR_E_NO_MEMORY;
  }
  table_closer table{p_table};
  p_table->p_rows_hash_table = p_rows_hash_table;
  p_table->p_tree = p_tree;
  const bool writable = (mode & SR_MODE_WRITE) != 0;
  p_table->mode = writable ? Sr_Mode_Writable : Sr_Mode_Read_Only;
  p_table->implicitly_controlled = (mode & SR_MODE_EXPLICIT_CONTROL) ? 0 : 1;
  p_table->block_size = block_size;
  if ((p_table->p_name = strdup(p_file_path)) == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (const int32_t rc = sr_i_attach_table_file(p_table, p_file_path, p_registry_path); rc != 0) {
    return rc;
  }
  if (writable) {
    p_table->p_file->fd = std::exchange(handed_over.fd, -1);
  }
  if (const int32_t rc = load(p_table, writable); rc != 0) {
    return rc;
  }
  *pp_table = p_table;
  table.p_table = nullptr;
  return 0;
}
