// sr_packed_keys_test.cpp - the rows and keys of unpacked tables: every row
// found where it was packed, by key and by index, through the caller's hash
// or without one; a repeated key refused wherever it lies and whatever the
// key's type, exactly when adding the same rows one by one refuses it;
// unchecked keys all kept; and damaged records refused in any row.

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "pmsg_test_values.h"
#include "qv_sr.h"
#include "sr_packed_test_support.h"
#include "sr_row_test_support.h"

namespace {

using sr_test::column;
using sr_test::compare_strings;
using sr_test::int32_value;
using sr_test::packed_table_description;
using sr_test::string_hash_64;
using sr_test::string_value;
using sr_test::write_packed_buffer;

using buffer_bytes = std::vector<unsigned char>;

// The whole buffer sr_pack_tables_1 makes of one table, all rows of its
// committed view.
buffer_bytes pack_one(sr_opaque_handle_t table) {
  const uint32_t view = 0, all_rows = 0;
  void *p_buffer = nullptr;
  EXPECT_EQ(sr_pack_tables_1(1, &table, &view, &all_rows, nullptr, &p_buffer), 0);
  if (p_buffer == nullptr) {
    return {};
  }
  uint32_t length;
  std::memcpy(&length, p_buffer, sizeof length);
  const auto *p_bytes = static_cast<const unsigned char *>(p_buffer);
  buffer_bytes bytes(p_bytes, p_bytes + length);
  std::free(p_buffer);
  return bytes;
}

std::string read_key(sr_opaque_handle_t table, int32_t index) {
  qv_value_t value{};
  EXPECT_EQ(sr_get_field_by_index_1(table, index, "name", &value), 0);
  std::string key = value.ptr_char != nullptr ? value.ptr_char : "";
  std::free(value.ptr_char);
  return key;
}

class PackedKeysTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (sr_opaque_handle_t *p_tree : {&tree_, &receiver_, &other_receiver_}) {
      ASSERT_EQ(sr_open_tree_1(p_tree, 0, 0), 0);
    }
  }
  void TearDown() override {
    for (sr_opaque_handle_t tree : {tree_, receiver_, other_receiver_}) {
      sr_close_tree_1(tree);
    }
  }

  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t receiver_ = nullptr;
  sr_opaque_handle_t other_receiver_ = nullptr;
};

// ---- Rows where they were packed ---------------------------------------------

// Rows added in a shuffled order and a tenth of them deleted, so that the
// packed order is neither the keys' order nor the fixed order; the hash of
// 64 buckets makes chains of dozens of keys.
TEST_F(PackedKeysTest, EveryRowIsFoundByKeyAndByIndexWhereItWasPacked) {
  sr_column_t columns[] = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY), column("count", QV_INT32)};
  sr_opaque_handle_t source = nullptr;
  ASSERT_EQ(sr_create_table_1(tree_, "/services", columns, 2, sr_test::Explicit, &source), 0);
  std::vector<int32_t> numbers(3000);
  std::iota(numbers.begin(), numbers.end(), 0);
  std::shuffle(numbers.begin(), numbers.end(), std::mt19937(11));
  for (const int32_t number : numbers) {
    ASSERT_EQ(sr_test::add_named(source, ("service" + std::to_string(number)).c_str(), number * 7),
              0);
  }
  ASSERT_EQ(sr_apply_1(source, 0), 0);
  ASSERT_EQ(sr_commit_1(source), 0);
  std::vector<std::string> deleted;
  for (int32_t index = 2990; index >= 0; index -= 10) {
    deleted.push_back(read_key(source, index));
    ASSERT_EQ(sr_delete_row_by_index_1(source, static_cast<uint32_t>(index)), 0);
  }
  ASSERT_EQ(sr_apply_1(source, 0), 0);
  ASSERT_EQ(sr_commit_1(source), 0);
  const buffer_bytes packed = pack_one(source);
  const std::map<std::string, int32_t> expected = sr_test::rows_in<std::string>(source, "name", 0);
  ASSERT_EQ(expected.size(), 2700u);

  sr_opaque_handle_t hashed = nullptr, unhashed = nullptr;
  ASSERT_EQ(
      sr_unpack_table_1(packed.data(), 64, string_hash_64, compare_strings, receiver_, 0, &hashed),
      0);
  ASSERT_EQ(sr_unpack_table_1(packed.data(), 0, nullptr, nullptr, other_receiver_, 0, &unhashed),
            0);
  for (sr_opaque_handle_t unpacked : {hashed, unhashed}) {
    SCOPED_TRACE(unpacked == hashed ? "hashed" : "without a hash table");
    for (int32_t index = 0; index < 2700; ++index) {
      ASSERT_EQ(read_key(unpacked, index), read_key(source, index)) << index;
    }
    for (const auto &[key, count] : expected) {
      qv_value_t value{};
      ASSERT_EQ(sr_get_field_by_key_1(unpacked, string_value(key.c_str()), "count", &value), 0)
          << key;
      ASSERT_EQ(value.val_int32, count) << key;
    }
    for (const std::string &key : deleted) {
      qv_value_t value{};
      EXPECT_EQ(sr_get_field_by_key_1(unpacked, string_value(key.c_str()), "count", &value),
                SR_E_NO_ROW_FOR_KEY);
    }
    // Packed again, the table gives back the very bytes it came from.
    EXPECT_TRUE(pack_one(unpacked) == packed);
  }
}

