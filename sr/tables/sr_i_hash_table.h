/*
 * sr_i_hash_table.h - the key hash table of a keyed table: a fixed number of
 * buckets, each a singly linked chain of elements that map a key value to
 * the row's position in the table's fixed row index.
 *
 * Elements do not copy keys: `p_key_value` points at the key inside a row
 * record, and whoever replaces or frees that record repoints the element
 * (sr_i_hash_table_get_index hands out the field's address for this).
 * The hash table has no lock of its own: lookups run under the owning
 * table's read lock, changes under its write lock.
 */
#ifndef SR_I_HASH_TABLE_H
#define SR_I_HASH_TABLE_H

#include <cstdint>
#include <memory>
#include <vector>

#include "qv_sr.h"

/* The bucket count of the built-in hash for resource-handle keys. */
inline constexpr uint32_t Sr_Resource_Handle_Hash_Buckets = 16384;

typedef struct sr_hash_table_element_struct_t {
  uint32_t row_index;                            /* position of the row in the fixed row index */
  const void *p_key_value;                       /* the key inside the row's record, not a copy */
  struct sr_hash_table_element_struct_t *p_next; /* same bucket; null at the end */
} sr_hash_table_element_t;

typedef struct sr_hash_table_struct_t {
  uint32_t total_hash_buckets;                        /* fixed for the table's life */
  sr_hash_function_t p_hash_function;                 /* null: the built-in hash */
  sr_hash_keys_compare_function_t p_compare_function; /* 0 means equal */
  sr_hash_table_element_t **p_elements;               /* bucket heads */

  /* Elements are carved from blocks the table owns, each block twice the
   * size of the one before up to a limit, and removed elements wait on a
   * free list for the next add: one allocation serves many rows, an element
   * costs no allocator header, and closing frees a few blocks instead of
   * walking every chain. */
  std::vector<std::unique_ptr<sr_hash_table_element_t[]>> element_blocks;
  uint32_t last_block_capacity;
  uint32_t unused_in_last_block;
  sr_hash_table_element_t *p_free_elements; /* linked through p_next */

  /* Tables of Sr_Home_Element_Buckets buckets or more are made for rows
   * beyond the cache, where each step of a lookup is a miss. They get one
   * element place per bucket, its home: an element added to a bucket whose
   * home is free takes it (a free home has a null `p_key_value`). A lookup
   * then reads the home of its bucket at the same time as the bucket head,
   * and when the head is the home, the element costs no miss of its own.
   * Elements never move, so a row's index entry keeps its element. Null
   * for fewer buckets; the memory comes from calloc and its pages are
   * touched only as homes are used. */
  sr_hash_table_element_t *p_home_elements;
} sr_hash_table_t;

/* The bucket count from which a hash table has home elements. */
inline constexpr uint32_t Sr_Home_Element_Buckets = 65536;

/*
 * Makes an empty hash table. With a null `p_hash_function` keys are resource
 * handles (qv_resource_handle_t): the table gets 16384 buckets, the bucket is
 * the low 14 bits of `id.id4` and keys compare with cu_rsrc_hndl_cmp_1,
 * whatever count and compare function were passed. A client hash function
 * needs a compare function and at least one bucket (the exported calls
 * check both with 101 first); without them this returns 15.
 * Returns 0 and the table in `*p_p_hash_table`, 12 or 15 (raised).
 */
int32_t sr_i_hash_table_open(uint32_t total_hash_buckets, sr_hash_function_t p_hash_function,
                             sr_hash_keys_compare_function_t p_compare_function,
                             sr_hash_table_t **p_p_hash_table);

/* An empty hash table with the bucket count and functions of
 * `p_hash_table`, or null in `*p_p_hash_table` for a null one: what a new
 * image of a table keyed the same way starts from. 0, 12 or 15 (raised). */
int32_t sr_i_hash_table_open_like(const sr_hash_table_t *p_hash_table,
                                  sr_hash_table_t **p_p_hash_table);

/* Frees every element, the buckets and the table; a null table is accepted.
 * Returns 0. Row records the elements point into are not touched. */
int32_t sr_i_hash_table_close(sr_hash_table_t *p_hash_table);

/* The hash table a client asks for with its three settings: 101 (raised)
 * unless all are given, then sr_i_hash_table_open. */
int32_t sr_i_hash_table_open_for_client(uint32_t total_hash_buckets,
                                        sr_hash_function_t p_hash_function,
                                        sr_hash_keys_compare_function_t p_compare_function,
                                        sr_hash_table_t **p_p_hash_table);

/*
 * The bucket of a key through `*p_hash_index`. A client hash function must
 * return a bucket below `total_hash_buckets`; any other result is refused
 * with 15 (raised) rather than used, here and in every operation below that
 * hashes a key.
 */
int32_t sr_i_hash_table_bucket(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                               uint32_t *p_hash_index);

/* The same without raising: false when the hash function's bucket is not
 * one of the table's. For a caller that only wants a hint. */
bool sr_i_hash_table_try_bucket(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                                uint32_t *p_hash_index);

/*
 * Adds an element for the key at `p_key_value` (kept, not copied) and row
 * `row_index` at the head of its bucket, and returns the bucket and the
 * element through `*p_hash_index` and `*p_p_hash_table_element`: the row's
 * index entry keeps both so the element can be unlinked without hashing.
 *
 * When `qualifier & 15` is SR_PRIMARY_KEY and an element with an equal key
 * exists, nothing is added: `*p_hash_index` and `*p_p_hash_table_element`
 * name that existing element and the result is 108, not raised (adding a row
 * may revive a deleted row through it). Under any other qualifier, notably
 * SR_PRIMARY_KEY_NOCHECK, equal keys are all kept, the newest first.
 * Returns 0, 108, 12 (raised) or 15 (raised, bad bucket); on 12 and 15 the
 * table is unchanged.
 */
