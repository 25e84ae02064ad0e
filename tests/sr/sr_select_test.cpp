// Selection: rows copied into a new table with the chosen columns and every
// definition they carry, or listed by fixed index; which view each call
// reads and on which record criteria are judged; empty results; and
// failures that leave nothing behind.

#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "frame/sr_i_tree.h"
#include "pmsg_test_values.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_hash_table.h"

namespace {

using namespace sr_test;

// The fixed indexes a listing returns, or {code with the top bit} when it
// fails.
template <typename... Values>
std::vector<uint32_t> listed(sr_opaque_handle_t table, uint32_t visible, const char *p_criteria,
                             Values... values) {
  uint32_t total = 0;
  uint32_t *p_rows = nullptr;
  const int32_t rc = list_rows(table, visible, &total, &p_rows, p_criteria, values...);
  if (rc != 0) {
    return {static_cast<uint32_t>(rc) | 0x80000000u};
  }
  EXPECT_NE(p_rows, nullptr) << "an array is returned also for a count of 0";
  std::vector<uint32_t> rows(p_rows, p_rows + total);
  std::free(p_rows);
  return rows;
}

constexpr uint32_t failed(int32_t code) {
  return static_cast<uint32_t>(code) | 0x80000000u;
}

class Select : public RowTables {
 protected:
  void SetUp() override {
    unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");
    RowTables::SetUp();
  }

  // name -> count of every row of a table's committed view.
  static std::map<std::string, int32_t> counts(sr_opaque_handle_t table) {
    std::map<std::string, int32_t> rows;
    for (uint32_t fixed = 0; fixed < object(table)->maximum_rows; ++fixed) {
      if (state_of(table, fixed) == SR_ROW_STATE_COMMITTED) {
        rows[string_at_fixed(table, fixed, "name", 0)] = int32_at_fixed(table, fixed, "count", 0);
      }
    }
    return rows;
  }

  // A committed table of a=1, b=2, c=3, then pending: d=4 added, b set to
  // 20, c deleted. Its setting for uncommitted updates is the environment's
  // at the time.
  sr_opaque_handle_t pending_table(const char *p_path) {
    sr_opaque_handle_t table = create_named_counts(p_path, Explicit);
    for (const auto &[p_name, count] : {std::pair{"a", 1}, {"b", 2}, {"c", 3}}) {
      EXPECT_EQ(add_named(table, p_name, count), 0);
    }
    apply_commit(table);
    EXPECT_EQ(add_named(table, "d", 4), 0);
    qv_value_t twenty = int32_value(20);
    EXPECT_EQ(sr_set_field_by_key_1(table, string_value("b"), "count", &twenty), 0);
    EXPECT_EQ(sr_delete_rows_1(table, "name == $s", "c"), 0);
    return table;
  }

