// sr_i_application_metadata.cpp - the application metadata container of a
// table: a sorted array of typed elements, each with an applied and a
// committed value, changed through add, set and delete and settled by commit
// and abort.
//
// Every value is one malloc'ed block (length word, then the bytes) so that
// it can be handed out, written to a file or stored in a commit record as it
// is. An element whose applied and committed values are equal shares one
// block, which is why every free below first compares the two pointers.
// Arrays are small (the exported calls use one element), so lookups walk
// them from the start.

#include "schema/sr_i_application_metadata.h"

#include <cstdlib>
#include <cstring>

#include "frame/sr_i_errors.h"

namespace {

using element_t = sr_i_application_metadata_index_element_t;

// A new value block holding a copy of the data, or null when memory runs
// out (the caller raises, so that the message names the operation).
qv_binary_t *new_value(uint32_t length, const void *p_data) {
  auto *p_value = static_cast<qv_binary_t *>(std::malloc(sizeof(qv_binary_t) + size_t{length}));
  if (p_value == nullptr) {
    return nullptr;
  }
  p_value->length = length;
  if (length != 0) {
    std::memcpy(p_value->data, p_data, length);
  }
  return p_value;
}

// The position of the element of `type`, or where it would be inserted:
// the first element whose type is not smaller.
uint32_t position_of(const sr_i_application_metadata_t *p_container, uint32_t type) {
  uint32_t position = 0;
  while (position < p_container->total_elements && p_container->p_index[position].type < type) {
    ++position;
  }
  return position;
}

// The element of `type`, or null.
element_t *find(const sr_i_application_metadata_t *p_container, uint32_t type) {
  const uint32_t position = position_of(p_container, type);
  if (position == p_container->total_elements || p_container->p_index[position].type != type) {
    return nullptr;
  }
  return &p_container->p_index[position];
}

void remove_element(sr_i_application_metadata_t *p_container, uint32_t position) {
  element_t *p_index = p_container->p_index;
  std::memmove(p_index + position, p_index + position + 1,
               (p_container->total_elements - position - 1) * sizeof(element_t));
  --p_container->total_elements;
  p_index[p_container->total_elements] = element_t{};
}

// Doubles the capacity (an empty one becomes 1) and zeroes the new slots.
// False when memory runs out, with the array unchanged.
bool grow(sr_i_application_metadata_t *p_container) {
  const uint32_t old_max = p_container->max_elements;
  if (old_max > UINT32_MAX / 2) {
    return false;
  }
  const uint32_t new_max = old_max == 0 ? 1 : old_max * 2;
  auto *p_index =
      static_cast<element_t *>(std::realloc(p_container->p_index, new_max * sizeof(element_t)));
  if (p_index == nullptr) {
    return false;
  }
  std::memset(static_cast<void *>(p_index + old_max), 0, (new_max - old_max) * sizeof(element_t));
  p_container->p_index = p_index;
  p_container->max_elements = new_max;
  return true;
}

// The value of `type` in the view asked for, checked as the gets require.
int32_t value_in_view(const sr_i_application_metadata_t *p_container, uint32_t type,
                      uint32_t uncommitted_updates_visible, const qv_binary_t **p_p_value,
                      sr_i_source_location where) {
  const element_t *p_element = find(p_container, type);
  if (p_element == nullptr) {
    return sr_i_raise(SR_E_NO_ROW_FOR_KEY, where);
  }
  if (uncommitted_updates_visible != 0) {
    if (p_element->p_applied == nullptr) {
      return sr_i_raise(SR_E_ROW_DELETED, where);
    }
    *p_p_value = p_element->p_applied;
  } else {
    if (p_element->p_committed == nullptr) {
      return sr_i_raise(SR_E_NO_ROW_FOR_KEY, where);
    }
    *p_p_value = p_element->p_committed;
  }
  return 0;
}

}  // namespace

