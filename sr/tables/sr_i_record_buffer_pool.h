/*
 * sr_i_record_buffer_pool.h - the record buffer pool of a table: large
 * blocks from the heap carved into variable-length records, each behind a
 * 20-byte header. Free records form one chain in ascending address order,
 * where neighbours merge; the pool counts exactly how many bytes are in use.
 *
 * Records are neither rounded nor aligned, so a record header, and the data
 * behind it, may lie at any address: the headers are packed structures (the
 * compiler reads their fields byte-safely), and callers read and write the
 * data area with memcpy. A record is addressed by its data pointer.
 *
 * The pool is a plain structure embedded in the table object and is not
 * locked: the table's lock covers it.
 */
#ifndef SR_I_RECORD_BUFFER_POOL_H
#define SR_I_RECORD_BUFFER_POOL_H

#include <cstddef>
#include <cstdint>

/* The type word of a record header. */
enum sr_i_record_type : uint32_t {
  SR_I_RECORD_FREE = 0,
  SR_I_RECORD_METADATA = 1, /* the table's metadata record */
  SR_I_RECORD_ROW = 2,      /* a row record */
};

/* The header in front of every record. */
typedef struct __attribute__((packed)) sr_i_record_metadata_struct_t {
  uint32_t record_length;                       /* the whole record, header included */
  struct sr_i_record_metadata_struct_t *p_next; /* next free record, while free */
  uint32_t type;                                /* an sr_i_record_type */
  uint32_t disk_table_offset;                   /* where the record lies in the table's file */
} sr_i_record_metadata_t;

/* A block: records lie back to back in `data`, filling it exactly. */
typedef struct __attribute__((packed)) sr_i_record_buffer_struct_t {
  struct sr_i_record_buffer_struct_t *p_next; /* next block, in allocation order */
  uint32_t total_bytes;                       /* the whole block, header included */
  unsigned char data[];
} sr_i_record_buffer_t;

inline constexpr uint32_t Sr_Record_Header_Length = 20;
inline constexpr uint32_t Sr_Record_Buffer_Header_Length = 12;
/* A free record is split only when the part left over can hold a header and
 * at least two bytes; a smaller remainder stays with the allocated record. */
inline constexpr uint32_t Sr_Smallest_Split_Remainder = 22;

static_assert(sizeof(sr_i_record_metadata_t) == Sr_Record_Header_Length);
static_assert(offsetof(sr_i_record_buffer_t, data) == Sr_Record_Buffer_Header_Length);

/* What the pool knows of one block, kept in its directory of blocks. */
typedef struct sr_i_record_buffer_directory_entry_struct_t {
  sr_i_record_buffer_t *p_block;
  sr_i_record_metadata_t *p_first_free; /* the block's lowest free record, or null */
  sr_i_record_metadata_t *p_last_free;  /* its highest, or null */
  /* No free record of the block has a longer data area. Raised when a
   * record is freed into the block; lowered when a search has looked at
   * every free record of the block. */
  uint32_t largest_free_bound;
} sr_i_record_buffer_directory_entry_t;

typedef struct sr_i_record_buffer_pool_struct_t {
  uint32_t total_bytes; /* sum of the sizes of all blocks */
  /* Every block header, every record header (free records too) and the
   * data area of every allocated record. */
  uint32_t used_bytes;
  sr_i_record_metadata_t *p_free_chain; /* lowest free record, or null */
  sr_i_record_buffer_t *p_first_record_buffer;
  sr_i_record_buffer_t *p_last_record_buffer;
  /* Where a first-fit search may begin without changing its answer: every
   * free record before p_search_start has a data area shorter than
   * search_bound, so a request of at least that size starts there. No hint
   * while search_bound is 0; a null p_search_start with a bound stands for
   * the end of the chain. Tables that add row after row strand a short free
   * tail in every block, and without the hint each request would walk them
   * all. */
  sr_i_record_metadata_t *p_search_start;
  sr_i_record_metadata_t *p_search_start_previous; /* the free record before it, or null */
  uint32_t search_bound;
  /* Every block in address order. The heap may hand out blocks at falling
   * addresses; the short tails stranded in older blocks then lie above the
   * newest one, where the hint cannot cover them. With the directory a
   * search steps over a block whose free records are all too short without
   * touching it, and a record entering the chain finds its neighbour below
   * in its own block or the nearest block below, not by walking the chain
   * from its head. */
  sr_i_record_buffer_directory_entry_t *p_directory;
  uint32_t total_blocks;
  uint32_t directory_capacity;
} sr_i_record_buffer_pool_t;

/*
 * Where each block of a source pool went in its one-block copy. `p_offset`
 * holds full address distances: a block and its copy may lie farther apart
 * than 32 bits can express.
 */
typedef struct sr_i_record_buffer_pool_duplication_map_struct_t {
  uint32_t total;          /* blocks of the source pool */
  unsigned char **p_begin; /* start of each source block's data area */
  unsigned char **p_end;   /* end of each source block */
  int64_t *p_offset;       /* copy address minus source address */
} sr_i_record_buffer_pool_duplication_map_t;

