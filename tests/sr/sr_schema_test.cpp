// Schema changes on open tables: columns added, deleted and renamed,
// defaults changed, and the two in-memory overlays. What the rebuilds must
// keep: every row, readable by key, by packed index and by fixed index in
// both views, through every handle; invisible columns; the table as it was
// when a change is refused. Persistent tables are rebuilt into their file,
// and a change made afterwards reaches the new file where a second program
// reads it.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

// The columns of a table as its description lists them (all, invisible
// ones included): name and type.
std::vector<std::pair<std::string, qv_data_type_t>> columns_of(sr_opaque_handle_t table) {
  sr_table_metadata_t *p_metadata = nullptr;
  EXPECT_EQ(sr_get_table_metadata_1(table, -1, &p_metadata), 0);
  std::vector<std::pair<std::string, qv_data_type_t>> columns;
  if (p_metadata == nullptr) {
    return columns;
  }
  for (uint32_t at = 0; at < p_metadata->number_of_columns; ++at) {
    columns.emplace_back(p_metadata->column_definitions[at].name,
                         p_metadata->column_definitions[at].type);
  }
  sr_free_table_metadata_1(p_metadata);
  return columns;
}

uint64_t change_counter_of(sr_opaque_handle_t table) {
  sr_table_metadata_t *p_metadata = nullptr;
  EXPECT_EQ(sr_get_table_metadata_1(table, 0, &p_metadata), 0);
  const uint64_t counter = p_metadata != nullptr ? p_metadata->table_change_counter : 0;
  sr_free_table_metadata_1(p_metadata);
  return counter;
}

// A string column read by key; "<code>" when the read fails.
std::string string_by_key(sr_opaque_handle_t table, const char *p_key, const char *p_column,
                          uint32_t uncommitted = 0) {
  qv_value_t result{};
  const int32_t rc = sr_get_field_by_key_and_visibility_1(table, string_value(p_key), p_column,
                                                          &result, uncommitted, nullptr);
  if (rc != 0) {
    return "<" + std::to_string(rc) + ">";
  }
  std::string text = result.ptr_char;
  std::free(result.ptr_char);
  return text;
}

int32_t int32_by_key(sr_opaque_handle_t table, const char *p_key, const char *p_column) {
  qv_value_t result{};
  const int32_t rc = sr_get_field_by_key_and_visibility_1(table, string_value(p_key), p_column,
                                                          &result, 0, nullptr);
  return rc == 0 ? result.val_int32 : -rc;
}

sr_column_t int32_column(const char *p_name, int32_t default_value) {
  sr_column_t definition = column(p_name, QV_INT32);
  definition.default_value.val_int32 = default_value;
  return definition;
}

sr_column_t string_column(const char *p_name, const char *p_default) {
  sr_column_t definition = column(p_name, QV_CHAR_PTR);
  definition.default_value.ptr_char = const_cast<char *>(p_default);
  return definition;
}

class Schema : public RowTables {
 protected:
  // "name" key, "count" (7), "note" ("none"), with rows a..e of counts 1..5,
  // and then b and d deleted, so that the packed and fixed indexes of the
  // live rows differ.
  sr_opaque_handle_t table_with_holes(const char *p_path) {
    sr_opaque_handle_t table = create_named_counts(p_path, Explicit);
    const char *names[] = {"a", "b", "c", "d", "e"};
    for (int32_t at = 0; at < 5; ++at) {
      EXPECT_EQ(add_named(table, names[at], at + 1), 0);
    }
    apply_commit(table);
    EXPECT_EQ(sr_delete_rows_1(table, "name == $s || name == $s", "b", "d"), 0);
    apply_commit(table);
    return table;
  }

