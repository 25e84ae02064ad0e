/*
 * sr_i_prefault.h - the large blocks of the library (file images, row
 * indexes, key hash tables, packed buffers and the rows unpacked from them),
 * mapped in as few page faults as the kernel allows before they are filled.
 */
#ifndef SR_I_PREFAULT_H
#define SR_I_PREFAULT_H

#include <cstddef>

/* Buffers shorter than this are left to fault page by page: a handful of
 * faults costs less than the system call. */
inline constexpr size_t Sr_Prefault_Minimum_Length = size_t{1} << 20;

/*
 * Maps the whole pages inside [p_memory, p_memory + length) of a heap block
 * the caller owns, writable, without changing a byte of them, unless the
 * first and last of those pages are mapped already. Only a hint: returns 0
 * when the kernel did it, the pages were mapped or the buffer is too short
 * to bother, otherwise the errno of madvise (EINVAL on kernels before
 * 5.14), which callers may ignore.
 */
int sr_i_prefault(void *p_memory, size_t length);

/*
 * Asks the kernel to back the whole 2 MB pages inside [p_memory,
 * p_memory + length), part of a heap block the caller owns, with huge pages
 * where it has them, and then maps every page of the block (sr_i_prefault).
 * Nothing of the block's contents changes. Only a hint: a kernel without
 * transparent huge pages, or a block too short, is left to fault page by
 * page.
 */
void sr_i_map_block_to_fill(void *p_memory, size_t length);

/* malloc of `length` bytes (at least 1), mapped by sr_i_map_block_to_fill;
 * null when memory runs out. The caller frees it with free. */
void *sr_i_allocate_block_to_fill(size_t length);

/* calloc of `count` elements of `size` bytes, a large one mapped by
 * sr_i_map_block_to_fill before it is cleared; null when memory runs out or
 * the size overflows. The caller frees it with free. */
void *sr_i_allocate_zeroed_block(size_t count, size_t size);

#endif /* SR_I_PREFAULT_H */
