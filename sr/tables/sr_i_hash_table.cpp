// sr_i_hash_table.cpp - the key hash table: bucket arrays, chained elements,
// the built-in hash for resource-handle keys and the diagnostic statistics.
//
// Buckets never grow: a client that chooses a bucket count chooses it for
// good. New elements go to the head of their chain, so among equal keys the
// newest is found first. Every bucket number a hash function produces is
// checked against the bucket count before it is used, since a client's
// function is outside our control. Elements come from the homes of large
// tables and from the table's own element blocks (see sr_hash_table_t);
// allocation uses calloc, nothrow new and catches the block list's growth,
// so a failure is a code and never an exception.

#include "tables/sr_i_hash_table.h"

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "frame/sr_i_errors.h"
#include "qv_cu.h"
#include "storage/sr_i_prefault.h"
#include "tables/sr_i_table.h"

namespace {

constexpr uint32_t Resource_Handle_Bucket_Mask = Sr_Resource_Handle_Hash_Buckets - 1;

// Element blocks start small, so that a table of a few keys stays small, and
// double up to a size that keeps each block well inside the heap.
constexpr uint32_t First_Element_Block = 32;
constexpr uint32_t Largest_Element_Block = 4096;

// Keys inside row records are not aligned: the handles are read through
// copies.
qv_resource_handle_t resource_handle_at(const void *p_key) {
  qv_resource_handle_t handle;
  std::memcpy(&handle, p_key, sizeof handle);
  return handle;
}

int32_t compare_resource_handles(const void *p_stored_key, const void *p_key) {
  const qv_resource_handle_t stored = resource_handle_at(p_stored_key);
  const qv_resource_handle_t wanted = resource_handle_at(p_key);
  return cu_rsrc_hndl_cmp_1(&stored, &wanted);
}

}  // namespace

int32_t sr_i_hash_table_open(uint32_t total_hash_buckets, sr_hash_function_t p_hash_function,
                             sr_hash_keys_compare_function_t p_compare_function,
                             sr_hash_table_t **p_p_hash_table) {
  if (p_hash_function == nullptr) {
    total_hash_buckets = Sr_Resource_Handle_Hash_Buckets;
    p_compare_function = compare_resource_handles;
  } else if (p_compare_function == nullptr || total_hash_buckets == 0) {
    return sr_i_raise_internal();
  }
  auto **p_elements = static_cast<sr_hash_table_element_t **>(
      sr_i_allocate_zeroed_block(total_hash_buckets, sizeof(sr_hash_table_element_t *)));
  if (p_elements == nullptr) {
    return sr_i_raise_no_memory();
  }
  auto *p_hash_table = new (std::nothrow) sr_hash_table_t;
  if (p_hash_table == nullptr) {
    std::free(p_elements);
    return sr_i_raise_no_memory();
  }
  p_hash_table->total_hash_buckets = total_hash_buckets;
  p_hash_table->p_hash_function = p_hash_function;
  p_hash_table->p_compare_function = p_compare_function;
  p_hash_table->p_elements = p_elements;
  p_hash_table->last_block_capacity = 0;
  p_hash_table->unused_in_last_block = 0;
  p_hash_table->p_free_elements = nullptr;
  p_hash_table->p_home_elements = nullptr;
  if (total_hash_buckets >= Sr_Home_Element_Buckets) {
    p_hash_table->p_home_elements = static_cast<sr_hash_table_element_t *>(
        std::calloc(total_hash_buckets, sizeof(sr_hash_table_element_t)));
    if (p_hash_table->p_home_elements == nullptr) {
      delete p_hash_table;
      std::free(p_elements);
      return sr_i_raise_no_memory();
    }
  }
  *p_p_hash_table = p_hash_table;
  return 0;
}

