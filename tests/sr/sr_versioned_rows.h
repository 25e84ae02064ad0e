// sr_versioned_rows.h - the table the durability tests (crash, power loss,
// several processes) write and read back: rows of Id (the key), Version
// and Payload, where the payload is a function of Id and Version, so that a
// record of the wrong row or the wrong version is noticed on reading; and
// the random changes the crash and power-loss writers make to it.

#ifndef SR_VERSIONED_ROWS_H
#define SR_VERSIONED_ROWS_H

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <random>
#include <set>
#include <sstream>
#include <string>
#include <utility>
#include <vector>

#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "sr_row_test_support.h"
#include "tables/sr_i_table.h"

namespace sr_versioned {

inline constexpr int32_t Open_For_Reading = 1;
inline constexpr int32_t Open_Implicit = 2;
inline constexpr int32_t Open_Explicit = 6;

// Rows are found by key through a key hash table: without one a new key
// is checked by a scan that refuses it whenever a deleted row left a free
// entry before the last live row.
inline constexpr uint32_t Hash_Buckets = 64;

inline uint32_t hash_id(const void *p_key) {
  return static_cast<uint32_t>(sr_test::int32_key_at(p_key)) % Hash_Buckets;
}

using sr_test::int32_value;
using sr_test::mounted_tree;
using sr_test::string_value;

inline int32_t create_table(sr_opaque_handle_t tree, const char *p_path, int32_t mode,
                            sr_opaque_handle_t *p_table) {
  sr_column_t columns[3] = {sr_test::column("Id", QV_INT32, SR_PRIMARY_KEY),
                            sr_test::column("Version", QV_INT32),
                            sr_test::column("Payload", QV_CHAR_PTR)};
  return sr_create_hashed_key_table_1(tree, p_path, columns, 3, mode, Hash_Buckets, hash_id,
                                      sr_test::compare_int32_keys, p_table);
}

inline int32_t open_table(sr_opaque_handle_t tree, const char *p_path, int32_t mode,
                          sr_opaque_handle_t *p_table) {
  return sr_open_hashed_key_table_1(tree, p_path, mode, Hash_Buckets, hash_id,
                                    sr_test::compare_int32_keys, p_table);
}

// 40 to 40 + `spread` - 1 bytes, different for every version of every row.
inline std::string payload(int32_t id, int32_t version, uint32_t spread) {
  const uint32_t hash =
      static_cast<uint32_t>(id) * 2654435761u ^ static_cast<uint32_t>(version) * 40503u;
  std::string text = std::to_string(id) + "/" + std::to_string(version) + ":";
  const size_t length = 40 + hash % spread;
  for (size_t at = text.size(); at < length; ++at) {
    text.push_back(static_cast<char>('a' + (hash + at * 7) % 26));
  }
  return text;
}

inline int32_t add_row(sr_opaque_handle_t table, int32_t id, int32_t version, uint32_t spread) {
  const std::string text = payload(id, version, spread);
  return sr_test::add_fields(table, {{"Id", int32_value(id)},
                                     {"Version", int32_value(version)},
                                     {"Payload", string_value(text.c_str())}});
}

inline int32_t set_row(sr_opaque_handle_t table, int32_t id, int32_t version, uint32_t spread) {
  const std::string text = payload(id, version, spread);
  const sr_test::field_list fields{{"Version", int32_value(version)},
                                   {"Payload", string_value(text.c_str())}};
  return sr_set_fields_by_key_1(table, int32_value(id), fields.names.data(), fields.pointers.data(),
                                2);
}

// A committed state: whether the table exists, its change counter, each
// row's Version by Id, and the int32 columns that schema changes added
// behind the first three, in order, with their defaults.
struct table_state {
  bool exists = false;
  uint64_t counter = 0;
  std::map<int32_t, int32_t> rows;
  std::vector<std::pair<std::string, int32_t>> columns;
  bool operator==(const table_state &) const = default;
};

// A state as text, "no table" or "counter 3: 1v2 5v1 | C1=7 C4=0" (Id v
// Version, then the added columns), and the state such a text describes.
inline std::string describe(const table_state &state) {
  if (!state.exists) {
    return "no table";
  }
  std::string text = "counter " + std::to_string(state.counter) + ":";
  for (const auto &[id, version] : state.rows) {
    text += " " + std::to_string(id) + "v" + std::to_string(version);
  }
  text += " |";
  for (const auto &[name, default_value] : state.columns) {
    text += " " + name + "=" + std::to_string(default_value);
  }
  return text;
}

inline table_state parse_state(const std::string &text) {
  table_state state;
  std::istringstream in(text);
  std::string word;
  char separator;
  state.exists = in >> word >> state.counter >> separator && word == "counter";
  for (int32_t id, version; in >> id >> separator >> version;) {
    state.rows[id] = version;
  }
  in.clear();
  in >> separator;  // the "|"
  for (std::string column; in >> column;) {
    const size_t equals = column.find('=');
    state.columns.emplace_back(column.substr(0, equals), std::atoi(column.c_str() + equals + 1));
  }
  return state;
}

// The committed rows of an open table into `state`: an empty string, or
// what went wrong (a failed read, a row this test does not write).
inline std::string read_rows(sr_opaque_handle_t table, table_state &state, uint32_t spread) {
  sr_table_metadata_t *p_metadata = nullptr;
  if (const int32_t rc = sr_get_table_metadata_1(table, -1, &p_metadata); rc != 0) {
    return "sr_get_table_metadata_1 gave " + std::to_string(rc);
  }
  state.exists = true;
  state.counter = p_metadata->table_change_counter;
  state.rows.clear();
  state.columns.clear();
  const uint32_t total_rows = p_metadata->number_of_rows;
  for (uint32_t column = 3; column < p_metadata->number_of_columns; ++column) {
    const sr_column_t &definition = p_metadata->column_definitions[column];
    state.columns.emplace_back(definition.name, definition.default_value.val_int32);
  }
  sr_free_table_metadata_1(p_metadata);
  for (uint32_t at = 0; at < total_rows; ++at) {
    // Every column of every row is read: a row short of a column the
    // table lists would fail here.
    sr_test::field_list row{{"Id", {}}, {"Version", {}}, {"Payload", {}}};
    for (const auto &[name, default_value] : state.columns) {
      row.names.push_back(name.c_str());
      row.values.emplace_back();
    }
    row.pointers.clear();
    for (qv_value_t &value : row.values) {
      row.pointers.push_back(&value);
    }
    const qv_value_t &id = row.values[0], &version = row.values[1], &text = row.values[2];
    if (const int32_t rc =
            sr_get_fields_by_index_1(table, static_cast<int32_t>(at), row.names.data(),
                                     row.pointers.data(), static_cast<uint32_t>(row.names.size()));
        rc != 0) {
      return "row " + std::to_string(at) + " gave " + std::to_string(rc);
    }
    const std::string stored = text.ptr_char;
    std::free(text.ptr_char);
    if (stored != payload(id.val_int32, version.val_int32, spread)) {
      return "row " + std::to_string(id.val_int32) + " has the payload \"" + stored + "\"";
    }
    if (!state.rows.emplace(id.val_int32, version.val_int32).second) {
      return "row " + std::to_string(id.val_int32) + " is there twice";
    }
  }
  return "";
}

// The table at `p_registry_path` below "/disk" mounted on `directory`, as a
// new program finds it: read-only, in a tree of its own. A missing table is
// a state (exists false), not a problem.
inline std::string read_table(const std::string &directory, const char *p_registry_path,
                              table_state &state, uint32_t spread) {
  state = table_state{};
  sr_opaque_handle_t tree = mounted_tree(directory);
  if (tree == nullptr) {
    return "no tree with the mount point";
  }
  std::string problem;
  sr_opaque_handle_t table = nullptr;
  if (const int32_t rc = sr_open_table_1(tree, p_registry_path, Open_For_Reading, &table);
      rc != 0 && rc != SR_E_NO_TABLE) {
    problem = "sr_open_table_1 gave " + std::to_string(rc);
  } else if (rc == 0) {
    problem = read_rows(table, state, spread);
  }
  sr_close_tree_1(tree);
  return problem;
}

// Random changes that keep the row count between `fewest` and `most`: new
// rows get fresh ids, sets raise a row's version, deletions take any row.
// Each call returns an empty string, or the call that failed.
class random_changes {
 public:
  // Hears of a commit about to begin: its kind ("implicit"; "apply", which
  // appends, or rewrites a file of mostly dead records; "rewrite", forced)
  // and the state it commits.
  using listener = std::function<void(const char *p_kind, const table_state &)>;