  size_t results_in_tree() const {
    return static_cast<sr_i_tree_t *>(tree_)->unnamed_tables.size();
  }
};

TEST_F(Select, TheResultCarriesTheChosenColumnsWithTheirDefinitionsAndValues) {
  sr_sd_def_t *p_point = static_cast<sr_sd_def_t *>(
      std::calloc(1, sizeof(sr_sd_def_t) + 2 * sizeof(sr_sd_field_def_t)));
  p_point->number_of_fields = 2;
  p_point->field_def[0] = {QV_INT32, const_cast<char *>("x")};
  p_point->field_def[1] = {QV_CHAR_PTR, const_cast<char *>("label")};
  std::vector<sr_column_t> columns = {
      column("id", QV_INT32, SR_PRIMARY_KEY),
      column("name", QV_CHAR_PTR, SR_STANDARD | SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED),
      column("blob", QV_BINARY_PTR),
      column("list", QV_INT64_ARRAY),
      column("point", QV_SD_PTR, SR_STANDARD | SR_INVISIBLE),
      column("ratio", QV_FLOAT64)};
  columns[1].default_value.ptr_char = const_cast<char *>("none");
  columns[4].sd_defn = p_point;
  columns[5].default_value.val_float64 = 0.5;
  sr_opaque_handle_t table = make_table("/all", columns, Explicit);
  std::free(p_point);

  value_arena arena;
  const int32_t types[] = {QV_INT32,       QV_CHAR_PTR, QV_BINARY_PTR,
                           QV_INT64_ARRAY, QV_SD_PTR,   QV_FLOAT64};
  std::vector<std::vector<qv_value_t>> rows;
  for (int32_t id = 1; id <= 3; ++id) {
    rows.push_back(
        {int32_value(id),
         arena.string("row " + std::to_string(id)),
         arena.binary(std::string(static_cast<size_t>(id), '\0')),
         arena.array({number64(static_cast<uint64_t>(id)), number64(UINT64_MAX)}),
         arena.structured({{QV_INT32, int32_value(id)}, {QV_CHAR_PTR, arena.string("p")}}),
         {}});
    rows.back()[5].val_float64 = id / 4.0;
    ASSERT_EQ(add_fields(table, {{"id", rows.back()[0]},
                                 {"name", rows.back()[1]},
                                 {"blob", rows.back()[2]},
                                 {"list", rows.back()[3]},
                                 {"point", rows.back()[4]},
                                 {"ratio", rows.back()[5]}}),
              0);
  }
  apply_commit(table);

  // The key comes first although not named; "name" named twice is there twice.
  const char *names[] = {"point", "name", "name", "id"};
  sr_opaque_handle_t result = nullptr;
  ASSERT_EQ(sr_select_1(table, names, 4, &result, "id >= $i", 2), 0);
  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(result, -1, &p_metadata), 0);
  EXPECT_STREQ(p_metadata->name, "");
  EXPECT_EQ(p_metadata->number_of_rows, 2u);
  EXPECT_EQ(p_metadata->table_change_counter, object(table)->change_counter + 1);
  ASSERT_EQ(p_metadata->number_of_columns, 4u);
  const uint32_t source_column[] = {0, 4, 1, 1};
  for (uint32_t at = 0; at < 4; ++at) {
    const sr_column_t &got = p_metadata->column_definitions[at];
    const sr_column_t &wanted = columns[source_column[at]];
    EXPECT_STREQ(got.name, wanted.name) << at;
    EXPECT_EQ(got.type, wanted.type) << at;
    EXPECT_EQ(got.qualifier, wanted.qualifier) << at;
  }
  EXPECT_STREQ(p_metadata->column_definitions[2].default_value.ptr_char, "none");
  const sr_sd_def_t *p_carried = p_metadata->column_definitions[1].sd_defn;
  ASSERT_NE(p_carried, nullptr);
  ASSERT_EQ(p_carried->number_of_fields, 2u);
  EXPECT_STREQ(p_carried->field_def[1].name, "label");
  EXPECT_EQ(p_carried->field_def[1].type, QV_CHAR_PTR);
  ASSERT_EQ(sr_free_table_metadata_1(p_metadata), 0);

  for (int32_t id = 2; id <= 3; ++id) {
    field_list read{{"point", {}}, {"name", {}}};
    qv_value_t *const *values = read.pointers.data();
    ASSERT_EQ(sr_get_fields_by_key_1(result, int32_value(id), read.names.data(), values, 2), 0);
    EXPECT_TRUE(values_equal(QV_SD_PTR, rows[static_cast<size_t>(id - 1)][4], *values[0]));
    EXPECT_TRUE(values_equal(QV_CHAR_PTR, rows[static_cast<size_t>(id - 1)][1], *values[1]));
    std::free(values[0]->ptr_char);
    std::free(values[1]->ptr_char);
  }
  // Every copied row is committed, and the result is explicitly controlled.
  for (const int32_t fixed : {0, 1}) {
    qv_value_t id{};
    sr_row_state_t state = SR_ROW_STATE_NO_ROW;
    ASSERT_EQ(sr_get_field_by_fixed_index_and_visibility_1(result, fixed, "id", &id, 1, &state), 0);
    EXPECT_EQ(state, SR_ROW_STATE_COMMITTED);
  }
  ASSERT_EQ(add_fields(result, {{"id", int32_value(9)}}), 0);
  EXPECT_EQ(sr_commit_1(result), SR_E_NOT_APPLIED);

  // Without a column list or criteria: a whole copy, every value as it was.
  sr_opaque_handle_t copy = nullptr;
  ASSERT_EQ(sr_select_1(table, nullptr, 0, &copy, nullptr), 0);
  for (int32_t id = 1; id <= 3; ++id) {
    for (uint32_t at = 1; at < 6; ++at) {
      qv_value_t value{};
      ASSERT_EQ(sr_get_field_by_key_1(copy, int32_value(id), columns[at].name, &value), 0);
      EXPECT_TRUE(values_equal(types[at], rows[static_cast<size_t>(id - 1)][at], value))
          << id << " " << columns[at].name;
      if (at != 5) {
        std::free(value.ptr_char);
      }
    }
  }
  EXPECT_EQ(results_in_tree(), 2u);
  ASSERT_EQ(sr_close_table_1(copy), 0);
  EXPECT_EQ(results_in_tree(), 1u);  // the other one goes with the tree
}