int32_t sr_i_hash_table_open_like(const sr_hash_table_t *p_hash_table,
                                  sr_hash_table_t **p_p_hash_table) {
  *p_p_hash_table = nullptr;
  if (p_hash_table == nullptr) {
    return 0;
  }
  return sr_i_hash_table_open(p_hash_table->total_hash_buckets, p_hash_table->p_hash_function,
                              p_hash_table->p_compare_function, p_p_hash_table);
}

int32_t sr_i_hash_table_close(sr_hash_table_t *p_hash_table) {
  if (p_hash_table == nullptr) {
    return 0;
  }
  std::free(p_hash_table->p_elements);
  std::free(p_hash_table->p_home_elements);
  delete p_hash_table;  // with it the element blocks
  return 0;
}

bool sr_i_hash_table_try_bucket(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                                uint32_t *p_hash_index) {
  uint32_t bucket = 0;
  if (p_hash_table->p_hash_function == nullptr) {
    bucket = resource_handle_at(p_key_value).id.id4 & Resource_Handle_Bucket_Mask;
  } else {
    bucket = p_hash_table->p_hash_function(p_key_value);
  }
  *p_hash_index = bucket;
  return bucket < p_hash_table->total_hash_buckets;
}

int32_t sr_i_hash_table_bucket(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                               uint32_t *p_hash_index) {
  uint32_t bucket = 0;
  if (!sr_i_hash_table_try_bucket(p_hash_table, p_key_value, &bucket)) {
    return sr_i_raise_internal();
  }
  *p_hash_index = bucket;
  return 0;
}

namespace {

bool is_home(const sr_hash_table_t *p_hash_table, const sr_hash_table_element_t *p_element) {
  // As addresses: the element may lie in a block rather than in the homes.
  const auto homes = reinterpret_cast<uintptr_t>(p_hash_table->p_home_elements);
  const auto element = reinterpret_cast<uintptr_t>(p_element);
  return homes != 0 && element >= homes &&
         element < homes + p_hash_table->total_hash_buckets * sizeof(sr_hash_table_element_t);
}

// An unused element for a key of `bucket`: the bucket's home if it has a
// free one (a null key cannot mark a home as used, so it never takes one),
// else a removed element if any waits, else the next of the last block,
// else the first of a new block. Null when memory runs out.
sr_hash_table_element_t *new_element(sr_hash_table_t *p_hash_table, uint32_t bucket,
                                     const void *p_key_value) {
  if (p_hash_table->p_home_elements != nullptr && p_key_value != nullptr &&
      p_hash_table->p_home_elements[bucket].p_key_value == nullptr) {
    return &p_hash_table->p_home_elements[bucket];
  }
  if (sr_hash_table_element_t *p_element = p_hash_table->p_free_elements) {
    p_hash_table->p_free_elements = p_element->p_next;
    return p_element;
  }
  if (p_hash_table->unused_in_last_block == 0) {
    const uint32_t capacity =
        p_hash_table->element_blocks.empty()
            ? First_Element_Block
            : std::min(p_hash_table->last_block_capacity * 2, Largest_Element_Block);
    std::unique_ptr<sr_hash_table_element_t[]> block(new (std::nothrow)
                                                         sr_hash_table_element_t[capacity]);
    if (block == nullptr) {
      return nullptr;
    }
    try {
      p_hash_table->element_blocks.push_back(std::move(block));
    } catch (const std::bad_alloc &) {
      return nullptr;
    }
    p_hash_table->last_block_capacity = capacity;
    p_hash_table->unused_in_last_block = capacity;
  }
  const uint32_t next = p_hash_table->last_block_capacity - p_hash_table->unused_in_last_block--;
  return &p_hash_table->element_blocks.back()[next];
}

void free_element(sr_hash_table_t *p_hash_table, sr_hash_table_element_t *p_element) {
  if (is_home(p_hash_table, p_element)) {
    p_element->p_key_value = nullptr;
    p_element->p_next = nullptr;
    return;
  }
  p_element->p_next = p_hash_table->p_free_elements;
  p_hash_table->p_free_elements = p_element;
}

// The link that points at the newest element with a key equal to
// `p_key_value` in `bucket` (the bucket head or a predecessor's `p_next`),
// or null when there is none.
sr_hash_table_element_t **find_link_to_key(const sr_hash_table_t *p_hash_table, uint32_t bucket,
                                           const void *p_key_value) {
  for (sr_hash_table_element_t **p_link = &p_hash_table->p_elements[bucket]; *p_link != nullptr;
       p_link = &(*p_link)->p_next) {
    if (p_hash_table->p_compare_function((*p_link)->p_key_value, p_key_value) == 0) {
      return p_link;
    }
  }
  return nullptr;
}

}  // namespace

