// sr_i_record_buffer_pool.cpp - the record buffer pool: blocks taken from
// the heap, first-fit allocation of records out of one address-ordered free
// chain, merging of freed neighbours, the exact count of bytes in use, and
// the copy of a whole pool into one block with a map of where each block
// went.
//
// Blocks stay with the pool until it is uninitialised, even when wholly
// free. Two blocks never touch (each begins with its own header), so a merge
// of free records can only happen inside one block.

#include "sr_i_record_buffer_pool.h"

#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "sr_i_errors.h"

namespace {

// Requests below this size get a block a hundred times their size, so that
// tables of many small rows need few blocks.
constexpr uint32_t Large_Request_Length = 65536;
constexpr uint32_t Small_Request_Block_Factor = 100;
// A block header plus the header of the one record a new block starts with.
constexpr uint32_t New_Block_Overhead = Sr_Record_Buffer_Header_Length + Sr_Record_Header_Length;

uintptr_t address_of(const void *p_address) {
  return reinterpret_cast<uintptr_t>(p_address);
}

uintptr_t end_of(const sr_i_record_metadata_t *p_record) {
  return address_of(p_record) + p_record->record_length;
}

uint32_t data_area_length(const sr_i_record_metadata_t *p_record) {
  return p_record->record_length - Sr_Record_Header_Length;
}

// A zeroed block of `block_size` bytes appended to the pool, its data area
// one free record linked into the chain. 12 (raised) when the block cannot
// be had or its size would not fit the pool's 32-bit count.
int32_t add_block(sr_i_record_buffer_pool_t *p_pool, uint64_t block_size,
                  sr_i_record_metadata_t **pp_record, sr_i_record_metadata_t **pp_previous) {
  if (block_size > UINT32_MAX - p_pool->total_bytes) {
    return sr_i_raise_no_memory();
  }
  auto *p_block = static_cast<sr_i_record_buffer_t *>(calloc(1, block_size));
  if (p_block == nullptr) {
    return sr_i_raise_no_memory();
  }
  p_block->total_bytes = static_cast<uint32_t>(block_size);
  if (p_pool->p_last_record_buffer == nullptr) {
    p_pool->p_first_record_buffer = p_block;
  } else {
    p_pool->p_last_record_buffer->p_next = p_block;
  }
  p_pool->p_last_record_buffer = p_block;
  p_pool->total_bytes += p_block->total_bytes;
  p_pool->used_bytes += New_Block_Overhead;

  auto *p_record = reinterpret_cast<sr_i_record_metadata_t *>(p_block->data);
  p_record->record_length = p_block->total_bytes - Sr_Record_Buffer_Header_Length;
  p_record->type = SR_I_RECORD_FREE;
  // A fresh block touches no other free record, so nothing merges and the
  // count returned is only the new data area, which is not in use.
  sr_i_rb_insert_free_record(p_record, &p_pool->p_free_chain, pp_previous);
  *pp_record = p_record;
  return 0;
}

}  // namespace

int32_t sr_i_rb_initialize_record_buffer_pool(uint32_t total_pages,
                                              sr_i_record_buffer_pool_t *p_pool) {
  if (total_pages == 0) {
    *p_pool = sr_i_record_buffer_pool_t{};
    return 0;
  }
  const long page_size = sysconf(_SC_PAGESIZE);
  const uint64_t block_size = uint64_t{total_pages} * static_cast<uint64_t>(page_size);
  if (page_size <= 0 || block_size > UINT32_MAX) {
    return sr_i_raise_no_memory();
  }
  sr_i_record_buffer_pool_t pool{};
  sr_i_record_metadata_t *p_record = nullptr;
  sr_i_record_metadata_t *p_previous = nullptr;
  if (const int32_t rc = add_block(&pool, block_size, &p_record, &p_previous); rc != 0) {
    return rc;
  }
  *p_pool = pool;
  return 0;
}

int32_t sr_i_rb_uninitialize_record_buffer_pool(sr_i_record_buffer_pool_t *p_pool) {
  sr_i_record_buffer_t *p_block = p_pool->p_first_record_buffer;
  while (p_block != nullptr) {
    sr_i_record_buffer_t *p_next = p_block->p_next;
    free(p_block);
    p_block = p_next;
  }
  *p_pool = sr_i_record_buffer_pool_t{};
  return 0;
}

