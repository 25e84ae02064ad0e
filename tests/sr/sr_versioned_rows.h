// sr_versioned_rows.h - the table the durability tests (crash, power loss,
// several processes) write and read back: rows of Id (the key), Version
// and Payload, where the payload is a function of Id and Version, so that a
// record of the wrong row or the wrong version is noticed on reading.

#ifndef SR_VERSIONED_ROWS_H
#define SR_VERSIONED_ROWS_H

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "qv_sr.h"

namespace sr_versioned {

// Rows are found by key through a key hash table: without one a new key
// is checked by a scan that refuses it whenever a deleted row left a free
// entry before the last live row.
inline constexpr uint32_t Hash_Buckets = 64;

inline uint32_t hash_id(const void *p_key) {
  int32_t id;
  std::memcpy(&id, p_key, sizeof id);
  return static_cast<uint32_t>(id) % Hash_Buckets;
}

inline int32_t compare_ids(const void *p_stored_key, const void *p_key) {
  return std::memcmp(p_stored_key, p_key, sizeof(int32_t)) == 0 ? 0 : 1;
}

inline qv_value_t int32_value(int32_t number) {
  qv_value_t value{};
  value.val_int32 = number;
  return value;
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

inline std::vector<sr_column_t> table_columns() {
  std::vector<sr_column_t> columns(3);
  columns[0] = {const_cast<char *>("Id"), QV_INT32, SR_PRIMARY_KEY, 0, nullptr, {}};
  columns[1] = {const_cast<char *>("Version"), QV_INT32, SR_STANDARD, 0, nullptr, {}};
  columns[2] = {const_cast<char *>("Payload"), QV_CHAR_PTR, SR_STANDARD, 0, nullptr, {}};
  return columns;
}

inline int32_t add_row(sr_opaque_handle_t table, int32_t id, int32_t version, uint32_t spread) {
  qv_value_t key = int32_value(id);
  qv_value_t number = int32_value(version);
  const std::string text = payload(id, version, spread);
  qv_value_t body{};
  body.ptr_char = const_cast<char *>(text.c_str());
  const char *names[] = {"Id", "Version", "Payload"};
  qv_value_t *values[] = {&key, &number, &body};
  return sr_add_row_1(table, names, values, 3);
}

inline int32_t set_row(sr_opaque_handle_t table, int32_t id, int32_t version, uint32_t spread) {
  qv_value_t number = int32_value(version);
  const std::string text = payload(id, version, spread);
  qv_value_t body{};
  body.ptr_char = const_cast<char *>(text.c_str());
  const char *names[] = {"Version", "Payload"};
  qv_value_t *values[] = {&number, &body};
  return sr_set_fields_by_key_1(table, int32_value(id), names, values, 2);
}

// A committed state: whether the table exists, its change counter and each
// row's Version by Id.
struct table_state {
  bool exists = false;
  uint64_t counter = 0;
  std::map<int32_t, int32_t> rows;
  bool operator==(const table_state &) const = default;
};

inline std::string describe(const table_state &state) {
  if (!state.exists) {
    return "no table";
  }
  std::string text = "counter " + std::to_string(state.counter) + ", " +
                     std::to_string(state.rows.size()) + " rows:";
  int shown = 0;
  for (const auto &[id, version] : state.rows) {
    if (++shown > 40) {
      return text + " ...";
    }
    text += " " + std::to_string(id) + "v" + std::to_string(version);
  }
  return text;
}

// The committed rows of an open table into `state`: an empty string, or
// what went wrong (a failed read, a row this test does not write).
inline std::string read_rows(sr_opaque_handle_t table, table_state &state, uint32_t spread) {
  sr_table_metadata_t *p_metadata = nullptr;
  if (const int32_t rc = sr_get_table_metadata_1(table, 0, &p_metadata); rc != 0) {
    return "sr_get_table_metadata_1 gave " + std::to_string(rc);
  }
  state.exists = true;
  state.counter = p_metadata->table_change_counter;
  state.rows.clear();
  const uint32_t total_rows = p_metadata->number_of_rows;
  sr_free_table_metadata_1(p_metadata);
  for (uint32_t at = 0; at < total_rows; ++at) {
    qv_value_t id{};
    qv_value_t version{};
    qv_value_t text{};
    const char *names[] = {"Id", "Version", "Payload"};
    qv_value_t *values[] = {&id, &version, &text};
    if (const int32_t rc =
            sr_get_fields_by_index_1(table, static_cast<int32_t>(at), names, values, 3);
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
  sr_opaque_handle_t tree = nullptr;
  if (sr_open_tree_1(&tree, 0, 0) != 0) {
    return "no tree";
  }
  std::string problem;
  sr_opaque_handle_t table = nullptr;
  if (sr_mount_local_tree_1(tree, "/disk", directory.c_str(), 0) != 0) {
    problem = "no mount point";
  } else if (const int32_t rc = sr_open_table_1(tree, p_registry_path, 1, &table);
             rc != 0 && rc != SR_E_NO_TABLE) {
    problem = "sr_open_table_1 gave " + std::to_string(rc);
  } else if (rc == 0) {
    problem = read_rows(table, state, spread);
  }
  sr_close_tree_1(tree);
  return problem;
}

}  // namespace sr_versioned

#endif  // SR_VERSIONED_ROWS_H
