/*
 * sr_i_application_metadata.h - the application metadata a table carries:
 * typed byte strings a client keeps with the table, told apart by an
 * unsigned 32-bit type, that follow the table's transaction life. Each
 * element has an applied value (what a change made) and a committed value;
 * commit makes the applied value the committed one, abort brings the
 * committed one back.
 *
 * The container has no lock of its own: every function here expects the
 * caller to hold the owning table's lock (read lock for the gets, write lock
 * for everything else). Failures are raised here; callers pass the code on.
 */
#ifndef SR_I_APPLICATION_METADATA_H
#define SR_I_APPLICATION_METADATA_H

#include <cstdarg>
#include <cstdint>

#include "qv_types.h"

/*
 * One element. A value is one heap block, a 32-bit length then the bytes
 * (the shape of qv_binary_t). The two pointers may share a block; whoever
 * frees one of them frees the block only when the other differs from it.
 *   p_applied == p_committed, both set: committed, unchanged
 *   both set, different:                 changed
 *   p_applied only:                      added, not yet committed
 *   p_committed only:                    deleted, not yet committed
 */
typedef struct sr_i_application_metadata_index_element_struct_t {
  uint32_t type;
  qv_binary_t *p_applied;   /* the newest value; null: deleted in the applied view */
  qv_binary_t *p_committed; /* null: not in the committed view */
} sr_i_application_metadata_index_element_t;

typedef struct sr_i_application_metadata_struct_t {
  uint32_t max_elements;   /* capacity of p_index */
  uint32_t total_elements; /* elements in use */
  /* Sorted by ascending type, no two elements with the same type. */
  sr_i_application_metadata_index_element_t *p_index;
} sr_i_application_metadata_t;

/* A new empty container with room for `max_elements` elements (it grows by
 * doubling). Returns 0, or 12 (raised) with nothing allocated. */
int32_t sr_i_allocate_application_metadata_buffer(
    uint32_t max_elements, sr_i_application_metadata_t **pp_application_metadata);

/* Frees every value (a shared block once), the array and the container.
 * Null is accepted. Returns 0. */
int32_t sr_i_free_application_metadata(sr_i_application_metadata_t *p_application_metadata);

/*
 * The functions below return 0 or a raised code. On 12 the container is
 * left as it was before the call. `p_data` may be null when `length` is 0.
 */

/* Adds an element of `type` whose applied value is a copy of the data and
 * which has no committed value. 108 when an element of `type` exists (even
 * one deleted in the applied view); 12. */
int32_t sr_i_add_application_metadata_element(sr_i_application_metadata_t *p_application_metadata,
                                              uint32_t type, uint32_t length, const void *p_data);

/* Deletes the element in the applied view; it leaves the array at the next
 * commit, or gets its committed value back at the next abort. Deleting an
 * element already deleted succeeds. 202 when there is no element of `type`. */
int32_t sr_i_delete_application_metadata_element(
    sr_i_application_metadata_t *p_application_metadata, uint32_t type);

/* Replaces the applied value of an existing element with a copy of the
 * data; the committed value is not touched. 202 when there is no element
 * of `type`; 12. */
int32_t sr_i_set_application_metadata_element(sr_i_application_metadata_t *p_application_metadata,
                                              uint32_t type, uint32_t length, const void *p_data);

/* Sets the element of `type`, adding it when there is none. 12. */
int32_t sr_i_set_application_metadata(sr_i_application_metadata_t *p_application_metadata,
                                      uint32_t type, uint32_t length, const void *p_data);

/*
 * sr_i_set_application_metadata for `array_count` triples read from `ap`:
 * uint32_t type, uint32_t length, const void *data. Stops at the first
 * failure and returns its code (the triples before it stay set). When every
 * triple succeeds it returns `array_count` itself, not 0: 0 only for an
 * empty list.
 */
int32_t sr_i_set_application_metadata_v(sr_i_application_metadata_t *p_application_metadata,
                                        uint32_t array_count, va_list ap);

/*
 * A new heap copy of the bytes of the element of `type` in `*p_p_data` (the
 * caller frees it with free; never null, even for an empty value) and their
 * count in `*p_length`. A non-zero `uncommitted_updates_visible` reads the
 * applied view, else the committed view. 202 when there is no element of
 * `type`, or it has no committed value and the committed view was asked
 * for; 204 when it is deleted in the applied view and that view was asked
 * for; 12. The outputs are set only on success.
 */
int32_t sr_i_get_application_metadata_element(
    const sr_i_application_metadata_t *p_application_metadata, uint32_t type,
    uint32_t uncommitted_updates_visible, uint32_t *p_length, void **p_p_data);

/* sr_i_get_application_metadata_element with `type` and
 * `uncommitted_updates_visible` exchanged. */
int32_t sr_i_get_application_metadata(const sr_i_application_metadata_t *p_application_metadata,
                                      uint32_t uncommitted_updates_visible, uint32_t type,
                                      uint32_t *p_length, void **p_p_data);

/* As sr_i_get_application_metadata_element, but the copy is one qv_binary_t
 * block (length word and bytes) in `*p_p_application_data`, freed with free. */
int32_t sr_i_get_application_metadata_element_binary(
    const sr_i_application_metadata_t *p_application_metadata, uint32_t type,
    uint32_t uncommitted_updates_visible, qv_binary_t **p_p_application_data);

/* Makes every applied value the committed one and drops the elements
 * deleted in the applied view. Returns 0. */
int32_t sr_i_commit_application_metadata_buffer_updates(
    sr_i_application_metadata_t *p_application_metadata);

/* Brings every committed value back as the applied one and drops the
 * elements that were added and not committed. Returns 0. */
int32_t sr_i_abort_application_metadata_buffer_updates(
    sr_i_application_metadata_t *p_application_metadata);

/*
 * A new container in `*p_p_to_application_metadata` holding a copy of the
 * committed view of `p_from_application_metadata`, committed, with the same
 * capacity: both views of the copy show the source's committed values.
 * Elements with no committed value (added and not committed) are left out;
 * elements deleted in the source's applied view keep their committed value.
 * 12, with nothing allocated.
 */
int32_t sr_i_duplicate_application_metadata_buffer(
    const sr_i_application_metadata_t *p_from_application_metadata,
    sr_i_application_metadata_t **p_p_to_application_metadata);

#endif /* SR_I_APPLICATION_METADATA_H */
