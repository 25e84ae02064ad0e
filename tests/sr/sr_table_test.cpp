// The table object: the row index hands out the lowest free position, and
// answers block containment for the file writer.

#include <gtest/gtest.h>

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
  sr_i_table_t *p_table_ = nullptr;
};

TEST_F(TableObject, NewTableStartsEmptyWithCountersAtOneAndNoFiles) {
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
  // Given back in neither ascending nor descending order.
  sr_i_rows_free_chain_insert(p_table_, taken[5]);
  sr_i_rows_free_chain_insert(p_table_, taken[7]);
  sr_i_rows_free_chain_insert(p_table_, taken[2]);
  EXPECT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), 2u);
  EXPECT_EQ(position_of(sr_i_rows_free_chain_remove(p_table_)), 5u);
  sr_i_index_entry_t *p_seven = sr_i_rows_free_chain_remove(p_table_);
  EXPECT_EQ(position_of(p_seven), 7u);
  EXPECT_EQ(p_seven->p_committed, nullptr);
  EXPECT_EQ(sr_i_rows_free_chain_remove(p_table_), nullptr);
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

}  // namespace
