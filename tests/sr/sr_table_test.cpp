// The table object: the row index hands out the lowest free position, also
// as it grows and while part of it was never used, and answers block
// containment for the file writer.

#include <gtest/gtest.h>

#include <cstddef>
#include <random>
#include <set>
#include <vector>

#include "tables/sr_i_table.h"

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

// Positions given back in any order while part of the index was never
// handed out, and growth whenever nothing is free: every take is the lowest
// free position, cleared of what its last row left there.
TEST_F(TableObject, TakesAgreeWithASetOfFreePositionsThroughReturnsAndGrowth) {
  ASSERT_EQ(sr_i_establish_rows_index(p_table_, 0), 0);  // no size: the default
  ASSERT_EQ(p_table_->maximum_rows, Sr_Default_Index_Rows);
  std::set<size_t> free_positions;
  for (size_t position = 0; position < Sr_Default_Index_Rows; ++position) {
    free_positions.insert(position);
  }
  std::vector<size_t> taken;
  std::mt19937 random(3);
  for (int step = 0; step < 3000; ++step) {
    if (taken.empty() || random() % 3 != 0) {
      sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_table_);
      if (free_positions.empty()) {
        ASSERT_EQ(p_entry, nullptr);
        const uint32_t old_rows = p_table_->maximum_rows;
        ASSERT_EQ(sr_i_grow_index(p_table_, old_rows), 0);
        for (size_t position = old_rows; position < 2 * size_t{old_rows}; ++position) {
          free_positions.insert(position);
        }
        continue;
      }
      ASSERT_NE(p_entry, nullptr);
      ASSERT_EQ(position_of(p_entry), *free_positions.begin()) << "step " << step;
      ASSERT_EQ(p_entry->p_committed, nullptr) << "step " << step;
      free_positions.erase(free_positions.begin());
      taken.push_back(position_of(p_entry));
      p_entry->p_committed = p_entry;  // a row's state, to be cleared when it goes
    } else {
      const size_t at = random() % taken.size();
      sr_i_rows_free_chain_insert(p_table_, p_table_->p_rows_fixed_index + taken[at]);
      free_positions.insert(taken[at]);
      taken.erase(taken.begin() + static_cast<std::ptrdiff_t>(at));
    }
  }
  EXPECT_GT(p_table_->maximum_rows, 4 * Sr_Default_Index_Rows);
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
