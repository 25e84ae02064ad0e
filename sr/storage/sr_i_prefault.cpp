// sr_i_prefault.cpp - mapping a large buffer's pages before it is filled.
//
// A fresh heap block of many megabytes comes straight from the kernel, and
// filling it takes one page fault per page: an exception, a page allocation
// and a return, about as costly as the work done on the page. Loading a
// table fills the file buffer, the image of its records and the used part
// of its row index, each known in size beforehand. MADV_POPULATE_WRITE maps
// all their pages in one call, as if each had been written, without
// touching what they hold. A block the heap reused is left alone.
//
// Blocks written once right after they are had (a packed buffer, the rows
// unpacked from one, a row index, a key hash table's buckets and elements)
// ask for more: every 4 KB page still costs a page cleared and a page-table
// entry, while 2 MB pages cost one fault per 512 of those pages.
// Transparent huge pages are often enabled only for memory that asks for
// them (madvise), so such blocks ask; the heap keeps the advice on what it
// hands out later, which is harmless.

#include "storage/sr_i_prefault.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>

namespace {

constexpr uintptr_t Huge_Page_Bytes = uintptr_t{1} << 21;
// mincore reports on whole pages; the smallest of any Linux port will do.
constexpr size_t Small_Page_Bytes = 4096;

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

// calloc clears a block the heap had handed out before, which faults in
// its unmapped pages one by one, 4 KB at a time; mapped first, they come
// in 2 MB pages and clearing them is a plain memset.
void *sr_i_allocate_zeroed_block(size_t count, size_t size) {
  size_t length = 0;
  if (__builtin_mul_overflow(count, size, &length)) {
    return nullptr;
  }
  if (length < Sr_Prefault_Minimum_Length) {
    return std::calloc(count, size);
  }
  void *p_memory = nullptr;
  if (posix_memalign(&p_memory, Huge_Page_Bytes, length) != 0) {
    return nullptr;
  }
  sr_i_map_block_to_fill(p_memory, length);
  std::memset(p_memory, 0, length);
  return p_memory;
}