  // Every way of reaching the rows a, c, e (counts 1, 3, 5) agrees.
  static void expect_rows_ace(sr_opaque_handle_t table) {
    for (uint32_t view = 0; view <= 1; ++view) {
      EXPECT_EQ((rows_in<std::string>(table, "name", view)),
                (std::map<std::string, int32_t>{{"a", 1}, {"c", 3}, {"e", 5}}))
          << "view " << view;
    }
    for (const char *p_name : {"a", "c", "e"}) {
      const uint32_t fixed = fixed_index_of(table, p_name);
      EXPECT_EQ(string_at_fixed(table, fixed, "name", 0), p_name);
      EXPECT_EQ(string_at_fixed(table, fixed, "name", 1), p_name);
      EXPECT_EQ(count_of(table, p_name, 0), int32_at_fixed(table, fixed, "count", 1));
    }
    EXPECT_EQ(count_of(table, "b", 0), -1);
  }
};

TEST_F(Schema, AddingColumnsToAnEmptyTableLengthensItsColumnList) {
  sr_opaque_handle_t table = create_named_counts("/empty", Implicit);
  sr_column_t added[] = {int32_column("port", 80), string_column("host", "localhost")};
  ASSERT_EQ(sr_add_columns_1(table, added, 2), 0);
  EXPECT_EQ(columns_of(table),
            (std::vector<std::pair<std::string, qv_data_type_t>>{{"name", QV_CHAR_PTR},
                                                                 {"count", QV_INT32},
                                                                 {"note", QV_CHAR_PTR},
                                                                 {"port", QV_INT32},
                                                                 {"host", QV_CHAR_PTR}}));
  EXPECT_TRUE((rows_in<std::string>(table, "name", 0).empty()));
  // The new table takes rows with the new defaults.
  ASSERT_EQ(add_named(table, "x", 1), 0);
  EXPECT_EQ(int32_by_key(table, "x", "port"), 80);
  EXPECT_EQ(string_by_key(table, "x", "host"), "localhost");
}

TEST_F(Schema, AddedColumnsHoldTheirDefaultsInEveryRowAndEveryHandleSeesThem) {
  sr_opaque_handle_t table = table_with_holes("/t");
  sr_opaque_handle_t second = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/t", SR_MODE_READ, &second), 0);
  const uint64_t counter = change_counter_of(table);
  sr_column_t added[] = {int32_column("port", 80), string_column("host", "localhost")};
  ASSERT_EQ(sr_add_columns_1(table, added, 2), 0);
  EXPECT_EQ(change_counter_of(second), counter + 1);
  for (const char *p_name : {"a", "c", "e"}) {
    EXPECT_EQ(int32_by_key(second, p_name, "port"), 80);
    EXPECT_EQ(string_by_key(second, p_name, "host"), "localhost");
    EXPECT_EQ(string_by_key(second, p_name, "note"), "none");
  }
  expect_rows_ace(table);
  expect_rows_ace(second);
  // The rebuilt table keeps working: rows added, changed and deleted.
  ASSERT_EQ(add_named(table, "f", 6), 0);
  const qv_value_t port = int32_value(8080);
  ASSERT_EQ(sr_set_field_by_key_1(table, string_value("a"), "port", &port), 0);
  ASSERT_EQ(sr_delete_rows_1(table, "name == $s", "c"), 0);
  apply_commit(table);
  EXPECT_EQ((rows_in<std::string>(second, "name", 0)),
            (std::map<std::string, int32_t>{{"a", 1}, {"e", 5}, {"f", 6}}));
  EXPECT_EQ(int32_by_key(second, "a", "port"), 8080);
  EXPECT_EQ(sr_close_table_1(second), 0);
}

TEST_F(Schema, AddingColumnsRefusesWhatCreationRefusesAndLeavesTheTable) {
  sr_opaque_handle_t table = table_with_holes("/t");
  const auto before = columns_of(table);
  sr_column_t again[] = {int32_column("count", 0)};
  EXPECT_EQ(sr_add_columns_1(table, again, 1), SR_E_DUPLICATE_COLUMN);
  sr_column_t twice[] = {int32_column("port", 0), int32_column("port", 1)};
  EXPECT_EQ(sr_add_columns_1(table, twice, 2), SR_E_DUPLICATE_COLUMN);
  sr_column_t key[] = {column("other", QV_INT32, SR_PRIMARY_KEY)};
  EXPECT_EQ(sr_add_columns_1(table, key, 1), SR_E_DUPLICATE_KEY);
  sr_column_t bad_name[] = {int32_column("9lives", 0)};
  EXPECT_EQ(sr_add_columns_1(table, bad_name, 1), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_add_columns_1(table, nullptr, 1), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_add_columns_1(table, again, 0), SR_E_NO_COLUMNS);
  EXPECT_EQ(sr_add_columns_1(nullptr, again, 1), SR_E_INVALID_HANDLE);
  EXPECT_EQ(columns_of(table), before);
  expect_rows_ace(table);
}