  random_changes(std::mt19937 &rng, uint32_t spread, size_t fewest, size_t most)
      : rng_(rng), spread_(spread), fewest_(fewest), most_(most) {}

  int32_t next_id = 1;

  // One change through an implicitly controlled handle, which commits it:
  // `state` becomes the new committed state. A row is deleted by its packed
  // index (`by_index`) or by a selection of its Id.
  std::string implicit_change(sr_opaque_handle_t table, table_state &state, bool by_index,
                              const listener &announce = {}) {
    table_state next = state;
    ++next.counter;
    if (const int32_t rc = change(table, next, by_index, announce, nullptr); rc != 0) {
      return "an implicit change gave " + std::to_string(rc);
    }
    state = next;
    return "";
  }

  // 1 to `most_changes` changes through an explicitly controlled handle (now
  // and then a row deleted earlier in the transaction comes back), applied
  // (appended or rewritten), then aborted or committed, half of the time
  // with a change counter of its own. A commit makes `state` the new
  // committed state. The rewrite is forced through the internal apply, whose
  // callers take the table's write lock: these writers run no other thread.
  std::string explicit_transaction(sr_opaque_handle_t table, table_state &state,
                                   uint32_t most_changes, const listener &announce = {}) {
    table_state next = state;
    std::set<int32_t> deleted;
    for (uint32_t changes = 1 + rng_() % most_changes; changes > 0; --changes) {
      int32_t rc = 0;
      if (!deleted.empty() && rng_() % 4 == 0) {
        const int32_t id = *deleted.begin();
        deleted.erase(deleted.begin());
        const auto old = state.rows.find(id);
        next.rows[id] = old == state.rows.end() ? 1 : old->second + 1;
        rc = add_row(table, id, next.rows[id], spread_);
      } else {
        rc = change(table, next, false, {}, &deleted);
      }
      if (rc != 0) {
        return "a change in a transaction gave " + std::to_string(rc);
      }
    }
    const uint64_t counter = rng_() % 2 ? 0 : state.counter + 1 + rng_() % 3;
    next.counter = counter == 0 ? state.counter + 1 : counter;
    // 0 and 1 applied and aborted, 2 to 7 committed; 1 to 3 rewrite.
    const uint32_t ending = rng_() % 8;
    const bool rewrite = ending >= 1 && ending <= 3;
    const char *p_kind = rewrite ? "rewrite" : "apply";
    if (ending >= 2 && announce) {
      announce(p_kind, next);
    }
    int32_t rc = rewrite ? sr_i_apply(static_cast<sr_i_table_t *>(table), 1, counter)
                         : sr_apply_1(table, counter);
    if (rc == 0) {
      rc = ending < 2 ? sr_abort_1(table) : sr_commit_1(table);
    }
    if (rc != 0) {
      return std::string(p_kind) + (ending < 2 ? " and abort" : " and commit") + " gave " +
             std::to_string(rc);
    }
    if (ending >= 2) {
      state = next;
    }
    return "";
  }

