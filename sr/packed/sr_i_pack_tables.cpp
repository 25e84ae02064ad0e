// sr_i_pack_tables.cpp - packing: several open tables, each in the view
// its caller chose and with all its rows or the rows chosen by fixed index,
// into one new buffer. Every table is read-locked, in the caller's order,
// from the first size computed to the last byte written.
//
// Names, fixed metadata and column metadata are encoded by libqv_pmsg. The
// rows, which are most of the buffer, are written here as the pointer array
// of binaries that docs/value-encoding.md describes, each element the pool
// record as it stands (header and row record): the codec would first need
// every row copied into a client value, and the rows are already encoded.

#include <cstdlib>
#include <cstring>
#include <vector>

#include "frame/sr_i_errors.h"
#include "packed/sr_i_packed_buffer.h"
#include "packed/sr_i_packed_columns.h"
#include "rows/sr_i_rows.h"
#include "storage/sr_i_prefault.h"

namespace {

// The read locks of the tables being packed: taken in array order, a table
// named twice only once; on a failure the ones taken are released in
// reverse; otherwise all are released in array order when this goes.
class table_read_locks {
 public:
  int32_t take(const std::vector<sr_i_table_t *> &tables) {
    for (sr_i_table_t *p_table : tables) {
      bool taken_already = false;
      for (const sr_i_read_write_lock_t *p_lock : locks_) {
        taken_already = taken_already || p_lock == &p_table->lock;
      }
      if (taken_already) {
        continue;
      }
      if (const int32_t rc = sr_i_rw_lock_read(&p_table->lock); rc != 0) {
        while (!locks_.empty()) {
          sr_i_rw_unlock_read(locks_.back());
          locks_.pop_back();
        }
        return rc;
      }
      locks_.push_back(&p_table->lock);
    }
    return 0;
  }
  ~table_read_locks() {
    for (sr_i_read_write_lock_t *p_lock : locks_) {
      sr_i_rw_unlock_read(p_lock);
    }
  }