TEST_F(Schema, DeletingColumnsKeepsTheKeyAndTheOtherValues) {
  sr_opaque_handle_t table = table_with_holes("/t");
  sr_column_t added[] = {int32_column("port", 80)};
  ASSERT_EQ(sr_add_columns_1(table, added, 1), 0);
  const char *note[] = {"note"};
  ASSERT_EQ(sr_delete_columns_1(table, note, 1), 0);
  EXPECT_EQ(columns_of(table),
            (std::vector<std::pair<std::string, qv_data_type_t>>{
                {"name", QV_CHAR_PTR}, {"count", QV_INT32}, {"port", QV_INT32}}));
  expect_rows_ace(table);
  EXPECT_EQ(int32_by_key(table, "e", "port"), 80);
  EXPECT_EQ(string_by_key(table, "a", "note"), "<105>");

  // All but the key may go; the key may not, nor more columns than there are.
  const char *too_many[] = {"count", "port", "count"};
  EXPECT_EQ(sr_delete_columns_1(table, too_many, 3), SR_E_INVALID_COLUMN);
  const char *rest[] = {"port", "count"};
  ASSERT_EQ(sr_delete_columns_1(table, rest, 2), 0);
  EXPECT_EQ(columns_of(table),
            (std::vector<std::pair<std::string, qv_data_type_t>>{{"name", QV_CHAR_PTR}}));
  for (const char *p_name : {"a", "c", "e"}) {
    EXPECT_EQ(string_at_fixed(table, fixed_index_of(table, p_name), "name", 0), p_name);
  }
}

TEST_F(Schema, DeletingColumnsRefusesTheKeyInvisibleAndUnknownColumns) {
  std::vector<sr_column_t> columns = {column("id", QV_INT32, SR_PRIMARY_KEY),
                                      column("count", QV_INT32),
                                      column("secret", QV_INT32, SR_STANDARD | SR_INVISIBLE)};
  sr_opaque_handle_t table = make_table("/t", columns, Implicit);
  ASSERT_EQ(add_numbered(table, 1, 10), 0);
  const char *key[] = {"id"};
  const char *invisible[] = {"secret"};
  const char *unknown[] = {"count", "missing"};
  EXPECT_EQ(sr_delete_columns_1(table, key, 1), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_delete_columns_1(table, invisible, 1), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_delete_columns_1(table, unknown, 2), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_delete_columns_1(table, nullptr, 1), SR_E_NULL_POINTER);
  EXPECT_EQ(sr_delete_columns_1(table, key, 0), SR_E_NO_COLUMNS);
  EXPECT_EQ(columns.size(), columns_of(table).size());
  // The invisible column survives a delete of everything deletable.
  const char *count[] = {"count"};
  ASSERT_EQ(sr_delete_columns_1(table, count, 1), 0);
  EXPECT_EQ(columns_of(table), (std::vector<std::pair<std::string, qv_data_type_t>>{
                                   {"id", QV_INT32}, {"secret", QV_INT32}}));
  qv_value_t value{};
  EXPECT_EQ(sr_get_field_by_key_1(table, int32_value(1), "count", &value), SR_E_INVALID_COLUMN);
  ASSERT_EQ(sr_get_field_by_key_1(table, int32_value(1), "secret", &value), 0);
  EXPECT_EQ(value.val_int32, 0);
}

