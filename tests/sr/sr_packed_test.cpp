// sr_packed_test.cpp - packed table buffers: what a buffer holds (layout,
// names, counts, chosen rows, both views, every type, column definitions),
// buffers written in the other byte order converted once, the read-only
// tables unpacked from them, and buffers that do not hold together refused
// with 14 and never read outside their stated length.

#include <gtest/gtest.h>

#include <bit>
#include <cstdlib>
#include <cstring>
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
using sr_test::field_list;
using sr_test::int32_value;
using sr_test::packed_table_description;
using sr_test::string_value;
using sr_test::write_packed_buffer;

using buffer_bytes = std::vector<unsigned char>;

// A malloc'ed buffer, freed when it goes.
struct packed_buffer {
  void *p_bytes = nullptr;
  ~packed_buffer() { std::free(p_bytes); }
  uint32_t length() const {
    uint32_t length;
    std::memcpy(&length, p_bytes, sizeof length);
    return length;
  }
  buffer_bytes bytes() const {
    const auto *p_begin = static_cast<const unsigned char *>(p_bytes);
    return {p_begin, p_begin + length()};
  }
};

// Buffer bytes in a block of exactly their size, so that AddressSanitizer
// sees any read past them.
struct exact_block {
  explicit exact_block(const buffer_bytes &bytes)
      : p_bytes(std::malloc(bytes.size() + !bytes.size())) {
    std::memcpy(p_bytes, bytes.data(), bytes.size());
  }
  ~exact_block() { std::free(p_bytes); }
  void *p_bytes;
};

uint32_t word_at(const buffer_bytes &bytes, size_t offset) {
  uint32_t word;
  std::memcpy(&word, bytes.data() + offset, sizeof word);
  return word;
}
void set_word(buffer_bytes &bytes, size_t offset, uint32_t word) {
  std::memcpy(bytes.data() + offset, &word, sizeof word);
}

uint32_t hash_calls = 0;
uint32_t counting_string_hash(const void *p_key) {
  ++hash_calls;
  return sr_test::string_hash_64(p_key);
}

class PackedTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_EQ(sr_open_tree_1(&tree_, 0, 0), 0);
    ASSERT_EQ(sr_open_tree_1(&receiver_, 0, 0), 0);
  }
  void TearDown() override {
    sr_close_tree_1(tree_);
    sr_close_tree_1(receiver_);
  }

  // "/services": a string key "name" and an int32 "count".
  sr_opaque_handle_t services(int32_t mode = sr_test::Implicit, const char *p_path = "/services") {
    sr_column_t columns[] = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                             column("count", QV_INT32)};
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_create_table_1(tree_, p_path, columns, 2, mode, &table), 0);
    return table;
  }

  int32_t pack(std::vector<sr_opaque_handle_t> tables, packed_buffer &buffer,
               std::vector<uint32_t> visible = {}, std::vector<uint32_t> counts = {},
               std::vector<uint32_t> fixed = {}) {
    visible.resize(tables.size());
    counts.resize(tables.size());
    return sr_pack_tables_1(static_cast<uint32_t>(tables.size()), tables.data(), visible.data(),
                            counts.data(), fixed.empty() ? nullptr : fixed.data(), &buffer.p_bytes);
  }

  int32_t unpack(const void *p_buffer, uint32_t index, sr_opaque_handle_t *p_table) {
    return sr_unpack_table_1(p_buffer, 64, counting_string_hash, compare_strings, receiver_, index,
                             p_table);
  }

  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t receiver_ = nullptr;
};

// ---- What a buffer holds ----------------------------------------------------

