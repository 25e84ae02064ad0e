// Copies and moves when memory runs out: each allocation of the call fails
// in turn (this program replaces operator new), and every failure must give
// 12 with the source whole where it was and its handles working, the target
// as it was, nothing freed under a handle and nothing leaked (the sanitizer
// builds run this too). The moves that carry a table object to a new name
// are the ones that could lose it: once it has left its old name, a
// failure can neither give it back nor free it.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <map>
#include <new>
#include <string>
#include <string_view>

#include "sr_row_test_support.h"

namespace {

// The allocation that fails: counted down by each one while the count is
// positive, the one that takes it to 0 fails; 0 means none fails.
std::atomic<long> Allocations_Before_Failure{0};

bool this_allocation_fails() {
  long left = Allocations_Before_Failure.load(std::memory_order_relaxed);
  while (left > 0) {
    if (Allocations_Before_Failure.compare_exchange_weak(left, left - 1)) {
      return left == 1;
    }
  }
  return false;
}

// The test's own allocations while a failure waits: made as if none could
// fail, and the count left as it was.
class test_allocations {
 public:
  test_allocations() : left_(Allocations_Before_Failure.exchange(0)) {}
  ~test_allocations() { Allocations_Before_Failure = left_; }
  test_allocations(const test_allocations &) = delete;
  test_allocations &operator=(const test_allocations &) = delete;

 private:
  long left_;
};

void *allocate(std::size_t size, std::size_t alignment) {
  if (this_allocation_fails()) {
    return nullptr;
  }
  const std::size_t bytes = size == 0 ? 1 : size;
  if (alignment <= alignof(std::max_align_t)) {
    return std::malloc(bytes);
  }
  return std::aligned_alloc(alignment, (bytes + alignment - 1) / alignment * alignment);
}

void *allocate_or_throw(std::size_t size, std::size_t alignment) {
  void *p_memory = allocate(size, alignment);
  if (p_memory == nullptr) {
    throw std::bad_alloc();
  }
  return p_memory;
}

}  // namespace

void *operator new(std::size_t size) {
  return allocate_or_throw(size, 0);
}
void *operator new[](std::size_t size) {
  return allocate_or_throw(size, 0);
}
void *operator new(std::size_t size, std::align_val_t alignment) {
  return allocate_or_throw(size, static_cast<std::size_t>(alignment));
}
void *operator new[](std::size_t size, std::align_val_t alignment) {
  return allocate_or_throw(size, static_cast<std::size_t>(alignment));
}
void *operator new(std::size_t size, const std::nothrow_t &) noexcept {
  return allocate(size, 0);
}
void *operator new[](std::size_t size, const std::nothrow_t &) noexcept {
  return allocate(size, 0);
}
void *operator new(std::size_t size, std::align_val_t alignment, const std::nothrow_t &) noexcept {
  return allocate(size, static_cast<std::size_t>(alignment));
}
void *operator new[](std::size_t size, std::align_val_t alignment,
                     const std::nothrow_t &) noexcept {
  return allocate(size, static_cast<std::size_t>(alignment));
}
void operator delete(void *p_memory) noexcept {
  std::free(p_memory);
}
void operator delete[](void *p_memory) noexcept {
  std::free(p_memory);
}
void operator delete(void *p_memory, std::size_t) noexcept {
  std::free(p_memory);
}
void operator delete[](void *p_memory, std::size_t) noexcept {
  std::free(p_memory);
}
void operator delete(void *p_memory, std::align_val_t) noexcept {
  std::free(p_memory);
}
void operator delete[](void *p_memory, std::align_val_t) noexcept {
  std::free(p_memory);
}
void operator delete(void *p_memory, std::size_t, std::align_val_t) noexcept {
  std::free(p_memory);
}
void operator delete[](void *p_memory, std::size_t, std::align_val_t) noexcept {
  std::free(p_memory);
}