 private:
  std::vector<sr_i_read_write_lock_t *> locks_;
};

constexpr uint32_t Fixed_Metadata_Elements = 5;

// What is packed of one table, and the sizes of its values.
struct table_plan {
  const sr_i_table_t *p_table = nullptr;
  const char *p_name = "";
  bool applied = false;  // the view packed
  uint32_t total_fixed_indices = 0;
  const uint32_t *p_fixed_indices = nullptr;
  uint32_t total_rows = 0;
  qv_structured_data_t *p_fixed_metadata = nullptr;
  sr_i_packed_column_metadata column_metadata;
  uint64_t name_bytes = 0;
  uint64_t fixed_metadata_bytes = 0;
  uint64_t column_metadata_bytes = 0;
  uint64_t rows_bytes = 0;
};

// The whole pool record of a row: its header and its data area.
uint32_t pool_record_length(const void *p_record) {
  return sr_i_rb_record_header(const_cast<void *>(p_record))->record_length;
}

constexpr uint32_t Records_Asked_Ahead = 16;

// Calls visit(p_record) with the visible record of every row of the view,
// in packed-index order, or of the rows at the caller's fixed indexes, in
// the caller's order (203 for an index outside the table, 204 for a row
// the view does not show). Sizing and writing each walk the rows once,
// rather than a list of them made for the purpose.
template <typename Visit>
int32_t visit_rows(const table_plan &plan, Visit &&visit) {
  const sr_i_table_t *p_table = plan.p_table;
  const bool applied = plan.applied;
  const auto record = [applied](const sr_i_index_entry_t &entry) -> const void * {
    return applied ? entry.p_applied : entry.p_committed;
  };
  if (plan.total_fixed_indices == 0) {
    const uint32_t total_rows = p_table->total_applied_rows;
    const auto record_at = [&](uint32_t packed) {
      return record(p_table->p_rows_fixed_index[p_table->p_rows_packed_index[packed]]);
    };
    for (uint32_t packed = 0; packed < total_rows; ++packed) {
      // Each record starts a cache line of its own, wherever the pool put
      // it: the one a few rows on is asked for now.
      if (packed + Records_Asked_Ahead < total_rows) {
        if (const void *p_ahead = record_at(packed + Records_Asked_Ahead)) {
          __builtin_prefetch(sr_i_rb_record_header(const_cast<void *>(p_ahead)));
        }
      }
      if (const void *p_record = record_at(packed)) {
        visit(p_record);
      }
    }
    return 0;
  }
  for (uint32_t at = 0; at < plan.total_fixed_indices; ++at) {
    const uint32_t fixed_index = plan.p_fixed_indices[at];
    if (fixed_index >= p_table->maximum_rows) {
      return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
    }
    const void *p_record = record(p_table->p_rows_fixed_index[fixed_index]);
    if (p_record == nullptr) {
      return sr_i_raise(SR_E_ROW_DELETED);
    }
    visit(p_record);
  }
  return 0;
}

int32_t indirect_size(qv_data_type_t type, const qv_value_t &value, uint64_t &bytes) {
  uint32_t length = 0;
  if (const int32_t rc = qv_pmsg_size_conv_protocol_value_1(1, 0, type, &value, &length); rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_size_conv_protocol_value", rc);
  }
  bytes = length;
  return 0;
}

// Counts and sizes the table's rows, and builds and sizes its other three
// values.
int32_t plan_table(const sr_i_table_t *p_table, bool applied, uint32_t total_fixed_indices,
                   const uint32_t *p_fixed_indices, qv_structured_data_t *p_fixed_metadata,
                   table_plan &plan) {
  plan.p_table = p_table;
  plan.applied = applied;
  plan.total_fixed_indices = total_fixed_indices;
  plan.p_fixed_indices = p_fixed_indices;
  // A persistent table is known in its tree by its file's path; the other
  // side knows it by its registry path.
  if (p_table->p_persistent_table_registry_path != nullptr) {
    plan.p_name = p_table->p_persistent_table_registry_path;
  } else if (p_table->p_name != nullptr) {
    plan.p_name = p_table->p_name;
  }
  uint64_t records_bytes = 0;
  if (const int32_t rc = visit_rows(plan,
                                    [&](const void *p_record) {
                                      ++plan.total_rows;
                                      records_bytes += pool_record_length(p_record);
                                    });
      rc != 0) {
    return rc;
  }
  plan.name_bytes = std::strlen(plan.p_name) + 1;

  constexpr qv_data_type_t types[Fixed_Metadata_Elements] = {QV_CHAR_PTR, QV_UINT32, QV_UINT32,
                                                             QV_UINT64, QV_INT32};
  p_fixed_metadata->element_count = Fixed_Metadata_Elements;
  for (uint32_t element = 0; element < Fixed_Metadata_Elements; ++element) {
    p_fixed_metadata->elements[element].data_type = types[element];
  }
  p_fixed_metadata->elements[0].value.ptr_char = const_cast<char *>(plan.p_name);
  // The rows packed: all the view shows, or those chosen.
  p_fixed_metadata->elements[1].value.val_uint32 = plan.total_rows;
  p_fixed_metadata->elements[2].value.val_uint32 = p_table->total_columns;
  p_fixed_metadata->elements[3].value.val_uint64 = p_table->change_counter;
  p_fixed_metadata->elements[4].value.val_int32 = 0;
  plan.p_fixed_metadata = p_fixed_metadata;
  qv_value_t fixed_value;
  fixed_value.ptr_sd = p_fixed_metadata;
  if (const int32_t rc = indirect_size(QV_SD_PTR, fixed_value, plan.fixed_metadata_bytes);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = plan.column_metadata.build(p_table); rc != 0) {
    return rc;
  }
  if (const int32_t rc =
          indirect_size(QV_SD_PTR_ARRAY, plan.column_metadata.value(), plan.column_metadata_bytes);
      rc != 0) {
    return rc;
  }
  plan.rows_bytes = 4 + uint64_t{Sr_Packed_Slot_Bytes} * plan.total_rows + records_bytes;
  return 0;
}

// Encodes one client value through the codec at the running offset.
int32_t encode_value(qv_data_type_t type, const qv_value_t &value, unsigned char *p_slot,
                     unsigned char *p_indirect, uint32_t indirect_length, uint32_t &offset) {
  qv_pmsg_value_t slot{};
  if (const int32_t rc = qv_pmsg_build_conv_protocol_value_1(nullptr, 0, type, &value, &slot,
                                                             p_indirect, indirect_length, &offset);
      rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_build_conv_protocol_value", rc);
  }
  std::memcpy(p_slot, &slot, sizeof slot);
  return 0;
}

// Writes the rows as a pointer array of binaries at the running offset:
// the count, one anchor per row (from the start of the array's body), then
// each pool record whole, with its free-chain link cleared, since an
// address means nothing on the other side.
void write_rows(const table_plan &plan, unsigned char *p_slot, unsigned char *p_indirect,
                uint32_t &offset) {
  const qv_pmsg_value_anchor_t array_anchor{offset, static_cast<uint32_t>(plan.rows_bytes)};
  std::memcpy(p_slot, &array_anchor, sizeof array_anchor);
  unsigned char *p_body = p_indirect + offset;
  sr_i_store_u32(p_body, plan.total_rows);
  unsigned char *p_anchor = p_body + 4;
  uint32_t element_offset = 4 + Sr_Packed_Slot_Bytes * plan.total_rows;
  // The rows were walked once to size them: the walk cannot fail now.
  visit_rows(plan, [&](const void *p_record) {
    const uint32_t length = pool_record_length(p_record);
    const qv_pmsg_value_anchor_t anchor{element_offset, length};
    std::memcpy(p_anchor, &anchor, sizeof anchor);
    p_anchor += Sr_Packed_Slot_Bytes;
    sr_i_record_metadata_t header = *sr_i_rb_record_header(const_cast<void *>(p_record));
    header.p_next = nullptr;
    std::memcpy(p_body + element_offset, &header, Sr_Record_Header_Length);
    std::memcpy(p_body + element_offset + Sr_Record_Header_Length, p_record,
                length - Sr_Record_Header_Length);
    element_offset += length;
  });
  offset += element_offset;
}

}  // namespace

