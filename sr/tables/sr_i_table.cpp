// sr_i_table.cpp - the table object: making and freeing it (freeing drops
// whatever is pending or applied and not committed), the key hash table and
// application metadata container it gets with its columns, the fixed row index
// with its free chain and growth, the change lists and the blocks their
// entries come from, and block containment. Freeing a persistent table
// closes its file through the storage code (storage/sr_i_table_file.h).
//
// Index entries are handed out lowest position first: the free chain is
// kept in ascending address order, linked through p_pending_change, which a
// free entry does not otherwise use. Entries that were never handed out
// follow one another without links (see p_rows_never_used). The index
// growth and the change entry blocks allocate through Sr_Allocation, so
// that tests can make them fail.

#include "tables/sr_i_table.h"

#include <algorithm>
#include <cassert>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <new>
#include <utility>

#include "frame/sr_i_errors.h"
#include "schema/sr_i_application_metadata.h"
#include "storage/sr_i_prefault.h"
#include "storage/sr_i_table_file.h"
#include "tables/sr_i_allocation.h"
#include "tables/sr_i_hash_table.h"

namespace {

sr_i_index_entry_t *next_free(const sr_i_table_t *p_table, sr_i_index_entry_t *p_entry) {
  if (p_entry >= p_table->p_rows_never_used) {
    sr_i_index_entry_t *p_end = p_table->p_rows_fixed_index + p_table->maximum_rows;
    return p_entry + 1 < p_end ? p_entry + 1 : nullptr;
  }
  return static_cast<sr_i_index_entry_t *>(p_entry->p_pending_change);
}

void free_change_entry_blocks(sr_i_table_t *p_table) {
  while (sr_i_change_entry_block_t *p_block = p_table->p_change_entry_blocks) {
    p_table->p_change_entry_blocks = p_block->p_next;
    std::free(p_block);
  }
  p_table->unused_change_entries = 0;
  p_table->p_free_change_entries = nullptr;
}

}  // namespace

sr_i_table_t *sr_i_create_null_table() {
  auto *p_table = static_cast<sr_i_table_t *>(std::calloc(1, sizeof(sr_i_table_t)));
  if (p_table == nullptr) {
    sr_i_raise_no_memory();
    return nullptr;
  }
  p_table->references = 1;
  p_table->implicitly_controlled = 1;
  p_table->change_counter = 1;
  // Read each time a table object is made, so a program may switch it
  // between tables; set to anything, even "", it is on.
  p_table->uncommitted_updates_visible = std::getenv("SR_UNCOMMITTED_UPDATES_VISIBLE") ? 1 : 0;
  sr_i_rw_open(&p_table->lock);
  sr_i_rb_initialize_record_buffer_pool(0, &p_table->record_buffer_pool);
  return p_table;
}

void sr_i_close_table(sr_i_table_t *p_table) {
  if (p_table == nullptr) {
    return;
  }
  sr_i_rw_close(&p_table->lock);
  sr_i_rb_uninitialize_record_buffer_pool(&p_table->record_buffer_pool);
  sr_i_hash_table_close(p_table->p_rows_hash_table);
  std::free(p_table->p_rows_fixed_index);
  std::free(p_table->p_rows_packed_index);
  sr_i_free_change_lists(p_table);
  std::free(p_table->p_name);
  sr_i_close_table_file(p_table->p_file);
  std::free(p_table->p_persistent_table_registry_path);
  sr_i_free_application_metadata(p_table->p_application_metadata);
  // The rows of a table unpacked from a packed buffer, which its index and
  // hash elements pointed into.
  std::free(p_table->p_packed_rows_array);
  std::free(p_table);
}

