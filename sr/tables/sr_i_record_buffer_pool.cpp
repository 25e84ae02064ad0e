// sr_i_record_buffer_pool.cpp - the record buffer pool: blocks taken from
// the heap, first-fit allocation of records out of one address-ordered free
// chain, merging of freed neighbours, the exact count of bytes in use, and
// the copy of a whole pool into one block with a map of where each block
// went.
//
// Blocks stay with the pool until it is uninitialised, even when wholly
// free. Two blocks never touch (each begins with its own header), so a merge
// of free records can only happen inside one block.
//
// Two aids keep first fit fast and leave its answer exact. The search hint
// (see the pool structure) lets a request start past the free records it
// knows to be too short. The directory lists the blocks in address order
// with each block's lowest and highest free record and a bound on its
// longest: when the hint has not brought a search to a fit within a few
// steps, the search goes on block by block, stepping over blocks whose bound
// is too short, and a record entering the chain finds the free record below
// it through its own block or the nearest block below that has one.

#include "tables/sr_i_record_buffer_pool.h"

#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "frame/sr_i_errors.h"

namespace {

// Requests below this size get a block a hundred times their size, so that
// tables of many small rows need few blocks.
constexpr uint32_t Large_Request_Length = 65536;
constexpr uint32_t Small_Request_Block_Factor = 100;
// A block header plus the header of the one record a new block starts with.
constexpr uint32_t New_Block_Overhead = Sr_Record_Buffer_Header_Length + Sr_Record_Header_Length;
// Free records a search walks from its start before it turns to the
// directory.
constexpr uint32_t Chain_Steps_Before_Directory = 8;
constexpr uint32_t First_Directory_Capacity = 8;

using directory_entry = sr_i_record_buffer_directory_entry_t;

uintptr_t address_of(const void *p_address) {
  return reinterpret_cast<uintptr_t>(p_address);
}

uintptr_t end_of(const sr_i_record_metadata_t *p_record) {
  return address_of(p_record) + p_record->record_length;
}

uint32_t data_area_length(const sr_i_record_metadata_t *p_record) {
  return p_record->record_length - Sr_Record_Header_Length;
}

bool in_block(const sr_i_record_buffer_t *p_block, const void *p_address) {
  const uintptr_t address = address_of(p_address);
  return address >= address_of(p_block) && address < address_of(p_block) + p_block->total_bytes;
}

// The directory entry of the block that holds `p_address`.
directory_entry &entry_of(const sr_i_record_buffer_pool_t *p_pool, const void *p_address) {
  directory_entry *p_first = p_pool->p_directory;
  if (p_pool->total_blocks == 1) {
    return *p_first;
  }
  directory_entry *p_after =
      std::upper_bound(p_first, p_first + p_pool->total_blocks, address_of(p_address),
                       [](uintptr_t address, const directory_entry &entry) {
                         return address < address_of(entry.p_block);
                       });
  return *(p_after - 1);
}

// The highest free record in the blocks below directory entry `p_entry`, or
// null when they have none.
sr_i_record_metadata_t *last_free_record_before(const sr_i_record_buffer_pool_t *p_pool,
                                                const directory_entry *p_entry) {
  while (p_entry != p_pool->p_directory) {
    --p_entry;
    if (p_entry->p_last_free != nullptr) {
      return p_entry->p_last_free;
    }
  }
  return nullptr;
}

// Links a free record into the address-ordered chain, as
// sr_i_rb_insert_free_record does, starting the walk at `p_below`: a free
// record known to lie below it, or null for the chain's head.
uint32_t insert_free_record_above(sr_i_record_metadata_t *p_record,
                                  sr_i_record_metadata_t **pp_free_chain,
                                  sr_i_record_metadata_t *p_below,
                                  sr_i_record_metadata_t **pp_previous) {
  uint32_t bytes_out_of_use = data_area_length(p_record);
  sr_i_record_metadata_t *p_previous = p_below;
  sr_i_record_metadata_t *p_next = p_below != nullptr ? p_below->p_next : *pp_free_chain;
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

// The highest free record below `p_record`, which lies in the block of
// `entry`: walked to from the hint's start or its neighbour, or from the
// block's lowest free record, when one of them lies below it in the same
// block; else the highest free record of the blocks below.
sr_i_record_metadata_t *free_record_below(const sr_i_record_buffer_pool_t *p_pool,
                                          const directory_entry &entry,
                                          const sr_i_record_metadata_t *p_record) {
  auto below_in_block = [&](sr_i_record_metadata_t *p_candidate) {
    return p_candidate != nullptr && in_block(entry.p_block, p_candidate) &&
           address_of(p_candidate) < address_of(p_record);
  };
  sr_i_record_metadata_t *p_below = nullptr;
  if (p_pool->search_bound != 0 && below_in_block(p_pool->p_search_start)) {
    p_below = p_pool->p_search_start;
  } else if (p_pool->search_bound != 0 && below_in_block(p_pool->p_search_start_previous)) {
    p_below = p_pool->p_search_start_previous;
  } else if (below_in_block(entry.p_first_free)) {
    p_below = entry.p_first_free;
  } else {
    return last_free_record_before(p_pool, &entry);
  }
  while (p_below->p_next != nullptr && address_of(p_below->p_next) < address_of(p_record)) {
    p_below = p_below->p_next;
  }
  return p_below;
}

// Keeps the search hint true after the free record `p_record` went into the
// chain, `p_previous` being the free record below it that now links to it or
// absorbed it. A record at or beyond the hint's start changes nothing the
// hint promises; one below it may raise the bound, become the start's
// neighbour, or swallow the start.
void note_free_record_inserted(sr_i_record_buffer_pool_t *p_pool, sr_i_record_metadata_t *p_record,
                               sr_i_record_metadata_t *p_previous) {
  sr_i_record_metadata_t *p_start = p_pool->p_search_start;
  if (p_pool->search_bound == 0 ||
      (p_start != nullptr && address_of(p_record) > address_of(p_start))) {
    return;
  }
  const bool absorbed = p_previous != nullptr && end_of(p_previous) > address_of(p_record);
  sr_i_record_metadata_t *p_merged = absorbed ? p_previous : p_record;
  if (p_start != nullptr && end_of(p_merged) > address_of(p_start)) {
    if (absorbed) {
      p_pool->search_bound = 0;  // the merged record's own predecessor is unknown
      return;
    }
    p_pool->p_search_start = p_merged;  // the bound still holds below it
    p_pool->p_search_start_previous = p_previous;
    return;
  }
  p_pool->search_bound = std::max(p_pool->search_bound, data_area_length(p_merged) + 1);
  if (p_merged->p_next == p_start) {
    p_pool->p_search_start_previous = p_merged;
  }
}

// Keeps a block's directory entry true after the free record `p_record`
// went into the chain, `p_previous` being as for note_free_record_inserted.
// The record, merged or not, may be the block's new lowest or highest free
// record, or have swallowed either.
void note_free_record_in_block(directory_entry &entry, sr_i_record_metadata_t *p_record,
                               sr_i_record_metadata_t *p_previous) {
  const bool absorbed = p_previous != nullptr && end_of(p_previous) > address_of(p_record);
  sr_i_record_metadata_t *p_merged = absorbed ? p_previous : p_record;
  if (entry.p_first_free == nullptr || address_of(entry.p_first_free) >= address_of(p_merged)) {
    entry.p_first_free = p_merged;
  }
  if (entry.p_last_free == nullptr || address_of(entry.p_last_free) < end_of(p_merged)) {
    entry.p_last_free = p_merged;
  }
  entry.largest_free_bound = std::max(entry.largest_free_bound, data_area_length(p_merged));
}

// Links a free record into the pool's chain, starting the walk next to it
// where the hint or the directory knows a free record below it, and keeps
// the hint and the directory true. Returns what sr_i_rb_insert_free_record
// returns.
uint32_t link_free_record(sr_i_record_buffer_pool_t *p_pool, sr_i_record_metadata_t *p_record,
                          sr_i_record_metadata_t **pp_previous) {
  directory_entry &entry = entry_of(p_pool, p_record);
  const uint32_t bytes_out_of_use = insert_free_record_above(
      p_record, &p_pool->p_free_chain, free_record_below(p_pool, entry, p_record), pp_previous);
  note_free_record_inserted(p_pool, p_record, *pp_previous);
  note_free_record_in_block(entry, p_record, *pp_previous);
  return bytes_out_of_use;
}

// First fit for `data_length` bytes among the free records from `p_from`
// on, every free record below `p_from` being shorter; `*pp_previous` comes
// in as the free record before `p_from` and goes out as the one before the
// record found. Blocks are taken in address order, and one whose bound is
// short of `data_length` is stepped over without being touched; a block
// looked at in full gets its exact longest free record as its bound. Null
// when nothing fits.
sr_i_record_metadata_t *search_by_directory(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                                            sr_i_record_metadata_t *p_from,
                                            sr_i_record_metadata_t **pp_previous) {
  directory_entry *p_start = &entry_of(p_pool, p_from);
  directory_entry *p_end = p_pool->p_directory + p_pool->total_blocks;
  sr_i_record_metadata_t *p_previous = *pp_previous;
  sr_i_record_metadata_t *p_record = p_from;
  for (directory_entry *p_entry = p_start; p_entry != p_end; ++p_entry) {
    if (p_entry != p_start) {
      if (p_entry->p_first_free == nullptr) {
        continue;
      }
      if (p_entry->largest_free_bound < data_length) {
        p_previous = p_entry->p_last_free;
        continue;
      }
      p_record = p_entry->p_first_free;
    }
    uint32_t longest = 0;
    for (; p_record != nullptr && in_block(p_entry->p_block, p_record);
         p_previous = p_record, p_record = p_record->p_next) {
      if (data_area_length(p_record) >= data_length) {
        *pp_previous = p_previous;
        return p_record;
      }
      longest = std::max(longest, data_area_length(p_record));
    }
    // In the first block only the records from p_from on were looked at;
    // those before it are shorter than data_length too.
    p_entry->largest_free_bound =
        p_entry == p_start ? std::min(p_entry->largest_free_bound, data_length - 1) : longest;
  }
  *pp_previous = p_previous;
  return nullptr;
}

void set_search_start(sr_i_record_buffer_pool_t *p_pool, sr_i_record_metadata_t *p_start,
                      sr_i_record_metadata_t *p_previous, uint32_t bound) {
  p_pool->p_search_start = p_start;
  p_pool->p_search_start_previous = p_previous;
  p_pool->search_bound = bound;
}

// Enters a new block in the directory at its place by address, with no
// free record yet. 12 (raised) when the directory cannot grow; the pool is
// then unchanged.
int32_t enter_in_directory(sr_i_record_buffer_pool_t *p_pool, sr_i_record_buffer_t *p_block) {
  if (p_pool->total_blocks == p_pool->directory_capacity) {
    const uint32_t capacity = std::max(First_Directory_Capacity, p_pool->directory_capacity * 2);
    auto *p_directory = static_cast<directory_entry *>(
        realloc(p_pool->p_directory, capacity * sizeof(directory_entry)));
    if (p_directory == nullptr) {
      return sr_i_raise_no_memory();
    }
    p_pool->p_directory = p_directory;
    p_pool->directory_capacity = capacity;
  }
  directory_entry *p_end = p_pool->p_directory + p_pool->total_blocks;
  directory_entry *p_entry = std::upper_bound(p_pool->p_directory, p_end, address_of(p_block),
                                              [](uintptr_t address, const directory_entry &entry) {
                                                return address < address_of(entry.p_block);
                                              });
  std::memmove(p_entry + 1, p_entry, (p_end - p_entry) * sizeof(directory_entry));
  *p_entry = directory_entry{p_block, nullptr, nullptr, 0};
  ++p_pool->total_blocks;
  return 0;
}

// A block of `block_size` bytes appended to the pool, its data area one
// free record linked into the chain. The block is not cleared: a record's
// bytes are cleared when a search hands it out, so a large block that a
// table grows into slowly is touched only as far as it is used. 12 (raised)
// when the block cannot be had or its size would not fit the pool's 32-bit
// count.
int32_t add_block(sr_i_record_buffer_pool_t *p_pool, uint64_t block_size,
                  sr_i_record_metadata_t **pp_record, sr_i_record_metadata_t **pp_previous) {
  if (block_size > UINT32_MAX - p_pool->total_bytes) {
    return sr_i_raise_no_memory();
  }
  auto *p_block = static_cast<sr_i_record_buffer_t *>(malloc(block_size));
  if (p_block == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (const int32_t rc = enter_in_directory(p_pool, p_block); rc != 0) {
    free(p_block);
    return rc;
  }
  p_block->p_next = nullptr;
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
  p_record->disk_table_offset = 0;
  // A fresh block touches no other free record, so nothing merges and the
  // count returned is only the new data area, which is not in use.
  link_free_record(p_pool, p_record, pp_previous);
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
  free(p_pool->p_directory);
  *p_pool = sr_i_record_buffer_pool_t{};
  return 0;
}

namespace {

// First fit for `data_length` bytes, adding a block when nothing fits:
// the record and the free record before it. Clears nothing.
int32_t find_first_fit(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                       sr_i_record_metadata_t **pp_record, sr_i_record_metadata_t **pp_previous) {
  sr_i_record_metadata_t *p_previous = nullptr;
  sr_i_record_metadata_t *p_record = p_pool->p_free_chain;
  if (p_pool->search_bound != 0 && data_length >= p_pool->search_bound) {
    p_previous = p_pool->p_search_start_previous;
    p_record = p_pool->p_search_start;
  }
  for (uint32_t steps = 0; p_record != nullptr && data_area_length(p_record) < data_length;
       ++steps) {
    if (steps == Chain_Steps_Before_Directory && p_pool->total_blocks > 1) {
      p_record = search_by_directory(p_pool, data_length, p_record, &p_previous);
      break;
    }
    p_previous = p_record;
    p_record = p_record->p_next;
  }
  if (p_record != nullptr) {
    // Every free record before this one is shorter than data_length. A hint
    // reaching further along the chain is kept.
    if (p_pool->search_bound == 0 || (p_pool->p_search_start != nullptr &&
                                      address_of(p_record) >= address_of(p_pool->p_search_start))) {
      set_search_start(p_pool, p_record, p_previous, data_length);
    }
  } else {
    const uint64_t block_size =
        data_length < Large_Request_Length
            ? uint64_t{data_length} * Small_Request_Block_Factor + New_Block_Overhead
            : uint64_t{data_length} + New_Block_Overhead;
    if (const int32_t rc = add_block(p_pool, block_size, &p_record, &p_previous); rc != 0) {
      return rc;
    }
    // No other free record holds data_length bytes.
    set_search_start(p_pool, p_record, p_previous, data_length);
  }
  *pp_record = p_record;
  *pp_previous = p_previous;
  return 0;
}

}  // namespace

int32_t sr_i_rb_find_suitable_record(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                                     void **pp_data,
                                     sr_i_record_metadata_t **pp_previous_free_record,
                                     uint32_t *p_actual_data_length) {
  sr_i_record_metadata_t *p_record = nullptr;
  if (const int32_t rc = find_first_fit(p_pool, data_length, &p_record, pp_previous_free_record);
      rc != 0) {
    return rc;
  }
  // This is the one place a record's bytes are cleared: blocks are not.
  // Beyond what a record of data_length bytes takes, the area is split off
  // as a free record again and needs no clearing; clearing it would cost a
  // whole block's worth for every row added to it.
  const uint32_t taken = data_length + Sr_Smallest_Split_Remainder - 1;
  memset(sr_i_rb_record_data(p_record), 0, std::min(data_area_length(p_record), taken));
  *pp_data = sr_i_rb_record_data(p_record);
  *p_actual_data_length = data_area_length(p_record);
  return 0;
}

int32_t sr_i_rb_make_room(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length, void **pp_room) {
  sr_i_record_metadata_t *p_record = nullptr;
  sr_i_record_metadata_t *p_previous = nullptr;
  if (const int32_t rc = find_first_fit(p_pool, data_length, &p_record, &p_previous); rc != 0) {
    return rc;
  }
  if (pp_room != nullptr) {
    *pp_room = sr_i_rb_record_data(p_record);
  }
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
  // What takes the record's place in the chain: the rest of it, or its
  // successor when it is taken whole.
  const bool taken_whole = remainder < Sr_Smallest_Split_Remainder;
  sr_i_record_metadata_t *p_successor;
  if (taken_whole) {
    p_successor = p_record->p_next;
    p_pool->used_bytes += data_area_length(p_record);
  } else {
    p_record->record_length = data_length + Sr_Record_Header_Length;
    p_successor = reinterpret_cast<sr_i_record_metadata_t *>(end_of(p_record));
    p_successor->record_length = remainder;
    p_successor->p_next = p_record->p_next;
    p_successor->type = SR_I_RECORD_FREE;
    p_successor->disk_table_offset = 0;
    p_pool->used_bytes += data_length + Sr_Record_Header_Length;
  }
  replace_in_chain(p_successor);
  // The block's lowest or highest free record may have been this one: a
  // split leaves its rest in its place; a record taken whole hands the role
  // to its neighbour in the chain, when that lies in the same block.
  directory_entry &entry = entry_of(p_pool, p_record);
  if (entry.p_first_free == p_record) {
    entry.p_first_free = in_block(entry.p_block, p_successor) ? p_successor : nullptr;
  }
  if (entry.p_last_free == p_record) {
    if (!taken_whole) {
      entry.p_last_free = p_successor;
    } else if (in_block(entry.p_block, p_previous_free_record)) {
      entry.p_last_free = p_previous_free_record;
    } else {
      entry.p_last_free = nullptr;
    }
  }
  // Records only shrink or leave here, so the hint's bound stays true; its
  // start and the start's neighbour may have to follow the change.
  if (p_record == p_pool->p_search_start) {
    p_pool->p_search_start = p_successor;
  } else if (p_record == p_pool->p_search_start_previous) {
    p_pool->p_search_start_previous = taken_whole ? p_previous_free_record : p_successor;
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
  p_pool->used_bytes -= link_free_record(p_pool, p_record, &p_previous);
  return 0;
}

uint32_t sr_i_rb_insert_free_record(sr_i_record_metadata_t *p_record,
                                    sr_i_record_metadata_t **pp_free_chain,
                                    sr_i_record_metadata_t **pp_previous) {
  return insert_free_record_above(p_record, pp_free_chain, nullptr, pp_previous);
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
  directory_entry *p_directory = nullptr;
  if (total_blocks > 0) {
    p_map->p_begin = static_cast<unsigned char **>(malloc(total_blocks * sizeof(unsigned char *)));
    p_map->p_end = static_cast<unsigned char **>(malloc(total_blocks * sizeof(unsigned char *)));
    p_map->p_offset = static_cast<int64_t *>(malloc(total_blocks * sizeof(int64_t)));
    p_directory = static_cast<directory_entry *>(malloc(sizeof(directory_entry)));
    if (p_map->p_begin != nullptr && p_map->p_end != nullptr && p_map->p_offset != nullptr &&
        p_directory != nullptr) {
      p_copy = static_cast<sr_i_record_buffer_t *>(malloc(p_to->total_bytes));
    }
    if (p_copy == nullptr) {
      free(p_directory);
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
  set_search_start(p_to, nullptr, nullptr, 0);
  p_to->p_directory = p_directory;
  p_to->total_blocks = total_blocks == 0 ? 0 : 1;
  p_to->directory_capacity = p_to->total_blocks;

  // The free chain of the copy is linked afresh in the copy's own address
  // order: the source's blocks lie end to end in allocation order, which
  // need not be their address order, so relinking the source chain through
  // the map could leave the copy's chain out of order. Free records that
  // meet across a former block seam stay separate: the accounting copied
  // above counts both headers.
  p_to->p_free_chain = nullptr;
  if (p_copy != nullptr) {
    sr_i_record_metadata_t *p_last_free = nullptr;
    const uintptr_t end = address_of(p_copy) + p_copy->total_bytes;
    for (auto *p_record = reinterpret_cast<sr_i_record_metadata_t *>(p_copy->data);
         address_of(p_record) < end;
         p_record = reinterpret_cast<sr_i_record_metadata_t *>(end_of(p_record))) {
      if (p_record->type != SR_I_RECORD_FREE) {
        continue;
      }
      p_record->p_next = nullptr;
      if (p_last_free == nullptr) {
        p_to->p_free_chain = p_record;
      } else {
        p_last_free->p_next = p_record;
      }
      p_last_free = p_record;
    }
    *p_directory = directory_entry{p_copy, p_to->p_free_chain, p_last_free, 0};
    for (const sr_i_record_metadata_t *p_free = p_to->p_free_chain; p_free != nullptr;
         p_free = p_free->p_next) {
      p_directory->largest_free_bound =
          std::max(p_directory->largest_free_bound, data_area_length(p_free));
    }
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
