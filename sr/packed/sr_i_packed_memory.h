/*
 * sr_i_packed_memory.h - the large blocks of packing and unpacking (the
 * buffer, the unpacked table's rows and its row index), each written front
 * to back right after it is had, mapped in as few page faults as the
 * kernel allows.
 */
#ifndef SR_I_PACKED_MEMORY_H
#define SR_I_PACKED_MEMORY_H

#include <cstddef>

/*
 * Asks the kernel to back the whole 2 MB pages inside [p_memory,
 * p_memory + length), part of a heap block the caller owns, with huge pages
 * where it has them, and then to map every page of the block writable
 * (sr_i_prefault). Nothing of the block's contents changes. Only a hint: a
 * kernel without transparent huge pages, or a block too short, is left to
 * fault page by page.
 */
void sr_i_map_block_to_fill(void *p_memory, size_t length);

/* malloc of `length` bytes (at least 1), mapped by sr_i_map_block_to_fill;
 * null when memory runs out. The caller frees it with free. */
void *sr_i_allocate_block_to_fill(size_t length);

#endif /* SR_I_PACKED_MEMORY_H */