int32_t sr_i_establish_rows_index(sr_i_table_t *p_table, uint32_t maximum_rows) {
  if (maximum_rows == 0) {
    maximum_rows = Sr_Default_Index_Rows;
  }
  auto *p_fixed = static_cast<sr_i_index_entry_t *>(
      sr_i_allocate_zeroed_block(maximum_rows, sizeof(sr_i_index_entry_t)));
  auto *p_packed =
      static_cast<uint32_t *>(sr_i_allocate_zeroed_block(maximum_rows, sizeof(uint32_t)));
  if (p_fixed == nullptr || p_packed == nullptr) {
    std::free(p_fixed);
    std::free(p_packed);
    return sr_i_raise_no_memory();
  }
  p_table->p_rows_fixed_index = p_fixed;
  p_table->p_rows_packed_index = p_packed;
  p_table->p_rows_free_chain = p_fixed;
  p_table->p_rows_never_used = p_fixed;
  p_table->maximum_rows = maximum_rows;
  return 0;
}

// Both arrays are had before either is given up, so that a failure leaves
// the table as it was. The packed index, a twelfth the size of the fixed
// one, is copied into a new array; the fixed index is reallocated, which
// keeps it in place when the heap can and moves it otherwise.
int32_t sr_i_grow_index(sr_i_table_t *p_table, uint32_t total_new_rows) {
  assert(p_table->p_rows_free_chain == nullptr);
  const uint32_t old_rows = p_table->maximum_rows;
  const uint64_t new_rows = uint64_t{old_rows} + total_new_rows;
  if (new_rows > UINT32_MAX) {
    return sr_i_raise_no_memory();
  }
  auto *p_packed = static_cast<uint32_t *>(Sr_Allocation.allocate(new_rows * sizeof(uint32_t)));
  if (p_packed == nullptr) {
    return sr_i_raise_no_memory();
  }
  // Where the change entries point, as positions, for after a move.
  const auto old_base = reinterpret_cast<uintptr_t>(p_table->p_rows_fixed_index);
  auto *p_fixed = static_cast<sr_i_index_entry_t *>(
      Sr_Allocation.reallocate(p_table->p_rows_fixed_index, new_rows * sizeof(sr_i_index_entry_t)));
  if (p_fixed == nullptr) {
    std::free(p_packed);
    return sr_i_raise_no_memory();
  }
  std::memcpy(p_packed, p_table->p_rows_packed_index, old_rows * sizeof(uint32_t));
  std::memset(p_packed + old_rows, 0, total_new_rows * sizeof(uint32_t));
  std::free(p_table->p_rows_packed_index);
  p_table->p_rows_packed_index = p_packed;
  std::memset(static_cast<void *>(p_fixed + old_rows), 0,
              total_new_rows * sizeof(sr_i_index_entry_t));
  p_table->p_rows_free_chain = p_fixed + old_rows;
  p_table->p_rows_never_used = p_fixed + old_rows;
  p_table->maximum_rows = static_cast<uint32_t>(new_rows);
  if (reinterpret_cast<uintptr_t>(p_fixed) != old_base) {
    for (sr_i_change_entry_t *p_list :
         {p_table->p_rows_change_list, p_table->p_delete_rows_change_list}) {
      for (sr_i_change_entry_t *p_change = p_list; p_change != nullptr;
           p_change = p_change->p_next) {
        const uintptr_t position =
            (reinterpret_cast<uintptr_t>(p_change->p_index_entry) - old_base) /
            sizeof(sr_i_index_entry_t);
        p_change->p_index_entry = p_fixed + position;
      }
    }
  }
  p_table->p_rows_fixed_index = p_fixed;
  return 0;
}

int32_t sr_i_open_key_hash_and_metadata(sr_i_table_t *p_table) {
  if (p_table->p_rows_hash_table == nullptr && p_table->p_columns[0].type == QV_RSRC_HANDLE_PTR) {
    if (const int32_t rc = sr_i_hash_table_open(0, nullptr, nullptr, &p_table->p_rows_hash_table);
        rc != 0) {
      return rc;
    }
  }
  return sr_i_allocate_application_metadata_buffer(1, &p_table->p_application_metadata);
}

