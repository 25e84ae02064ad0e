// qvreg_tables.cpp - the subcommands about whole tables: ls, schema, stat,
// create and the column changes, cp, mv, rm, repair, and the internals
// dump.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
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

// The fields of a structured-data type written "sd(NAME=TYPE,...)" or
// "sd_array(...)", from the text inside the parentheses.
std::vector<std::pair<std::string, qv_data_type_t>> fields_of(const std::string &text) {
  std::vector<std::pair<std::string, qv_data_type_t>> fields;
  for (size_t start = 0; start < text.size();) {
    const size_t comma = std::min(text.find(',', start), text.size());
    const std::string field = text.substr(start, comma - start);
    const size_t equals = field.find('=');
    const qv_data_type_t type =
        equals == std::string::npos ? QV_UNKNOWN : type_of_name(field.substr(equals + 1));
    if (type == QV_UNKNOWN || equals == 0) {
      throw usage_error("\"" + field + "\" is not a structured-data field NAME=TYPE");
    }
    fields.emplace_back(field.substr(0, equals), type);
    start = comma + 1;
  }
  return fields;
}

// Column definitions from "NAME:TYPE[:QUALIFIER][=DEFAULT]" arguments, a
// structured-data TYPE being "sd(NAME=TYPE,...)" or "sd_array(...)", with
// what their names, defaults and field definitions point into.
struct column_specs {
  std::vector<column_info> infos;
  std::vector<owned_value> defaults; /* also holds the field definitions */
  std::vector<sr_column_t> columns;

  explicit column_specs(const std::vector<std::string> &specs) {
    infos.reserve(specs.size());
    defaults.reserve(specs.size());
    for (const std::string &argument : specs) {
      const size_t colon = argument.find(':');
      if (colon == std::string::npos || colon == 0) {
        throw usage_error("\"" + argument + "\" is not NAME:TYPE[:QUALIFIER][=DEFAULT]");
      }
      // The type ends at the next ":" or "=", or after its field list.
      size_t type_end = std::min(argument.find_first_of(":=", colon + 1), argument.size());
      const size_t open = argument.find('(', colon + 1);
      std::string fields_text;
      if (open < type_end) {
        const size_t close = argument.find(')', open);
        if (close == std::string::npos) {
          throw usage_error("\"" + argument + "\" has no \")\" after its fields");
        }
        fields_text = argument.substr(open + 1, close - open - 1);
        type_end = close + 1;
      }
      const std::string type_text =
          argument.substr(colon + 1, std::min(open, type_end) - colon - 1);
      column_info column{argument.substr(0, colon), type_of_name(type_text), SR_STANDARD, {}};
      const bool structured = column.type == QV_SD_PTR || column.type == QV_SD_PTR_ARRAY;
      if (column.type == QV_UNKNOWN || structured != (open < type_end)) {
        throw usage_error("\"" + argument.substr(colon + 1, type_end - colon - 1) +
                          "\" is not a column type");
      }
      if (structured) {
        column.fields = fields_of(fields_text);
      }
      const size_t equals = std::min(argument.find('=', type_end), argument.size());
      if (type_end < argument.size() && argument[type_end] == ':') {
        column.qualifier = qualifier_of(argument.substr(type_end + 1, equals - type_end - 1));
      }
      defaults.emplace_back();
      if (equals < argument.size()) {
        from_text(column, argument.substr(equals + 1), defaults.back());
      }
      sr_column_t definition{};
      definition.type = column.type;
      definition.qualifier = static_cast<sr_qualifier_t>(column.qualifier);
      definition.default_value = defaults.back().value;
      if (structured) {
        definition.sd_defn = field_definitions(column, defaults.back());
      }
      infos.push_back(std::move(column));
      columns.push_back(definition);
    }
    for (size_t at = 0; at < columns.size(); ++at) {
      columns[at].name = infos[at].name.data();
    }
  }

  // The library's form of a column's fields, in blocks of `owner`.
  static sr_sd_def_t *field_definitions(const column_info &column, owned_value &owner) {
    auto *p_definition = static_cast<sr_sd_def_t *>(
        owner.block(sizeof(sr_sd_def_t) + column.fields.size() * sizeof(sr_sd_field_def_t)));
    p_definition->number_of_fields = static_cast<uint32_t>(column.fields.size());
    for (size_t at = 0; at < column.fields.size(); ++at) {
      const std::string &name = column.fields[at].first;
      auto *p_name = static_cast<char *>(owner.block(name.size() + 1));
      std::memcpy(p_name, name.c_str(), name.size() + 1);
      p_definition->field_def[at] = {column.fields[at].second, p_name};
    }
    return p_definition;
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
