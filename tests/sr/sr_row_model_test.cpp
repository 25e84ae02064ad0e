// A randomised model test of rows and transactions: thousands of random
// adds, sets, deletes, applies, commits and aborts run against a table and
// against a plain reference model of its committed and applied views; after
// every step each key reads back as the model says in both views, and the
// table's indexes agree with each other.

#include <gtest/gtest.h>

#include <cstdlib>
#include <map>
#include <optional>
#include <random>
#include <string>

#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

struct row_values {
  int32_t count;
  std::string note;
  bool operator==(const row_values &) const = default;
};

// What the table should hold, kept the simplest way.
struct reference_model {
  std::map<uint32_t, row_values> committed, applied;
  bool ready_for_commit = false;
  bool changed = false;  // something pending or applied since the last commit or abort
};

constexpr uint32_t Total_Keys = 12;

class RowModel : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    std::vector<sr_column_t> columns = {column("handle", QV_RSRC_HANDLE_PTR, SR_PRIMARY_KEY),
                                        column("count", QV_INT32, SR_STANDARD),
                                        column("note", QV_CHAR_PTR, SR_STANDARD)};
    ASSERT_EQ(sr_create_table_1(tree_, "/model/t", columns.data(), 3, Explicit, &table_), 0);
    for (uint32_t key = 0; key < Total_Keys; ++key) {
      handles_[key].id.id1 = 0xABCD;
      handles_[key].id.id4 = key;
    }
  }

  qv_value_t key_value(uint32_t key) {
    qv_value_t value{};
    value.ptr_rsrc_handle = &handles_[key];
    return value;
  }

  int32_t add(uint32_t key, const row_values &values) {
    return add_fields(table_, {{"note", string_value(values.note.c_str())},
                               {"handle", key_value(key)},
                               {"count", int32_value(values.count)}});
  }

  int32_t set(uint32_t key, const row_values &values) {
    const field_list fields{{"count", int32_value(values.count)},
                            {"note", string_value(values.note.c_str())}};
    return sr_set_fields_by_key_1(table_, key_value(key), fields.names.data(),
                                  fields.pointers.data(), 2);
  }

  int32_t remove(uint32_t key) {
    uint32_t fixed = 0;
    if (const int32_t rc = sr_get_fixed_row_index_for_key_1(table_, key_value(key), &fixed);
        rc != 0) {
      return rc;
    }
    return sr_delete_row_by_index_1(table_, object(table_)->p_rows_fixed_index[fixed].packed_index);
  }

  std::optional<row_values> read(uint32_t key, uint32_t uncommitted) {
    qv_value_t count{}, note{};
    const char *names[] = {"count", "note"};
    qv_value_t *results[] = {&count, &note};
    const int32_t rc = sr_get_fields_by_key_and_visibility_1(table_, key_value(key), names, results,
                                                             2, uncommitted, nullptr);
    if (rc != 0) {
      EXPECT_TRUE(rc == SR_E_NO_ROW_FOR_KEY || rc == SR_E_ROW_DELETED) << rc;
      return std::nullopt;
    }
    row_values values{count.val_int32, note.ptr_char};
    std::free(note.ptr_char);
    return values;
  }

  void expect_table_matches(const reference_model &model, int step) {
    for (uint32_t key = 0; key < Total_Keys; ++key) {
      for (const uint32_t uncommitted : {0u, 1u}) {
        const auto &view = uncommitted ? model.applied : model.committed;
        const auto expected = view.find(key);
        const std::optional<row_values> actual = read(key, uncommitted);
        ASSERT_EQ(actual.has_value(), expected != view.end())
            << "step " << step << " key " << key << " view " << uncommitted;
        if (actual) {
          ASSERT_TRUE(*actual == expected->second)
              << "step " << step << " key " << key << " view " << uncommitted;
        }
      }
    }
    const sr_i_table_t *p = object(table_);
    ASSERT_EQ(p->total_applied_rows - p->applied_deletions, model.applied.size()) << step;
    if (!model.changed) {
      ASSERT_EQ(p->total_committed_rows, model.committed.size()) << step;
    }
    for (uint32_t at = 0; at < p->total_applied_rows; ++at) {
      ASSERT_EQ(p->p_rows_fixed_index[p->p_rows_packed_index[at]].packed_index, at) << step;
    }
  }

  sr_opaque_handle_t table_ = nullptr;
  qv_resource_handle_t handles_[Total_Keys] = {};
};