int32_t sr_i_rb_find_suitable_record(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                                     void **pp_data,
                                     sr_i_record_metadata_t **pp_previous_free_record,
                                     uint32_t *p_actual_data_length) {
  sr_i_record_metadata_t *p_previous = nullptr;
  sr_i_record_metadata_t *p_record = p_pool->p_free_chain;
  while (p_record != nullptr && data_area_length(p_record) < data_length) {
    p_previous = p_record;
    p_record = p_record->p_next;
  }
  if (p_record != nullptr) {
    memset(sr_i_rb_record_data(p_record), 0, data_area_length(p_record));
  } else {
    // A new block comes zeroed from calloc.
    const uint64_t block_size =
        data_length < Large_Request_Length
            ? uint64_t{data_length} * Small_Request_Block_Factor + New_Block_Overhead
            : uint64_t{data_length} + New_Block_Overhead;
    if (const int32_t rc = add_block(p_pool, block_size, &p_record, &p_previous); rc != 0) {
      return rc;
    }
  }
  *pp_data = sr_i_rb_record_data(p_record);
  *pp_previous_free_record = p_previous;
  *p_actual_data_length = data_area_length(p_record);
  return 0;
}

int32_t sr_i_rb_allocate_record(sr_i_record_buffer_pool_t *p_pool, void *p_data,
                                sr_i_record_metadata_t *p_previous_free_record,
                                uint32_t data_length, uint32_t record_type) {
  sr_i_record_metadata_t *p_record = sr_i_rb_record_header(p_data);
  // The chain link that points at the record: the chain head or the
  // previous free record's (packed fields cannot be bound to a reference).
  auto replace_in_chain = [&](sr_i_record_metadata_t *p_replacement) {
    if (p_previous_free_record == nullptr) {
      p_pool->p_free_chain = p_replacement;
    } else {
      p_previous_free_record->p_next = p_replacement;
    }
  };
  const sr_i_record_metadata_t *p_linked =
      p_previous_free_record == nullptr ? p_pool->p_free_chain : p_previous_free_record->p_next;
  if (data_length > data_area_length(p_record) || p_record->type != SR_I_RECORD_FREE ||
      p_linked != p_record) {
    return sr_i_raise_internal();
  }
  p_record->type = record_type;
  const uint32_t remainder = data_area_length(p_record) - data_length;
  if (remainder < Sr_Smallest_Split_Remainder) {
    replace_in_chain(p_record->p_next);
    p_pool->used_bytes += data_area_length(p_record);
  } else {
    p_record->record_length = data_length + Sr_Record_Header_Length;
    auto *p_rest = reinterpret_cast<sr_i_record_metadata_t *>(end_of(p_record));
    p_rest->record_length = remainder;
    p_rest->p_next = p_record->p_next;
    p_rest->type = SR_I_RECORD_FREE;
    p_rest->disk_table_offset = 0;
    replace_in_chain(p_rest);
    p_pool->used_bytes += data_length + Sr_Record_Header_Length;
  }
  // A record taken from the free chain has not been written to the file yet.
  p_record->p_next = nullptr;
  p_record->disk_table_offset = 0;
  return 0;
}

int32_t sr_i_rb_free_record(sr_i_record_buffer_pool_t *p_pool, void *p_data) {
  sr_i_record_metadata_t *p_record = sr_i_rb_record_header(p_data);
  p_record->type = SR_I_RECORD_FREE;
  sr_i_record_metadata_t *p_previous = nullptr;
  p_pool->used_bytes -= sr_i_rb_insert_free_record(p_record, &p_pool->p_free_chain, &p_previous);
  return 0;
}

uint32_t sr_i_rb_insert_free_record(sr_i_record_metadata_t *p_record,
                                    sr_i_record_metadata_t **pp_free_chain,
                                    sr_i_record_metadata_t **pp_previous) {
  uint32_t bytes_out_of_use = data_area_length(p_record);
  sr_i_record_metadata_t *p_previous = nullptr;
  sr_i_record_metadata_t *p_next = *pp_free_chain;
  while (p_next != nullptr && address_of(p_next) < address_of(p_record)) {
    p_previous = p_next;
    p_next = p_next->p_next;
  }
  if (p_next != nullptr && end_of(p_record) == address_of(p_next)) {
    p_record->record_length += p_next->record_length;
    p_record->p_next = p_next->p_next;
    bytes_out_of_use += Sr_Record_Header_Length;
  } else {
    p_record->p_next = p_next;
  }
  if (p_previous != nullptr && end_of(p_previous) == address_of(p_record)) {
    p_previous->record_length += p_record->record_length;
    p_previous->p_next = p_record->p_next;
    bytes_out_of_use += Sr_Record_Header_Length;
  } else if (p_previous != nullptr) {
    p_previous->p_next = p_record;
  } else {
    *pp_free_chain = p_record;
  }
  *pp_previous = p_previous;
  return bytes_out_of_use;
}