// ---- Keys that repeat ------------------------------------------------------------

// `total` rows keyed "k<i>" with count i; the row at `second` takes the key
// of the row at `first` when they differ.
packed_table_description keyed_rows(std::vector<std::string> &keys, uint32_t total, uint32_t first,
                                    uint32_t second, uint32_t qualifier = SR_PRIMARY_KEY) {
  keys.clear();
  for (uint32_t row = 0; row < total; ++row) {
    keys.push_back("k" + std::to_string(row));
  }
  keys[second] = keys[first];
  packed_table_description table{
      "/keyed", {column("name", QV_CHAR_PTR, qualifier), column("count", QV_INT32)}, {}};
  for (uint32_t row = 0; row < total; ++row) {
    table.rows.push_back({string_value(keys[row].c_str()), int32_value(static_cast<int32_t>(row))});
  }
  return table;
}

TEST_F(PackedKeysTest, ARepeatedKeyIsRefusedWhereverItLies) {
  std::vector<std::string> keys;
  for (const auto &[first, second] :
       {std::pair{0u, 1499u}, {700u, 701u}, {3u, 1000u}, {1498u, 1499u}, {5u, 5u}}) {
    SCOPED_TRACE(std::to_string(first) + " " + std::to_string(second));
    const buffer_bytes bytes = write_packed_buffer({keyed_rows(keys, 1500, first, second)}, false);
    const int32_t expected = first == second ? 0 : SR_E_DUPLICATE_KEY;
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(
        sr_unpack_table_1(bytes.data(), 64, string_hash_64, compare_strings, receiver_, 0, &table),
        expected);
    EXPECT_EQ(sr_unpack_table_1(bytes.data(), 0, nullptr, nullptr, other_receiver_, 0, &table),
              expected);
    for (sr_opaque_handle_t tree : {receiver_, other_receiver_}) {
      sr_opaque_handle_t handle = nullptr;
      EXPECT_EQ(sr_open_table_1(tree, "/keyed", SR_MODE_READ, &handle),
                expected == 0 ? 0 : SR_E_NO_TABLE);
      if (handle != nullptr) {
        sr_close_table_1(handle);
        ASSERT_EQ(sr_delete_table_1(tree, "/keyed"), 0);
      }
    }
  }
}

