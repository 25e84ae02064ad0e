// Entering many rows into a key hash table at once: the chains come out as
// adding the rows one by one makes them (same buckets, same order, the
// newest of equal keys first), each entry names its bucket and element, a
// repeated key under SR_PRIMARY_KEY is refused wherever it lies, and a
// refusal or a bad bucket leaves the table empty and usable.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <numeric>
#include <random>
#include <vector>

#include "qv_cu.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

namespace {

using sr_test::last_error;

constexpr uint32_t Buckets = 16;

uint32_t key_of(const void *p_key) {
  uint32_t key;
  std::memcpy(&key, p_key, sizeof key);
  return key;
}
uint32_t sixteen_buckets(const void *p_key) {
  return key_of(p_key) * 2654435761u >> 28;
}
// Every key is its own bucket: keys of 16 and above are refused.
uint32_t key_is_bucket(const void *p_key) {
  return key_of(p_key);
}
int32_t compare_keys(const void *p_stored_key, const void *p_key) {
  return key_of(p_stored_key) == key_of(p_key) ? 0 : 1;
}

// The entries point at their keys through p_committed, as a row's entry
// points at its record.
const void *entry_key(const void *, const sr_i_index_entry_t *p_entry) {
  return p_entry->p_committed;
}

struct rows_to_enter {
  explicit rows_to_enter(std::vector<uint32_t> row_keys)
      : keys(std::move(row_keys)), entries(keys.size()) {
    for (size_t row = 0; row < keys.size(); ++row) {
      entries[row].p_committed = &keys[row];
    }
  }
  int32_t enter(sr_hash_table_t *p_table, uint32_t qualifier) {
    return sr_i_hash_table_add_entries(p_table, entries.data(),
                                       static_cast<uint32_t>(entries.size()), entry_key, nullptr,
                                       static_cast<sr_qualifier_t>(qualifier));
  }
  std::vector<uint32_t> keys;
  std::vector<sr_i_index_entry_t> entries;
};

// The row numbers of each bucket's chain, head first.
std::vector<std::vector<uint32_t>> chains(const sr_hash_table_t *p_table) {
  std::vector<std::vector<uint32_t>> rows(p_table->total_hash_buckets);
  for (uint32_t bucket = 0; bucket < p_table->total_hash_buckets; ++bucket) {
    for (const sr_hash_table_element_t *p_element = p_table->p_elements[bucket];
         p_element != nullptr; p_element = p_element->p_next) {
      rows[bucket].push_back(p_element->row_index);
    }
  }
  return rows;
}

struct HashTableAddEntries : ::testing::Test {
  void SetUp() override {
    ASSERT_EQ(sr_i_hash_table_open(Buckets, sixteen_buckets, compare_keys, &p_table), 0);
  }
  void TearDown() override { sr_i_hash_table_close(p_table); }

  // The same rows added one at a time to a table of their own.
  std::vector<std::vector<uint32_t>> chains_added_one_by_one(const rows_to_enter &rows,
                                                             uint32_t qualifier) {
    sr_hash_table_t *p_other = nullptr;
    EXPECT_EQ(sr_i_hash_table_open(Buckets, sixteen_buckets, compare_keys, &p_other), 0);
    for (uint32_t row = 0; row < rows.keys.size(); ++row) {
      uint32_t bucket = 0;
      sr_hash_table_element_t *p_element = nullptr;
      EXPECT_EQ(sr_i_hash_table_add(p_other, &rows.keys[row], row, &bucket, &p_element,
                                    static_cast<sr_qualifier_t>(qualifier)),
                0);
    }
    std::vector<std::vector<uint32_t>> result = chains(p_other);
    sr_i_hash_table_close(p_other);
    return result;
  }

  // No key of `keys` is found, and the table takes rows again.
  void expect_empty_and_usable(const std::vector<uint32_t> &keys) {
    for (const uint32_t key : keys) {
      uint32_t row = 0;
      EXPECT_EQ(sr_i_hash_table_get_index(p_table, &key, &row, nullptr), SR_E_NO_ROW_FOR_KEY)
          << key;
    }
    rows_to_enter again({7, 8, 9});
    EXPECT_EQ(again.enter(p_table, SR_PRIMARY_KEY), 0);
    uint32_t row = 0;
    const uint32_t key = 8;
    EXPECT_EQ(sr_i_hash_table_get_index(p_table, &key, &row, nullptr), 0);
    EXPECT_EQ(row, 1u);
  }