TEST_F(Select, EveryTypeSurvivesACopyColumnByColumn) {
  value_arena arena;
  const auto samples = sample_values(arena);
  sr_sd_def_t *p_any =
      static_cast<sr_sd_def_t *>(std::calloc(1, sizeof(sr_sd_def_t) + sizeof(sr_sd_field_def_t)));
  p_any->number_of_fields = 1;
  p_any->field_def[0] = {QV_INT32, const_cast<char *>("f")};
  std::vector<std::string> names;
  std::vector<sr_column_t> columns = {column("id", QV_INT32, SR_PRIMARY_KEY)};
  for (size_t at = 0; at < samples.size(); ++at) {
    names.push_back("c" + std::to_string(at));
  }
  for (size_t at = 0; at < samples.size(); ++at) {
    columns.push_back(column(names[at].c_str(), as_type(samples[at].first)));
    columns.back().sd_defn = p_any;
  }
  sr_opaque_handle_t table = make_table("/types", columns, Implicit);
  std::free(p_any);
  std::vector<const char *> row_names = {"id"};
  std::vector<qv_value_t> row_values = {int32_value(1)};
  for (size_t at = 0; at < samples.size(); ++at) {
    row_names.push_back(names[at].c_str());
    row_values.push_back(samples[at].second);
  }
  std::vector<qv_value_t *> row_pointers;
  for (qv_value_t &value : row_values) {
    row_pointers.push_back(&value);
  }
  ASSERT_EQ(sr_add_row_1(table, row_names.data(), row_pointers.data(),
                         static_cast<uint32_t>(row_names.size())),
            0);

  // Backwards, so that every body moves to another place in the record.
  std::vector<const char *> reversed(row_names.rbegin(), row_names.rend() - 1);
  sr_opaque_handle_t result = nullptr;
  ASSERT_EQ(
      sr_select_1(table, reversed.data(), static_cast<uint32_t>(reversed.size()), &result, nullptr),
      0);
  for (size_t at = 0; at < samples.size(); ++at) {
    qv_value_t value{};
    ASSERT_EQ(sr_get_field_by_key_1(result, int32_value(1), names[at].c_str(), &value), 0);
    EXPECT_TRUE(values_equal(samples[at].first, samples[at].second, value)) << names[at];
    if (!is_fixed_type(samples[at].first)) {
      std::free(value.ptr_char);
    }
  }
}

TEST_F(Select, SelectingReadsTheTablesViewAndListingTheAskedOneJudgingPendingValues) {
  sr_opaque_handle_t committed_view = pending_table("/hidden");
  setenv("SR_UNCOMMITTED_UPDATES_VISIBLE", "1", 1);
  sr_opaque_handle_t applied_view = pending_table("/shown");
  unsetenv("SR_UNCOMMITTED_UPDATES_VISIBLE");

  for (const bool applied : {false, true}) {
    SCOPED_TRACE(applied ? "applied" : "pending");
    // Applied but not committed, the views are as when pending.
    if (applied) {
      ASSERT_EQ(sr_apply_1(committed_view, 0), 0);
      ASSERT_EQ(sr_apply_1(applied_view, 0), 0);
    }
    sr_opaque_handle_t result = nullptr;
    ASSERT_EQ(sr_select_1(committed_view, nullptr, 0, &result, nullptr), 0);
    EXPECT_EQ(counts(result), (std::map<std::string, int32_t>{{"a", 1}, {"b", 2}, {"c", 3}}));
    ASSERT_EQ(sr_select_1(applied_view, nullptr, 0, &result, "count > $i", 1), 0);
    EXPECT_EQ(counts(result), (std::map<std::string, int32_t>{{"b", 20}, {"d", 4}}));

    const uint32_t a = fixed_index_of(committed_view, "a");
    const uint32_t b = fixed_index_of(committed_view, "b");
    const uint32_t c = fixed_index_of(committed_view, "c");
    const uint32_t d = fixed_index_of(committed_view, "d");
    EXPECT_EQ(listed(committed_view, 0, nullptr), (std::vector<uint32_t>{a, b, c}));
    EXPECT_EQ(listed(committed_view, 1, nullptr), (std::vector<uint32_t>{a, b, d}));
    // The committed view judges b by its pending 20; c, deleted, matches
    // nothing there although it is still committed.
    EXPECT_EQ(listed(committed_view, 0, "count == $i", 20), std::vector<uint32_t>{b});
    EXPECT_EQ(listed(committed_view, 0, "count == $i", 2), std::vector<uint32_t>{});
    EXPECT_EQ(listed(committed_view, 0, "name == $s", "c"), std::vector<uint32_t>{});
    EXPECT_EQ(listed(applied_view, 0, "count >= $i", 4).size(), 2u);  // its own setting
  }
  ASSERT_EQ(sr_commit_1(committed_view), 0);
  EXPECT_EQ(listed(committed_view, 0, nullptr), listed(committed_view, 1, nullptr));
}