namespace {

using namespace sr_test;

using rows_t = std::map<std::string, int32_t>;
const rows_t Rows = {{"a", 1}, {"b", 2}, {"c", 3}};
const rows_t Old_Target = {{"old", 7}};

// One way to copy or move: where the source and the target lie, whether
// the source is open, and whether a table already lies at the target.
struct way_t {
  const char *p_name;
  const char *p_source;
  const char *p_target;
  bool by_handle;
  bool move;
  bool target_open;  // a target is open here: replaced in memory, read again on disk
};

const way_t Ways[] = {
    {"move in memory", "/m/a", "/m/b", true, true, false},
    {"move an open file within its directory", "/disk/a", "/disk/b", true, true, false},
    {"move a file into memory", "/disk/a", "/m/b", false, true, false},
    {"move in memory onto an open table", "/m/a", "/m/t", true, true, true},
    {"copy in memory onto an open table", "/m/a", "/m/t", true, false, true},
    {"copy memory to a file", "/m/a", "/disk/b", true, false, false},
    {"copy a file onto an open table file", "/disk/a", "/disk/t", false, false, true},
    {"move a file onto an open table file", "/disk/a", "/disk/t", false, true, true},
};

class AllocationFailure : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    mount_disk();
  }
  void TearDown() override {
    Allocations_Before_Failure = 0;
    RowTables::TearDown();
  }

  // The rows at `p_path` in this tree, or one "<code>" entry.
  rows_t rows_at(const char *p_path) {
    sr_opaque_handle_t table = nullptr;
    if (const int32_t rc = sr_open_table_1(tree_, p_path, SR_MODE_READ, &table); rc != 0) {
      return {{"<" + std::to_string(rc) + ">", rc}};
    }
    rows_t rows = rows_in<std::string>(table, "name", 0);
    EXPECT_EQ(sr_close_table_1(table), 0);
    return rows;
  }

  // Makes the tables of `way` afresh: the source with Rows committed (its
  // handle in `*p_source`, or closed for a move by name) and the open
  // target with Old_Target (`*p_target`).
  void prepare(const way_t &way, sr_opaque_handle_t *p_source, sr_opaque_handle_t *p_target) {
    for (const char *p_path : {"/m/a", "/m/b", "/m/t", "/disk/a", "/disk/b", "/disk/t"}) {
      sr_delete_table_1(tree_, p_path);
    }
    *p_source = create_named_counts(way.p_source, Explicit);
    ASSERT_NE(*p_source, nullptr);
    for (const auto &[name, count] : Rows) {
      ASSERT_EQ(add_named(*p_source, name.c_str(), count), 0);
    }
    apply_commit(*p_source);
    if (!way.by_handle) {
      ASSERT_EQ(sr_close_table_1(*p_source), 0);
      *p_source = nullptr;
    }
    *p_target = nullptr;
    if (way.target_open) {
      *p_target = create_named_counts(way.p_target, Implicit);
      ASSERT_NE(*p_target, nullptr);
      ASSERT_EQ(add_named(*p_target, "old", 7), 0);
    }
  }

  int32_t take(const way_t &way, sr_opaque_handle_t source) const {
    if (!way.by_handle) {
      return way.move ? sr_move_table_by_name_1(tree_, way.p_source, way.p_target, 1)
                      : sr_copy_table_by_name_1(tree_, way.p_source, way.p_target, 1);
    }
    return way.move ? sr_move_table_by_handle_1(source, way.p_target, 1)
                    : sr_copy_table_by_handle_1(source, way.p_target, 1);
  }
};

// Fails the first allocation of the call, then the second, and so on until
// the call no longer allocates as often as the count says. A call may get
// over a failed allocation and succeed; otherwise it fails with 12.
TEST_F(AllocationFailure, EveryFailedAllocationOfACopyOrMoveLeavesBothTablesAsTheyWere) {
  int failures = 0;
  for (const way_t &way : Ways) {
    SCOPED_TRACE(way.p_name);
    bool succeeded = false;
    for (long nth = 1; !succeeded && nth < 10000; ++nth) {
      SCOPED_TRACE("allocation " + std::to_string(nth) + " fails");
      sr_opaque_handle_t source = nullptr, target = nullptr;
      ASSERT_NO_FATAL_FAILURE(prepare(way, &source, &target));
      Allocations_Before_Failure = nth;
      const int32_t rc = take(way, source);
      const bool injected = Allocations_Before_Failure.exchange(0) == 0;
      succeeded = !injected;
      if (rc == 0) {
        EXPECT_EQ(rows_at(way.p_target), Rows);
        if (way.move) {
          EXPECT_EQ(rows_at(way.p_source), (rows_t{{"<200>", 200}}));
        }
      } else {
        ++failures;
        ASSERT_EQ(rc, SR_E_NO_MEMORY);
        EXPECT_EQ(rows_at(way.p_source), Rows);
        const rows_t old_target = way.target_open ? Old_Target : rows_t{{"<200>", 200}};
        EXPECT_EQ(rows_at(way.p_target), old_target);
      }
      // The handles work whatever happened: the source's on its table; the
      // target's on the table it had, on the detached one when a transient
      // target was replaced, or on the new file that an open table file
      // was given.
      if (source != nullptr) {
        EXPECT_EQ(rows_in<std::string>(source, "name", 0), Rows);
        EXPECT_EQ(sr_close_table_1(source), 0);
      }
      if (target != nullptr) {
        const bool refreshed = rc == 0 && std::string_view(way.p_target).starts_with("/disk/");
        EXPECT_EQ(rows_in<std::string>(target, "name", 0), refreshed ? Rows : Old_Target);
        EXPECT_EQ(sr_close_table_1(target), 0);
      }
    }
    EXPECT_TRUE(succeeded) << "the call never got through";
  }
  std::printf("[ injected ] %d failed allocations\n", failures);
}

