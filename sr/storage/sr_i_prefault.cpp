// sr_i_prefault.cpp - mapping a large buffer's pages before it is filled.
//
// A fresh heap block of many megabytes comes straight from the kernel, and
// filling it takes one page fault per page: an exception, a page allocation
// and a return, about as costly as the work done on the page. Loading a
// table fills the file buffer, the image of its records and the used part
// of its row index, each known in size beforehand. MADV_POPULATE_WRITE maps
// all their pages in one call, as if each had been written, without
// touching what they hold. A block the heap reused is left alone.

#include "storage/sr_i_prefault.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>

namespace {

bool is_mapped(uintptr_t page, uintptr_t page_size) {
  unsigned char residence = 0;
  return mincore(reinterpret_cast<void *>(page), page_size, &residence) == 0 &&
         (residence & 1) != 0;
}

}  // namespace

int sr_i_prefault(void *p_memory, size_t length) {
  if (p_memory == nullptr || length < Sr_Prefault_Minimum_Length) {
    return 0;
  }
  // madvise takes whole pages; the partial pages at either end belong in
  // part to other heap blocks and are left alone.
  const long system_page_size = sysconf(_SC_PAGESIZE);
  if (system_page_size <= 0) {
    return 0;
  }
  const auto page_size = static_cast<uintptr_t>(system_page_size);
  const auto start = reinterpret_cast<uintptr_t>(p_memory);
  const uintptr_t first_page = (start + page_size - 1) & ~(page_size - 1);
  const uintptr_t end_page = (start + length) & ~(page_size - 1);
  if (end_page <= first_page) {
    return 0;
  }
  // A block whose first and last pages are both mapped is memory the heap
  // has handed out before and is mapped throughout; asking for it again
  // would walk every page for nothing, at a tenth of what faulting it costs.
  if (is_mapped(first_page, page_size) && is_mapped(end_page - page_size, page_size)) {
    return 0;
  }
  if (madvise(reinterpret_cast<void *>(first_page), end_page - first_page, MADV_POPULATE_WRITE) !=
      0) {
    return errno;
  }
  return 0;
}
