// qvreg_tables.cpp - the subcommands about whole tables: ls, schema, stat,
// create and the column changes, cp, mv, rm, repair, and the internals
// dump.

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <iostream>

#include "qvreg_commands.h"
#include "qvreg_output.h"

namespace qvreg {

namespace {

constexpr uint32_t Qualifier_Base = 15;

int64_t size_of(const std::string &file) {
  struct stat status {};
  return !file.empty() && ::stat(file.c_str(), &status) == 0 ? status.st_size : -1;
}

std::string qualifier_text(uint32_t qualifier) {
  static constexpr const char *Bases[] = {"unknown", "system", "standard", "key", "key-nocheck"};
  const uint32_t base = qualifier & Qualifier_Base;
  std::string text = base < std::size(Bases) ? Bases[base] : "unknown";
  if ((qualifier & SR_PROTECTED) != 0) {
    text += "+protected";
  }
  if ((qualifier & SR_INVISIBLE) != 0) {
    text += "+invisible";
  }
  if ((qualifier & SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED) != 0) {
    text += "+default-when-unspecified";
  }
  return text;
}

uint32_t qualifier_of(const std::string &text) {
  uint32_t qualifier = 0;
  size_t start = 0;
  for (bool first = true; start <= text.size(); first = false) {
    const size_t plus = text.find('+', start);
    const std::string word = text.substr(start, plus - start);
    start = plus == std::string::npos ? text.size() + 1 : plus + 1;
    if (first && word == "standard") {
      qualifier |= SR_STANDARD;
    } else if (first && word == "key") {
      qualifier |= SR_PRIMARY_KEY;
    } else if (first && word == "key-nocheck") {
      qualifier |= SR_PRIMARY_KEY_NOCHECK;
    } else if (!first && word == "protected") {
      qualifier |= SR_PROTECTED;
    } else if (!first && word == "invisible") {
      qualifier |= SR_INVISIBLE;
    } else if (!first && word == "default-when-unspecified") {
      qualifier |= SR_SET_TO_DEFAULT_WHEN_UNSPECIFIED;
    } else {
      throw usage_error("\"" + text +
                        "\" is not a qualifier (standard, key or key-nocheck, then +protected, "
                        "+invisible, +default-when-unspecified)");
    }
  }
  return qualifier;
}

// Column definitions from "NAME:TYPE[:QUALIFIER][=DEFAULT]" arguments, with
// what their defaults point into.
struct column_specs {
  std::vector<std::string> names;
  std::vector<owned_value> defaults;
  std::vector<sr_column_t> columns;