  sr_hash_table_t *p_table = nullptr;
};

TEST_F(HashTableAddEntries, UniqueKeysMakeTheChainsOfAddingOneByOne) {
  std::vector<uint32_t> keys(3000);
  std::iota(keys.begin(), keys.end(), 100u);
  std::shuffle(keys.begin(), keys.end(), std::mt19937(3));
  rows_to_enter rows(keys);
  ASSERT_EQ(rows.enter(p_table, SR_PRIMARY_KEY), 0);
  EXPECT_EQ(chains(p_table), chains_added_one_by_one(rows, SR_PRIMARY_KEY));
  for (uint32_t row = 0; row < keys.size(); ++row) {
    const sr_i_index_entry_t &entry = rows.entries[row];
    EXPECT_EQ(entry.hash_index, sixteen_buckets(&keys[row]));
    ASSERT_NE(entry.p_hash_table_element, nullptr);
    EXPECT_EQ(entry.p_hash_table_element->row_index, row);
    EXPECT_EQ(entry.p_hash_table_element->p_key_value, &rows.keys[row]);
    uint32_t found = 0;
    ASSERT_EQ(sr_i_hash_table_get_index(p_table, &keys[row], &found, nullptr), 0);
    EXPECT_EQ(found, row);
  }
  // Each entry's element is unlinked from its bucket by identity.
  for (const sr_i_index_entry_t &entry : rows.entries) {
    ASSERT_EQ(sr_i_hash_table_remove_element(p_table, entry.hash_index, entry.p_hash_table_element),
              0);
  }
  EXPECT_EQ(chains(p_table), std::vector<std::vector<uint32_t>>(Buckets));
}

TEST_F(HashTableAddEntries, UncheckedKeysAreAllKeptTheNewestFirst) {
  std::vector<uint32_t> keys;
  std::mt19937 random(5);
  for (int row = 0; row < 2000; ++row) {
    keys.push_back(random() % 300);
  }
  rows_to_enter rows(keys);
  ASSERT_EQ(rows.enter(p_table, SR_PRIMARY_KEY_NOCHECK), 0);
  EXPECT_EQ(chains(p_table), chains_added_one_by_one(rows, SR_PRIMARY_KEY_NOCHECK));
  for (uint32_t key = 0; key < 300; ++key) {
    const auto last = std::find(keys.rbegin(), keys.rend(), key);
    uint32_t found = 0;
    const int32_t rc = sr_i_hash_table_get_index(p_table, &key, &found, nullptr);
    if (last == keys.rend()) {
      EXPECT_EQ(rc, SR_E_NO_ROW_FOR_KEY);
    } else {
      ASSERT_EQ(rc, 0);
      EXPECT_EQ(found, static_cast<uint32_t>(keys.rend() - last - 1)) << key;
    }
  }
}

TEST_F(HashTableAddEntries, ARepeatedKeyIsRefusedWhereverItLiesAndLeavesTheTableEmpty) {
  std::vector<uint32_t> distinct(1000);
  std::iota(distinct.begin(), distinct.end(), 0u);
  // The repeat first and last, side by side, and far apart in the middle.
  for (const auto &[first, second] : {std::pair{0, 999}, {500, 501}, {10, 700}, {998, 999}}) {
    SCOPED_TRACE(std::to_string(first) + " " + std::to_string(second));
    std::vector<uint32_t> keys = distinct;
    keys[second] = keys[first];
    rows_to_enter rows(keys);
    cu_set_no_error_1();
    EXPECT_EQ(rows.enter(p_table, SR_PRIMARY_KEY), SR_E_DUPLICATE_KEY);
    EXPECT_EQ(last_error().first, SR_E_DUPLICATE_KEY);
    EXPECT_EQ(chains(p_table), std::vector<std::vector<uint32_t>>(Buckets));
    expect_empty_and_usable(keys);
    sr_i_hash_table_close(p_table);
    ASSERT_EQ(sr_i_hash_table_open(Buckets, sixteen_buckets, compare_keys, &p_table), 0);
  }
}

TEST_F(HashTableAddEntries, ABadBucketOrATableInUseIsRefusedWith15) {
  sr_i_hash_table_close(p_table);
  ASSERT_EQ(sr_i_hash_table_open(Buckets, key_is_bucket, compare_keys, &p_table), 0);
  // Row 40's key is no bucket; the rows before it went in and come out.
  std::vector<uint32_t> keys(60);
  for (uint32_t row = 0; row < keys.size(); ++row) {
    keys[row] = row % Buckets;
  }
  keys[40] = Buckets;
  rows_to_enter rows(keys);
  EXPECT_EQ(rows.enter(p_table, SR_PRIMARY_KEY_NOCHECK), SR_E_INTERNAL);
  EXPECT_EQ(last_error().first, SR_E_INTERNAL);
  expect_empty_and_usable({0, 1, 2, 3, 4, 5, 6, 10, 11, 12, 15});
  // It now holds three rows: a second bulk add would not start from empty.
  rows_to_enter more({1, 2});
  EXPECT_EQ(more.enter(p_table, SR_PRIMARY_KEY), SR_E_INTERNAL);
}

}  // namespace
