// sr_i_packed_memory.cpp - mapping the large blocks of packing and
// unpacking before they are written.
//
// A buffer of 100,000 rows is about 12 MB, and the table unpacked from it
// takes as much again for its copy of the rows and a third of that for its
// row index. Each is fresh memory from the kernel, and every 4 KB page of it
// costs a fault, a page cleared and a page-table entry: for blocks written
// once, as costly as the writing. Backed by 2 MB pages the same memory
// costs one fault per 512 of those pages. Transparent huge pages are often
// enabled only for memory that asks for them (madvise), so the blocks ask;
// the heap keeps the advice on what it hands out later, which is harmless.

#include "packed/sr_i_packed_memory.h"

#include <sys/mman.h>

#include <cstdint>
#include <cstdlib>

#include "storage/sr_i_prefault.h"

namespace {

constexpr uintptr_t Huge_Page_Bytes = uintptr_t{1} << 21;
// mincore reports on whole pages; the smallest of any Linux port will do.
constexpr size_t Small_Page_Bytes = 4096;

}  // namespace

void sr_i_map_block_to_fill(void *p_memory, size_t length) {
  if (p_memory == nullptr) {
    return;
  }
  const auto start = reinterpret_cast<uintptr_t>(p_memory);
  const uintptr_t first_huge_page = (start + Huge_Page_Bytes - 1) & ~(Huge_Page_Bytes - 1);
  const uintptr_t end_huge_page = (start + length) & ~(Huge_Page_Bytes - 1);
  // Memory the heap hands out again is mapped already: advice would change
  // nothing now and only split the heap's mapping.
  unsigned char residence = 0;
  if (end_huge_page > first_huge_page &&
      mincore(reinterpret_cast<void *>(first_huge_page), Small_Page_Bytes, &residence) == 0 &&
      (residence & 1) == 0) {
    // Refused by a kernel built without huge pages: the block is then
    // mapped page by page, as without the advice.
    madvise(reinterpret_cast<void *>(first_huge_page), end_huge_page - first_huge_page,
            MADV_HUGEPAGE);
  }
  sr_i_prefault(p_memory, length);
}

void *sr_i_allocate_block_to_fill(size_t length) {
  void *p_memory = std::malloc(length > 0 ? length : 1);
  sr_i_map_block_to_fill(p_memory, length);
  return p_memory;
}