  explicit column_specs(const std::vector<std::string> &specs) {
    names.reserve(specs.size());
    defaults.reserve(specs.size());
    for (const std::string &spec : specs) {
      const size_t equals = spec.find('=');
      const std::string head = spec.substr(0, equals);
      const size_t colon = head.find(':');
      if (colon == std::string::npos) {
        throw usage_error("\"" + spec + "\" is not NAME:TYPE[:QUALIFIER][=DEFAULT]");
      }
      const size_t second = head.find(':', colon + 1);
      const std::string type_text = head.substr(colon + 1, second - colon - 1);
      column_info column{head.substr(0, colon), type_of_name(type_text), SR_STANDARD, {}};
      if (column.type == QV_UNKNOWN) {
        throw usage_error("\"" + type_text + "\" is not a column type");
      }
      if (column.type == QV_SD_PTR || column.type == QV_SD_PTR_ARRAY) {
        throw usage_error("structured-data columns cannot be defined from the command line");
      }
      if (second != std::string::npos) {
        column.qualifier = qualifier_of(head.substr(second + 1));
      }
      names.push_back(column.name);
      defaults.emplace_back();
      if (equals != std::string::npos) {
        from_text(column, spec.substr(equals + 1), defaults.back());
      }
      sr_column_t definition{};
      definition.type = column.type;
      definition.qualifier = static_cast<sr_qualifier_t>(column.qualifier);
      definition.default_value = defaults.back().value;
      columns.push_back(definition);
    }
    for (size_t at = 0; at < columns.size(); ++at) {
      columns[at].name = names[at].data();
    }
  }
};

// Key hashes for the command line's --hashed: the key's bytes, 4 or 8 of
// them, folded.
uint32_t hash_4_bytes(const void *p_key) {
  uint32_t key;
  std::memcpy(&key, p_key, sizeof key);
  return key * 2654435761u;
}
uint32_t hash_8_bytes(const void *p_key) {
  uint64_t key;
  std::memcpy(&key, p_key, sizeof key);
  return static_cast<uint32_t>((key * 0x9E3779B97F4A7C15ull) >> 32);
}
int32_t compare_4_bytes(const void *p_stored, const void *p_key) {
  return std::memcmp(p_stored, p_key, 4) == 0 ? 0 : 1;
}
int32_t compare_8_bytes(const void *p_stored, const void *p_key) {
  return std::memcmp(p_stored, p_key, 8) == 0 ? 0 : 1;
}

}  // namespace

void list_tables(session &s, const std::string &path) {
  char **p_list = nullptr;
  uint32_t total = 0;
  check(sr_list_tables_1(s.tree(), path.c_str(), &p_list, &total));
  std::vector<std::string> names(p_list, p_list + total);
  sr_free_table_list_1(p_list, total);
  grid listing{{"table", "storage", "rows", "columns", "bytes"}, {}};
  for (const std::string &name : names) {
    sr_opaque_handle_t table = nullptr;
    check(sr_open_table_1(s.tree(), name.c_str(), SR_MODE_READ, &table));
    sr_table_metadata_t *p_metadata = nullptr;
    const int32_t rc = sr_get_table_metadata_1(table, 0, &p_metadata);
    sr_close_table_1(table);
    check(rc);
    const std::string file = s.file_of(name);
    listing.rows.push_back({name, file.empty() ? "memory" : "file", p_metadata->number_of_rows,
                            p_metadata->number_of_columns,
                            file.empty() ? json(nullptr) : json(size_of(file))});
    sr_free_table_metadata_1(p_metadata);
  }
  print(std::cout, listing, s.settings().format);
}

void show_schema(session &s, const std::string &table) {
  std::vector<json> defaults;
  const std::vector<column_info> columns = columns_of(s.open(table, false), &defaults);
  grid schema{{"column", "type", "qualifier", "default", "fields"}, {}};
  for (size_t at = 0; at < columns.size(); ++at) {
    json fields = json::array();
    for (const auto &[name, type] : columns[at].fields) {
      fields.push_back(name + ":" + type_name(type));
    }
    schema.rows.push_back({columns[at].name, type_name(columns[at].type),
                           qualifier_text(columns[at].qualifier), defaults[at],
                           columns[at].fields.empty() ? json(nullptr) : fields});
  }
  print(std::cout, schema, s.settings().format);
}

void show_stat(session &s, const std::string &table) {
  const sr_opaque_handle_t handle = s.open(table, false);
  sr_table_metadata_t *p_metadata = nullptr;
  check(sr_get_table_metadata_1(handle, 0, &p_metadata));
  const uint64_t counter = p_metadata->table_change_counter;
  const uint32_t committed = p_metadata->number_of_rows;
  const uint32_t columns = p_metadata->number_of_columns;
  sr_free_table_metadata_1(p_metadata);
  const std::string file = s.file_of(table);
  grid facts{{"property", "value"}, {}};
  facts.rows.push_back({"table", table});
  facts.rows.push_back({"storage", file.empty() ? "memory" : "file"});
  facts.rows.push_back({"columns", columns});
  facts.rows.push_back({"rows", committed});
  facts.rows.push_back({"change_counter", counter});
  if (!file.empty()) {
    // What a rewrite would keep: the live rows written as a new file, here
    // a copy of the table in a directory of its own, mounted for it.
    const int64_t bytes = size_of(file);
    std::string scratch = (std::filesystem::temp_directory_path() / "qvreg-stat-XXXXXX").string();
    if (mkdtemp(scratch.data()) == nullptr) {
      throw usage_error("no scratch directory for the live size");
    }
    const int32_t mounted = sr_mount_local_tree_1(s.tree(), "/qvreg_stat", scratch.c_str(), 0);
    int32_t rc = mounted != 0 ? mounted : sr_copy_table_by_handle_1(handle, "/qvreg_stat/live", 0);
    const int64_t live = rc == 0 ? size_of(scratch + "/live") : -1;
    if (mounted == 0) {
      sr_delete_table_1(s.tree(), "/qvreg_stat/live");
      sr_unmount_local_tree_1(s.tree(), "/qvreg_stat");
    }
    std::error_code ignored;
    std::filesystem::remove_all(scratch, ignored);
    check(rc);
    facts.rows.push_back({"file", file});
    facts.rows.push_back({"file_bytes", bytes});
    facts.rows.push_back({"live_bytes", live});
    facts.rows.push_back({"dead_bytes", bytes > live ? bytes - live : 0});
    facts.rows.push_back({"side_file", std::filesystem::exists(file + ".rewrite")});
  }
  print(std::cout, facts, s.settings().format);
}

void create_table(session &s, const std::string &table, const std::vector<std::string> &specs,
                  uint32_t hash_buckets) {
  column_specs definitions(specs);
  sr_opaque_handle_t handle = nullptr;
  if (hash_buckets == 0) {
    check(sr_create_table_1(s.tree(), table.c_str(), definitions.columns.data(),
                            static_cast<uint32_t>(definitions.columns.size()),
                            SR_MODE_WRITE_EXPLICIT, &handle));
  } else {
    qv_data_type_t key_type = QV_UNKNOWN;
    for (const sr_column_t &column : definitions.columns) {
      const uint32_t base = column.qualifier & Qualifier_Base;
      if (base == SR_PRIMARY_KEY || base == SR_PRIMARY_KEY_NOCHECK) {
        key_type = column.type;
      }
    }
    const bool four = key_type == QV_INT32 || key_type == QV_UINT32;
    const bool eight = key_type == QV_INT64 || key_type == QV_UINT64;
    if (!four && !eight) {
      throw usage_error("--hashed needs an integer key column");
    }
    check(sr_create_hashed_key_table_1(
        s.tree(), table.c_str(), definitions.columns.data(),
        static_cast<uint32_t>(definitions.columns.size()), SR_MODE_WRITE_EXPLICIT, hash_buckets,
        four ? hash_4_bytes : hash_8_bytes, four ? compare_4_bytes : compare_8_bytes, &handle));
  }
  check(sr_close_table_1(handle));
}

void add_columns(session &s, const std::string &table, const std::vector<std::string> &specs) {
  column_specs definitions(specs);
  check(sr_add_columns_1(s.open(table, true), definitions.columns.data(),
                         static_cast<uint32_t>(definitions.columns.size())));
}

void drop_columns(session &s, const std::string &table, const std::vector<std::string> &names) {
  std::vector<const char *> pointers;
  for (const std::string &name : names) {
    pointers.push_back(name.c_str());
  }
  check(sr_delete_columns_1(s.open(table, true), pointers.data(),
                            static_cast<uint32_t>(pointers.size())));
}

void rename_column(session &s, const std::string &table, const std::string &old_name,
                   const std::string &new_name) {
  check(sr_change_column_name_1(s.open(table, true), old_name.c_str(), new_name.c_str()));
}

void copy_table(session &s, const std::string &from, const std::string &to, bool overwrite) {
  check(sr_copy_table_by_name_1(s.tree(), from.c_str(), to.c_str(), overwrite ? 1 : 0));
}

void move_table(session &s, const std::string &from, const std::string &to, bool overwrite) {
  check(sr_move_table_by_name_1(s.tree(), from.c_str(), to.c_str(), overwrite ? 1 : 0));
}

void remove_table(session &s, const std::string &table) {
  check(sr_delete_table_1(s.tree(), table.c_str()));
}

void repair_tables(session &s, const std::vector<std::string> &paths) {
  std::vector<const char *> pointers;
  for (const std::string &path : paths) {
    pointers.push_back(path.c_str());
  }
  check(sr_repair_tables_1(s.tree(), pointers.data(), static_cast<uint32_t>(pointers.size())));
}

void dump_internals(session &s, const std::string &table) {
  std::cout.flush();
  check(sr_i_dump_table(s.open(table, false)));
}

}  // namespace qvreg