void sr_i_rows_free_chain_insert(sr_i_table_t *p_table, sr_i_index_entry_t *p_entry) {
  *p_entry = sr_i_index_entry_t{};
  sr_i_index_entry_t *p_previous = nullptr;
  sr_i_index_entry_t *p_next = p_table->p_rows_free_chain;
  while (p_next != nullptr && p_next < p_entry) {
    p_previous = p_next;
    p_next = next_free(p_table, p_next);
  }
  p_entry->p_pending_change = p_next;
  if (p_previous == nullptr) {
    p_table->p_rows_free_chain = p_entry;
  } else {
    p_previous->p_pending_change = p_entry;
  }
}

sr_i_index_entry_t *sr_i_rows_free_chain_remove(sr_i_table_t *p_table) {
  sr_i_index_entry_t *p_entry = p_table->p_rows_free_chain;
  if (p_entry != nullptr) {
    p_table->p_rows_free_chain = next_free(p_table, p_entry);
    p_table->p_rows_never_used = std::max(p_table->p_rows_never_used, p_entry + 1);
    p_entry->p_pending_change = nullptr;
  }
  return p_entry;
}

// Every change entry is on one of the two lists or free, so once both lists
// are let go no entry is in use and the blocks go back to the heap: a table
// does not keep the memory of its largest transaction.
void sr_i_free_change_lists(sr_i_table_t *p_table) {
  free_change_entry_blocks(p_table);
  p_table->p_rows_change_list = nullptr;
  p_table->p_rows_change_list_tail = nullptr;
  p_table->p_delete_rows_change_list = nullptr;
  p_table->p_delete_rows_change_list_tail = nullptr;
}

sr_i_change_entry_t *sr_i_new_change_entry(sr_i_table_t *p_table) {
  sr_i_change_entry_t *p_change = p_table->p_free_change_entries;
  if (p_change != nullptr) {
    p_table->p_free_change_entries = p_change->p_next;
  } else {
    if (p_table->unused_change_entries == 0) {
      auto *p_block = static_cast<sr_i_change_entry_block_t *>(
          Sr_Allocation.allocate(sizeof(sr_i_change_entry_block_t)));
      if (p_block == nullptr) {
        sr_i_raise_no_memory();
        return nullptr;
      }
      p_block->p_next = p_table->p_change_entry_blocks;
      p_table->p_change_entry_blocks = p_block;
      p_table->unused_change_entries = Sr_Change_Entries_Per_Block;
    }
    p_change = &p_table->p_change_entry_blocks
                    ->entries[Sr_Change_Entries_Per_Block - p_table->unused_change_entries--];
  }
  *p_change = sr_i_change_entry_t{};
  return p_change;
}

void sr_i_free_change_entry(sr_i_table_t *p_table, sr_i_change_entry_t *p_change) {
  p_change->p_next = p_table->p_free_change_entries;
  p_table->p_free_change_entries = p_change;
}

bool sr_i_record_contained_in_block(const sr_i_table_t *p_table, uint32_t offset, uint32_t length,
                                    uint32_t &block) {
  const uint64_t block_size = p_table->block_size;
  if (block_size == 0) {  // a transient table has no blocks
    block = 0;
    return true;
  }
  block = static_cast<uint32_t>(offset / block_size);
  return offset / block_size == (uint64_t{offset} + length) / block_size;
}

void sr_i_swap_table_contents(sr_i_table_t *p_open, sr_i_table_t *p_other) {
  // Everything moves but what makes the open object what it is to its
  // holders: its lock, its reference count and its place in the tree. The
  // lock is never copied (copying a table leaves it where it is), since
  // readers count themselves in it without its mutex while this runs.
  sr_i_table_t kept = *p_open;
  *p_open = *p_other;
  *p_other = kept;
  std::swap(p_open->references, p_other->references);
  std::swap(p_open->p_tree, p_other->p_tree);
  std::swap(p_open->p_next, p_other->p_next);
}
