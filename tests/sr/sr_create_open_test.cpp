// Creating, opening and closing transient tables through the exported
// calls: column validation and its order, the key moved first without
// touching the caller's array, modes, shared objects and their references,
// the metadata handed out; and threads at once, creating, opening and
// closing tables of one tree, or reading rows while a writer commits.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "frame/sr_i_tree.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

namespace {

using namespace sr_test;

class Tables : public RowTables {
 protected:
  int32_t create(const char *p_path, std::vector<sr_column_t> columns, int32_t mode = 0,
                 sr_opaque_handle_t *p_table = nullptr) {
    sr_opaque_handle_t table = nullptr;
    return sr_create_table_1(tree_, p_path, columns.data(), static_cast<uint32_t>(columns.size()),
                             mode, p_table ? p_table : &table);
  }
};

TEST_F(Tables, KeyColumnComesFirstAndTheCallersArrayIsUntouched) {
  std::vector<sr_column_t> columns = {column("a", QV_INT32, SR_STANDARD),
                                      column("k", QV_CHAR_PTR, SR_PRIMARY_KEY)};
  const std::vector<sr_column_t> before = columns;
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(sr_create_table_1(tree_, "/cfg/t", columns.data(), 2, 0, &table), 0);
  EXPECT_STREQ(object(table)->p_columns[0].name, "k");
  EXPECT_STREQ(object(table)->p_columns[1].name, "a");
  EXPECT_EQ(std::memcmp(columns.data(), before.data(), sizeof(sr_column_t) * 2), 0);
  // The failure path leaves it untouched too.
  EXPECT_EQ(sr_create_table_1(tree_, "/cfg/t", columns.data(), 2, 0, &table), SR_E_TABLE_EXISTS);
  EXPECT_EQ(std::memcmp(columns.data(), before.data(), sizeof(sr_column_t) * 2), 0);
}

TEST_F(Tables, EveryColumnIsCheckedBeforeTheKeysAreCounted) {
  const std::string longest(255, 'n');
  const std::string too_long(256, 'n');
  struct refusal {
    std::vector<sr_column_t> columns;
    int32_t code;
  } cases[] = {
      {{}, SR_E_NO_COLUMNS},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("j", QV_INT32, SR_PRIMARY_KEY),
        column("bad-name", QV_INT32, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("j", QV_INT32, SR_PRIMARY_KEY_NOCHECK)},
       SR_E_DUPLICATE_KEY},
      {{column("a", QV_INT32, SR_STANDARD)}, SR_E_KEY_EXPECTED},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("k", QV_INT64, SR_STANDARD)},
       SR_E_DUPLICATE_COLUMN},
      {{column("k", QV_BINARY_PTR, SR_PRIMARY_KEY)}, SR_E_INVALID_COLUMN},
      {{column("k", QV_SD_PTR, SR_PRIMARY_KEY)}, SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("s", QV_SD_PTR, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("n", QV_NONE, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY),
        column("n", static_cast<qv_data_type_t>(23), SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_SYSTEM)}, SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column(too_long.c_str(), QV_INT32, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("9lives", QV_INT32, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("_x", QV_INT32, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
      {{column("k", QV_INT32, SR_PRIMARY_KEY), column("a b", QV_INT32, SR_STANDARD)},
       SR_E_INVALID_COLUMN},
  };
  for (const refusal &refused : cases) {
    EXPECT_EQ(create("/t", refused.columns), refused.code);
  }
  EXPECT_TRUE(static_cast<sr_i_tree_t *>(tree_)->tables.empty());
  EXPECT_EQ(create("/t", {column("k", QV_INT32, SR_PRIMARY_KEY),
                          column(longest.c_str(), QV_INT32, SR_STANDARD | SR_PROTECTED)}),
            0);
}

TEST_F(Tables, ResourceHandleKeysGetTheBuiltInHashTable) {
  sr_opaque_handle_t handle_keyed = nullptr, int_keyed = nullptr;
  ASSERT_EQ(create("/h", {column("k", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY)}, 0, &handle_keyed), 0);
  ASSERT_EQ(create("/i", {column("k", QV_INT32, SR_PRIMARY_KEY)}, 0, &int_keyed), 0);
  EXPECT_NE(object(handle_keyed)->p_rows_hash_table, nullptr);
  EXPECT_EQ(object(int_keyed)->p_rows_hash_table, nullptr);
  sr_column_t key = column("k", QV_INT32, SR_PRIMARY_KEY);
  sr_opaque_handle_t table = nullptr;
  const auto hash = [](const void *) -> uint32_t { return 0; };
  const auto compare = [](const void *, const void *) -> int32_t { return 0; };
  EXPECT_EQ(sr_create_hashed_key_table_1(tree_, "/x", &key, 1, 0, 0, hash, compare, &table),
            SR_E_NULL_POINTER);
  EXPECT_EQ(sr_create_hashed_key_table_1(tree_, "/x", &key, 1, 0, 8, nullptr, compare, &table),
            SR_E_NULL_POINTER);
  ASSERT_EQ(sr_create_hashed_key_table_1(tree_, "/x", &key, 1, 0, 8, hash, compare, &table), 0);
  EXPECT_EQ(object(table)->p_rows_hash_table->total_hash_buckets, 8u);
}

TEST_F(Tables, ARefusedPersistentTableLeavesNoFile) {
  mount_disk();
  EXPECT_EQ(create("/disk/t", {column("k", QV_BINARY_PTR, SR_PRIMARY_KEY)}), SR_E_INVALID_COLUMN);
  EXPECT_TRUE(std::filesystem::is_empty(directory_));
  // A transient table's own path cannot become a mount point.
  ASSERT_EQ(create("/cfg", {column("k", QV_INT32, SR_PRIMARY_KEY)}), 0);
  EXPECT_EQ(sr_mount_local_tree_1(tree_, "/cfg", directory_.c_str(), 0), SR_E_TABLE_EXISTS);
}

// Creation takes modes 0 to 7, always writable, implicitly controlled below
// 4; opening takes modes 1, 2, 3 and 6 (reading, writing implicitly or
// explicitly controlled), shares one object, and the control kinds of the
// writing handles must agree.
TEST_F(Tables, OpeningSharesOneObjectAndControlKindsMustAgree) {
  sr_opaque_handle_t created = nullptr, first = nullptr, second = nullptr, other = nullptr;
  EXPECT_EQ(create("/m8", {column("k", QV_INT32, SR_PRIMARY_KEY)}, 8), SR_E_INVALID_MODE);
  EXPECT_EQ(create("/m-1", {column("k", QV_INT32, SR_PRIMARY_KEY)}, -1), SR_E_INVALID_MODE);
  ASSERT_EQ(create("/m5", {column("k", QV_INT32, SR_PRIMARY_KEY)}, 5, &other), 0);
  EXPECT_EQ(object(other)->mode, Sr_Mode_Writable);
  EXPECT_EQ(object(other)->implicitly_controlled, 0u);
  ASSERT_EQ(create("/shared", {column("k", QV_INT32, SR_PRIMARY_KEY)}, 1, &created), 0);
  EXPECT_EQ(object(created)->mode, Sr_Mode_Writable);
  EXPECT_EQ(object(created)->implicitly_controlled, 1u);
  EXPECT_EQ(sr_open_table_1(tree_, "/missing", 2, &other), SR_E_NO_TABLE);
  for (int32_t refused : {0, 4, 5, 8, -1}) {
    EXPECT_EQ(sr_open_table_1(tree_, "/shared", refused, &other), SR_E_INVALID_MODE) << refused;
  }
  ASSERT_EQ(sr_open_table_1(tree_, "/shared", 2, &first), 0);
  ASSERT_EQ(sr_open_table_1(tree_, "/shared", 3, &second), 0);
  EXPECT_EQ(first, created);
  EXPECT_EQ(second, created);
  EXPECT_EQ(object(created)->references, 3u);
  EXPECT_EQ(sr_open_table_1(tree_, "/shared", 6, &other), SR_E_EXCLUSIVE_MODES);
  EXPECT_EQ(object(created)->references, 3u);
  ASSERT_EQ(sr_open_table_1(tree_, "/shared", 1, &other), 0);  // reading is always allowed
  for (sr_opaque_handle_t handle : {created, first, second, other}) {
    EXPECT_EQ(sr_close_table_1(handle), 0);
  }
  // Closed but kept: the next opening starts afresh and may choose anew.
  EXPECT_EQ(object(created)->references, 0u);
  ASSERT_EQ(sr_open_table_1(tree_, "/shared", 1, &first), 0);
  EXPECT_EQ(first, created);
  EXPECT_EQ(object(first)->mode, Sr_Mode_Read_Only);
  ASSERT_EQ(sr_open_table_1(tree_, "/shared", 6, &second), 0);
  EXPECT_EQ(object(first)->mode, Sr_Mode_Writable);  // both handles now write
  EXPECT_EQ(object(first)->implicitly_controlled, 0u);
}

TEST_F(Tables, MetadataDescribesColumnsWithOrWithoutInvisibleOnes) {
  sr_sd_def_t *p_definition =
      static_cast<sr_sd_def_t *>(std::malloc(sizeof(sr_sd_def_t) + sizeof(sr_sd_field_def_t)));
  p_definition->number_of_fields = 1;
  p_definition->field_def[0] = {QV_FLOAT64, const_cast<char *>("weight")};
  std::vector<sr_column_t> columns = {column("k", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                      column("secret", QV_INT32, SR_STANDARD | SR_INVISIBLE),
                                      column("label", QV_CHAR_PTR, SR_STANDARD),
                                      column("shape", QV_SD_PTR, SR_STANDARD)};
  columns[1].properties = 42;
  columns[1].sd_defn = p_definition;  // ignored: the column is not structured
  columns[2].default_value.ptr_char = const_cast<char *>("none");
  columns[3].sd_defn = p_definition;
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(create("/meta/t", columns, 0, &table), 0);
  std::free(p_definition);

  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(table, 0, &p_metadata), 0);
  EXPECT_STREQ(p_metadata->name, "/meta/t");
  EXPECT_EQ(p_metadata->number_of_columns, 4u);
  EXPECT_EQ(p_metadata->column_definitions, nullptr);
  EXPECT_EQ(p_metadata->table_change_counter, 1u);
  ASSERT_EQ(sr_free_table_metadata_1(p_metadata), 0);

  ASSERT_EQ(sr_get_table_metadata_1(table, 1, &p_metadata), 0);
  ASSERT_EQ(p_metadata->number_of_columns, 3u);
  EXPECT_STREQ(p_metadata->column_definitions[1].name, "label");
  EXPECT_STREQ(p_metadata->column_definitions[1].default_value.ptr_char, "none");
  EXPECT_STREQ(p_metadata->column_definitions[0].default_value.ptr_char, "");
  const sr_sd_def_t *p_copy = p_metadata->column_definitions[2].sd_defn;
  ASSERT_NE(p_copy, nullptr);
  ASSERT_EQ(p_copy->number_of_fields, 1u);
  EXPECT_EQ(p_copy->field_def[0].type, QV_FLOAT64);
  EXPECT_STREQ(p_copy->field_def[0].name, "weight");
  ASSERT_EQ(sr_free_table_metadata_1(p_metadata), 0);

  ASSERT_EQ(sr_get_table_metadata_1(table, -1, &p_metadata), 0);
  ASSERT_EQ(p_metadata->number_of_columns, 4u);
  EXPECT_STREQ(p_metadata->column_definitions[1].name, "secret");
  EXPECT_EQ(p_metadata->column_definitions[1].properties, 42);
  EXPECT_EQ(p_metadata->column_definitions[1].sd_defn, nullptr);
  ASSERT_EQ(sr_free_table_metadata_1(p_metadata), 0);

  EXPECT_EQ(sr_free_table_metadata_1(nullptr), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_get_table_metadata_1(nullptr, 0, &p_metadata), SR_E_INVALID_HANDLE);
}

TEST_F(Tables, ManyThreadsCreateOpenAndCloseTablesOfOneTree) {
  constexpr int Threads = 4;
  constexpr int Rounds = 100;
  std::atomic<int> failures{0};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < Threads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < Rounds; ++round) {
        const std::string own = "/t" + std::to_string(thread) + "_" + std::to_string(round);
        sr_column_t key = column("k", QV_INT32, SR_PRIMARY_KEY);
        sr_opaque_handle_t created = nullptr, opened = nullptr, common = nullptr;
        if (sr_create_table_1(tree_, own.c_str(), &key, 1, 0, &created) != 0 ||
            sr_open_table_1(tree_, own.c_str(), 1, &opened) != 0 || opened != created ||
            sr_close_table_1(opened) != 0 || sr_close_table_1(created) != 0) {
          ++failures;
        }
        // All threads race for one path: exactly one creates it each round.
        const std::string shared = "/common" + std::to_string(round);
        const int32_t rc = sr_create_table_1(tree_, shared.c_str(), &key, 1, 0, &common);
        if (rc != 0 && rc != SR_E_TABLE_EXISTS) {
          ++failures;
        }
        if (sr_open_table_1(tree_, shared.c_str(), 2, &common) != 0 ||
            sr_close_table_1(common) != 0) {
          ++failures;
        }
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(static_cast<sr_i_tree_t *>(tree_)->tables.size(),
            static_cast<size_t>(Threads * Rounds + Rounds));
}

// Many reader threads and one writer on one table: readers never see a row
// half-changed (a row's two columns always agree) and never fail with
// anything but "no such row", while the writer adds, updates, deletes and
// commits through an implicitly controlled handle.
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