int32_t sr_i_reserve_record(sr_i_record_buffer_pool_t *p_pool, uint32_t length, uint32_t type,
                            void **pp_record_data) {
  void *p_data = nullptr;
  sr_i_record_metadata_t *p_previous = nullptr;
  uint32_t actual_length = 0;
  if (const int32_t rc =
          sr_i_rb_find_suitable_record(p_pool, length, &p_data, &p_previous, &actual_length);
      rc != 0) {
    return rc;
  }
  if (const int32_t rc = sr_i_rb_allocate_record(p_pool, p_data, p_previous, length, type);
      rc != 0) {
    return rc;
  }
  *pp_record_data = p_data;
  return 0;
}

int32_t sr_i_rb_duplicate_record_buffer_pool(
    sr_i_record_buffer_pool_t *p_from, sr_i_record_buffer_pool_t *p_to,
    sr_i_record_buffer_pool_duplication_map_t **pp_duplication_map) {
  uint32_t total_blocks = 0;
  for (const sr_i_record_buffer_t *p_block = p_from->p_first_record_buffer; p_block != nullptr;
       p_block = p_block->p_next) {
    ++total_blocks;
  }
  // The copy keeps one block header in place of the source's n.
  const uint32_t headers_saved =
      total_blocks == 0 ? 0 : (total_blocks - 1) * Sr_Record_Buffer_Header_Length;
  p_to->total_bytes = p_from->total_bytes - headers_saved;
  p_to->used_bytes = p_from->used_bytes - headers_saved;

  auto *p_map = static_cast<sr_i_record_buffer_pool_duplication_map_t *>(
      calloc(1, sizeof(sr_i_record_buffer_pool_duplication_map_t)));
  if (p_map == nullptr) {
    return sr_i_raise_no_memory();
  }
  p_map->total = total_blocks;
  sr_i_record_buffer_t *p_copy = nullptr;
  if (total_blocks > 0) {
    p_map->p_begin = static_cast<unsigned char **>(malloc(total_blocks * sizeof(unsigned char *)));
    p_map->p_end = static_cast<unsigned char **>(malloc(total_blocks * sizeof(unsigned char *)));
    p_map->p_offset = static_cast<int64_t *>(malloc(total_blocks * sizeof(int64_t)));
    if (p_map->p_begin != nullptr && p_map->p_end != nullptr && p_map->p_offset != nullptr) {
      p_copy = static_cast<sr_i_record_buffer_t *>(malloc(p_to->total_bytes));
    }
    if (p_copy == nullptr) {
      sr_i_rb_free_duplication_map(p_map);
      return sr_i_raise_no_memory();
    }
  }

  if (p_copy != nullptr) {
    p_copy->p_next = nullptr;
    p_copy->total_bytes = p_to->total_bytes;
    unsigned char *p_target = p_copy->data;
    uint32_t at = 0;
    for (sr_i_record_buffer_t *p_block = p_from->p_first_record_buffer; p_block != nullptr;
         p_block = p_block->p_next, ++at) {
      const uint32_t data_length = p_block->total_bytes - Sr_Record_Buffer_Header_Length;
      memcpy(p_target, p_block->data, data_length);
      p_map->p_begin[at] = p_block->data;
      p_map->p_end[at] = p_block->data + data_length;
      p_map->p_offset[at] = static_cast<int64_t>(address_of(p_target) - address_of(p_block->data));
      p_target += data_length;
    }
  }
  p_to->p_first_record_buffer = p_copy;
  p_to->p_last_record_buffer = p_copy;

  // Free records that meet across a former block seam stay separate: the
  // accounting copied above counts both headers.
  auto map_record = [p_map](const sr_i_record_metadata_t *p_record) {
    return static_cast<sr_i_record_metadata_t *>(sr_i_rb_map_duplicated_address(p_map, p_record));
  };
  p_to->p_free_chain = map_record(p_from->p_free_chain);
  for (sr_i_record_metadata_t *p_record = p_to->p_free_chain; p_record != nullptr;
       p_record = p_record->p_next) {
    p_record->p_next = map_record(p_record->p_next);
  }
  *pp_duplication_map = p_map;
  return 0;
}

void *sr_i_rb_map_duplicated_address(const sr_i_record_buffer_pool_duplication_map_t *p_map,
                                     const void *p_address) {
  const uintptr_t address = address_of(p_address);
  for (uint32_t at = 0; at < p_map->total; ++at) {
    if (address >= address_of(p_map->p_begin[at]) && address < address_of(p_map->p_end[at])) {
      return reinterpret_cast<void *>(address + static_cast<uintptr_t>(p_map->p_offset[at]));
    }
  }
  return nullptr;
}

void sr_i_rb_free_duplication_map(sr_i_record_buffer_pool_duplication_map_t *p_map) {
  if (p_map == nullptr) {
    return;
  }
  free(p_map->p_begin);
  free(p_map->p_end);
  free(p_map->p_offset);
  free(p_map);
}