// Rows are judged many index positions at a time: a table of a few
// thousand rows, with pending additions, updates and deletions spread over
// it (and a run of deletions longer than one batch), lists and copies
// exactly the rows a position-by-position reading through the interface
// says, in both views, with criteria the compiler fuses, criteria it does
// not, and none.
TEST_F(Select, LongTablesWithPendingChangesAreJudgedPositionByPosition) {
  sr_opaque_handle_t table = create_named_counts("/long", Explicit);
  for (int32_t row = 0; row < 2500; ++row) {
    ASSERT_EQ(add_named(table, ("r" + std::to_string(row)).c_str(), row), 0);
  }
  apply_commit(table);
  for (int32_t row = 0; row < 60; ++row) {
    ASSERT_EQ(add_named(table, ("n" + std::to_string(row)).c_str(), 300 + row), 0);
  }
  for (int32_t row = 1; row < 2500; row += 5) {
    qv_value_t changed = int32_value(-row);
    ASSERT_EQ(sr_set_field_by_key_1(table, string_value(("r" + std::to_string(row)).c_str()),
                                    "count", &changed),
              0);
  }
  ASSERT_EQ(sr_delete_rows_1(table, "count % $i == $i", 7, 3), 0);
  ASSERT_EQ(sr_delete_rows_1(table, "count >= $i && count < $i", 700, 1900), 0);

  struct criteria_case {
    const char *p_text;
    std::function<bool(int32_t)> holds;
  };
  const std::vector<criteria_case> cases = {
      {"count >= 100 && count < 600", [](int32_t count) { return count >= 100 && count < 600; }},
      {"note != 'none' || count < 0", [](int32_t count) { return count < 0; }},
      {"count % 3 == 1", [](int32_t count) { return count % 3 == 1; }},
      {nullptr, [](int32_t) { return true; }}};
  const uint32_t positions = object(table)->maximum_rows;
  ASSERT_GT(positions, 2560u);
  for (const criteria_case &criteria : cases) {
    SCOPED_TRACE(criteria.p_text != nullptr ? criteria.p_text : "no criteria");
    std::vector<uint32_t> committed_view;
    std::vector<uint32_t> applied_view;
    std::map<std::string, int32_t> copied;
    for (uint32_t fixed = 0; fixed < positions; ++fixed) {
      qv_value_t committed{};
      qv_value_t applied{};
      const bool is_committed =
          sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed), "count",
                                                       &committed, 0, nullptr) == 0;
      const bool is_applied =
          sr_get_field_by_fixed_index_and_visibility_1(table, static_cast<int32_t>(fixed), "count",
                                                       &applied, 1, nullptr) == 0;
      // The listing judges the pending values in either view; without
      // criteria it lists every row of the view.
      const bool applied_matches =
          criteria.p_text == nullptr || (is_applied && criteria.holds(applied.val_int32));
      if (is_committed && applied_matches) {
        committed_view.push_back(fixed);
      }
      if (is_applied && applied_matches) {
        applied_view.push_back(fixed);
      }
      // A selection judges the view it copies, here the committed one.
      if (is_committed && criteria.holds(committed.val_int32)) {
        copied[string_at_fixed(table, fixed, "name", 0)] = committed.val_int32;
      }
    }
    EXPECT_EQ(listed(table, 0, criteria.p_text), committed_view);
    EXPECT_EQ(listed(table, 1, criteria.p_text), applied_view);
    sr_opaque_handle_t result = nullptr;
    ASSERT_EQ(sr_select_1(table, nullptr, 0, &result, criteria.p_text), 0);
    EXPECT_EQ(counts(result), copied);
  }
}

