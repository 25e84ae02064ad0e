// The key hash table: client and built-in hashing, bucket numbers out of
// range, the statistics, a random sequence of operations under both key
// qualifiers, with unlinking by identity, checked against a std::multimap,
// and enough elements to span many element blocks with removed ones reused.

#include <gtest/gtest.h>

#include <iterator>
#include <map>
#include <random>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "qv_cu.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_hash_table.h"

namespace {

using sr_test::last_error;

constexpr uint32_t Buckets = 8;

uint32_t key_modulo_buckets(const void *p_key) {
  return *static_cast<const uint32_t *>(p_key) % Buckets;
}
// The same eight chains in a table large enough to give every bucket a home
// element, so that homes are taken, freed, taken again and put in front.
constexpr uint32_t Home_Bucket_Spacing = Sr_Home_Element_Buckets / Buckets;
uint32_t key_modulo_buckets_with_homes(const void *p_key) {
  return key_modulo_buckets(p_key) * Home_Bucket_Spacing;
}
uint32_t key_itself(const void *p_key) {
  return *static_cast<const uint32_t *>(p_key);
}
int32_t compare_keys(const void *p_stored_key, const void *p_key) {
  const uint32_t stored_key = *static_cast<const uint32_t *>(p_stored_key);
  return stored_key == *static_cast<const uint32_t *>(p_key) ? 0 : 1;
}

// The row found for the key, or -1 for a clean 202 (returned, nothing raised).
// The reader's walk must find the same row, having been shown the element
// it found before comparing it.
int64_t row_for(const sr_hash_table_t *p_table, const void *p_key) {
  uint32_t row = 0;
  cu_set_no_error_1();
  const int32_t rc = sr_i_hash_table_get_index(p_table, p_key, &row, nullptr);
  EXPECT_EQ(last_error().first, 0);
  uint32_t walked_row = 0;
  std::set<uint32_t> rows_shown;
  const int32_t walk_rc = sr_i_hash_table_find_row(
      p_table, p_key, &walked_row,
      [&](const sr_hash_table_element_t &element) { rows_shown.insert(element.row_index); });
  EXPECT_EQ(walk_rc, rc);
  if (rc == SR_E_NO_ROW_FOR_KEY) {
    return -1;
  }
  EXPECT_EQ(rc, 0);
  EXPECT_EQ(walked_row, row);
  EXPECT_EQ(rows_shown.count(row), 1u);
  return row;
}

int64_t row_for(const sr_hash_table_t *p_table, uint32_t key) {
  return row_for(p_table, &key);
}

struct ClientHashTable : ::testing::Test {
  void SetUp() override { open(false); }
  void open(bool with_homes) {
    ASSERT_EQ(sr_i_hash_table_open(with_homes ? Sr_Home_Element_Buckets : Buckets,
                                   with_homes ? key_modulo_buckets_with_homes : key_modulo_buckets,
                                   compare_keys, &p_table),
              0);
    ASSERT_EQ(p_table->p_home_elements != nullptr, with_homes);
    spacing = with_homes ? Home_Bucket_Spacing : 1;
  }
  void TearDown() override { EXPECT_EQ(sr_i_hash_table_close(p_table), 0); }
  int32_t add(const uint32_t &key, uint32_t row, uint32_t qualifier = SR_PRIMARY_KEY) {
    return sr_i_hash_table_add(p_table, &key, row, &bucket, &p_element,
                               static_cast<sr_qualifier_t>(qualifier));
  }
  sr_hash_table_t *p_table = nullptr;
  uint32_t spacing = 1;  // between the buckets the keys fall in
  uint32_t bucket = 0;
  sr_hash_table_element_t *p_element = nullptr;
};

// An element looked for in another bucket is not there: 202, no key named.
// The statistics list the buckets in use, then the totals.
TEST_F(ClientHashTable, ElementsAreFoundInTheirBucketAndCounted) {
  const uint32_t keys[] = {1, 9, 6};
  for (uint32_t at = 0; at < 3; ++at) {
    ASSERT_EQ(add(keys[at], at), 0);
  }
  EXPECT_EQ(sr_i_hash_table_remove_element(p_table, 2, p_element), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(last_error(),
            std::make_pair(SR_E_NO_ROW_FOR_KEY,
                           std::string("2605-202 There is no row corresponding to the specified "
                                       "key value.\n")));
  EXPECT_EQ(row_for(p_table, 6), 2);
  ::testing::internal::CaptureStdout();
  sr_i_hash_table_output_stats(p_table);
  EXPECT_EQ(::testing::internal::GetCapturedStdout(),
            "1 2\n6 1\n"
            "total hash buckets : 8\n"
            "max_bucket_count   : 2\n"
            "unused buckets     : 6\n");
}

TEST(HashTable, ClientBucketAtOrAboveTheCountIsRefusedWith15) {
  sr_hash_table_t *p_table = nullptr;
  ASSERT_EQ(sr_i_hash_table_open(Buckets, key_itself, compare_keys, &p_table), 0);
  const uint32_t inside = Buckets - 1, outside = Buckets;
  uint32_t bucket = 0, row = 0;
  sr_hash_table_element_t *p_element = nullptr;
  ASSERT_EQ(sr_i_hash_table_add(p_table, &inside, 4, &bucket, &p_element, SR_PRIMARY_KEY), 0);
  EXPECT_EQ(sr_i_hash_table_add(p_table, &outside, 5, &bucket, &p_element, SR_PRIMARY_KEY),
            SR_E_INTERNAL);
  EXPECT_EQ(last_error().first, SR_E_INTERNAL);
  EXPECT_EQ(sr_i_hash_table_get_index(p_table, &outside, &row, nullptr), SR_E_INTERNAL);
  EXPECT_EQ(sr_i_hash_table_remove(p_table, &outside), SR_E_INTERNAL);
  EXPECT_EQ(sr_i_hash_table_remove_element(p_table, Buckets, p_element), SR_E_INTERNAL);
  EXPECT_EQ(row_for(p_table, inside), 4);
  EXPECT_EQ(sr_i_hash_table_close(p_table), 0);
  EXPECT_EQ(sr_i_hash_table_close(nullptr), 0);
}

TEST(HashTable, BuiltInHashSharesABucketForHandlesDifferingAboveId4sLow14Bits) {
  sr_hash_table_t *p_table = nullptr;
  // The count and compare function given are replaced: this one would call every key equal.
  ASSERT_EQ(sr_i_hash_table_open(
                7, nullptr, [](const void *, const void *) { return 0; }, &p_table),
            0);
  EXPECT_EQ(p_table->total_hash_buckets, 16384u);
  const qv_resource_handle_t first{1, {10, 20, 30, 0x00012345}};
  const qv_resource_handle_t second{1, {11, 20, 30, 0xabcde345}};
  const qv_resource_handle_t first_copy = first;
  uint32_t first_bucket = 0, second_bucket = 0;
  sr_hash_table_element_t *p_first = nullptr, *p_second = nullptr, *p_found = nullptr;
  ASSERT_EQ(sr_i_hash_table_add(p_table, &first, 0, &first_bucket, &p_first, SR_PRIMARY_KEY), 0);
  ASSERT_EQ(sr_i_hash_table_add(p_table, &second, 1, &second_bucket, &p_second, SR_PRIMARY_KEY), 0);
  EXPECT_EQ(first_bucket, 0x2345u);
  EXPECT_EQ(second_bucket, 0x2345u);
  EXPECT_EQ(sr_i_hash_table_add(p_table, &first_copy, 2, &second_bucket, &p_found, SR_PRIMARY_KEY),
            SR_E_DUPLICATE_KEY);
  EXPECT_EQ(p_found, p_first);
  EXPECT_EQ(row_for(p_table, &first_copy), 0);
  EXPECT_EQ(row_for(p_table, &second), 1);
  EXPECT_EQ(sr_i_hash_table_close(p_table), 0);
}

// Random adds under both qualifiers, removals by element and by key, and
// lookups, against a multimap whose equal keys keep their insertion order:
// a checked add of a present key returns the newest equal element.
// The random and the many-element tests run on eight buckets alone and on
// eight buckets of a table with homes.
struct ClientHashTableLayouts : ClientHashTable, ::testing::WithParamInterface<bool> {
  void SetUp() override { open(GetParam()); }
};
INSTANTIATE_TEST_SUITE_P(WithAndWithoutHomes, ClientHashTableLayouts, ::testing::Bool());

TEST_P(ClientHashTableLayouts, RandomOperationsAgreeWithAMultimap) {
  struct entry {
    uint32_t row, bucket;
    sr_hash_table_element_t *p_element;
  };
  std::multimap<uint32_t, entry> model;
  uint32_t keys[4000];
  std::mt19937 random(20240517);
  for (uint32_t row = 0; row < 4000; ++row) {
    keys[row] = random() % 40;
    const uint32_t key = keys[row];
    const auto [begin, end] = model.equal_range(key);
    switch (random() % 4) {
      case 0:
      case 1: {
        // Modifier bits above the base qualifier do not turn the check off.
        const bool check = random() % 2 == 0;
        cu_set_no_error_1();
        const int32_t rc =
            add(keys[row], row, check ? SR_PRIMARY_KEY | SR_PROTECTED : SR_PRIMARY_KEY_NOCHECK);
        if (check && begin != end) {
          ASSERT_EQ(rc, SR_E_DUPLICATE_KEY);
          ASSERT_EQ(last_error().first, 0) << "a duplicate is returned, not raised";
          ASSERT_EQ(p_element, std::prev(end)->second.p_element);
        } else {
          ASSERT_EQ(rc, 0);
          ASSERT_EQ(bucket, key % Buckets * spacing);
          model.insert(end, {key, entry{row, bucket, p_element}});
        }
        break;
      }
      case 2:
        if (begin == end) {
          ASSERT_EQ(sr_i_hash_table_remove(p_table, &key), SR_E_NO_ROW_FOR_KEY);
        } else {  // an arbitrary one of the equal keys, by identity
          auto victim = std::next(begin, random() % std::distance(begin, end));
          ASSERT_EQ(sr_i_hash_table_remove_element(p_table, victim->second.bucket,
                                                   victim->second.p_element),
                    0);
          model.erase(victim);
        }
        break;
      default:
        if (begin != end) {
          ASSERT_EQ(sr_i_hash_table_remove(p_table, &key), 0);
          model.erase(std::prev(end));
        }
    }
    for (uint32_t probe = 0; probe < 40; ++probe) {
      const auto [first, last] = model.equal_range(probe);
      const int64_t newest_row = first == last ? int64_t{-1} : int64_t{std::prev(last)->second.row};
      ASSERT_EQ(row_for(p_table, probe), newest_row);
    }
  }
}

// In a table with homes, the first key of a bucket takes the bucket's home
// and keeps it at the head while later unequal keys go behind it; a removed
// home is taken by the next key of its bucket, and no element ever moves:
// the ones handed out stay where they were and are still removed by
// identity.
TEST_F(ClientHashTable, HomesStayAtTheHeadAndAreTakenAgainWithoutMovingAnElement) {
  EXPECT_EQ(sr_i_hash_table_close(p_table), 0);
  open(true);
  const uint32_t keys[] = {3, 11, 19, 27};  // one bucket
  sr_hash_table_element_t *p_elements[4] = {};
  for (uint32_t at = 0; at < 3; ++at) {
    ASSERT_EQ(add(keys[at], at), 0);
    p_elements[at] = p_element;
  }
  sr_hash_table_element_t *p_home = &p_table->p_home_elements[bucket];
  EXPECT_EQ(p_elements[0], p_home);
  EXPECT_EQ(p_table->p_elements[bucket], p_home);

  ASSERT_EQ(sr_i_hash_table_remove_element(p_table, bucket, p_home), 0);
  EXPECT_EQ(row_for(p_table, keys[0]), -1);
  EXPECT_EQ(row_for(p_table, keys[1]), 1);
  EXPECT_EQ(row_for(p_table, keys[2]), 2);
  EXPECT_NE(p_table->p_elements[bucket], p_home);

  ASSERT_EQ(add(keys[3], 3), 0);
  p_elements[3] = p_element;
  EXPECT_EQ(p_elements[3], p_home);
  EXPECT_EQ(p_table->p_elements[bucket], p_home);
  // A duplicate under the check names the existing element, wherever it is.
  ASSERT_EQ(add(keys[1], 9), SR_E_DUPLICATE_KEY);
  EXPECT_EQ(p_element, p_elements[1]);
  for (uint32_t at = 1; at < 4; ++at) {
    EXPECT_EQ(row_for(p_table, keys[at]), at);
    ASSERT_EQ(sr_i_hash_table_remove_element(p_table, bucket, p_elements[at]), 0);
    EXPECT_EQ(row_for(p_table, keys[at]), -1);
  }
  EXPECT_EQ(p_table->p_elements[bucket], nullptr);
}

// Elements live in blocks the table carves them from, and removed ones are
// handed out again: thousands of keys, half removed and replaced by new
// keys, must all stay findable, each element distinct from every other.
TEST_P(ClientHashTableLayouts, ManyElementsSurviveRemovalAndReuseAcrossBlocks) {
  constexpr uint32_t Keys = 6000;
  std::vector<uint32_t> keys(2 * Keys);
  std::vector<std::pair<uint32_t, sr_hash_table_element_t *>> placed(2 * Keys);
  for (uint32_t key = 0; key < Keys; ++key) {
    keys[key] = key;
    ASSERT_EQ(add(keys[key], key), 0);
    placed[key] = {bucket, p_element};
  }
  for (uint32_t key = 0; key < Keys; key += 2) {
    ASSERT_EQ(sr_i_hash_table_remove_element(p_table, placed[key].first, placed[key].second), 0);
  }
  std::set<sr_hash_table_element_t *> live;
  for (uint32_t key = 1; key < Keys; key += 2) {
    live.insert(placed[key].second);
  }
  for (uint32_t key = Keys; key < Keys + Keys / 2; ++key) {
    keys[key] = key;
    ASSERT_EQ(add(keys[key], key), 0);
    ASSERT_TRUE(live.insert(p_element).second) << "element of key " << key << " is in use";
  }
  for (uint32_t key = 0; key < Keys + Keys / 2; ++key) {
    ASSERT_EQ(row_for(p_table, key), key < Keys && key % 2 == 0 ? -1 : int64_t{key}) << key;
  }
}

}  // namespace