int32_t sr_i_hash_table_add(sr_hash_table_t *p_hash_table, const void *p_key_value,
                            uint32_t row_index, uint32_t *p_hash_index,
                            sr_hash_table_element_t **p_p_hash_table_element,
                            sr_qualifier_t qualifier) {
  uint32_t bucket = 0;
  if (const int32_t rc = sr_i_hash_table_bucket(p_hash_table, p_key_value, &bucket); rc != 0) {
    return rc;
  }
  return sr_i_hash_table_add_to_bucket(p_hash_table, bucket, p_key_value, row_index,
                                       p_p_hash_table_element, qualifier, p_hash_index);
}

int32_t sr_i_hash_table_add_to_bucket(sr_hash_table_t *p_hash_table, uint32_t bucket,
                                      const void *p_key_value, uint32_t row_index,
                                      sr_hash_table_element_t **p_p_hash_table_element,
                                      sr_qualifier_t qualifier, uint32_t *p_hash_index) {
  if ((qualifier & 15) == SR_PRIMARY_KEY) {
    if (sr_hash_table_element_t **p_link = find_link_to_key(p_hash_table, bucket, p_key_value)) {
      *p_hash_index = bucket;
      *p_p_hash_table_element = *p_link;
      return SR_E_DUPLICATE_KEY;
    }
  }
  sr_hash_table_element_t *p_element = new_element(p_hash_table, bucket, p_key_value);
  if (p_element == nullptr) {
    return sr_i_raise_no_memory();
  }
  p_element->row_index = row_index;
  p_element->p_key_value = p_key_value;
  // A lookup finds the home without a miss of its own only while the home
  // is the head, so a new element goes behind a home at the head when no
  // equal key can be in the chain (the check above looked): the order of
  // unequal keys is never seen. Equal keys are kept newest first.
  sr_hash_table_element_t *p_head = p_hash_table->p_elements[bucket];
  if (p_head != nullptr && (qualifier & 15) == SR_PRIMARY_KEY && is_home(p_hash_table, p_head)) {
    p_element->p_next = p_head->p_next;
    p_head->p_next = p_element;
  } else {
    p_element->p_next = p_head;
    p_hash_table->p_elements[bucket] = p_element;
  }
  *p_hash_index = bucket;
  *p_p_hash_table_element = p_element;
  return 0;
}

int32_t sr_i_hash_table_get_index(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                                  uint32_t *p_row_index, const void ***p_p_p_key_value) {
  uint32_t bucket = 0;
  if (const int32_t rc = sr_i_hash_table_bucket(p_hash_table, p_key_value, &bucket); rc != 0) {
    return rc;
  }
  sr_hash_table_element_t **p_link = find_link_to_key(p_hash_table, bucket, p_key_value);
  if (p_link == nullptr) {
    return SR_E_NO_ROW_FOR_KEY;
  }
  *p_row_index = (*p_link)->row_index;
  if (p_p_p_key_value != nullptr) {
    *p_p_p_key_value = &(*p_link)->p_key_value;
  }
  return 0;
}