TEST_F(Select, AHashedTablesResultIsFoundByKeyThroughTheSameHashing) {
  sr_opaque_handle_t table =
      make_table("/hashed", {column("id", QV_INT32, SR_PRIMARY_KEY), column("count", QV_INT32)},
                 Implicit, four_buckets, 4);
  for (int32_t id = 0; id < 20; ++id) {
    ASSERT_EQ(add_numbered(table, id, id * 10), 0);
  }
  sr_opaque_handle_t result = nullptr;
  ASSERT_EQ(sr_select_1(table, nullptr, 0, &result, "count >= $i", 100), 0);
  const sr_hash_table_t *p_hash_table = object(result)->p_rows_hash_table;
  ASSERT_NE(p_hash_table, nullptr);
  EXPECT_EQ(p_hash_table->total_hash_buckets, 4u);
  EXPECT_EQ(p_hash_table->p_hash_function, four_buckets);
  for (int32_t id = 0; id < 20; ++id) {
    qv_value_t count{};
    EXPECT_EQ(sr_get_field_by_key_1(result, int32_value(id), "count", &count),
              id >= 10 ? 0 : SR_E_NO_ROW_FOR_KEY);
    EXPECT_EQ(count.val_int32, id >= 10 ? id * 10 : 0);
  }
}

