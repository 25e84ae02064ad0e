/*
 * sr_i_prefault.h - asking the kernel to map, in one call, the pages of a
 * large buffer the caller is about to fill front to back.
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

#endif /* SR_I_PREFAULT_H */