int32_t sr_i_hash_table_remove_element(sr_hash_table_t *p_hash_table, uint32_t hash_index,
                                       sr_hash_table_element_t *p_hash_table_element) {
  if (hash_index >= p_hash_table->total_hash_buckets) {
    return sr_i_raise_internal();
  }
  for (sr_hash_table_element_t **p_link = &p_hash_table->p_elements[hash_index]; *p_link != nullptr;
       p_link = &(*p_link)->p_next) {
    if (*p_link == p_hash_table_element) {
      *p_link = p_hash_table_element->p_next;
      free_element(p_hash_table, p_hash_table_element);
      return 0;
    }
  }
  return sr_i_raise(SR_E_NO_ROW_FOR_KEY);
}

int32_t sr_i_hash_table_remove(sr_hash_table_t *p_hash_table, const void *p_key_value) {
  uint32_t bucket = 0;
  if (const int32_t rc = sr_i_hash_table_bucket(p_hash_table, p_key_value, &bucket); rc != 0) {
    return rc;
  }
  sr_hash_table_element_t **p_link = find_link_to_key(p_hash_table, bucket, p_key_value);
  if (p_link == nullptr) {
    return sr_i_raise(SR_E_NO_ROW_FOR_KEY);
  }
  sr_hash_table_element_t *p_element = *p_link;
  *p_link = p_element->p_next;
  free_element(p_hash_table, p_element);
  return 0;
}

void sr_i_hash_table_output_stats(const sr_hash_table_t *p_hash_table) {
  uint32_t longest_chain = 0;
  uint32_t empty_buckets = 0;
  for (uint32_t bucket = 0; bucket < p_hash_table->total_hash_buckets; ++bucket) {
    uint32_t chain_length = 0;
    for (const sr_hash_table_element_t *p_element = p_hash_table->p_elements[bucket];
         p_element != nullptr; p_element = p_element->p_next) {
      ++chain_length;
    }
    if (chain_length == 0) {
      ++empty_buckets;
      continue;
    }
    std::printf("%u %u\n", bucket, chain_length);
    if (chain_length > longest_chain) {
      longest_chain = chain_length;
    }
  }
  std::printf("total hash buckets : %u\n", p_hash_table->total_hash_buckets);
  std::printf("max_bucket_count   : %u\n", longest_chain);
  std::printf("unused buckets     : %u\n", empty_buckets);
}

int32_t sr_i_hash_table_open_for_client(uint32_t total_hash_buckets,
                                        sr_hash_function_t p_hash_function,
                                        sr_hash_keys_compare_function_t p_compare_function,
                                        sr_hash_table_t **p_p_hash_table) {
  if (total_hash_buckets == 0 || p_hash_function == nullptr || p_compare_function == nullptr) {
    return sr_i_raise(SR_E_NULL_POINTER);
  }
  return sr_i_hash_table_open(total_hash_buckets, p_hash_function, p_compare_function,
                              p_p_hash_table);
}

// ---- Entering many rows at once ----------------------------------------------
//
// The rows go in in order, each element the next of one block, so that the
// elements and the entries are written front to back. What is left to wait
// for is what lies far apart: the bucket head of each key and, when the
// bucket has a chain, the elements and keys it is compared with. Those are
// asked for a few rows ahead, in stages, each stage reading only what the
// stage before brought in: the key hashed and its head asked for, then the
// head's element, then that element's key.

namespace {

constexpr uint32_t Rows_Hashed_Ahead = 48;
constexpr uint32_t Heads_Followed_Ahead = 32;
constexpr uint32_t Keys_Followed_Ahead = 16;

// The table as it was made, for a bulk add that failed after entering
// `total_entered` rows.
void forget_every_element(sr_hash_table_t *p_hash_table, const sr_i_index_entry_t *p_entries,
                          uint32_t total_entered) {
  for (uint32_t row = 0; row < total_entered; ++row) {
    p_hash_table->p_elements[p_entries[row].hash_index] = nullptr;
  }
  p_hash_table->element_blocks.clear();
  p_hash_table->last_block_capacity = 0;
  p_hash_table->unused_in_last_block = 0;
}

}  // namespace