TEST_F(PackedTest, NoTableIsTheFortyByteBuffer) {
  packed_buffer buffer;
  ASSERT_EQ(pack({}, buffer), 0);
  const buffer_bytes bytes = buffer.bytes();
  ASSERT_EQ(bytes.size(), 40u);
  EXPECT_EQ(bytes[4], 0);
  EXPECT_EQ(bytes[5], QV_PMSG_ARCH_LOCAL);
  EXPECT_EQ(bytes[6], 2);
  EXPECT_EQ(bytes[7], 0);
  for (const auto &[offset, number] : {std::pair{8, 0u}, {16, 1u}, {24, 40u}, {32, 0u}}) {
    EXPECT_EQ(word_at(bytes, offset), number);
    EXPECT_EQ(word_at(bytes, offset + 4), 0u);
  }
  uint32_t total = 9;
  EXPECT_EQ(sr_get_total_packed_tables_1(buffer.p_bytes, &total), 0);
  EXPECT_EQ(total, 0u);
  const char *p_name = nullptr;
  EXPECT_EQ(sr_get_packed_table_name_1(buffer.p_bytes, 0, &p_name), SR_E_NO_ROW_FOR_INDEX);
  sr_opaque_handle_t table = nullptr;
  EXPECT_EQ(unpack(buffer.p_bytes, 0, &table), SR_E_NO_ROW_FOR_INDEX);
}

TEST_F(PackedTest, TablesKeepTheirNamesAndAnUnnamedOneIsEmpty) {
  sr_opaque_handle_t first = services();
  ASSERT_EQ(sr_test::add_named(first, "ntp", 3), 0);
  sr_opaque_handle_t selected = nullptr;
  ASSERT_EQ(sr_select_1(first, nullptr, 0, &selected, nullptr), 0);
  packed_buffer buffer;
  ASSERT_EQ(pack({first, selected, first}, buffer), 0);
  uint32_t total = 0;
  ASSERT_EQ(sr_get_total_packed_tables_1(buffer.p_bytes, &total), 0);
  ASSERT_EQ(total, 3u);
  const char *names[3] = {};
  for (uint32_t index = 0; index < 3; ++index) {
    ASSERT_EQ(sr_get_packed_table_name_1(buffer.p_bytes, index, &names[index]), 0);
  }
  EXPECT_STREQ(names[0], "/services");
  EXPECT_STREQ(names[1], "");
  EXPECT_STREQ(names[2], "/services");
  const char *p_name = nullptr;
  EXPECT_EQ(sr_get_packed_table_name_1(buffer.p_bytes, 3, &p_name), SR_E_NO_ROW_FOR_INDEX);

  // The unnamed table comes back unnamed, as a result table does: not by
  // name, and freed by its close.
  sr_opaque_handle_t named = nullptr, unnamed = nullptr;
  ASSERT_EQ(unpack(buffer.p_bytes, 0, &named), 0);
  ASSERT_EQ(unpack(buffer.p_bytes, 1, &unnamed), 0);
  EXPECT_EQ(sr_test::object(unnamed)->p_name, nullptr);
  EXPECT_EQ((sr_test::rows_in<std::string>(unnamed, "name", 0)),
            (std::map<std::string, int32_t>{{"ntp", 3}}));
  EXPECT_EQ(sr_close_table_1(unnamed), 0);
  sr_opaque_handle_t again = nullptr;
  EXPECT_EQ(unpack(buffer.p_bytes, 2, &again), SR_E_TABLE_EXISTS);
  sr_opaque_handle_t opened = nullptr;
  EXPECT_EQ(sr_open_table_1(receiver_, "/services", SR_MODE_READ, &opened), 0);
  EXPECT_EQ(opened, named);
}

