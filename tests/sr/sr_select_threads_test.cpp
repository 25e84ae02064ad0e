// Selections while a writer commits: every selection and every listing sees
// one whole committed state (a transaction moves an amount between two rows,
// so the committed sum never changes), and in a forked child both calls still
// work, since selecting changes nothing another process shares.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdarg>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

constexpr int32_t Rows = 40;
constexpr int32_t Start_Count = 100;

// The sum of "count" over every row of a result table, or -1.
int64_t sum_of_counts(sr_opaque_handle_t result) {
  int64_t sum = 0;
  for (uint32_t packed = 0;; ++packed) {
    qv_value_t count{};
    const int32_t rc =
        sr_get_field_by_index_1(result, static_cast<int32_t>(packed), "count", &count);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      return sum;
    }
    if (rc != 0) {
      return -1;
    }
    sum += count.val_int32;
  }
}

class SelectThreads : public RowTables {
 protected:
  void SetUp() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    RowTables::SetUp();
    table_ = create_named_counts("/threads/select", Explicit);
    for (int32_t row = 0; row < Rows; ++row) {
      ASSERT_EQ(add_named(table_, std::to_string(row).c_str(), Start_Count), 0);
    }
    apply_commit(table_);
  }

  sr_opaque_handle_t table_ = nullptr;
};

TEST_F(SelectThreads, SelectionsAndListingsSeeWholeCommittedStatesWhileAWriterCommits) {
  std::atomic<bool> writing{true};
  std::atomic<int> wrong{0}, selections{0};
  auto selector = [&] {
    while (writing.load() || selections.load() < 20) {
      sr_opaque_handle_t result = nullptr;
      if (sr_select_1(table_, nullptr, 0, &result, "count >= $i", 0) != 0 ||
          sum_of_counts(result) != int64_t{Rows} * Start_Count || sr_close_table_1(result) != 0) {
        ++wrong;
      }
      ++selections;
    }
  };
  auto lister = [&] {
    while (writing.load()) {
      uint32_t total = 0;
      uint32_t *p_rows = nullptr;
      if (list_rows(table_, 0, &total, &p_rows, nullptr) != 0 || total != Rows) {
        ++wrong;
      }
      std::free(p_rows);
    }
  };
  std::vector<std::thread> readers;
  readers.emplace_back(selector);
  readers.emplace_back(selector);
  readers.emplace_back(lister);
  while (selections.load() == 0) {
    std::this_thread::yield();  // the readers are under way before the writer starts
  }
  for (int32_t round = 0; round < 200; ++round) {
    // One unit moves from one row to the next: the sum stays.
    const std::string from = std::to_string(round % Rows);
    const std::string to = std::to_string((round + 1) % Rows);
    const qv_value_t from_count = int32_value(count_of(table_, from.c_str(), 0) - 1);
    const qv_value_t to_count = int32_value(count_of(table_, to.c_str(), 0) + 1);
    ASSERT_EQ(sr_set_field_by_key_1(table_, string_value(from.c_str()), "count", &from_count), 0);
    ASSERT_EQ(sr_set_field_by_key_1(table_, string_value(to.c_str()), "count", &to_count), 0);
    apply_commit(table_);
  }
  writing = false;
  for (std::thread &thread : readers) {
    thread.join();
  }
  EXPECT_EQ(wrong.load(), 0);
}

TEST_F(SelectThreads, AForkedChildSelectsAndLists) {
  const pid_t child = ::fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    sr_opaque_handle_t result = nullptr;
    uint32_t total = 0;
    uint32_t *p_rows = nullptr;
    const bool selected =
        sr_select_1(table_, nullptr, 0, &result, "count == $i", Start_Count) == 0 &&
        sum_of_counts(result) == int64_t{Rows} * Start_Count;
    const bool listed = list_rows(table_, 0, &total, &p_rows, "name == $s", "7") == 0 && total == 1;
    // A change is still refused in the child.
    const bool refused = add_named(table_, "new", 1) == SR_E_INTERNAL;
    ::_exit(selected && listed && refused ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

}  // namespace