  // One schema change of a committed table: an int32 column added, or one
  // of the added columns deleted, renamed or given a new default. `state`
  // becomes the new committed state.
  std::string schema_change(sr_opaque_handle_t table, table_state &state,
                            const listener &announce = {}) {
    table_state next = state;
    ++next.counter;
    auto &columns = next.columns;
    const int kind = columns.empty() ? 0 : static_cast<int>(rng_() % 4);
    const size_t at = columns.empty() ? 0 : rng_() % columns.size();
    const int32_t default_value = static_cast<int32_t>(rng_() % 1000);
    const std::string old_name = columns.empty() ? "" : columns[at].first;
    if (kind == 0) {
      columns.emplace_back(fresh_column_name(columns), default_value);
    } else if (kind == 1) {
      columns.erase(columns.begin() + static_cast<std::ptrdiff_t>(at));
    } else if (kind == 2) {
      columns[at].first = fresh_column_name(columns);
    } else {
      columns[at].second = default_value;
    }
    const char *const kinds[] = {"add-column", "delete-column", "rename-column", "new-default"};
    if (announce) {
      announce(kinds[kind], next);
    }
    int32_t rc;
    if (kind == 0) {
      sr_column_t added = sr_test::column(columns.back().first.c_str(), QV_INT32);
      added.default_value.val_int32 = default_value;
      rc = sr_add_columns_1(table, &added, 1);
    } else if (kind == 1) {
      const char *p_name = old_name.c_str();
      rc = sr_delete_columns_1(table, &p_name, 1);
    } else if (kind == 2) {
      rc = sr_change_column_name_1(table, old_name.c_str(), columns[at].first.c_str());
    } else {
      rc = sr_change_default_value_1(table, old_name.c_str(), int32_value(default_value));
    }
    if (rc != 0) {
      return std::string(kinds[kind]) + " gave " + std::to_string(rc);
    }
    state = next;
    return "";
  }