TEST_F(PackedTest, ChosenRowsAreTakenInTurnByEachTable) {
  sr_opaque_handle_t first = services();
  sr_opaque_handle_t second = services(sr_test::Implicit, "/other");
  for (int32_t row = 0; row < 6; ++row) {
    ASSERT_EQ(sr_test::add_named(first, ("f" + std::to_string(row)).c_str(), row), 0);
    ASSERT_EQ(sr_test::add_named(second, ("s" + std::to_string(row)).c_str(), 10 + row), 0);
  }
  packed_buffer buffer;
  // Two rows of the first, every row of the second, one of the first again.
  ASSERT_EQ(pack({first, second, first}, buffer, {}, {2, 0, 1}, {5, 1, 3}), 0);
  sr_opaque_handle_t tables[3] = {};
  const std::vector<std::vector<std::string>> expected = {
      {"f5", "f1"}, {"s0", "s1", "s2", "s3", "s4", "s5"}, {"f3"}};
  for (uint32_t index = 0; index < 3; ++index) {
    ASSERT_EQ(sr_unpack_table_1(buffer.p_bytes, 64, counting_string_hash, compare_strings,
                                index == 1 ? receiver_ : tree_, index, &tables[index]),
              index == 1 ? 0 : SR_E_TABLE_EXISTS)
        << index;
  }
  // The first table's rows go to trees of their own, which hold no
  // "/services" yet.
  for (uint32_t index : {0u, 2u}) {
    sr_opaque_handle_t own_tree = nullptr;
    ASSERT_EQ(sr_open_tree_1(&own_tree, 0, 0), 0);
    ASSERT_EQ(
        sr_unpack_table_1(buffer.p_bytes, 0, nullptr, nullptr, own_tree, index, &tables[index]), 0);
    std::vector<std::string> keys;
    for (int32_t row = 0;; ++row) {
      qv_value_t key{};
      if (sr_get_field_by_index_1(tables[index], row, "name", &key) != 0) {
        break;
      }
      keys.emplace_back(key.ptr_char);
      std::free(key.ptr_char);
    }
    EXPECT_EQ(keys, expected[index]);
    sr_close_tree_1(own_tree);
  }
  EXPECT_EQ(sr_test::rows_in<std::string>(tables[1], "name", 0).size(), 6u);

  packed_buffer refused;
  EXPECT_EQ(pack({first}, refused, {}, {1}, {100}), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(refused.p_bytes, nullptr);
}

TEST_F(PackedTest, EachTableIsPackedInTheViewItsCallerChose) {
  sr_opaque_handle_t table = services(sr_test::Explicit);
  for (const char *p_name : {"dns", "ntp", "smtp"}) {
    ASSERT_EQ(sr_test::add_named(table, p_name, 1), 0);
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  qv_value_t count = int32_value(2);
  ASSERT_EQ(sr_set_field_by_key_1(table, string_value("dns"), "count", &count), 0);
  ASSERT_EQ(sr_delete_row_by_index_1(table, 1), 0);
  ASSERT_EQ(sr_test::add_named(table, "http", 7), 0);
  uint32_t fixed_of_http = 0;
  ASSERT_EQ(sr_get_fixed_row_index_for_key_1(table, string_value("http"), &fixed_of_http), 0);

  packed_buffer buffer;
  ASSERT_EQ(pack({table, table}, buffer, {0, 1}), 0);
  sr_opaque_handle_t committed = nullptr, applied = nullptr;
  ASSERT_EQ(unpack(buffer.p_bytes, 0, &committed), 0);
  sr_opaque_handle_t other_tree = nullptr;
  ASSERT_EQ(sr_open_tree_1(&other_tree, 0, 0), 0);
  ASSERT_EQ(sr_unpack_table_1(buffer.p_bytes, 0, nullptr, nullptr, other_tree, 1, &applied), 0);
  EXPECT_EQ((sr_test::rows_in<std::string>(committed, "name", 0)),
            (std::map<std::string, int32_t>{{"dns", 1}, {"ntp", 1}, {"smtp", 1}}));
  EXPECT_EQ((sr_test::rows_in<std::string>(applied, "name", 0)),
            (std::map<std::string, int32_t>{{"dns", 2}, {"http", 7}, {"smtp", 1}}));

  // A row added but not committed is not in the committed view.
  packed_buffer refused;
  EXPECT_EQ(pack({table}, refused, {0}, {1}, {fixed_of_http}), SR_E_ROW_DELETED);
  sr_close_tree_1(other_tree);
}

// ---- Every type, and the columns that describe it ------------------------

// A table with a column of every type 2 to 22 behind an int32 key, with
// defaults, properties and structured-data definitions, and rows of sample
// and random values.
struct every_type_table {
  value_arena arena;
  std::vector<std::string> names;
  std::vector<sr_column_t> columns;
  std::vector<std::vector<qv_value_t>> rows;
  sr_sd_def_t *p_definition = nullptr;

  every_type_table() {
    p_definition = static_cast<sr_sd_def_t *>(
        arena.allocate(sizeof(sr_sd_def_t) + 2 * sizeof(sr_sd_field_def_t)));
    p_definition->number_of_fields = 2;
    p_definition->field_def[0] = {QV_CHAR_PTR, const_cast<char *>("label")};
    p_definition->field_def[1] = {QV_UINT64, const_cast<char *>("size")};
    columns.push_back(column("id", QV_INT32, SR_PRIMARY_KEY));
    names.reserve(QV_SD_PTR_ARRAY + 1);
    std::mt19937 random(20);
    std::vector<qv_value_t> samples(QV_SD_PTR_ARRAY + 1), randoms(QV_SD_PTR_ARRAY + 1);
    for (const auto &[type, value] : sample_values(arena)) {
      samples[type] = value;
    }
    for (int32_t type = QV_INT32; type <= QV_SD_PTR_ARRAY; ++type) {
      names.push_back("c" + std::to_string(type));
      sr_column_t definition =
          column(names.back().c_str(), as_type(type),
                 SR_STANDARD | (type % 2 ? SR_PROTECTED : SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED));
      definition.properties = -type;
      definition.default_value = random_value(random, arena, type).second;
      if (type == QV_SD_PTR || type == QV_SD_PTR_ARRAY) {
        definition.sd_defn = p_definition;
      }
      columns.push_back(definition);
      randoms[type] = random_value(random, arena, type).second;
    }
    for (int32_t id = 0; id < 3; ++id) {
      rows.emplace_back(1, int32_value(id));
      for (int32_t type = QV_INT32; type <= QV_SD_PTR_ARRAY; ++type) {
        rows.back().push_back(id == 1 ? samples[type] : randoms[type]);
      }
    }
  }

  packed_table_description description(const char *p_name) const {
    return {p_name, columns, rows, 5};
  }
};

// Reads every value of every row of `table` by packed index and compares it
// with the rows it was made from, then compares the column definitions.
void expect_every_type_table(sr_opaque_handle_t table, const every_type_table &expected) {
  const auto total_columns = static_cast<uint32_t>(expected.columns.size());
  std::vector<const char *> names;
  for (const sr_column_t &definition : expected.columns) {
    names.push_back(definition.name);
  }
  for (size_t row = 0; row < expected.rows.size(); ++row) {
    std::vector<qv_value_t> values(total_columns);
    std::vector<qv_value_t *> results;
    for (qv_value_t &value : values) {
      results.push_back(&value);
    }
    ASSERT_EQ(sr_get_fields_by_index_1(table, static_cast<int32_t>(row), names.data(),
                                       results.data(), total_columns),
              0);
    for (uint32_t at = 0; at < total_columns; ++at) {
      const qv_data_type_t type = expected.columns[at].type;
      EXPECT_TRUE(values_equal(type, expected.rows[row][at], values[at]))
          << "row " << row << " " << names[at];
      if (type >= QV_CHAR_PTR) {
        std::free(values[at].ptr_char);
      }
    }
  }
  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(table, -1, &p_metadata), 0);
  EXPECT_EQ(p_metadata->number_of_rows, expected.rows.size());
  ASSERT_EQ(p_metadata->number_of_columns, total_columns);
  for (uint32_t at = 0; at < total_columns; ++at) {
    const sr_column_t &got = p_metadata->column_definitions[at];
    const sr_column_t &want = expected.columns[at];
    EXPECT_STREQ(got.name, want.name);
    EXPECT_EQ(got.type, want.type);
    EXPECT_EQ(got.qualifier, want.qualifier);
    EXPECT_EQ(got.properties, want.properties);
    EXPECT_TRUE(values_equal(want.type, want.default_value, got.default_value)) << want.name;
    ASSERT_EQ(got.sd_defn != nullptr, want.sd_defn != nullptr) << want.name;
    if (want.sd_defn != nullptr) {
      ASSERT_EQ(got.sd_defn->number_of_fields, 2u);
      EXPECT_EQ(got.sd_defn->field_def[1].type, QV_UINT64);
      EXPECT_STREQ(got.sd_defn->field_def[1].name, "size");
    }
  }
  sr_free_table_metadata_1(p_metadata);
}

TEST_F(PackedTest, EveryTypeAndColumnDefinitionSurvivesPackingTwice) {
  every_type_table source;
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(
      sr_create_table_1(tree_, "/types", source.columns.data(),
                        static_cast<uint32_t>(source.columns.size()), sr_test::Explicit, &table),
      0);
  for (const std::vector<qv_value_t> &row : source.rows) {
    std::vector<const char *> names;
    std::vector<qv_value_t> values = row;
    std::vector<qv_value_t *> pointers;
    for (size_t at = 0; at < row.size(); ++at) {
      names.push_back(source.columns[at].name);
      pointers.push_back(&values[at]);
    }
    ASSERT_EQ(
        sr_add_row_1(table, names.data(), pointers.data(), static_cast<uint32_t>(names.size())), 0);
  }
  ASSERT_EQ(sr_apply_1(table, 41), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  packed_buffer buffer;
  ASSERT_EQ(pack({table}, buffer), 0);
  sr_opaque_handle_t unpacked = nullptr;
  ASSERT_EQ(sr_unpack_table_1(buffer.p_bytes, 0, nullptr, nullptr, receiver_, 0, &unpacked), 0);
  expect_every_type_table(unpacked, source);
  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(unpacked, 0, &p_metadata), 0);
  EXPECT_EQ(p_metadata->table_change_counter, 41u);
  sr_free_table_metadata_1(p_metadata);

  // An unpacked table packs again; the rows it reads come from the first
  // buffer's copy, which the second one must not depend on.
  packed_buffer again;
  ASSERT_EQ(pack({unpacked}, again), 0);
  sr_opaque_handle_t third_tree = nullptr, repacked = nullptr;
  ASSERT_EQ(sr_open_tree_1(&third_tree, 0, 0), 0);
  ASSERT_EQ(sr_unpack_table_1(again.p_bytes, 0, nullptr, nullptr, third_tree, 0, &repacked), 0);
  expect_every_type_table(repacked, source);
  sr_close_tree_1(third_tree);
}

// ---- The other byte order ----------------------------------------------------

TEST_F(PackedTest, ABufferOfTheOtherByteOrderConvertsOnceAndReadsBack) {
  every_type_table source;
  const std::vector<packed_table_description> tables = {source.description("/types"),
                                                        source.description("")};
  const buffer_bytes native = write_packed_buffer(tables, false);
  buffer_bytes foreign = write_packed_buffer(tables, true);
  ASSERT_NE(foreign, native);
  uint32_t total = 0;
  EXPECT_EQ(sr_get_total_packed_tables_1(foreign.data(), &total), SR_E_TABLE_UNREADABLE);

  ASSERT_EQ(sr_convert_packed_table_buffer_1(foreign.data(), 0, 0), 0);
  // Byte for byte what this machine writes, row records included (their
  // links cleared).
  EXPECT_EQ(foreign, native);
  ASSERT_EQ(sr_convert_packed_table_buffer_1(foreign.data(), 0, 0), 0);
  EXPECT_EQ(foreign, native);

  ASSERT_EQ(sr_get_total_packed_tables_1(foreign.data(), &total), 0);
  EXPECT_EQ(total, 2u);
  sr_opaque_handle_t unpacked = nullptr;
  ASSERT_EQ(sr_unpack_table_1(foreign.data(), 0, nullptr, nullptr, receiver_, 0, &unpacked), 0);
  expect_every_type_table(unpacked, source);

  // The caller that took the header over itself asks for the rest.
  buffer_bytes caller_converted = write_packed_buffer(tables, true);
  int32_t required = 0, header_converted = 0;
  ASSERT_EQ(qv_pmsg_cnv_required_1(reinterpret_cast<qv_pmsg_header_t *>(caller_converted.data()),
                                   &required, &header_converted),
            0);
  ASSERT_EQ(sr_convert_packed_table_buffer_1(caller_converted.data(), 1, 1), 0);
  EXPECT_EQ(caller_converted, native);

  // A buffer packed here needs nothing.
  packed_buffer local;
  ASSERT_EQ(pack({unpacked}, local), 0);
  const buffer_bytes before = local.bytes();
  ASSERT_EQ(sr_convert_packed_table_buffer_1(local.p_bytes, 0, 0), 0);
  EXPECT_EQ(local.bytes(), before);
}

// ---- The unpacked table ---------------------------------------------------------

TEST_F(PackedTest, AnUnpackedTableIsReadOnlyAndUsesTheCallersHash) {
  sr_opaque_handle_t table = services();
  for (int32_t row = 0; row < 40; ++row) {
    ASSERT_EQ(sr_test::add_named(table, ("service" + std::to_string(row)).c_str(), row), 0);
  }
  packed_buffer buffer;
  ASSERT_EQ(pack({table}, buffer), 0);
  hash_calls = 0;
  sr_opaque_handle_t unpacked = nullptr;
  ASSERT_EQ(unpack(buffer.p_bytes, 0, &unpacked), 0);
  EXPECT_EQ(hash_calls, 40u);  // every row entered through the caller's hash
  std::free(buffer.p_bytes);   // the table has rows of its own
  buffer.p_bytes = nullptr;
  qv_value_t count{};
  ASSERT_EQ(sr_get_field_by_key_1(unpacked, string_value("service17"), "count", &count), 0);
  EXPECT_EQ(count.val_int32, 17);
  EXPECT_EQ(hash_calls, 41u);

  EXPECT_EQ(sr_test::add_named(unpacked, "new", 1), SR_E_ACCESS);
  EXPECT_EQ(sr_set_field_by_index_1(unpacked, 0, "count", &count), SR_E_ACCESS);
  EXPECT_EQ(sr_delete_row_by_index_1(unpacked, 0), SR_E_ACCESS);
  EXPECT_EQ(sr_delete_rows_1(unpacked, nullptr), SR_E_ACCESS);
  sr_opaque_handle_t handle = nullptr;
  EXPECT_EQ(sr_open_table_1(receiver_, "/services", SR_MODE_WRITE, &handle), SR_E_ACCESS);
  EXPECT_EQ(sr_open_table_1(receiver_, "/services", SR_MODE_READ, &handle), 0);
  EXPECT_EQ(sr_test::rows_in<std::string>(unpacked, "name", 0).size(), 40u);

  packed_buffer again;
  ASSERT_EQ(pack({table}, again), 0);
  sr_opaque_handle_t other = nullptr;
  EXPECT_EQ(
      sr_unpack_table_1(again.p_bytes, 64, counting_string_hash, nullptr, receiver_, 0, &other),
      SR_E_NULL_POINTER);
  EXPECT_EQ(sr_unpack_table_1(again.p_bytes, 0, counting_string_hash, compare_strings, receiver_, 0,
                              &other),
            SR_E_NULL_POINTER);
}

TEST_F(PackedTest, ARepeatedKeyOrAPersistentNameMakesNoTable) {
  std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                      column("count", QV_INT32)};
  const packed_table_description repeated{
      "/twice",
      columns,
      {{string_value("a"), int32_value(1)}, {string_value("a"), int32_value(2)}}};
  const buffer_bytes bytes = write_packed_buffer({repeated}, false);
  sr_opaque_handle_t table = nullptr;
  EXPECT_EQ(unpack(bytes.data(), 0, &table), SR_E_DUPLICATE_KEY);
  // Without a hash table the rows are compared with each other.
  EXPECT_EQ(sr_unpack_table_1(bytes.data(), 0, nullptr, nullptr, receiver_, 0, &table),
            SR_E_DUPLICATE_KEY);
  EXPECT_EQ(sr_open_table_1(receiver_, "/twice", SR_MODE_READ, &table), SR_E_NO_TABLE);

  const std::string directory = sr_test::new_directory("sr_packed");
  ASSERT_EQ(sr_mount_local_tree_1(receiver_, "/disk", directory.c_str(), 0), 0);
  const buffer_bytes below =
      write_packed_buffer({{"/disk/t", columns, {{string_value("a"), int32_value(1)}}}}, false);
  EXPECT_EQ(unpack(below.data(), 0, &table), SR_E_INVALID_PATH);
  std::filesystem::remove_all(directory);
}