/* The header of the record whose data starts at `p_data`, and back. */
inline sr_i_record_metadata_t *sr_i_rb_record_header(void *p_data) {
  return reinterpret_cast<sr_i_record_metadata_t *>(static_cast<unsigned char *>(p_data) -
                                                    Sr_Record_Header_Length);
}
inline void *sr_i_rb_record_data(sr_i_record_metadata_t *p_record) {
  return reinterpret_cast<unsigned char *>(p_record) + Sr_Record_Header_Length;
}

/*
 * Makes an empty pool: with 0 pages no block at all (how every table
 * starts); otherwise one block of `total_pages` system pages that is one free
 * record. Returns 0, or 12 (raised) leaving the pool as it was.
 */
int32_t sr_i_rb_initialize_record_buffer_pool(uint32_t total_pages,
                                              sr_i_record_buffer_pool_t *p_pool);

/* Frees every block and zeroes every field. Returns 0. */
int32_t sr_i_rb_uninitialize_record_buffer_pool(sr_i_record_buffer_pool_t *p_pool);

/*
 * First fit: finds the lowest free record whose data area holds
 * `data_length` bytes, adding a block when none does, and zeroes the part of
 * its data area that a record of up to `data_length` bytes can take (all of
 * it when the rest would be too small to split off). The record stays free
 * until sr_i_rb_allocate_record takes it.
 * Returns its data pointer, the free record before it in the chain (null
 * when it is the first) and its whole data-area length.
 * Returns 0, or 12 (raised) leaving the pool as it was.
 */
int32_t sr_i_rb_find_suitable_record(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                                     void **pp_data,
                                     sr_i_record_metadata_t **pp_previous_free_record,
                                     uint32_t *p_actual_data_length);

/*
 * Makes sure a free record holds `data_length` bytes, adding a block when
 * none does, and clears nothing: how a caller that is about to fill a pool
 * sizes it in one block. `pp_room`, when not null, receives where that free
 * record's data area begins. Returns 0, or 12 (raised) leaving the pool as
 * it was.
 */
int32_t sr_i_rb_make_room(sr_i_record_buffer_pool_t *p_pool, uint32_t data_length,
                          void **pp_room = nullptr);

/*
 * Takes the free record found by sr_i_rb_find_suitable_record for
 * `data_length` bytes of type `record_type`, splitting off what is left when
 * the remainder is big enough to be a record. Returns 0, or 15 (raised) when
 * the record cannot hold `data_length` bytes or is not the free record that
 * follows `p_previous_free_record`; the pool is then unchanged.
 */
int32_t sr_i_rb_allocate_record(sr_i_record_buffer_pool_t *p_pool, void *p_data,
                                sr_i_record_metadata_t *p_previous_free_record,
                                uint32_t data_length, uint32_t record_type);

/* Gives an allocated record back to the pool. Returns 0. */
int32_t sr_i_rb_free_record(sr_i_record_buffer_pool_t *p_pool, void *p_data);

/*
 * Links the free record `p_record` into the chain at `*pp_free_chain` in
 * address order, merging it with a free neighbour that touches it.
 * `*pp_previous` receives the last free record below it (the one that now
 * links to it or absorbed it), or null. Returns the number of bytes that
 * left use: its data area, plus 20 for each header merged away.
 */
uint32_t sr_i_rb_insert_free_record(sr_i_record_metadata_t *p_record,
                                    sr_i_record_metadata_t **pp_free_chain,
                                    sr_i_record_metadata_t **pp_previous);

/*
 * Finds and allocates a record of `length` data bytes and type `type`, its
 * data zeroed. Returns 0, 12 or 15 (raised).
 */
int32_t sr_i_reserve_record(sr_i_record_buffer_pool_t *p_pool, uint32_t length, uint32_t type,
                            void **pp_record_data);

/*
 * Copies the pool `p_from` into the empty pool `p_to` as one block (the data
 * areas of its blocks end to end) and returns in `*pp_duplication_map` the
 * map from source to copy addresses, which the caller frees with
 * sr_i_rb_free_duplication_map. The free chain of the copy is relinked;
 * pointers held inside allocated records are the caller's to map. A pool
 * without blocks gives a pool without blocks and a map of none.
 * Returns 0, or 12 (raised): then nothing is allocated, but the byte counts
 * of `p_to` have already been set.
 */
int32_t sr_i_rb_duplicate_record_buffer_pool(
    sr_i_record_buffer_pool_t *p_from, sr_i_record_buffer_pool_t *p_to,
    sr_i_record_buffer_pool_duplication_map_t **pp_duplication_map);

/* The address in the copy of the byte at `p_address` in the source pool, or
 * null when no source block holds it. */
void *sr_i_rb_map_duplicated_address(const sr_i_record_buffer_pool_duplication_map_t *p_map,
                                     const void *p_address);

/* Frees the map and its arrays; a null map is ignored. */
void sr_i_rb_free_duplication_map(sr_i_record_buffer_pool_duplication_map_t *p_map);

#endif /* SR_I_RECORD_BUFFER_POOL_H */