  // Adds `total` new rows in one transaction of an explicitly controlled
  // handle, as a program loading a table does.
  std::string fill(sr_opaque_handle_t table, table_state &state, uint32_t total,
                   const listener &announce = {}) {
    table_state next = state;
    ++next.counter;
    const int32_t first_id = next_id;
    for (uint32_t added = 0; added < total; ++added) {
      next.rows[next_id++] = 1;
    }
    if (announce) {
      announce("fill", next);
    }
    for (int32_t id = first_id; id < next_id; ++id) {
      if (const int32_t rc = add_row(table, id, 1, spread_); rc != 0) {
        return "adding a row gave " + std::to_string(rc);
      }
    }
    if (const int32_t rc = sr_apply_1(table, 0); rc != 0 || sr_commit_1(table) != 0) {
      return "the fill's apply or commit failed";
    }
    state = next;
    return "";
  }

 private:
  // A new row, a new version of any row, or any row deleted, as `next`
  // records it; the row count stays within its bounds.
  int32_t change(sr_opaque_handle_t table, table_state &next, bool by_index,
                 const listener &announce, std::set<int32_t> *p_deleted) {
    enum kind_t { Add, Set, Remove };
    const size_t rows = next.rows.size();
    const auto kind = rows < fewest_ ? Add : rows > most_ ? Remove : kind_t(rng_() % 3);
    qv_value_t id = int32_value(kind == Add ? next_id++ : 0);
    const auto at = static_cast<int32_t>(kind == Add ? 0 : rng_() % rows);
    if (kind != Add) {
      id.val_int32 = std::next(next.rows.begin(), at)->first;
    }
    // The row at a packed index is looked up in the table itself.
    if (kind == Remove && by_index) {
      if (const int32_t rc = sr_get_field_by_index_1(table, at, "Id", &id); rc != 0) {
        return rc;
      }
    }
    if (kind == Remove) {
      next.rows.erase(id.val_int32);
      if (p_deleted != nullptr) {
        p_deleted->insert(id.val_int32);
      }
    } else {
      ++next.rows[id.val_int32];
    }
    if (announce) {
      announce("implicit", next);
    }
    switch (kind) {
      case Add:
        return add_row(table, id.val_int32, 1, spread_);
      case Set:
        return set_row(table, id.val_int32, next.rows[id.val_int32], spread_);
      default:
        return by_index ? sr_delete_row_by_index_1(table, static_cast<uint32_t>(at))
                        : sr_delete_rows_1(table, "Id == $i", id.val_int32);
    }
  }

  // "C" and a number above every added column's.
  static std::string fresh_column_name(
      const std::vector<std::pair<std::string, int32_t>> &columns) {
    int highest = 0;
    for (const auto &[name, default_value] : columns) {
      highest = std::max(highest, std::atoi(name.c_str() + 1));
    }
    return "C" + std::to_string(highest + 1);
  }

  std::mt19937 &rng_;
  uint32_t spread_;
  size_t fewest_;
  size_t most_;
};

}  // namespace sr_versioned

#endif  // SR_VERSIONED_ROWS_H