// ---- Buffers that do not hold together --------------------------------------

// Every call that reads the buffer, on every table: each either succeeds or
// refuses with one of the codes a damaged buffer may give.
void read_everything(const void *p_buffer, sr_opaque_handle_t tree) {
  uint32_t total = 0;
  const int32_t rc = sr_get_total_packed_tables_1(p_buffer, &total);
  ASSERT_TRUE(rc == 0 || rc == SR_E_TABLE_UNREADABLE) << rc;
  for (uint32_t index = 0; rc == 0 && index < total; ++index) {
    const char *p_name = nullptr;
    const int32_t name_rc = sr_get_packed_table_name_1(p_buffer, index, &p_name);
    ASSERT_TRUE(name_rc == 0 || name_rc == SR_E_TABLE_UNREADABLE) << name_rc;
    sr_opaque_handle_t table = nullptr;
    const int32_t unpack_rc = sr_unpack_table_1(p_buffer, 0, nullptr, nullptr, tree, index, &table);
    if (unpack_rc != 0) {
      ASSERT_NE(unpack_rc, SR_E_INTERNAL);
      continue;
    }
    sr_table_metadata_t *p_metadata = nullptr;
    ASSERT_EQ(sr_get_table_metadata_1(table, -1, &p_metadata), 0);
    for (uint32_t row = 0; row < p_metadata->number_of_rows; ++row) {
      for (uint32_t at = 0; at < p_metadata->number_of_columns; ++at) {
        qv_value_t value{};
        const int32_t read_rc = sr_get_field_by_index_1(
            table, static_cast<int32_t>(row), p_metadata->column_definitions[at].name, &value);
        ASSERT_TRUE(read_rc == 0 || read_rc == SR_E_LIBRARY_CALL) << read_rc;
        if (read_rc == 0 && p_metadata->column_definitions[at].type >= QV_CHAR_PTR) {
          std::free(value.ptr_char);
        }
      }
    }
    sr_free_table_metadata_1(p_metadata);
    sr_close_table_1(table);
  }
}