int32_t sr_i_pack_tables(uint32_t total_tables, const sr_opaque_handle_t *p_table_handles,
                         const uint32_t *p_uncommitted_updates_visible,
                         const uint32_t *p_total_row_fixed_indices,
                         const uint32_t *p_row_fixed_indices, void **pp_buffer) {
  std::vector<sr_i_table_t *> tables(total_tables);
  for (uint32_t table = 0; table < total_tables; ++table) {
    if ((tables[table] = static_cast<sr_i_table_t *>(p_table_handles[table])) == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
  }
  table_read_locks locks;
  if (const int32_t rc = locks.take(tables); rc != 0) {
    return rc;
  }
  // The fixed metadata of every table, as one block of client values.
  const size_t fixed_metadata_bytes =
      sizeof(qv_structured_data_t) + Fixed_Metadata_Elements * sizeof(qv_structured_data_element_t);
  std::vector<unsigned char> fixed_metadata(fixed_metadata_bytes * total_tables);
  std::vector<table_plan> plans(total_tables);
  uint64_t indirect_length = 0;
  const uint32_t *p_fixed_indices = p_row_fixed_indices;
  for (uint32_t table = 0; table < total_tables; ++table) {
    const sr_i_table_t *p_table = tables[table];
    const bool applied =
        p_uncommitted_updates_visible[table] != 0 || p_table->uncommitted_updates_visible != 0;
    const uint32_t total_fixed_indices = p_total_row_fixed_indices[table];
    if (total_fixed_indices != 0 && p_row_fixed_indices == nullptr) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    auto *p_fixed_metadata = reinterpret_cast<qv_structured_data_t *>(fixed_metadata.data() +
                                                                      fixed_metadata_bytes * table);
    table_plan &plan = plans[table];
    if (const int32_t rc = plan_table(p_table, applied, total_fixed_indices, p_fixed_indices,
                                      p_fixed_metadata, plan);
        rc != 0) {
      return rc;
    }
    p_fixed_indices += total_fixed_indices;
    indirect_length +=
        plan.name_bytes + plan.fixed_metadata_bytes + plan.column_metadata_bytes + plan.rows_bytes;
  }
  const uint64_t fixed_part = sr_i_packed_fixed_part_bytes(total_tables);
  if (fixed_part + indirect_length > UINT32_MAX) {
    return sr_i_raise_no_memory();  // more than a buffer's 32-bit length can say
  }
  const auto length = static_cast<uint32_t>(fixed_part + indirect_length);
  // Every byte is written below, so the buffer is not cleared first.
  auto *p_buffer = static_cast<unsigned char *>(sr_i_allocate_block_to_fill(length));
  if (p_buffer == nullptr) {
    return sr_i_raise_no_memory();
  }
  sr_i_decoded<unsigned char> buffer(p_buffer);
  const qv_pmsg_header_t header{length, QV_PMSG_VERSION, QV_PMSG_ARCH_LOCAL,
                                Sr_Packed_Protocol_Type, 0};
  std::memcpy(p_buffer, &header, sizeof header);
  std::memset(p_buffer + Sr_Packed_Header_Bytes, 0,
              Sr_Packed_Empty_Buffer_Bytes - Sr_Packed_Header_Bytes);
  const uint32_t buffer_slots[] = {0, 1, length, total_tables};
  for (uint32_t slot = 0; slot < 4; ++slot) {
    sr_i_store_u32(p_buffer + Sr_Packed_Header_Bytes + slot * Sr_Packed_Slot_Bytes,
                   buffer_slots[slot]);
  }
  sr_i_packed_buffer_view view{p_buffer, length, total_tables, p_buffer + fixed_part,
                               static_cast<uint32_t>(indirect_length)};
  uint32_t offset = 0;
  for (uint32_t table = 0; table < total_tables; ++table) {
    const table_plan &plan = plans[table];
    qv_value_t name;
    name.ptr_char = const_cast<char *>(plan.p_name);
    qv_value_t fixed_value;
    fixed_value.ptr_sd = plan.p_fixed_metadata;
    if (const int32_t rc = encode_value(QV_CHAR_PTR, name, view.table_slot(table, SR_I_PACKED_NAME),
                                        view.p_indirect, view.indirect_length, offset);
        rc != 0) {
      return rc;
    }
    if (const int32_t rc =
            encode_value(QV_SD_PTR, fixed_value, view.table_slot(table, SR_I_PACKED_FIXED_METADATA),
                         view.p_indirect, view.indirect_length, offset);
        rc != 0) {
      return rc;
    }
    if (const int32_t rc = encode_value(QV_SD_PTR_ARRAY, plan.column_metadata.value(),
                                        view.table_slot(table, SR_I_PACKED_COLUMN_METADATA),
                                        view.p_indirect, view.indirect_length, offset);
        rc != 0) {
      return rc;
    }
    write_rows(plan, view.table_slot(table, SR_I_PACKED_ROWS), view.p_indirect, offset);
  }
  if (offset != view.indirect_length) {
    return sr_i_raise_internal();  // the codec encoded other sizes than it measured
  }
  *pp_buffer = buffer.release();
  return 0;
}