// Equal unchecked keys are all kept, and a key finds the row that adding
// the rows one by one makes it find.
TEST_F(PackedKeysTest, UncheckedKeysKeepEveryRowAndFindWhatAddingFinds) {
  std::vector<std::string> keys;
  packed_table_description table = keyed_rows(keys, 400, 0, 0, SR_PRIMARY_KEY_NOCHECK);
  std::mt19937 random(8);
  for (uint32_t row = 0; row < 400; ++row) {
    keys[row] = "k" + std::to_string(random() % 60);
    table.rows[row][0] = string_value(keys[row].c_str());
  }
  sr_column_t columns[] = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY_NOCHECK),
                           column("count", QV_INT32)};
  sr_opaque_handle_t added = nullptr;
  ASSERT_EQ(sr_create_hashed_key_table_1(tree_, "/added", columns, 2, sr_test::Implicit, 64,
                                         string_hash_64, compare_strings, &added),
            0);
  for (uint32_t row = 0; row < 400; ++row) {
    ASSERT_EQ(sr_test::add_named(added, keys[row].c_str(), static_cast<int32_t>(row)), 0);
  }
  const buffer_bytes bytes = write_packed_buffer({table}, false);
  sr_opaque_handle_t unpacked = nullptr;
  ASSERT_EQ(
      sr_unpack_table_1(bytes.data(), 64, string_hash_64, compare_strings, receiver_, 0, &unpacked),
      0);
  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(unpacked, 0, &p_metadata), 0);
  EXPECT_EQ(p_metadata->number_of_rows, 400u);
  sr_free_table_metadata_1(p_metadata);
  for (uint32_t number = 0; number < 60; ++number) {
    const std::string key = "k" + std::to_string(number);
    qv_value_t from_added{}, from_unpacked{};
    const int32_t rc =
        sr_get_field_by_key_1(added, string_value(key.c_str()), "count", &from_added);
    ASSERT_EQ(sr_get_field_by_key_1(unpacked, string_value(key.c_str()), "count", &from_unpacked),
              rc)
        << key;
    EXPECT_EQ(from_unpacked.val_int32, from_added.val_int32) << key;
  }
}

qv_value_t float64_value(double number) {
  qv_value_t value{};
  value.val_float64 = number;
  return value;
}
qv_value_t float32_value(float number) {
  qv_value_t value{};
  value.val_float32 = number;
  return value;
}
qv_value_t uint64_value(uint64_t number) {
  qv_value_t value{};
  value.val_uint64 = number;
  return value;
}

// Lists of keys of one type, each unpacked without a hash table (a
// resource handle gets the built-in one) and compared with what adding the
// same rows to a table one by one gives: refused as a repeat exactly when
// adding refuses one, whole otherwise.
struct key_case {
  const char *p_what;
  qv_data_type_t type;
  std::vector<qv_value_t> keys;
};

TEST_F(PackedKeysTest, EveryKeyTypeIsCheckedAsAddingRowsChecksIt) {
  const double nan = std::numeric_limits<double>::quiet_NaN();
  const auto nanf = std::numeric_limits<float>::quiet_NaN();
  value_arena arena;
  std::vector<key_case> cases = {
      {"int32 repeat", QV_INT32, {int32_value(5), int32_value(-3), int32_value(5)}},
      {"int32 distinct", QV_INT32, {int32_value(5), int32_value(-3), int32_value(-5)}},
      {"uint64 repeat",
       QV_UINT64,
       {uint64_value(1ull << 40), uint64_value(7), uint64_value(1ull << 40)}},
      {"uint64 above int64", QV_UINT64, {uint64_value(~0ull), uint64_value(1)}},
      {"signed zeros", QV_FLOAT64, {float64_value(-0.0), float64_value(1), float64_value(0.0)}},
      {"NaN alone", QV_FLOAT64, {float64_value(nan)}},
      {"NaN last", QV_FLOAT64, {float64_value(1), float64_value(2), float64_value(nan)}},
      {"NaN first", QV_FLOAT64, {float64_value(nan), float64_value(2)}},
      {"float32 NaN", QV_FLOAT32, {float32_value(1), float32_value(nanf)}},
      {"float32 distinct", QV_FLOAT32, {float32_value(1.5f), float32_value(-1.5f)}},
      {"strings", QV_CHAR_PTR, {string_value("b"), string_value(""), string_value("ba")}},
      {"string repeat", QV_CHAR_PTR, {string_value("b"), string_value(""), string_value("b")}},
      {"handles",
       QV_RSRC_HANDLE_PTR,
       {arena.handle(1, 2, 3, 4, 5), arena.handle(1, 2, 3, 4, 5 + (1u << 20)),
        arena.handle(9, 2, 3, 4, 5)}},
      {"handle repeat",
       QV_RSRC_HANDLE_PTR,
       {arena.handle(1, 2, 3, 4, 5), arena.handle(2, 2, 3, 4, 5), arena.handle(1, 2, 3, 4, 5)}},
  };
  // Many numbers, with and without a repeat among them.
  std::mt19937 random(13);
  for (const bool repeat : {false, true}) {
    key_case many{repeat ? "random with a repeat" : "random distinct", QV_INT32, {}};
    std::vector<int32_t> numbers(2000);
    std::iota(numbers.begin(), numbers.end(), -1000);
    std::shuffle(numbers.begin(), numbers.end(), random);
    if (repeat) {
      numbers[1234] = numbers[77];
    }
    for (const int32_t number : numbers) {
      many.keys.push_back(int32_value(number));
    }
    cases.push_back(many);
  }
  int table_number = 0;
  for (const key_case &one : cases) {
    SCOPED_TRACE(one.p_what);
    const std::string path = "/case" + std::to_string(table_number++);
    std::vector<sr_column_t> columns = {column("key", one.type, SR_PRIMARY_KEY),
                                        column("count", QV_INT32)};
    sr_opaque_handle_t added = nullptr;
    ASSERT_EQ(sr_create_table_1(tree_, path.c_str(), columns.data(), 2, sr_test::Implicit, &added),
              0);
    int32_t adding = 0;
    packed_table_description description{path, columns, {}};
    for (size_t row = 0; row < one.keys.size(); ++row) {
      description.rows.push_back({one.keys[row], int32_value(static_cast<int32_t>(row))});
      if (adding == 0) {
        sr_test::field_list fields{{"key", one.keys[row]},
                                   {"count", int32_value(static_cast<int32_t>(row))}};
        adding = sr_add_row_1(added, fields.names.data(), fields.pointers.data(), fields.count());
      }
    }
    ASSERT_TRUE(adding == 0 || adding == SR_E_DUPLICATE_KEY) << adding;
    const buffer_bytes bytes = write_packed_buffer({description}, false);
    sr_opaque_handle_t unpacked = nullptr;
    EXPECT_EQ(sr_unpack_table_1(bytes.data(), 0, nullptr, nullptr, receiver_, 0, &unpacked),
              adding);
    if (adding == 0 && unpacked != nullptr) {
      sr_table_metadata_t *p_metadata = nullptr;
      ASSERT_EQ(sr_get_table_metadata_1(unpacked, 0, &p_metadata), 0);
      EXPECT_EQ(p_metadata->number_of_rows, one.keys.size());
      sr_free_table_metadata_1(p_metadata);
    }
  }
}