TEST_F(Schema, RenamingMovesTheValuesToTheNewNameAndRefusesTakenNames) {
  std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                      column("count", QV_INT32), column("note", QV_CHAR_PTR),
                                      column("hidden", QV_INT32, SR_STANDARD | SR_INVISIBLE)};
  sr_opaque_handle_t table = make_table("/t", columns, Implicit);
  ASSERT_EQ(add_fields(table, {{"name", string_value("a")},
                               {"count", int32_value(1)},
                               {"note", string_value("first")},
                               {"hidden", int32_value(42)}}),
            0);
  const auto before = columns_of(table);
  EXPECT_EQ(sr_change_column_name_1(table, "count", "note"), SR_E_DUPLICATE_COLUMN);
  EXPECT_EQ(sr_change_column_name_1(table, "count", "hidden"), SR_E_DUPLICATE_COLUMN);
  EXPECT_EQ(sr_change_column_name_1(table, "hidden", "shown"), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_change_column_name_1(table, "missing", "other"), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_change_column_name_1(table, "count", "bad name"), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_change_column_name_1(table, nullptr, "x"), SR_E_NULL_POINTER);
  EXPECT_EQ(columns_of(table), before);

  ASSERT_EQ(sr_change_column_name_1(table, "note", "comment"), 0);
  EXPECT_EQ(string_by_key(table, "a", "comment"), "first");
  EXPECT_EQ(string_by_key(table, "a", "note"), "<105>");
  ASSERT_EQ(sr_change_column_name_1(table, "name", "host"), 0);  // the key too
  qv_value_t hidden{};
  ASSERT_EQ(sr_get_field_by_key_1(table, string_value("a"), "hidden", &hidden), 0);
  EXPECT_EQ(hidden.val_int32, 42);
  EXPECT_EQ(columns_of(table)[0].first, "host");
}

TEST_F(Schema, ANewDefaultReachesOnlyRowsAddedLater) {
  sr_opaque_handle_t table = create_named_counts("/t", Implicit);
  ASSERT_EQ(add_fields(table, {{"name", string_value("old")}}), 0);
  ASSERT_EQ(sr_change_default_value_1(table, "count", int32_value(99)), 0);
  ASSERT_EQ(sr_change_default_value_1(table, "note", string_value("a much longer default")), 0);
  ASSERT_EQ(add_fields(table, {{"name", string_value("new")}}), 0);
  EXPECT_EQ(int32_by_key(table, "old", "count"), 7);
  EXPECT_EQ(string_by_key(table, "old", "note"), "none");
  EXPECT_EQ(int32_by_key(table, "new", "count"), 99);
  EXPECT_EQ(string_by_key(table, "new", "note"), "a much longer default");
  EXPECT_EQ(sr_change_default_value_1(table, "missing", int32_value(1)), SR_E_INVALID_COLUMN);
}