// One change of a persistent table with committed Rows, open for explicit
// control: what is made pending or applied first, the change itself, and
// the rows the file holds once the change is applied and committed.
struct change_t {
  const char *p_name;
  enum { Nothing, Added, Applied } before;
  int32_t (*change)(sr_opaque_handle_t table);
  rows_t committed;
};

// The row "d" with count 4, added without an allocation of the test's.
int32_t add_d(sr_opaque_handle_t table) {
  const char *names[] = {"name", "count"};
  qv_value_t name = string_value("d");
  qv_value_t count = int32_value(4);
  qv_value_t *values[] = {&name, &count};
  return sr_add_row_1(table, names, values, 2);
}

const change_t Changes[] = {
    {"add a row", change_t::Nothing, add_d, {{"a", 1}, {"b", 2}, {"c", 3}, {"d", 4}}},
    {"set a field",
     change_t::Nothing,
     [](sr_opaque_handle_t table) {
       const qv_value_t count = int32_value(20);
       return sr_set_field_by_key_1(table, string_value("b"), "count", &count);
     },
     {{"a", 1}, {"b", 20}, {"c", 3}}},
    {"delete rows",
     change_t::Nothing,
     [](sr_opaque_handle_t table) { return sr_delete_rows_1(table, "count > $i", 2); },
     {{"a", 1}, {"b", 2}}},
    {"apply",
     change_t::Added,
     [](sr_opaque_handle_t table) { return sr_apply_1(table, 0); },
     {{"a", 1}, {"b", 2}, {"c", 3}, {"d", 4}}},
    {"commit", change_t::Applied, sr_commit_1, {{"a", 1}, {"b", 2}, {"c", 3}, {"d", 4}}},
    {"select", change_t::Nothing,
     [](sr_opaque_handle_t table) {
       sr_opaque_handle_t result = nullptr;
       const int32_t rc = sr_select_1(table, nullptr, 0, &result, "count > $i", 1);
       if (rc != 0) {
         return rc;
       }
       {
         test_allocations checking;
         EXPECT_EQ(rows_in<std::string>(result, "name", 0), (rows_t{{"b", 2}, {"c", 3}}));
       }
       return sr_close_table_1(result);
     },
     Rows},
};

// Each allocation of each change fails in turn. A change that fails for
// want of memory leaves the table as it was, so that the same change tried
// again succeeds, and the file ends up with the change made once.
TEST_F(AllocationFailure, EveryFailedAllocationOfAChangeLeavesTheTableToTryAgain) {
  int failures = 0;
  for (const change_t &change : Changes) {
    SCOPED_TRACE(change.p_name);
    bool succeeded = false;
    for (long nth = 1; !succeeded && nth < 10000; ++nth) {
      SCOPED_TRACE("allocation " + std::to_string(nth) + " fails");
      sr_delete_table_1(tree_, "/disk/c");
      sr_opaque_handle_t table = create_named_counts("/disk/c", Explicit);
      ASSERT_NE(table, nullptr);
      for (const auto &[name, count] : Rows) {
        ASSERT_EQ(add_named(table, name.c_str(), count), 0);
      }
      apply_commit(table);
      if (change.before != change_t::Nothing) {
        ASSERT_EQ(add_d(table), 0);
      }
      if (change.before == change_t::Applied) {
        ASSERT_EQ(sr_apply_1(table, 0), 0);
      }
      Allocations_Before_Failure = nth;
      const int32_t rc = change.change(table);
      succeeded = Allocations_Before_Failure.exchange(0) != 0;
      if (rc != 0) {
        ++failures;
        ASSERT_EQ(rc, SR_E_NO_MEMORY);
        ASSERT_EQ(change.change(table), 0) << "the change cannot be tried again";
      }
      // The change made, it is applied (unless that was the change or came
      // before it) and committed.
      if (change.before == change_t::Nothing) {
        ASSERT_EQ(sr_apply_1(table, 0), 0);
      }
      if (change.change != sr_commit_1) {
        ASSERT_EQ(sr_commit_1(table), 0);
      }
      EXPECT_EQ(rows_in<std::string>(table, "name", 0), change.committed);
      ASSERT_EQ(sr_close_table_1(table), 0);
      EXPECT_EQ(rows_at("/disk/c"), change.committed);
    }
    EXPECT_TRUE(succeeded) << "the change never got through";
  }
  std::printf("[ injected ] %d failed allocations\n", failures);
}

}  // namespace