TEST_F(Select, NothingMatchingIsAnEmptyResultNotAnError) {
  sr_opaque_handle_t table = create_named_counts("/few", Implicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  sr_opaque_handle_t result = nullptr;
  ASSERT_EQ(sr_select_1(table, nullptr, 0, &result, "count > $i", 5), 0);
  EXPECT_EQ(object(result)->total_committed_rows, 0u);
  EXPECT_EQ(listed(table, 0, "count > $i", 5), std::vector<uint32_t>{});
  ASSERT_EQ(sr_delete_rows_1(table, nullptr), 0);
  EXPECT_EQ(listed(table, 1, nullptr), std::vector<uint32_t>{});
  ASSERT_EQ(sr_select_1(table, nullptr, 0, &result, nullptr), 0);
  EXPECT_EQ(object(result)->total_committed_rows, 0u);
}

TEST_F(Select, FailuresComeInTheirOrderAndLeaveNothingBehind) {
  sr_opaque_handle_t table = pending_table("/t");
  const uint64_t counter = object(table)->change_counter;
  const std::map<std::string, int32_t> rows = counts(table);
  const char *unknown[] = {"count", "nosuch"};
  const char *known[] = {"count"};
  sr_opaque_handle_t result = nullptr;
  const struct {
    int32_t rc;
    int32_t code;
  } cases[] = {
      {sr_select_1(nullptr, known, 1, &result, nullptr), SR_E_INVALID_HANDLE},
      {sr_select_1(table, known, 1, nullptr, nullptr), SR_E_NULL_POINTER},
      {sr_select_1(table, nullptr, 1, &result, nullptr), SR_E_NO_COLUMNS},
      {sr_select_1(table, unknown, 2, &result, nullptr), SR_E_INVALID_COLUMN},
      {sr_select_1(table, known, 1, &result, "nosuch == 1"), SR_E_LIBRARY_CALL},
      {sr_select_1(table, known, 1, &result, "count == $q", 1), SR_E_INVALID_CRITERIA},
  };
  for (const auto &[rc, code] : cases) {
    EXPECT_EQ(rc, code);
  }
  EXPECT_EQ(result, nullptr);
  EXPECT_EQ(results_in_tree(), 0u);
  EXPECT_EQ(listed(nullptr, 0, nullptr), std::vector<uint32_t>{failed(SR_E_INVALID_HANDLE)});
  EXPECT_EQ(listed(table, 0, "nosuch == 1"), std::vector<uint32_t>{failed(SR_E_LIBRARY_CALL)});
  EXPECT_TRUE(last_error().second.starts_with("2605-011 The cu_comp_expr library function"))
      << last_error().second;
  EXPECT_EQ(listed(table, 0, "count == $q", 1),
            std::vector<uint32_t>{failed(SR_E_INVALID_CRITERIA)});
  uint32_t total = 0;
  EXPECT_EQ(list_rows(table, 0, &total, nullptr, nullptr), SR_E_NULL_POINTER);
  EXPECT_EQ(object(table)->change_counter, counter);
  EXPECT_EQ(counts(table), rows);
  EXPECT_EQ(count_of(table, "d", 1), 4);  // pending changes untouched
}

// ---- The guide's worked example ------------------------------------------

// The cells of the markdown table rows in `text` that follow the line
// starting with `header`, up to the first line that is not a table row.
std::vector<std::vector<std::string>> table_after(const std::string &text,
                                                  const std::string &header) {
  std::vector<std::vector<std::string>> rows;
  std::istringstream lines(text.substr(text.find("\n" + header) + 1));
  std::string line;
  std::getline(lines, line);  // the header
  std::getline(lines, line);  // the rule
  while (std::getline(lines, line) && line.starts_with("|")) {
    std::vector<std::string> cells;
    std::string cell;
    for (size_t at = 1; at < line.size(); ++at) {
      if (line[at] == '\\' && at + 1 < line.size() && line[at + 1] == '|') {
        cell += line[++at];  // an escaped bar inside a cell
      } else if (line[at] == '|') {
        const size_t first = cell.find_first_not_of(' ');
        cells.push_back(first == std::string::npos
                            ? ""
                            : cell.substr(first, cell.find_last_not_of(' ') - first + 1));
        cell.clear();
      } else {
        cell += line[at];
      }
    }
    rows.push_back(cells);
  }
  return rows;
}

std::vector<std::string> split_names(const std::string &list) {
  std::vector<std::string> names;
  std::istringstream items(list);
  for (std::string name; std::getline(items, name, ',');) {
    name.erase(0, name.find_first_not_of(' '));
    if (!name.empty() && name != "(none)") {
      names.push_back(name);
    }
  }
  return names;
}

TEST_F(Select, TheGuidesWorkedExampleSelectsWhatItSays) {
  std::ifstream guide(std::string(QV_SOURCE_DIR) + "/docs/expressions.md");
  const std::string text{std::istreambuf_iterator<char>(guide), {}};
  const auto rows = table_after(text, "| Name | Mtu | Metric | Aliases |");
  const auto examples = table_after(text, "| Criteria | Selects |");
  ASSERT_EQ(rows.size(), 4u);
  ASSERT_GE(examples.size(), 5u);

  sr_opaque_handle_t interfaces =
      make_table("/interfaces",
                 {column("Name", QV_CHAR_PTR, SR_PRIMARY_KEY), column("Mtu", QV_UINT32),
                  column("Metric", QV_INT32), column("Aliases", QV_CHAR_PTR_ARRAY)},
                 Implicit);
  value_arena arena;
  for (const auto &row : rows) {
    std::vector<qv_value_t> aliases;
    for (const std::string &alias : split_names(row[3])) {
      aliases.push_back(arena.string(alias));
    }
    ASSERT_EQ(add_fields(interfaces, {{"Name", arena.string(row[0])},
                                      {"Mtu", number32(std::stoul(row[1]))},
                                      {"Metric", int32_value(std::stoi(row[2]))},
                                      {"Aliases", arena.array(aliases)}}),
              0);
  }
  auto names_of = [&](sr_opaque_handle_t table) {
    std::vector<std::string> names;
    for (int32_t packed = 0;; ++packed) {
      qv_value_t name{};
      if (sr_get_field_by_index_1(table, packed, "Name", &name) != 0) {
        return names;
      }
      names.push_back(name.ptr_char);
      std::free(name.ptr_char);
    }
  };
  for (const auto &example : examples) {
    std::string criteria = example[0].substr(1, example[0].size() - 2);  // the code span
    SCOPED_TRACE(criteria);
    const std::vector<std::string> wanted = split_names(example[1]);
    sr_opaque_handle_t result = nullptr;
    ASSERT_EQ(sr_select_1(interfaces, nullptr, 0, &result, criteria.c_str()), 0);
    EXPECT_EQ(names_of(result), wanted);
    std::vector<std::string> listed_names;
    for (const uint32_t fixed : listed(interfaces, 0, criteria.c_str())) {
      listed_names.push_back(string_at_fixed(interfaces, fixed, "Name", 0));
    }
    EXPECT_EQ(listed_names, wanted);
  }

  // The C snippet closing the section.
  sr_opaque_handle_t wide = nullptr;
  const char *columns[] = {"Mtu"};
  ASSERT_EQ(sr_select_1(interfaces, columns, 1, &wide, "Mtu >= $ui", uint32_t{1500}), 0);
  EXPECT_EQ(object(wide)->total_columns, 2u);
  EXPECT_STREQ(object(wide)->p_columns[1].name, "Mtu");
  EXPECT_EQ(names_of(wide), (std::vector<std::string>{"eth0", "eth1", "lo"}));
}

}  // namespace
