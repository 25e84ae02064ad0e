// Many reader threads and one writer on one table: readers never see a row
// half-changed (a row's two columns always agree) and never fail with
// anything but "no such row", while the writer adds, updates, deletes and
// commits through an implicitly controlled handle.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

using RowThreads = RowTables;

TEST_F(RowThreads, ReadersSeeWholeRowsWhileAWriterCommits) {
  // The note of each row always spells its count: a torn row breaks that.
  sr_opaque_handle_t table = create_named_counts("/threads/t", Implicit, SR_PRIMARY_KEY_NOCHECK);
  constexpr int Rows = 20;
  for (int row = 0; row < Rows; ++row) {
    const std::string text = std::to_string(row);
    ASSERT_EQ(add_fields(table, {{"name", string_value(text.c_str())},
                                 {"count", int32_value(row)},
                                 {"note", string_value(text.c_str())}}),
              0);
  }

  std::atomic<bool> writing{true};
  std::atomic<int> torn{0}, unexpected{0}, reads{0};
  auto reader = [&](uint32_t uncommitted) {
    while (writing.load()) {
      for (int32_t packed = 0; packed < Rows; ++packed) {
        qv_value_t count{}, note{};
        const char *names[] = {"count", "note"};
        qv_value_t *results[] = {&count, &note};
        const int32_t rc = sr_get_fields_by_index_and_visibility_1(table, packed, names, results, 2,
                                                                   uncommitted, nullptr);
        if (rc == 0) {
          if (std::to_string(count.val_int32) != note.ptr_char) {
            ++torn;
          }
          std::free(note.ptr_char);
          ++reads;
        } else if (rc != SR_E_NO_ROW_FOR_INDEX && rc != SR_E_ROW_DELETED) {
          ++unexpected;
        }
      }
    }
  };
  std::vector<std::thread> readers;
  for (int at = 0; at < 4; ++at) {
    readers.emplace_back(reader, static_cast<uint32_t>(at % 2));
  }

  while (reads.load() == 0) {
    std::this_thread::yield();  // the readers are under way before the writer starts
  }
  for (int round = 0; round < 300; ++round) {
    const int32_t value = 1000 + round;
    const std::string text = std::to_string(value);
    const field_list row{{"count", int32_value(value)}, {"note", string_value(text.c_str())}};
    ASSERT_EQ(
        sr_set_fields_by_index_1(table, round % Rows, row.names.data(), row.pointers.data(), 2), 0);
    if (round % 10 == 0) {
      ASSERT_EQ(sr_delete_row_by_index_1(table, 0), 0);
      ASSERT_EQ(add_fields(table, {{"name", string_value("again")},
                                   {"count", int32_value(value)},
                                   {"note", string_value(text.c_str())}}),
                0);
    }
  }
  writing = false;
  for (std::thread &thread : readers) {
    thread.join();
  }
  EXPECT_EQ(torn.load(), 0);
  EXPECT_EQ(unexpected.load(), 0);
  EXPECT_GT(reads.load(), 0);
}

}  // namespace