class HostileBufferTest : public PackedTest {
 protected:
  void SetUp() override {
    PackedTest::SetUp();
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                        column("count", QV_INT32), column("note", QV_CHAR_PTR)};
    tables_ = {{"",
                columns,
                {{string_value("a"), int32_value(1), string_value("first")},
                 {string_value("bb"), int32_value(2), string_value("")}}}};
    native_ = write_packed_buffer(tables_, false);
    foreign_ = write_packed_buffer(tables_, true);
  }

  // The buffer with its stated length (header and slot 2) cut to `length`,
  // in a block of that size.
  static buffer_bytes cut(buffer_bytes bytes, uint32_t length, bool other_byte_order) {
    const uint32_t stated = other_byte_order ? __builtin_bswap32(length) : length;
    set_word(bytes, 0, stated);
    set_word(bytes, 24, stated);
    bytes.resize(length);
    return bytes;
  }

  std::vector<packed_table_description> tables_;
  buffer_bytes native_, foreign_;
};

TEST_F(HostileBufferTest, EveryTruncationIsRefused) {
  for (uint32_t length = 28; length < native_.size(); ++length) {
    SCOPED_TRACE(length);
    exact_block native(cut(native_, length, false));
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_unpack_table_1(native.p_bytes, 0, nullptr, nullptr, receiver_, 0, &table),
              SR_E_TABLE_UNREADABLE);
    exact_block foreign(cut(foreign_, length, true));
    EXPECT_EQ(sr_convert_packed_table_buffer_1(foreign.p_bytes, 0, 0), SR_E_TABLE_UNREADABLE);
  }
}

