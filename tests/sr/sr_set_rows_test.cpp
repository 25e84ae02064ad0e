// Setting values of existing rows through the exported calls: the order of
// the checks and the row left as it was after each refusal; the row's state;
// columns reset to their defaults when not named; long values; key changes
// and the key hash table. (That a set gives back the record it replaces is
// checked by the row model test, after every abort.)

#include <gtest/gtest.h>

#include <cstdlib>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "rows/sr_i_rows.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

constexpr auto &number = int32_value;
constexpr auto &text = string_value;

/*
 * The table under test is table_: by default one of eight columns, the key
 * k; name (default "none"); count; two protected columns around a
 * structured-data column; and two columns that go back to their defaults
 * ("fresh", 5) whenever a set leaves them out.
 */
class SetRows : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    p_definition_->number_of_fields = 1;
    p_definition_->field_def[0] = {QV_INT32, const_cast<char *>("n")};
    std::vector<sr_column_t> columns = {
        column("k", QV_INT32, SR_PRIMARY_KEY),
        column("name", QV_CHAR_PTR),
        column("count", QV_INT32),
        column("locked", QV_INT32, SR_STANDARD | SR_PROTECTED),
        column("peer", QV_SD_PTR),
        column("sealed", QV_INT32, SR_STANDARD | SR_PROTECTED),
        column("reset", QV_CHAR_PTR, SR_STANDARD | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED),
        column("level", QV_INT32, SR_STANDARD | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED)};
    columns[1].default_value.ptr_char = const_cast<char *>("none");
    columns[4].sd_defn = p_definition_.get();
    columns[6].default_value.ptr_char = const_cast<char *>("fresh");
    columns[7].default_value.val_int32 = 5;
    table_ = make_table("/set/rows", columns, Explicit);
  }
  // Adds a row whose first value is its int32 key; returns its fixed index.
  // The second form adds one with locked 7, reset "custom" and level 9.
  uint32_t add(const field_list &row) {
    EXPECT_EQ(add_fields(table_, row), 0);
    return static_cast<uint32_t>(lookup(row.values[0].val_int32));
  }
  uint32_t add(int32_t key, const char *p_name, int32_t count) {
    return add({{"k", number(key)},
                {"name", text(p_name)},
                {"count", number(count)},
                {"locked", number(7)},
                {"reset", text("custom")},
                {"level", number(9)}});
  }
  // The fixed index the key leads to, or -(the code).
  int64_t lookup(int32_t key) {
    uint32_t fixed = 0;
    const int32_t rc = sr_get_fixed_row_index_for_key_1(table_, number(key), &fixed);
    return rc == 0 ? static_cast<int64_t>(fixed) : -static_cast<int64_t>(rc);
  }
  void commit() { apply_commit(table_); }

  // One value goes through the call that sets one field.
  int32_t set(uint32_t fixed, const field_list &values) {
    const auto index = static_cast<int32_t>(fixed);
    return values.count() == 1
               ? sr_set_field_by_fixed_index_1(table_, index, values.names[0], values.pointers[0])
               : sr_set_fields_by_fixed_index_1(table_, index, values.names.data(),
                                                values.pointers.data(), values.count());
  }

  // Values by fixed index in the applied view (1) or the committed one (0).
  std::string text_of(uint32_t fixed, const char *p_column = "name", uint32_t view = 1) {
    return string_at_fixed(table_, fixed, p_column, view);
  }
  int32_t number_of(uint32_t fixed, const char *p_column = "count", uint32_t view = 1) {
    return int32_at_fixed(table_, fixed, p_column, view);
  }

  std::unique_ptr<sr_sd_def_t, decltype(&std::free)> p_definition_ =
      zeroed_block<sr_sd_def_t>(sizeof(sr_sd_field_def_t));
  sr_opaque_handle_t table_ = nullptr;
};

