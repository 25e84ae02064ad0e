// The table object: the row index hands out the lowest free position,
// grows by doubling without losing pending changes, and answers block
// containment for the file writer.

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <vector>

#include "sr_i_table.h"

namespace {

class TableObject : public ::testing::Test {
 protected:
  void SetUp() override {
    p_table_ = sr_i_create_null_table();
    ASSERT_NE(p_table_, nullptr);
  }
  void TearDown() override { sr_i_close_table(p_table_); }

  size_t position_of(const sr_i_index_entry_t *p_entry) const {
    return static_cast<size_t>(p_entry - p_table_->p_rows_fixed_index);
  }
  // Appends a pending change for the entry, as adding a row does.
  void add_pending_change(sr_i_index_entry_t *p_entry) {
    auto *p_change =
        static_cast<sr_i_change_entry_t *>(std::calloc(1, sizeof(sr_i_change_entry_t)));
    ASSERT_NE(p_change, nullptr);
    p_change->p_index_entry = p_entry;
    p_change->p_prev = p_table_->p_rows_change_list_tail;
    if (p_table_->p_rows_change_list_tail != nullptr) {
      p_table_->p_rows_change_list_tail->p_next = p_change;
    } else {
      p_table_->p_rows_change_list = p_change;
    }
    p_table_->p_rows_change_list_tail = p_change;
    p_entry->p_pending_change = p_change;
  }

  sr_i_table_t *p_table_ = nullptr;
};

TEST_F(TableObject, NewTableStartsEmptyWithCountersAtOne) {
  EXPECT_EQ(p_table_->change_counter, 1u);
  EXPECT_EQ(p_table_->file_fd, -1);
  EXPECT_EQ(p_table_->rewrite_file_fd, -1);
  ASSERT_EQ(sr_i_establish_rows_index(p_table_, 0), 0);
  EXPECT_EQ(p_table_->maximum_rows, Sr_Default_Index_Rows);
}

TEST_F(TableObject, FreedPositionsAreReusedLowestFirst) {
  ASSERT_EQ(sr_i_establish_rows_index(p_table_, 10), 0);
  std::vector<sr_i_index_entry_t *> taken;
  for (int row = 0; row < 10; ++row) {
    taken.push_back(sr_i_rows_free_chain_remove(p_table_));
    ASSERT_EQ(position_of(taken.back()), static_cast<size_t>(row));
  }
  EXPECT_EQ(sr_i_rows_free_chain_remove(p_table_), nullptr);
  taken[7]->p_committed = taken[7];  // some state that must be cleared
  sr_i_rows_free_chain_insert(p_table_, taken[7]);
  sr_i_rows_free_chain_insert(p_table_, taken[5]);
  sr_i_rows_free_chain_insert(p_table_, taken[2]);
  EXPECT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), 2u);
  EXPECT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), 5u);
  sr_i_index_entry_t *p_seven = sr_i_rows_free_chain_remove(p_table_);
  EXPECT_EQ(position_of(p_seven), 7u);
  EXPECT_EQ(p_seven->p_committed, nullptr);
  EXPECT_EQ(sr_i_rows_free_chain_remove(p_table_), nullptr);
}

TEST_F(TableObject, GrowingKeepsPendingChangesOnTheirRows) {
  ASSERT_EQ(sr_i_establish_rows_index(p_table_, Sr_Initial_Transient_Rows), 0);
  for (uint32_t row = 0; row < Sr_Initial_Transient_Rows; ++row) {
    sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_table_);
    p_entry->packed_index = row;  // a mark to find the row by after a move
    add_pending_change(p_entry);
  }
  // Something allocated behind the index makes a move on growth likely.
  void *p_neighbour = std::malloc(64);
  ASSERT_EQ(sr_i_rows_free_chain_remove(p_table_), nullptr);
  ASSERT_EQ(sr_i_grow_index(p_table_, p_table_->maximum_rows), 0);
  std::free(p_neighbour);
  EXPECT_EQ(p_table_->maximum_rows, 200u);
  EXPECT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), 100u);
  uint32_t row = 0;
  for (sr_i_change_entry_t *p_change = p_table_->p_rows_change_list; p_change != nullptr;
       p_change = p_change->p_next, ++row) {
    EXPECT_EQ(position_of(p_change->p_index_entry), row);
    EXPECT_EQ(p_change->p_index_entry->packed_index, row);
    EXPECT_EQ(p_change->p_index_entry->p_pending_change, p_change);
  }
  EXPECT_EQ(row, 100u);
  // The new positions come out in order after the first.
  for (uint32_t position = 101; position < 200; ++position) {
    ASSERT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), position);
  }
}

TEST_F(TableObject, RecordEndingOnABlockBoundaryIsNotContained) {
  p_table_->block_size = 4096;
  uint32_t block = 99;
  EXPECT_FALSE(sr_i_record_contained_in_block(p_table_, 4000, 96, block));
  EXPECT_TRUE(sr_i_record_contained_in_block(p_table_, 4000, 95, block));
  EXPECT_EQ(block, 0u);
  EXPECT_TRUE(sr_i_record_contained_in_block(p_table_, 8192, 100, block));
  EXPECT_EQ(block, 2u);
}

TEST_F(TableObject, FilePathSwitchesBetweenDataAndRewriteFile) {
  const char name[] = "/var/reg/cfg,t\0rewrite";
  p_table_->p_file_path = static_cast<char *>(std::malloc(sizeof name));
  std::memcpy(p_table_->p_file_path, name, sizeof name);
  p_table_->file_path_length = 14;
  sr_i_set_rewrite_path(p_table_);
  EXPECT_STREQ(p_table_->p_file_path, "/var/reg/cfg,t.rewrite");
  sr_i_set_data_path(p_table_);
  EXPECT_STREQ(p_table_->p_file_path, "/var/reg/cfg,t");
}

}  // namespace