int32_t sr_i_hash_table_add(sr_hash_table_t *p_hash_table, const void *p_key_value,
                            uint32_t row_index, uint32_t *p_hash_index,
                            sr_hash_table_element_t **p_p_hash_table_element,
                            sr_qualifier_t qualifier);

/* sr_i_hash_table_add for a caller that has already hashed the key: `bucket`
 * must be what sr_i_hash_table_bucket gives for it. */
int32_t sr_i_hash_table_add_to_bucket(sr_hash_table_t *p_hash_table, uint32_t bucket,
                                      const void *p_key_value, uint32_t row_index,
                                      sr_hash_table_element_t **p_p_hash_table_element,
                                      sr_qualifier_t qualifier, uint32_t *p_hash_index);

/*
 * Finds the most recently added element whose key equals the key at
 * `p_key_value`: its row through `*p_row_index` and, when
 * `p_p_p_key_value` is not null, the address of its `p_key_value` field,
 * through which the caller repoints it at a new record.
 * Returns 0, 202 (not raised: the caller reports a missing key in its own
 * words) or 15 (raised, bad bucket).
 */
int32_t sr_i_hash_table_get_index(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                                  uint32_t *p_row_index, const void ***p_p_p_key_value);

/*
 * sr_i_hash_table_get_index for a reader about to read the row it finds:
 * `reached(element)` is called with each element the walk reaches before
 * its key is compared, and with the home of the key's bucket before the
 * bucket head is read (a home may be free, or not in the chain: its fields
 * are then only hints), so the caller can ask for the row's memory while
 * the walk waits. Nothing is handed out through which an element could be
 * changed. Returns 0, 202 (not raised) or 15 (raised).
 */
template <typename Reached>
int32_t sr_i_hash_table_find_row(const sr_hash_table_t *p_hash_table, const void *p_key_value,
                                 uint32_t *p_row_index, Reached reached) {
  uint32_t bucket = 0;
  if (const int32_t rc = sr_i_hash_table_bucket(p_hash_table, p_key_value, &bucket); rc != 0) {
    return rc;
  }
  // The home is read at the same time as the bucket head, and its key asked
  // for, so that when the head is the home its key's miss overlaps the
  // head's instead of following it.
  const sr_hash_table_element_t *p_home = nullptr;
  if (p_hash_table->p_home_elements != nullptr) {
    p_home = &p_hash_table->p_home_elements[bucket];
    __builtin_prefetch(p_home->p_key_value);
    reached(*p_home);
  }
  for (const sr_hash_table_element_t *p_element = p_hash_table->p_elements[bucket];
       p_element != nullptr; p_element = p_element->p_next) {
    if (p_element != p_home) {
      reached(*p_element);
    }
    // The next element, if the key is not this one, loads while the
    // comparison waits.
    if (p_element->p_next != nullptr) {
      __builtin_prefetch(p_element->p_next);
    }
    if (p_hash_table->p_compare_function(p_element->p_key_value, p_key_value) == 0) {
      *p_row_index = p_element->row_index;
      return 0;
    }
  }
  return SR_E_NO_ROW_FOR_KEY;
}

/*
 * Unlinks and frees exactly `p_hash_table_element` (by identity, not by key)
 * from bucket `hash_index`. Returns 0, 202 (raised) when the element is not
 * in that bucket, or 15 (raised) when `hash_index` is not a bucket.
 */
int32_t sr_i_hash_table_remove_element(sr_hash_table_t *p_hash_table, uint32_t hash_index,
                                       sr_hash_table_element_t *p_hash_table_element);

/* Unlinks and frees the most recently added element whose key equals the
 * key at `p_key_value`. Returns 0, 202 (raised) or 15 (raised, bad bucket). */
int32_t sr_i_hash_table_remove(sr_hash_table_t *p_hash_table, const void *p_key_value);

/* Prints to standard output, for diagnosis: "<bucket> <chain length>" for
 * each non-empty bucket in bucket order, then the bucket count, the longest
 * chain and the number of empty buckets. */
void sr_i_hash_table_output_stats(const sr_hash_table_t *p_hash_table);

/* ---- Entering many rows at once ----------------------------------------- */

struct sr_i_index_entry_struct_t;

/* The key of the row an index entry holds, as sr_i_hash_table_add_entries
 * reads it: a pointer the elements keep, like `p_key_value` above. */
typedef const void *(*sr_i_entry_key_function_t)(const void *p_context,
                                                 const struct sr_i_index_entry_struct_t *p_entry);

/*
 * Enters the rows of `total_entries` consecutive index entries, entry i
 * holding the row at fixed index i, into a hash table that holds no
 * element yet, as many sr_i_hash_table_add calls in entry order would:
 * each entry's `hash_index` and `p_hash_table_element` are set, equal keys
 * under a qualifier other than SR_PRIMARY_KEY are all kept, the newest
 * first. All elements come from one block, in entry order; the bucket
 * heads, chains and keys a row will meet are asked for a few rows ahead.
 * Returns 0, 108 (raised) when two keys are equal under SR_PRIMARY_KEY, 12
 * (raised), 15 (raised) for a bad bucket or a table that holds elements.
 * On failure the table holds no element and the entries' hash fields mean
 * nothing.
 */
int32_t sr_i_hash_table_add_entries(sr_hash_table_t *p_hash_table,
                                    struct sr_i_index_entry_struct_t *p_entries,
                                    uint32_t total_entries, sr_i_entry_key_function_t key_of,
                                    const void *p_context, sr_qualifier_t qualifier);

#endif /* SR_I_HASH_TABLE_H */