int32_t sr_i_allocate_application_metadata_buffer(
    uint32_t max_elements, sr_i_application_metadata_t **pp_application_metadata) {
  auto *p_container = static_cast<sr_i_application_metadata_t *>(
      std::calloc(1, sizeof(sr_i_application_metadata_t)));
  if (p_container == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (max_elements != 0) {
    p_container->p_index = static_cast<element_t *>(std::calloc(max_elements, sizeof(element_t)));
    if (p_container->p_index == nullptr) {
      std::free(p_container);
      return sr_i_raise_no_memory();
    }
  }
  p_container->max_elements = max_elements;
  *pp_application_metadata = p_container;
  return 0;
}

int32_t sr_i_free_application_metadata(sr_i_application_metadata_t *p_application_metadata) {
  if (p_application_metadata == nullptr) {
    return 0;
  }
  for (uint32_t position = 0; position < p_application_metadata->total_elements; ++position) {
    element_t &element = p_application_metadata->p_index[position];
    if (element.p_committed != element.p_applied) {
      std::free(element.p_committed);
    }
    std::free(element.p_applied);
  }
  std::free(p_application_metadata->p_index);
  std::free(p_application_metadata);
  return 0;
}

int32_t sr_i_add_application_metadata_element(sr_i_application_metadata_t *p_application_metadata,
                                              uint32_t type, uint32_t length, const void *p_data) {
  const uint32_t position = position_of(p_application_metadata, type);
  if (position < p_application_metadata->total_elements &&
      p_application_metadata->p_index[position].type == type) {
    return sr_i_raise(SR_E_DUPLICATE_KEY);
  }
  qv_binary_t *p_value = new_value(length, p_data);
  if (p_value == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (p_application_metadata->total_elements == p_application_metadata->max_elements &&
      !grow(p_application_metadata)) {
    std::free(p_value);
    return sr_i_raise_no_memory();
  }
  element_t *p_index = p_application_metadata->p_index;
  std::memmove(p_index + position + 1, p_index + position,
               (p_application_metadata->total_elements - position) * sizeof(element_t));
  p_index[position] = element_t{type, p_value, nullptr};
  ++p_application_metadata->total_elements;
  return 0;
}

int32_t sr_i_delete_application_metadata_element(
    sr_i_application_metadata_t *p_application_metadata, uint32_t type) {
  element_t *p_element = find(p_application_metadata, type);
  if (p_element == nullptr) {
    return sr_i_raise(SR_E_NO_ROW_FOR_KEY);
  }
  if (p_element->p_applied != p_element->p_committed) {
    std::free(p_element->p_applied);
  }
  p_element->p_applied = nullptr;
  return 0;
}

int32_t sr_i_set_application_metadata_element(sr_i_application_metadata_t *p_application_metadata,
                                              uint32_t type, uint32_t length, const void *p_data) {
  element_t *p_element = find(p_application_metadata, type);
  if (p_element == nullptr) {
    return sr_i_raise(SR_E_NO_ROW_FOR_KEY);
  }
  qv_binary_t *p_value = new_value(length, p_data);
  if (p_value == nullptr) {
    return sr_i_raise_no_memory();
  }
  if (p_element->p_applied != p_element->p_committed) {
    std::free(p_element->p_applied);
  }
  p_element->p_applied = p_value;
  return 0;
}

// A missing element is added rather than first raising "not found" from the
// set and then recovering: the outcome is the same, without leaving an error
// record for a failure that never reaches the caller.
int32_t sr_i_set_application_metadata(sr_i_application_metadata_t *p_application_metadata,
                                      uint32_t type, uint32_t length, const void *p_data) {
  if (find(p_application_metadata, type) == nullptr) {
    return sr_i_add_application_metadata_element(p_application_metadata, type, length, p_data);
  }
  return sr_i_set_application_metadata_element(p_application_metadata, type, length, p_data);
}

int32_t sr_i_set_application_metadata_v(sr_i_application_metadata_t *p_application_metadata,
                                        uint32_t array_count, va_list ap) {
  for (uint32_t triple = 0; triple < array_count; ++triple) {
    const uint32_t type = va_arg(ap, uint32_t);
    const uint32_t length = va_arg(ap, uint32_t);
    const void *p_data = va_arg(ap, const void *);
    if (const int32_t rc =
            sr_i_set_application_metadata(p_application_metadata, type, length, p_data);
        rc != 0) {
      return rc;
    }
  }
  return static_cast<int32_t>(array_count);
}

int32_t sr_i_get_application_metadata_element(
    const sr_i_application_metadata_t *p_application_metadata, uint32_t type,
    uint32_t uncommitted_updates_visible, uint32_t *p_length, void **p_p_data) {
  const qv_binary_t *p_value = nullptr;
  if (const int32_t rc = value_in_view(p_application_metadata, type, uncommitted_updates_visible,
                                       &p_value, sr_i_source_location::current());
      rc != 0) {
    return rc;
  }
  // One byte at least, so that an empty value is still a block to free.
  void *p_copy = std::malloc(p_value->length == 0 ? 1 : p_value->length);
  if (p_copy == nullptr) {
    return sr_i_raise_no_memory();
  }
  std::memcpy(p_copy, p_value->data, p_value->length);
  *p_length = p_value->length;
  *p_p_data = p_copy;
  return 0;
}

int32_t sr_i_get_application_metadata(const sr_i_application_metadata_t *p_application_metadata,
                                      uint32_t uncommitted_updates_visible, uint32_t type,
                                      uint32_t *p_length, void **p_p_data) {
  return sr_i_get_application_metadata_element(p_application_metadata, type,
                                               uncommitted_updates_visible, p_length, p_p_data);
}

int32_t sr_i_get_application_metadata_element_binary(
    const sr_i_application_metadata_t *p_application_metadata, uint32_t type,
    uint32_t uncommitted_updates_visible, qv_binary_t **p_p_application_data) {
  const qv_binary_t *p_value = nullptr;
  if (const int32_t rc = value_in_view(p_application_metadata, type, uncommitted_updates_visible,
                                       &p_value, sr_i_source_location::current());
      rc != 0) {
    return rc;
  }
  qv_binary_t *p_copy = new_value(p_value->length, p_value->data);
  if (p_copy == nullptr) {
    return sr_i_raise_no_memory();
  }
  *p_p_application_data = p_copy;
  return 0;
}

namespace {

// Makes one view of every element the other: commit keeps the applied
// values, abort the committed ones. The value given up is freed unless the
// two views share it, and an element the kept view lacks is removed.
void settle_views(sr_i_application_metadata_t *p_application_metadata,
                  qv_binary_t *element_t::*kept, qv_binary_t *element_t::*dropped) {
  uint32_t position = 0;
  while (position < p_application_metadata->total_elements) {
    element_t &element = p_application_metadata->p_index[position];
    if (element.*dropped != element.*kept) {
      std::free(element.*dropped);
    }
    if (element.*kept == nullptr) {
      remove_element(p_application_metadata, position);  // the next one moved here
      continue;
    }
    element.*dropped = element.*kept;
    ++position;
  }
}

}  // namespace

int32_t sr_i_commit_application_metadata_buffer_updates(
    sr_i_application_metadata_t *p_application_metadata) {
  settle_views(p_application_metadata, &element_t::p_applied, &element_t::p_committed);
  return 0;
}

int32_t sr_i_abort_application_metadata_buffer_updates(
    sr_i_application_metadata_t *p_application_metadata) {
  settle_views(p_application_metadata, &element_t::p_committed, &element_t::p_applied);
  return 0;
}

int32_t sr_i_duplicate_application_metadata_buffer(
    const sr_i_application_metadata_t *p_from_application_metadata,
    sr_i_application_metadata_t **p_p_to_application_metadata) {
  sr_i_application_metadata_t *p_copy = nullptr;
  if (const int32_t rc = sr_i_allocate_application_metadata_buffer(
          p_from_application_metadata->max_elements, &p_copy);
      rc != 0) {
    return rc;
  }
  for (uint32_t position = 0; position < p_from_application_metadata->total_elements; ++position) {
    const element_t &element = p_from_application_metadata->p_index[position];
    // An element added and never committed has no committed value to copy.
    if (element.p_committed == nullptr) {
      continue;
    }
    if (const int32_t rc = sr_i_add_application_metadata_element(
            p_copy, element.type, element.p_committed->length, element.p_committed->data);
        rc != 0) {
      sr_i_free_application_metadata(p_copy);
      return rc;
    }
  }
  sr_i_commit_application_metadata_buffer_updates(p_copy);
  *p_p_to_application_metadata = p_copy;
  return 0;
}