TEST_F(RowModel, RandomTransactionsMatchTheReferenceModel) {
  const unsigned seed = std::random_device{}();
  SCOPED_TRACE("seed " + std::to_string(seed));
  std::mt19937 random(seed);
  auto pick = [&](uint32_t below) {
    return std::uniform_int_distribution<uint32_t>(0, below - 1)(random);
  };
  auto random_values = [&] {
    // Notes up to 120 bytes push records past their first size estimate.
    return row_values{static_cast<int32_t>(random()), std::string(pick(120), char('a' + pick(26)))};
  };

  reference_model model;
  for (int step = 0; step < 6000; ++step) {
    const uint32_t key = pick(Total_Keys);
    const uint32_t operation = pick(100);
    if (operation < 30) {
      const row_values values = random_values();
      int32_t expected = 0;
      if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.count(key) != 0) {
        expected = SR_E_DUPLICATE_KEY;
      }
      ASSERT_EQ(add(key, values), expected) << "add, step " << step;
      if (expected == 0) {
        model.applied[key] = values;
        model.changed = true;
      }
    } else if (operation < 55) {
      const row_values values = random_values();
      // The key is found while some view holds it; a row deleted in the
      // applied view is found and then refused.
      const bool found = model.applied.count(key) != 0 || model.committed.count(key) != 0;
      int32_t expected = 0;
      if (!found) {
        expected = SR_E_NO_ROW_FOR_KEY;
      } else if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.count(key) == 0) {
        expected = SR_E_ROW_DELETED;
      }
      ASSERT_EQ(set(key, values), expected) << "set, step " << step;
      if (expected == 0) {
        model.applied[key] = values;
        model.changed = true;
      }
    } else if (operation < 72) {
      const bool found = model.applied.count(key) != 0 || model.committed.count(key) != 0;
      int32_t expected = 0;
      if (!found) {
        expected = SR_E_NO_ROW_FOR_KEY;
      } else if (model.applied.count(key) == 0) {
        expected = SR_E_ROW_DELETED;
      }
      // Deleting one row is allowed even while changes wait for commit.
      ASSERT_EQ(remove(key), expected) << "delete, step " << step;
      if (expected == 0) {
        model.applied.erase(key);
        model.changed = true;
      }
    } else if (operation < 74) {
      int32_t expected = 0;
      if (model.ready_for_commit) {
        expected = SR_E_APPLIED_UNCOMMITTED;
      } else if (model.applied.empty()) {
        expected = SR_E_NO_ROWS;
      }
      ASSERT_EQ(sr_delete_rows_1(table_, nullptr), expected) << "delete all, step " << step;
      if (expected == 0) {
        model.applied.clear();
        model.changed = true;
      }
    } else if (operation < 84) {
      ASSERT_EQ(sr_apply_1(table_, 0), model.ready_for_commit ? SR_E_APPLIED_UNCOMMITTED : 0)
          << "apply, step " << step;
      model.ready_for_commit = true;
      model.changed = true;
    } else if (operation < 94) {
      int32_t expected = 0;
      if (!model.ready_for_commit && model.changed) {
        expected = SR_E_NOT_APPLIED;
      }
      ASSERT_EQ(sr_commit_1(table_), expected) << "commit, step " << step;
      if (expected == 0) {
        model.committed = model.applied;
        model.ready_for_commit = false;
        model.changed = false;
      }
    } else {
      ASSERT_EQ(sr_abort_1(table_), 0) << "abort, step " << step;
      model.applied = model.committed;
      model.ready_for_commit = false;
      model.changed = false;
    }
    expect_table_matches(model, step);
    if (HasFatalFailure()) {
      return;
    }
  }
}

}  // namespace