TEST_F(SetRows, RefusalsComeInOrderAndLeaveTheRowAsItWas) {
  const uint32_t row = add(1, "one", 10);
  const uint32_t doomed = add(2, "two", 20);
  commit();
  ASSERT_EQ(sr_delete_row_by_index_1(table_, 1), 0);
  const uint32_t used = object(table_)->record_buffer_pool.used_bytes;
  const uint32_t past_end = object(table_)->maximum_rows;
  // A structured-data value with an element of no known type, which the
  // codec refuses.
  auto bad = zeroed_block<qv_structured_data_t>(sizeof(qv_structured_data_element_t));
  bad->element_count = 1;
  bad->elements[0].data_type = static_cast<qv_data_type_t>(99);
  qv_value_t peer{};
  peer.ptr_sd = bad.get();

  // Index range, then the row's record, then the columns; a protected
  // column is refused even with the value it holds. Columns are taken in
  // table order ("locked" before "peer" before "sealed") whatever the
  // caller's order; unknown or repeated names are found last.
  EXPECT_EQ(set(past_end, {{"count", number(1)}}), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(set(static_cast<uint32_t>(-1), {{"count", number(1)}}), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(set(doomed, {{"nosuch", number(1)}}), SR_E_ROW_DELETED);
  EXPECT_EQ(set(past_end - 1, {{"nosuch", number(1)}}), SR_E_ROW_DELETED);
  EXPECT_EQ(set(row, {{"locked", number(7)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"sealed", number(0)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"nosuch", number(1)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"count", number(1)}, {"count", number(2)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"count", number(1)}, {"nosuch", number(2)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"peer", peer}}), SR_E_LIBRARY_CALL);
  EXPECT_EQ(set(row, {{"peer", peer}, {"locked", number(7)}}), SR_E_INVALID_COLUMN);
  EXPECT_EQ(set(row, {{"sealed", number(0)}, {"peer", peer}}), SR_E_LIBRARY_CALL);
  EXPECT_EQ(set(row, {{"nosuch", number(0)}, {"peer", peer}}), SR_E_LIBRARY_CALL);
  EXPECT_EQ(object(table_)->record_buffer_pool.used_bytes, used);
  EXPECT_EQ(object(table_)->p_rows_change_list, nullptr);
  EXPECT_EQ(state_of(table_, row), SR_ROW_STATE_COMMITTED);
  EXPECT_EQ(number_of(row), 10);
  EXPECT_EQ(text_of(row), "one");

  // With changes applied and not committed every set is refused; the
  // fixed index is not even looked at, while the packed index and the key
  // are resolved first.
  ASSERT_EQ(sr_apply_1(table_, 0), 0);
  EXPECT_EQ(set(past_end, {{"count", number(1)}}), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(set(row, {{"count", number(1)}}), SR_E_APPLIED_UNCOMMITTED);
  const qv_value_t one = number(1);
  EXPECT_EQ(sr_set_field_by_index_1(table_, 5, "count", &one), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_field_by_index_1(table_, 0, "count", &one), SR_E_APPLIED_UNCOMMITTED);
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(99), "count", &one), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(1), "count", &one), SR_E_APPLIED_UNCOMMITTED);
  ASSERT_EQ(sr_commit_1(table_), 0);
  EXPECT_EQ(number_of(row, "count", 0), 10);
  EXPECT_EQ(set(row, {{"count", number(11)}}), 0);
  EXPECT_EQ(number_of(row), 11);
}

TEST_F(SetRows, ARowKeepsItsStateAndItsFileOffset) {
  const uint32_t row = add(1, "one", 10);
  commit();
  // A row added in the same pending set stays added, with no committed
  // record; a committed row becomes updated.
  const uint32_t added = add(2, "two", 20);
  EXPECT_EQ(set(added, {{"name", text("deux")}, {"count", number(21)}}), 0);
  EXPECT_EQ(state_of(table_, added), SR_ROW_STATE_ADDED);
  EXPECT_EQ(number_of(added, "count", 0), -1);
  // The new record carries the row's file offset.
  object(table_)->p_rows_fixed_index[row].file_offset = 4096;  // as if it lay at 4096 in a file
  EXPECT_EQ(set(row, {{"count", number(12)}}), 0);
  EXPECT_EQ(state_of(table_, row), SR_ROW_STATE_UPDATED);
  EXPECT_EQ(sr_i_row_header_word(object(table_)->p_rows_fixed_index[row].p_applied), 4096u);
  EXPECT_EQ(sr_abort_1(table_), 0);
}