TEST_F(HostileBufferTest, EachFieldThatDoesNotHoldTogetherIsRefused) {
  const size_t area = 40 + 32;  // one table
  uint32_t rows_offset = word_at(native_, 64);
  const size_t rows_body = area + rows_offset;
  const size_t first_row = rows_body + word_at(native_, rows_body + 4);
  const size_t first_row_slots = first_row + 20 + 4;
  struct damage {
    const char *p_what;
    size_t offset;
    uint32_t word;
  };
  const damage damages[] = {
      {"version and architecture", 4, 0x00000200u | 0xFF},
      {"slot 0", 8, 7},
      {"slot 1", 16, 0},
      {"slot 2", 24, 12345},
      {"table count", 32, 0x10000000u},
      {"name anchor", 40, 0xFFFFFFF0u},
      {"fixed metadata length", 52, 3},
      {"column metadata anchor", 56, 0x7FFFFFFFu},
      {"rows length", 68, word_at(native_, 68) + 1},
      {"row count", rows_body, 3},
      {"record length word", first_row, word_at(native_, first_row) - 1},
      {"key anchor past the record", first_row_slots, 200},
      {"key without its NUL", first_row_slots + 4, 1},
      {"note anchor past the record", first_row_slots + 16 + 4, 99},
  };
  for (const damage &one : damages) {
    SCOPED_TRACE(one.p_what);
    buffer_bytes bytes = native_;
    set_word(bytes, one.offset, one.word);
    exact_block block(bytes);
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_unpack_table_1(block.p_bytes, 0, nullptr, nullptr, receiver_, 0, &table),
              SR_E_TABLE_UNREADABLE);
    EXPECT_EQ(sr_test::last_error(),
              (std::pair<int32_t, std::string>{14, "2605-014 The table is unreadable.\n"}));
  }
  // The key moved away from the first column.
  std::vector<packed_table_description> moved = tables_;
  std::swap(moved[0].columns[0].qualifier, moved[0].columns[1].qualifier);
  sr_opaque_handle_t table = nullptr;
  EXPECT_EQ(unpack(write_packed_buffer(moved, false).data(), 0, &table), SR_E_TABLE_UNREADABLE);
}

TEST_F(HostileBufferTest, NoDamagedByteIsReadOutsideTheBuffer) {
  for (const bool other_byte_order : {false, true}) {
    const buffer_bytes &good = other_byte_order ? foreign_ : native_;
    for (size_t offset = 0; offset < good.size(); ++offset) {
      for (const unsigned char value : {0x00, 0x01, 0x7F, 0xFF}) {
        SCOPED_TRACE(std::to_string(offset) + " " + std::to_string(value));
        buffer_bytes bytes = good;
        bytes[offset] = value;
        exact_block block(bytes);
        if (other_byte_order) {
          const int32_t rc = sr_convert_packed_table_buffer_1(block.p_bytes, 0, 0);
          ASSERT_TRUE(rc == 0 || rc == SR_E_TABLE_UNREADABLE) << rc;
          if (rc != 0) {
            continue;
          }
        }
        read_everything(block.p_bytes, receiver_);
      }
    }
  }
}

}  // namespace
