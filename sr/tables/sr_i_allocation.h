/*
 * sr_i_allocation.h - the door through which a table allocates as it
 * grows: its row index and the blocks its change entries come from. A
 * failure there must leave the table as it was, so tests swap an entry of
 * Sr_Allocation to make one allocation fail, and restore it afterwards.
 *
 * A door rather than a malloc interposed in the test program: it is swapped
 * at run time as the file-system door is, it reaches only the allocations
 * whose failure is to be tested, and it works the same under the sanitizers,
 * which interpose malloc themselves. Memory from the door is freed with free.
 */
#ifndef SR_I_ALLOCATION_H
#define SR_I_ALLOCATION_H

#include <cstddef>

typedef struct sr_i_allocation_calls_struct_t {
  void *(*allocate)(size_t length);
  /* As realloc: on failure null, and the block is left as it was. */
  void *(*reallocate)(void *p_block, size_t length);
} sr_i_allocation_calls_t;

/* The calls in use; replaced only by tests, while no other thread runs. */
extern sr_i_allocation_calls_t Sr_Allocation;
/* The C library's malloc and realloc, for restoring Sr_Allocation. */
extern const sr_i_allocation_calls_t Sr_Default_Allocation;

#endif /* SR_I_ALLOCATION_H */