// ---- Records that do not hold together ------------------------------------------

// Three string columns over 40 rows; the first, a middle and the last row
// each damaged in turn: a length word one short, and the anchor of each
// string column pointing past its record.
TEST_F(PackedKeysTest, ADamagedRecordIsRefusedInAnyRow) {
  std::vector<std::string> texts;
  for (int row = 0; row < 40; ++row) {
    texts.push_back("text of row " + std::to_string(row));
  }
  packed_table_description table{
      "",
      {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY), column("note", QV_CHAR_PTR),
       column("count", QV_INT32), column("more", QV_CHAR_PTR)},
      {}};
  for (int row = 0; row < 40; ++row) {
    table.rows.push_back({string_value(texts[row].c_str() + 8), string_value(texts[row].c_str()),
                          int32_value(row), string_value("")});
  }
  const buffer_bytes good = write_packed_buffer({table}, false);
  sr_opaque_handle_t unpacked = nullptr;
  ASSERT_EQ(sr_unpack_table_1(good.data(), 0, nullptr, nullptr, receiver_, 0, &unpacked), 0);
  ASSERT_EQ(sr_close_table_1(unpacked), 0);

  const auto word_at = [](const buffer_bytes &bytes, size_t offset) {
    uint32_t word;
    std::memcpy(&word, bytes.data() + offset, sizeof word);
    return word;
  };
  const size_t rows_body = 40 + 32 + word_at(good, 64);
  for (const uint32_t row : {0u, 17u, 39u}) {
    const size_t record = rows_body + word_at(good, rows_body + 4 + 8 * row);
    const uint32_t length = word_at(good, record);
    struct damage {
      size_t offset;
      uint32_t word;
    };
    const damage damages[] = {{record, length - 1},
                              {record + 24 + 0 * 8, length},
                              {record + 24 + 1 * 8, length},
                              {record + 24 + 3 * 8, length}};
    for (const damage &one : damages) {
      SCOPED_TRACE("row " + std::to_string(row) + " at " + std::to_string(one.offset - record));
      buffer_bytes bytes = good;
      std::memcpy(bytes.data() + one.offset, &one.word, sizeof one.word);
      EXPECT_EQ(sr_unpack_table_1(bytes.data(), 0, nullptr, nullptr, receiver_, 0, &unpacked),
                SR_E_TABLE_UNREADABLE);
    }
  }
}

}  // namespace