int32_t sr_i_hash_table_add_entries(sr_hash_table_t *p_hash_table, sr_i_index_entry_t *p_entries,
                                    uint32_t total_entries, sr_i_entry_key_function_t key_of,
                                    const void *p_context, sr_qualifier_t qualifier) {
  if (!p_hash_table->element_blocks.empty()) {
    return sr_i_raise_internal();
  }
  if (total_entries == 0) {
    return 0;
  }
  std::unique_ptr<sr_hash_table_element_t[]> block(new (std::nothrow)
                                                       sr_hash_table_element_t[total_entries]);
  if (block == nullptr) {
    return sr_i_raise_no_memory();
  }
  sr_hash_table_element_t *p_block = block.get();
  sr_i_map_block_to_fill(p_block, sizeof(sr_hash_table_element_t) * total_entries);
  try {
    p_hash_table->element_blocks.push_back(std::move(block));
  } catch (const std::bad_alloc &) {
    return sr_i_raise_no_memory();
  }
  p_hash_table->last_block_capacity = total_entries;
  p_hash_table->unused_in_last_block = 0;

  sr_hash_table_element_t **p_heads = p_hash_table->p_elements;
  const bool unique = (qualifier & 15) == SR_PRIMARY_KEY;
  // A row's key is had once, when it is hashed, and kept in its element.
  const auto hash_row = [&](uint32_t row) {
    uint32_t &bucket = p_entries[row].hash_index;
    const void *p_key_value = key_of(p_context, &p_entries[row]);
    p_block[row].p_key_value = p_key_value;
    if (!sr_i_hash_table_try_bucket(p_hash_table, p_key_value, &bucket)) {
      return false;
    }
    __builtin_prefetch(&p_heads[bucket]);
    return true;
  };
  // The head of a row's bucket as it stands now: rows entered before that
  // row is reached may still change it, which only makes the hint stale.
  const auto head_ahead = [&](uint32_t row) {
    return row < total_entries ? p_heads[p_entries[row].hash_index] : nullptr;
  };
  for (uint32_t row = 0; row < total_entries && row < Rows_Hashed_Ahead; ++row) {
    if (!hash_row(row)) {
      forget_every_element(p_hash_table, p_entries, 0);
      return sr_i_raise_internal();
    }
  }
  for (uint32_t row = 0; row < total_entries; ++row) {
    if (row + Rows_Hashed_Ahead < total_entries && !hash_row(row + Rows_Hashed_Ahead)) {
      forget_every_element(p_hash_table, p_entries, row);
      return sr_i_raise_internal();
    }
    sr_i_index_entry_t &entry = p_entries[row];
    sr_hash_table_element_t &element = p_block[row];
    const void *p_key_value = element.p_key_value;
    sr_hash_table_element_t *&p_head = p_heads[entry.hash_index];
    if (unique) {
      if (const sr_hash_table_element_t *p_element = head_ahead(row + Heads_Followed_Ahead)) {
        __builtin_prefetch(p_element);
      }
      if (const sr_hash_table_element_t *p_element = head_ahead(row + Keys_Followed_Ahead)) {
        __builtin_prefetch(p_element->p_key_value);
      }
      for (const sr_hash_table_element_t *p_older = p_head; p_older != nullptr;
           p_older = p_older->p_next) {
        if (p_hash_table->p_compare_function(p_older->p_key_value, p_key_value) == 0) {
          forget_every_element(p_hash_table, p_entries, row);
          return sr_i_raise(SR_E_DUPLICATE_KEY);
        }
      }
    }
    element.row_index = row;
    element.p_next = p_head;
    p_head = &element;
    entry.p_hash_table_element = &element;
  }
  return 0;
}
