// The record buffer pool: byte counts, block growth, splitting, the raised
// failures, and copying a pool with its address map. The randomized cases
// walk every block after each step and check the whole structure (merged
// free neighbours, the free chain, the directory of blocks, both byte
// counts) against a model of the live records and their contents, and that
// every request gets exactly the record first fit chooses, also when the
// heap hands out blocks at falling addresses. Prefaulting a large buffer
// before it is filled, a memory hint of its own, is checked here too.

#include <gtest/gtest.h>
#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>
#include <map>
#include <random>
#include <set>
#include <vector>

#include "qv_sr.h"
#include "sr_row_test_support.h"
#include "storage/sr_i_prefault.h"
#include "tables/sr_i_record_buffer_pool.h"

namespace {

using sr_test::last_error;

uint32_t page_size() {
  return static_cast<uint32_t>(sysconf(_SC_PAGESIZE));
}

uintptr_t address(const void *p) {
  return reinterpret_cast<uintptr_t>(p);
}

// A live record as the model knows it: the length asked for and the seed of
// the bytes written into it.
struct live_record {
  uint32_t length;
  uint8_t seed;
};
using model_t = std::map<void *, live_record>;

void fill(void *p_data, live_record record) {
  for (uint32_t at = 0; at < record.length; ++at) {
    static_cast<uint8_t *>(p_data)[at] = static_cast<uint8_t>(record.seed + at);
  }
}

bool holds_its_bytes(const void *p_data, live_record record) {
  for (uint32_t at = 0; at < record.length; ++at) {
    if (static_cast<const uint8_t *>(p_data)[at] != static_cast<uint8_t>(record.seed + at)) {
      return false;
    }
  }
  return true;
}

// Walks every block record by record and checks: the records fill each block
// exactly; the live records are exactly the allocated ones, none lost, each
// no more than 21 bytes longer than asked, with its bytes intact; the free
// chain holds exactly the free records in ascending address order; no two
// free records touch unless the second starts at one of `seams`; and both
// byte counts agree with what the walk found; the directory lists every
// block once in address order with its lowest and highest free record and a
// bound no shorter than its longest.
void check_pool(const sr_i_record_buffer_pool_t &pool, const model_t &live,
                const std::set<uintptr_t> &seams = {}) {
  uint64_t total_bytes = 0, used_bytes = 0;
  std::vector<uintptr_t> free_records;
  size_t allocated = 0;
  uint32_t blocks = 0;
  const sr_i_record_buffer_t *p_last = nullptr;
  for (const sr_i_record_buffer_t *p_block = pool.p_first_record_buffer; p_block != nullptr;
       p_block = p_block->p_next) {
    p_last = p_block;
    total_bytes += p_block->total_bytes;
    used_bytes += Sr_Record_Buffer_Header_Length;
    const uintptr_t end = address(p_block) + p_block->total_bytes;
    bool previous_free = false;
    const sr_i_record_metadata_t *p_first_free = nullptr, *p_last_free = nullptr;
    uint32_t longest_free = 0;
    for (uintptr_t at = address(p_block->data); at != end;) {
      auto *p_record = reinterpret_cast<sr_i_record_metadata_t *>(at);
      ASSERT_GE(p_record->record_length, Sr_Record_Header_Length);
      ASSERT_LE(at + p_record->record_length, end) << "a record runs past its block";
      used_bytes += Sr_Record_Header_Length;
      const uint32_t data_length = p_record->record_length - Sr_Record_Header_Length;
      if (p_record->type == SR_I_RECORD_FREE) {
        ASSERT_FALSE(previous_free && seams.count(at) == 0) << "free neighbours left unmerged";
        free_records.push_back(at);
        p_first_free = p_first_free == nullptr ? p_record : p_first_free;
        p_last_free = p_record;
        longest_free = std::max(longest_free, data_length);
      } else {
        used_bytes += data_length;
        ++allocated;
        const auto found = live.find(sr_i_rb_record_data(p_record));
        ASSERT_NE(found, live.end()) << "an allocated record the model does not know";
        EXPECT_GE(data_length, found->second.length);
        EXPECT_LT(data_length, found->second.length + Sr_Smallest_Split_Remainder);
        EXPECT_TRUE(holds_its_bytes(found->first, found->second));
      }
      previous_free = p_record->type == SR_I_RECORD_FREE;
      at += p_record->record_length;
    }
    const auto *p_entry = std::find_if(
        pool.p_directory, pool.p_directory + pool.total_blocks,
        [&](const sr_i_record_buffer_directory_entry_t &e) { return e.p_block == p_block; });
    ASSERT_NE(p_entry, pool.p_directory + pool.total_blocks)
        << "a block missing from the directory";
    EXPECT_EQ(p_entry->p_first_free, p_first_free);
    EXPECT_EQ(p_entry->p_last_free, p_last_free);
    EXPECT_GE(p_entry->largest_free_bound, longest_free);
    ++blocks;
  }
  EXPECT_EQ(pool.total_blocks, blocks);
  EXPECT_TRUE(std::is_sorted(pool.p_directory, pool.p_directory + pool.total_blocks,
                             [](const auto &one, const auto &other) {
                               return address(one.p_block) < address(other.p_block);
                             }));
  EXPECT_EQ(pool.p_last_record_buffer, p_last);
  EXPECT_EQ(allocated, live.size()) << "a live record was lost";
  EXPECT_EQ(pool.total_bytes, total_bytes);
  EXPECT_EQ(pool.used_bytes, used_bytes);
  std::sort(free_records.begin(), free_records.end());
  std::vector<uintptr_t> chain;
  for (const sr_i_record_metadata_t *p = pool.p_free_chain; p != nullptr; p = p->p_next) {
    ASSERT_LE(chain.size(), free_records.size()) << "the free chain runs on";
    chain.push_back(address(p));
  }
  EXPECT_EQ(chain, free_records);
}

// The record first fit should choose for `length`, or null for a new block.
void *first_fit(const sr_i_record_buffer_pool_t &pool, uint32_t length) {
  for (sr_i_record_metadata_t *p = pool.p_free_chain; p != nullptr; p = p->p_next) {
    if (p->record_length - Sr_Record_Header_Length >= length) {
      return sr_i_rb_record_data(p);
    }
  }
  return nullptr;
}

// Random reservations (now and then a large one), each after making room
// for it, and frees, checked step by step.
void random_steps(sr_i_record_buffer_pool_t &pool, model_t &live, std::mt19937 &random, int steps,
                  const std::set<uintptr_t> &seams = {},
                  std::function<uint32_t()> next_length = {}) {
  if (!next_length) {
    next_length = [&random] {
      return random() % 100 == 0 ? 65536 + random() % 5000 : random() % 300;
    };
  }
  for (int step = 0; step < steps; ++step) {
    if (live.empty() || random() % 5 < 3) {
      // Making room finds, without taking, the record the request then gets.
      const uint32_t length = next_length();
      void *p_expected = first_fit(pool, length), *p_room = nullptr, *p_data = nullptr;
      ASSERT_EQ(sr_i_rb_make_room(&pool, length, &p_room), 0);
      ASSERT_EQ(sr_i_reserve_record(&pool, length, SR_I_RECORD_ROW, &p_data), 0);
      ASSERT_EQ(p_data, p_room) << "making room named another record";
      if (p_expected != nullptr) {
        ASSERT_EQ(p_data, p_expected) << "not the first fit";
      } else {
        ASSERT_EQ(p_data, pool.p_last_record_buffer->data + Sr_Record_Header_Length);
      }
      const uint32_t data_area = sr_i_rb_record_header(p_data)->record_length - 20;
      const auto *p_bytes = static_cast<const uint8_t *>(p_data);
      ASSERT_TRUE(std::all_of(p_bytes, p_bytes + data_area, [](uint8_t b) { return b == 0; }))
          << "reused data not cleared";
      live[p_data] = {length, static_cast<uint8_t>(random())};
      fill(p_data, live[p_data]);
    } else {
      auto victim = std::next(live.begin(), random() % live.size());
      ASSERT_EQ(sr_i_rb_free_record(&pool, victim->first), 0);
      live.erase(victim);
    }
    ASSERT_NO_FATAL_FAILURE(check_pool(pool, live, seams)) << "after step " << step;
  }
}

TEST(RecordBufferPool, FirstRequestCountsBytesExactly) {
  const uint32_t page = page_size(), data_area = page - 32;
  struct {
    uint32_t pages, length, total_bytes, used_bytes, free_record_length;
  } const cases[] = {
      {0, 10, 1032, 62, 990},  // a hundredfold block, the rest stays free
      {0, 0, 32, 32, 0},
      {0, 65535, 6553532, 32 + 65535 + 20, 6553532 - 12 - 65535 - 20},
      {0, 65536, 65568, 32 + 65536, 0},                   // a large request gets its own size
      {1, data_area - 21, page, 32 + data_area, 0},       // 21 bytes over: taken whole
      {1, data_area - 22, page, 32 + data_area - 2, 22},  // 22 over: split
      {3, 0, 3 * page, 52, 3 * page - 32},
  };
  for (const auto &c : cases) {
    sr_i_record_buffer_pool_t pool{};
    ASSERT_EQ(sr_i_rb_initialize_record_buffer_pool(c.pages, &pool), 0);
    void *p_data = nullptr;
    ASSERT_EQ(sr_i_reserve_record(&pool, c.length, SR_I_RECORD_METADATA, &p_data), 0);
    EXPECT_EQ(sr_i_rb_record_header(p_data)->type, SR_I_RECORD_METADATA);
    EXPECT_EQ(pool.total_bytes, c.total_bytes) << c.length;
    EXPECT_EQ(pool.used_bytes, c.used_bytes) << c.length;
    EXPECT_EQ(pool.p_free_chain == nullptr ? 0 : pool.p_free_chain->record_length,
              c.free_record_length)
        << c.length;
    fill(p_data, {c.length, 1});
    check_pool(pool, {{p_data, {c.length, 1}}});
    sr_i_rb_uninitialize_record_buffer_pool(&pool);
    EXPECT_EQ(pool.total_bytes + pool.used_bytes, 0u);
    EXPECT_EQ(pool.p_first_record_buffer, nullptr);
  }
}

// Prefaulting maps pages and changes no byte, neither inside the range nor
// in the partial pages at its ends, which may belong to other blocks; a
// block already mapped at both ends is left as it is.
TEST(Prefault, MapsEveryWholePageAndKeepsEveryByte) {
  const size_t page = page_size(), pages = 512;
  void *p_region =
      mmap(nullptr, pages * page, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(p_region, MAP_FAILED);
  auto *p_bytes = static_cast<unsigned char *>(p_region);
  // Written: the first page and the last; never touched: all between.
  std::memset(p_bytes, 0xA5, page);
  std::memset(p_bytes + (pages - 1) * page, 0x5A, page);

  const int rc = sr_i_prefault(p_bytes + page / 2, (pages - 1) * page);
  if (rc == EINVAL) {
    munmap(p_region, pages * page);
    GTEST_SKIP() << "this kernel cannot populate pages on request";
  }
  ASSERT_EQ(rc, 0);
  std::vector<unsigned char> resident(pages);
  ASSERT_EQ(mincore(p_region, pages * page, resident.data()), 0);
  for (size_t at = 0; at < pages; ++at) {
    EXPECT_EQ(resident[at] & 1, 1) << "page " << at;
  }
  EXPECT_EQ(std::count(p_bytes, p_bytes + page, 0xA5), static_cast<std::ptrdiff_t>(page));
  EXPECT_EQ(std::count(p_bytes + page, p_bytes + (pages - 1) * page, 0),
            static_cast<std::ptrdiff_t>((pages - 2) * page));
  EXPECT_EQ(std::count(p_bytes + (pages - 1) * page, p_bytes + pages * page, 0x5A),
            static_cast<std::ptrdiff_t>(page));

  // A block mapped at both ends is taken as reused memory, mapped
  // throughout, and not walked again.
  EXPECT_EQ(madvise(p_bytes + 200 * page, 300 * page, MADV_DONTNEED), 0);
  std::memset(p_bytes + 200 * page, 1, page);
  std::memset(p_bytes + 499 * page, 1, page);
  EXPECT_EQ(sr_i_prefault(p_bytes + 200 * page, 300 * page), 0);
  ASSERT_EQ(mincore(p_bytes + 200 * page, 300 * page, resident.data()), 0);
  EXPECT_EQ(resident[0] & 1, 1);
  EXPECT_EQ(resident[150] & 1, 0);
  EXPECT_EQ(resident[299] & 1, 1);

  // A buffer below the threshold is left to fault page by page.
  void *p_small = mmap(nullptr, Sr_Prefault_Minimum_Length - page, PROT_READ | PROT_WRITE,
                       MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
  ASSERT_NE(p_small, MAP_FAILED);
  EXPECT_EQ(sr_i_prefault(p_small, Sr_Prefault_Minimum_Length - page), 0);
  ASSERT_EQ(mincore(p_small, page, resident.data()), 0);
  EXPECT_EQ(resident[0] & 1, 0);
  munmap(p_small, Sr_Prefault_Minimum_Length - page);
  munmap(p_region, pages * page);
}

// Large zeroed blocks are zero however dirty the heap memory they reuse,
// small ones too, and a size that overflows is refused, not wrapped. The
// C library's heap is told to keep what is freed, so that the blocks do
// reuse it.
TEST(Prefault, AZeroedBlockIsZeroOnReusedMemoryAndAnOverflowIsRefused) {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
  GTEST_SKIP() << "a sanitizer's heap does not hand freed memory straight back";
#endif
  ASSERT_EQ(mallopt(M_MMAP_THRESHOLD, 256 << 20), 1);
  ASSERT_EQ(mallopt(M_TRIM_THRESHOLD, 256 << 20), 1);
  for (const size_t length : {size_t{4000}, Sr_Prefault_Minimum_Length * 3 + 24}) {
    auto *p_dirty = static_cast<unsigned char *>(std::malloc(length * 3));
    ASSERT_NE(p_dirty, nullptr);
    std::memset(p_dirty, 0xEE, length * 3);
    const auto dirty_start = reinterpret_cast<uintptr_t>(p_dirty);
    std::free(p_dirty);
    auto *p_block = static_cast<unsigned char *>(sr_i_allocate_zeroed_block(length / 8, 8));
    ASSERT_NE(p_block, nullptr);
    const auto start = reinterpret_cast<uintptr_t>(p_block);
    EXPECT_TRUE(start >= dirty_start && start < dirty_start + length * 3)
        << "the block did not reuse the dirty memory; the test proves nothing";
    EXPECT_EQ(std::count(p_block, p_block + length, 0), static_cast<std::ptrdiff_t>(length))
        << length << " bytes";
    std::free(p_block);
  }
  EXPECT_EQ(sr_i_allocate_zeroed_block(SIZE_MAX / 4, 8), nullptr);
}

TEST(RecordBufferPool, RaisesAndLeavesThePoolAsItWas) {
  sr_i_record_buffer_pool_t pool{};
  ASSERT_EQ(sr_i_rb_initialize_record_buffer_pool(1, &pool), 0);
  void *p_data = nullptr;
  sr_i_record_metadata_t *p_previous = nullptr;
  uint32_t actual = 0;
  ASSERT_EQ(sr_i_rb_find_suitable_record(&pool, 100, &p_data, &p_previous, &actual), 0);
  const sr_i_record_buffer_pool_t before = pool;

  EXPECT_EQ(sr_i_rb_allocate_record(&pool, p_data, p_previous, actual + 1, 2), 15);
  EXPECT_EQ(last_error().first, 15);
  sr_i_record_metadata_t *p_wrong_previous = sr_i_rb_record_header(p_data);
  EXPECT_EQ(sr_i_rb_allocate_record(&pool, p_data, p_wrong_previous, 100, 2), 15);
  // Blocks whose size does not fit the 32-bit counts cannot be had.
  EXPECT_EQ(sr_i_reserve_record(&pool, UINT32_MAX - 16, 2, &p_data), 12);
  EXPECT_EQ(last_error().first, 12);
  EXPECT_EQ(sr_i_rb_initialize_record_buffer_pool(UINT32_MAX, &pool), 12);

  EXPECT_EQ(std::memcmp(&pool, &before, sizeof pool), 0);
  check_pool(pool, {});
  sr_i_rb_uninitialize_record_buffer_pool(&pool);
}

// Random reservations and frees from pools of 0 and 2 pages; then rows of
// up to 3000 bytes with now and then one of 150 KB or more, whose blocks
// come from mmap at falling addresses: the short free tails of older blocks
// then lie above the newest one, where the search hint cannot cover them.
TEST(RecordBufferPool, RandomAllocationsAndFreesKeepThePoolConsistentAndFirstFitExact) {
  for (const uint32_t pages : {0u, 2u}) {
    sr_i_record_buffer_pool_t pool{};
    ASSERT_EQ(sr_i_rb_initialize_record_buffer_pool(pages, &pool), 0);
    std::mt19937 random(pages + 7);
    model_t live;
    ASSERT_NO_FATAL_FAILURE(random_steps(pool, live, random, 1500));
    for (const auto &[p_data, record] : live) {
      ASSERT_EQ(sr_i_rb_free_record(&pool, p_data), 0);
    }
    check_pool(pool, {});  // every block is one free record again
    sr_i_rb_uninitialize_record_buffer_pool(&pool);
  }
  sr_i_record_buffer_pool_t pool{};
  model_t live;
  std::mt19937 random(5);
  ASSERT_NO_FATAL_FAILURE(random_steps(pool, live, random, 1500, {}, [&random] {
    return random() % 50 == 0 ? 150000 + random() % 50000 : 1 + random() % 3000;
  }));
  bool fell = false;
  for (const auto *p = pool.p_first_record_buffer; p->p_next != nullptr; p = p->p_next) {
    fell = fell || address(p->p_next) < address(p);
  }
  EXPECT_TRUE(fell) << "every block came above the one before: the case was not exercised";
  sr_i_rb_uninitialize_record_buffer_pool(&pool);
}

// A pool without blocks copies to an empty pool. A pool of many blocks, one
// of them 64 MB (so that the copy gets a mapping of its own, usually far
// from the heap blocks it copies), is copied into one block: every record
// at its mapped address with its bytes, the free chain relinked; the copy
// then works as a pool of its own and the source is untouched.
TEST(RecordBufferPool, DuplicateCopiesEveryRecordIntoOneBlock) {
  sr_i_record_buffer_pool_t source{}, copy{};
  sr_i_record_buffer_pool_duplication_map_t *p_map = nullptr;
  ASSERT_EQ(sr_i_rb_duplicate_record_buffer_pool(&source, &copy, &p_map), 0);
  EXPECT_EQ(p_map->total, 0u);
  EXPECT_EQ(std::memcmp(&copy, &source, sizeof copy), 0);
  sr_i_rb_free_duplication_map(p_map);

  std::mt19937 random(11);
  model_t live;
  ASSERT_NO_FATAL_FAILURE(random_steps(source, live, random, 800));
  void *p_large = nullptr;
  ASSERT_EQ(sr_i_reserve_record(&source, 64u << 20, SR_I_RECORD_ROW, &p_large), 0);
  ASSERT_EQ(sr_i_rb_free_record(&source, p_large), 0);
  ASSERT_GE(source.total_blocks, 3u);
  ASSERT_EQ(sr_i_rb_duplicate_record_buffer_pool(&source, &copy, &p_map), 0);
  ASSERT_EQ(p_map->total, source.total_blocks);
  EXPECT_EQ(copy.total_bytes, source.total_bytes - 12 * source.total_blocks + 12);
  EXPECT_EQ(copy.used_bytes, source.used_bytes - 12 * source.total_blocks + 12);
  ASSERT_EQ(copy.p_first_record_buffer, copy.p_last_record_buffer);
  EXPECT_EQ(copy.p_first_record_buffer->p_next, nullptr);

  model_t copied;
  for (const auto &[p_data, record] : live) {
    void *p_copy = sr_i_rb_map_duplicated_address(p_map, p_data);
    ASSERT_NE(p_copy, nullptr);
    EXPECT_EQ(sr_i_rb_record_header(p_copy)->type, SR_I_RECORD_ROW);
    copied[p_copy] = record;
  }
  std::set<uintptr_t> seams;
  for (uint32_t at = 1; at < p_map->total; ++at) {
    seams.insert(address(sr_i_rb_map_duplicated_address(p_map, p_map->p_begin[at])));
  }
  ASSERT_NO_FATAL_FAILURE(check_pool(copy, copied, seams));
  const int outside = 0;
  EXPECT_EQ(sr_i_rb_map_duplicated_address(p_map, &outside), nullptr);
  EXPECT_EQ(sr_i_rb_map_duplicated_address(p_map, p_map->p_end[0]), nullptr);

  ASSERT_NO_FATAL_FAILURE(random_steps(copy, copied, random, 300, seams));
  ASSERT_NO_FATAL_FAILURE(check_pool(source, live));
  sr_i_rb_free_duplication_map(p_map);
  sr_i_rb_uninitialize_record_buffer_pool(&copy);
  sr_i_rb_uninitialize_record_buffer_pool(&source);
}

}  // namespace