TEST_F(SetRows, EachSetRebuildsTheRecordFromTheRowAndTheNamedValues) {
  const uint32_t row = add(1, "one", 10);
  std::string long_name;
  for (int at = 0; long_name.size() < 20000; ++at) {
    long_name += std::to_string(at) + ",";
  }
  const std::string other(5000, 'z');
  // Columns qualified to reset take their defaults when not named; the
  // others, long values too, are carried into the new record.
  auto expect_row = [&](const std::string &name, int32_t count, const std::string &reset,
                        int32_t level) {
    EXPECT_EQ(text_of(row), name);
    EXPECT_EQ(number_of(row), count);
    EXPECT_EQ(text_of(row, "reset"), reset);
    EXPECT_EQ(number_of(row, "level"), level);
  };
  expect_row("one", 10, "custom", 9);
  EXPECT_EQ(set(row, {{"count", number(11)}}), 0);
  expect_row("one", 11, "fresh", 5);
  EXPECT_EQ(set(row, {{"reset", text("again")}}), 0);
  expect_row("one", 11, "again", 5);
  EXPECT_EQ(set(row, {{"level", number(8)}}), 0);
  expect_row("one", 11, "fresh", 8);
  EXPECT_EQ(set(row, {{"name", text(long_name.c_str())}}), 0);
  expect_row(long_name, 11, "fresh", 5);
  EXPECT_EQ(set(row, {{"count", number(12)}}), 0);
  expect_row(long_name, 12, "fresh", 5);
  EXPECT_EQ(set(row, {{"reset", text(other.c_str())}, {"name", text(long_name.c_str() + 1)}}), 0);
  expect_row(long_name.substr(1), 12, other, 5);
  commit();
  EXPECT_EQ(text_of(row, "name", 0), long_name.substr(1));
  EXPECT_EQ(set(row, {{"name", text("short")}}), 0);
  expect_row("short", 12, "fresh", 5);
}

TEST_F(SetRows, EveryWayOfNamingTheRowReachesIt) {
  for (int32_t key = 1; key <= 3; ++key) {
    add(key, "row", key * 10);
  }
  commit();
  // Deleting packed row 0 moves the last row (key 3) into its place.
  ASSERT_EQ(sr_delete_row_by_index_1(table_, 0), 0);
  commit();
  field_list count{{"count", {}}};
  const char *const *names = count.names.data();
  qv_value_t *const *values = count.pointers.data();
  // Each way sets the count to `value`, which the row of `key` then holds.
  auto expect_count = [&](int32_t key, int32_t value, auto set_by) {
    count.values[0] = number(value);
    EXPECT_EQ(set_by(), 0);
    EXPECT_EQ(number_of(static_cast<uint32_t>(lookup(key))), value);
  };
  expect_count(3, 31, [&] { return sr_set_field_by_index_1(table_, 0, "count", values[0]); });
  expect_count(2, 21, [&] { return sr_set_fields_by_index_1(table_, 1, names, values, 1); });
  expect_count(2, 22, [&] { return sr_set_field_by_key_1(table_, number(2), "count", values[0]); });
  expect_count(3, 32, [&] { return sr_set_fields_by_key_1(table_, number(3), names, values, 1); });
  EXPECT_EQ(sr_set_field_by_index_1(table_, 2, "count", values[0]), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_fields_by_index_1(table_, -1, names, values, 1), SR_E_NO_ROW_FOR_INDEX);
  EXPECT_EQ(sr_set_fields_by_key_1(table_, number(1), names, values, 1), SR_E_NO_ROW_FOR_KEY);
}

TEST_F(SetRows, AKeyChangeLeavesTheHashElementOfACommittedRowAlone) {
  // One bucket: every element is compared, so the element's key pointer
  // alone decides what a lookup finds.
  table_ =
      make_table("/set/hashed", {column("k", QV_INT32, SR_PRIMARY_KEY), column("v", QV_CHAR_PTR)},
                 Explicit, one_bucket, 1);
  const uint32_t committed = add({{"k", number(1)}});
  commit();
  const uint32_t added = add({{"k", number(2)}});
  // Each new record (v as long as the key) is longer than the last and never
  // fits where that one was.
  for (const auto &[fixed, key] :
       {std::pair(committed, 100), {committed, 101}, {added, 200}, {added, 201}}) {
    const std::string filler(static_cast<size_t>(key), 'v');
    ASSERT_EQ(set(fixed, {{"k", number(key)}, {"v", text(filler.c_str())}}), 0);
  }
  // The committed row's element keeps pointing into its committed record,
  // so its old key still names it, for setting too; the added row's element
  // follows its key into each new record, never left in one given back.
  EXPECT_EQ(number_of(committed, "k"), 101);
  EXPECT_EQ(lookup(1), committed);
  EXPECT_EQ(lookup(201), added);
  for (const int32_t key : {101, 2, 200}) {
    EXPECT_EQ(lookup(key), -SR_E_NO_ROW_FOR_KEY) << key;
  }
  const qv_value_t value = text("by old key");
  EXPECT_EQ(sr_set_field_by_key_1(table_, number(1), "v", &value), 0);
  EXPECT_EQ(text_of(committed, "v"), "by old key");
  EXPECT_EQ(number_of(committed, "k"), 101);
  commit();
  EXPECT_EQ(lookup(101), committed);
  EXPECT_EQ(lookup(201), added);
  EXPECT_EQ(lookup(1), -SR_E_NO_ROW_FOR_KEY);
}

}  // namespace