TEST_F(Schema, EveryRebuildRefusesATableWithChangesOnTheWayOrOpenForReading) {
  sr_opaque_handle_t table = create_named_counts("/t", Explicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  apply_commit(table);
  sr_column_t added[] = {int32_column("port", 80)};
  const char *note[] = {"note"};
  auto rebuilds = [&] {
    return std::vector<int32_t>{sr_add_columns_1(table, added, 1),
                                sr_delete_columns_1(table, note, 1),
                                sr_change_column_name_1(table, "note", "comment"),
                                sr_change_default_value_1(table, "count", int32_value(1))};
  };
  const std::vector<int32_t> uncommitted(4, SR_E_UNCOMMITTED);

  ASSERT_EQ(add_named(table, "pending", 1), 0);  // a pending addition
  EXPECT_EQ(rebuilds(), uncommitted);
  ASSERT_EQ(sr_apply_1(table, 0), 0);  // applied, not committed
  EXPECT_EQ(rebuilds(), uncommitted);
  ASSERT_EQ(sr_commit_1(table), 0);
  ASSERT_EQ(sr_delete_rows_1(table, "name == $s", "pending"), 0);  // a pending deletion
  EXPECT_EQ(rebuilds(), uncommitted);
  ASSERT_EQ(sr_abort_1(table), 0);
  EXPECT_EQ(count_of(table, "pending", 0), 1);
  EXPECT_EQ(columns_of(table).size(), 3u);

  // A table opened for reading only (here, a file opened by a second
  // program) refuses them all.
  mount_disk();
  ASSERT_NE(create_named_counts("/disk/r", Implicit), nullptr);
  sr_opaque_handle_t tree = mounted_tree(directory_);
  ASSERT_NE(tree, nullptr);
  ASSERT_EQ(sr_open_table_1(tree, "/disk/r", SR_MODE_READ, &table), 0);
  EXPECT_EQ(rebuilds(), std::vector<int32_t>(4, SR_E_ACCESS));
  EXPECT_EQ(sr_close_tree_1(tree), 0);
}

TEST_F(Schema, OverlaysChangeDefaultsAndFlagsInMemoryOnly) {
  sr_opaque_handle_t table = create_named_counts("/t", Implicit);
  ASSERT_EQ(add_fields(table, {{"name", string_value("before")}}), 0);
  EXPECT_EQ(sr_overlay_memory_default_value_1(table, "note", string_value("long default")),
            SR_E_NO_ROWS);
  ASSERT_EQ(sr_overlay_memory_default_value_1(table, "note", string_value("nil")), 0);
  ASSERT_EQ(sr_overlay_memory_default_value_1(table, "count", int32_value(3)), 0);
  ASSERT_EQ(add_fields(table, {{"name", string_value("after")}}), 0);
  EXPECT_EQ(string_by_key(table, "after", "note"), "nil");
  EXPECT_EQ(int32_by_key(table, "after", "count"), 3);
  EXPECT_EQ(string_by_key(table, "before", "note"), "none");
  // The room is what the present default takes: an equal length fits, and
  // once shorter, it never grows back.
  ASSERT_EQ(sr_overlay_memory_default_value_1(table, "note", string_value("abc")), 0);
  EXPECT_EQ(sr_overlay_memory_default_value_1(table, "note", string_value("none")), SR_E_NO_ROWS);
  ASSERT_EQ(add_fields(table, {{"name", string_value("last")}}), 0);
  EXPECT_EQ(string_by_key(table, "last", "note"), "abc");
  EXPECT_EQ(sr_overlay_memory_default_value_1(table, "missing", int32_value(1)),
            SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_overlay_memory_default_value_1(table, nullptr, int32_value(1)), SR_E_NULL_POINTER);

  const auto with_flags = static_cast<sr_qualifier_t>(SR_STANDARD | SR_INVISIBLE);
  EXPECT_EQ(sr_overlay_memory_column_qualifier_1(table, "name", with_flags), SR_E_INVALID_COLUMN);
  EXPECT_EQ(sr_overlay_memory_column_qualifier_1(table, "count", SR_PRIMARY_KEY),
            SR_E_INVALID_COLUMN);
  ASSERT_EQ(sr_overlay_memory_column_qualifier_1(table, "count", with_flags), 0);
  sr_table_metadata_t *p_metadata = nullptr;
  ASSERT_EQ(sr_get_table_metadata_1(table, 1, &p_metadata), 0);
  EXPECT_EQ(p_metadata->number_of_columns, 2u);  // "count" is invisible now
  sr_free_table_metadata_1(p_metadata);
}

// A forked child may read but not change: every schema call refuses at once.
TEST_F(Schema, AForkedChildGetsInternalErrorFromEverySchemaCall) {
  sr_opaque_handle_t table = create_named_counts("/t", Implicit);
  const pid_t child = fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    sr_column_t added[] = {int32_column("port", 80)};
    const char *note[] = {"note"};
    const bool all_refused =
        sr_add_columns_1(table, added, 1) == SR_E_INTERNAL &&
        sr_delete_columns_1(table, note, 1) == SR_E_INTERNAL &&
        sr_change_column_name_1(table, "note", "x") == SR_E_INTERNAL &&
        sr_change_default_value_1(table, "count", int32_value(1)) == SR_E_INTERNAL &&
        sr_overlay_memory_default_value_1(table, "count", int32_value(1)) == SR_E_INTERNAL &&
        sr_overlay_memory_column_qualifier_1(table, "count", SR_STANDARD) == SR_E_INTERNAL;
    _exit(all_refused ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

class PersistentSchema : public Schema {
 protected:
  void SetUp() override {
    Schema::SetUp();
    mount_disk();
  }
  std::string file(const char *p_name) const { return directory_ + "/" + p_name; }
};

// Each rebuilding call rewrites the file; a second program then reads the
// new schema, and a change made afterwards lands where it reads it too.
TEST_F(PersistentSchema, RebuildsReachTheFileAndLaterChangesFollowThem) {
  sr_opaque_handle_t table = table_with_holes("/disk/t");
  auto metadata = zeroed_block<qv_binary_t>(4);
  metadata->length = 4;
  std::memcpy(metadata->data, "meta", 4);
  ASSERT_EQ(sr_set_application_metadata_1(table, metadata.get()), 0);
  apply_commit(table);

  sr_column_t added[] = {int32_column("port", 80), string_column("host", "h")};
  const char *host[] = {"host"};
  struct step {
    const char *p_what;
    int32_t rc;
  };
  const step steps[] = {
      {"add", sr_add_columns_1(table, added, 2)},
      {"rename", sr_change_column_name_1(table, "port", "tcp_port")},
      {"default", sr_change_default_value_1(table, "tcp_port", int32_value(443))},
      {"delete", sr_delete_columns_1(table, host, 1)},
  };
  for (const step &done : steps) {
    EXPECT_EQ(done.rc, 0) << done.p_what;
  }
  EXPECT_FALSE(std::filesystem::exists(file("t.rewrite")));
  expect_rows_ace(table);
  ASSERT_EQ(add_named(table, "f", 6), 0);
  ASSERT_EQ(sr_delete_rows_1(table, "name == $s", "a"), 0);
  apply_commit(table);

  sr_opaque_handle_t other_tree = mounted_tree(directory_);
  ASSERT_NE(other_tree, nullptr);
  sr_opaque_handle_t reopened = nullptr;
  ASSERT_EQ(sr_open_table_1(other_tree, "/disk/t", SR_MODE_READ, &reopened), 0);
  EXPECT_EQ(columns_of(reopened), columns_of(table));
  EXPECT_EQ((rows_in<std::string>(reopened, "name", 0)),
            (std::map<std::string, int32_t>{{"c", 3}, {"e", 5}, {"f", 6}}));
  EXPECT_EQ(int32_by_key(reopened, "c", "tcp_port"), 80);
  EXPECT_EQ(int32_by_key(reopened, "f", "tcp_port"), 443);
  EXPECT_EQ(change_counter_of(reopened), change_counter_of(table));
  qv_binary_t *p_read = nullptr;
  ASSERT_EQ(sr_get_application_metadata_1(reopened, &p_read), 0);
  EXPECT_EQ(std::string(reinterpret_cast<char *>(p_read->data), p_read->length), "meta");
  std::free(p_read);
  EXPECT_EQ(sr_close_tree_1(other_tree), 0);
}

// Pending application metadata stays pending through a rebuild: the new
// file carries the committed value only.
TEST_F(PersistentSchema, ARebuildWritesOnlyCommittedApplicationMetadata) {
  sr_opaque_handle_t table = create_named_counts("/disk/t", Explicit);
  ASSERT_EQ(add_named(table, "a", 1), 0);
  apply_commit(table);
  auto metadata = zeroed_block<qv_binary_t>(7);
  metadata->length = 7;
  std::memcpy(metadata->data, "pending", 7);
  ASSERT_EQ(sr_set_application_metadata_1(table, metadata.get()), 0);
  sr_column_t added[] = {int32_column("port", 80)};
  ASSERT_EQ(sr_add_columns_1(table, added, 1), 0);

  sr_opaque_handle_t other_tree = mounted_tree(directory_);
  sr_opaque_handle_t reopened = nullptr;
  ASSERT_EQ(sr_open_table_1(other_tree, "/disk/t", SR_MODE_READ, &reopened), 0);
  qv_binary_t *p_read = nullptr;
  EXPECT_EQ(sr_get_application_metadata_1(reopened, &p_read), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(int32_by_key(reopened, "a", "port"), 80);
  EXPECT_EQ(sr_close_tree_1(other_tree), 0);
}

}  // namespace
