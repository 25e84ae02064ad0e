// qvreg_rows.cpp - the subcommands that read and change rows: dump,
// select, get, set, add, delete, export and import. Reads go row by row in
// packed order through the exported calls, in the view --uncommitted
// chooses; changes go into one transaction that the run commits at its
// end, or drops when anything fails.

#include <fstream>
#include <iostream>
#include <iterator>

#include "qvreg_commands.h"
#include "qvreg_output.h"

namespace qvreg {

namespace {

const column_info &column_named(const std::vector<column_info> &columns, const std::string &table,
                                const std::string &name) {
  for (const column_info &column : columns) {
    if (column.name == name) {
      return column;
    }
  }
  throw usage_error("table " + table + " has no column \"" + name + "\"");
}

// The chosen columns of a table (all when none are named), with room for
// one row of their values as the reading calls take them.
struct row_buffer {
  std::vector<column_info> columns;
  std::vector<const char *> names;
  std::vector<qv_value_t> values;
  std::vector<qv_value_t *> pointers;

  row_buffer(const std::vector<column_info> &all, const std::string &table,
             const std::vector<std::string> &chosen) {
    if (chosen.empty()) {
      columns = all;
    }
    for (const std::string &name : chosen) {
      columns.push_back(column_named(all, table, name));
    }
    values.resize(columns.size());
    for (size_t at = 0; at < columns.size(); ++at) {
      names.push_back(columns[at].name.c_str());
      pointers.push_back(&values[at]);
    }
  }

  uint32_t count() const { return static_cast<uint32_t>(columns.size()); }

  std::vector<std::string> header() const {
    std::vector<std::string> header;
    for (const column_info &column : columns) {
      header.push_back(column.name);
    }
    return header;
  }

  // The values read, rendered, then freed.
  std::vector<json> take_row() {
    std::vector<json> row;
    for (size_t at = 0; at < columns.size(); ++at) {
      row.push_back(to_json(columns[at], values[at]));
      free_value(columns[at].type, values[at]);
    }
    return row;
  }
};

// The rows of an open table in one view, as a grid of the named columns.
grid read_rows(sr_opaque_handle_t table, const std::string &path,
               const std::vector<std::string> &names, uint32_t visibility) {
  row_buffer buffer(columns_of(table), path, names);
  grid rows{buffer.header(), {}};
  for (int32_t at = 0;; ++at) {
    const int32_t rc = sr_get_fields_by_index_and_visibility_1(table, at, buffer.names.data(),
                                                               buffer.pointers.data(),
                                                               buffer.count(), visibility, nullptr);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      return rows;
    }
    if (rc == SR_E_ROW_DELETED) {
      continue;
    }
    check(rc);
    rows.rows.push_back(buffer.take_row());
  }
}

// Values for named columns, typed by their columns, ready for a call.
struct field_values {
  std::vector<const char *> names;
  std::vector<owned_value> values;
  std::vector<qv_value_t *> pointers;

  void add(const column_info &column) {
    names.push_back(column.name.c_str());
    values.emplace_back();
  }
  void finish() {
    for (owned_value &value : values) {
      pointers.push_back(&value.value);
    }
  }
};

// "COLUMN=VALUE" arguments parsed by their columns' types.
void parse_assignments(const std::vector<column_info> &columns, const std::string &table,
                       const std::vector<std::string> &assignments, field_values &fields) {
  fields.values.reserve(assignments.size());
  for (const std::string &assignment : assignments) {
    const size_t equals = assignment.find('=');
    if (equals == std::string::npos) {
      throw usage_error("\"" + assignment + "\" is not COLUMN=VALUE");
    }
    const column_info &column = column_named(columns, table, assignment.substr(0, equals));
    fields.add(column);
    from_text(column, assignment.substr(equals + 1), fields.values.back());
  }
  fields.finish();
}

// Deletes the rows whose key equals `key`, through a criterion on the key
// column with the value as its typed replacement variable.
int32_t delete_by_key(sr_opaque_handle_t table, const column_info &key_column,
                      const owned_value &key) {
  const std::string criterion = key_column.name + " == ";
  const qv_value_t &value = key.value;
  switch (key_column.type) {
    case QV_INT32:
      return sr_delete_rows_1(table, (criterion + "$i").c_str(), value.val_int32);
    case QV_UINT32:
      return sr_delete_rows_1(table, (criterion + "$ui").c_str(), value.val_uint32);
    case QV_INT64:
      return sr_delete_rows_1(table, (criterion + "$l").c_str(), value.val_int64);
    case QV_UINT64:
      return sr_delete_rows_1(table, (criterion + "$ul").c_str(), value.val_uint64);
    case QV_FLOAT32:
      return sr_delete_rows_1(table, (criterion + "$d").c_str(),
                              static_cast<double>(value.val_float32));
    case QV_FLOAT64:
      return sr_delete_rows_1(table, (criterion + "$d").c_str(), value.val_float64);
    case QV_CHAR_PTR:
      return sr_delete_rows_1(table, (criterion + "$s").c_str(), value.ptr_char);
    case QV_BINARY_PTR:
      return sr_delete_rows_1(table, (criterion + "$b").c_str(), value.ptr_binary);
    case QV_RSRC_HANDLE_PTR:
      return sr_delete_rows_1(table, (criterion + "$rh").c_str(), value.ptr_rsrc_handle);
    default:
      throw usage_error("rows of a table keyed by " + type_name(key_column.type) +
                        " are deleted with --where");
  }
}

// Criteria as a user types them: literal values only. A replacement
// variable ("$i", "$s", ...) would make the library read an argument the
// shell never passes.
const char *typed_criteria(const std::string &where) {
  if (where.find('$') != std::string::npos) {
    throw usage_error(
        "criteria typed on the command line take values, not replacement "
        "variables (\"$\"): " +
        where);
  }
  return where.empty() ? nullptr : where.c_str();
}

}  // namespace

void dump_rows(session &s, const std::string &table) {
  print(std::cout, read_rows(s.open(table, false), table, {}, s.visibility()), s.settings().format);
}

void select_rows(session &s, const std::string &table, const std::string &where,
                 const std::vector<std::string> &columns) {
  const sr_opaque_handle_t source = s.open(table, false);
  std::vector<const char *> names;
  for (const std::string &name : columns) {
    names.push_back(name.c_str());
  }
  sr_opaque_handle_t selected = nullptr;
  check(sr_select_1(source, names.data(), static_cast<uint32_t>(names.size()), &selected,
                    typed_criteria(where)));
  try {
    print(std::cout, read_rows(selected, table, {}, 0), s.settings().format);
  } catch (...) {
    sr_close_table_1(selected);
    throw;
  }
  sr_close_table_1(selected);
}

void get_row(session &s, const std::string &table, const std::string &key,
             const std::vector<std::string> &columns) {
  const sr_opaque_handle_t handle = s.open(table, false);
  const std::vector<column_info> all = columns_of(handle);
  owned_value key_value;
  from_text(all.front(), key, key_value);
  row_buffer buffer(all, table, columns);
  check(sr_get_fields_by_key_and_visibility_1(handle, key_value.value, buffer.names.data(),
                                              buffer.pointers.data(), buffer.count(),
                                              s.visibility(), nullptr));
  print(std::cout, grid{buffer.header(), {buffer.take_row()}}, s.settings().format);
}

void set_row(session &s, const std::string &table, const std::string &key,
             const std::vector<std::string> &assignments) {
  const sr_opaque_handle_t handle = s.open(table, true);
  const std::vector<column_info> columns = columns_of(handle);
  owned_value key_value;
  from_text(columns.front(), key, key_value);
  field_values fields;
  parse_assignments(columns, table, assignments, fields);
  check(sr_set_fields_by_key_1(handle, key_value.value, fields.names.data(), fields.pointers.data(),
                               static_cast<uint32_t>(fields.names.size())));
  s.changed(table);
}

void add_row(session &s, const std::string &table, const std::vector<std::string> &assignments) {
  const sr_opaque_handle_t handle = s.open(table, true);
  const std::vector<column_info> columns = columns_of(handle);  // the names point into it
  field_values fields;
  parse_assignments(columns, table, assignments, fields);
  check(sr_add_row_1(handle, fields.names.data(), fields.pointers.data(),
                     static_cast<uint32_t>(fields.names.size())));
  s.changed(table);
}

void delete_rows(session &s, const std::string &table, const std::optional<std::string> &key,
                 const std::optional<std::string> &where) {
  if (key.has_value() == where.has_value()) {
    throw usage_error("delete takes either a KEY or --where CRITERIA");
  }
  const sr_opaque_handle_t handle = s.open(table, true);
  if (where) {
    check(sr_delete_rows_1(handle, typed_criteria(*where)));
  } else {
    const std::vector<column_info> columns = columns_of(handle);
    owned_value key_value;
    from_text(columns.front(), *key, key_value);
    check(delete_by_key(handle, columns.front(), key_value));
  }
  s.changed(table);
}

void export_rows(session &s, const std::string &table, const std::string &format) {
  if (format != "csv" && format != "json") {
    throw usage_error("export writes csv or json, not \"" + format + "\"");
  }
  print(std::cout, read_rows(s.open(table, false), table, {}, s.visibility()), format);
}

void import_rows(session &s, const std::string &table, const std::string &file) {
  std::ifstream in(file, std::ios::binary);
  if (!in) {
    throw usage_error("cannot read " + file);
  }
  const std::string text{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  const sr_opaque_handle_t handle = s.open(table, true);
  const std::vector<column_info> columns = columns_of(handle);
  const auto add = [&](field_values &fields) {
    fields.finish();
    check(sr_add_row_1(handle, fields.names.data(), fields.pointers.data(),
                       static_cast<uint32_t>(fields.names.size())));
  };
  const size_t first = text.find_first_not_of(" \t\r\n");
  if (first != std::string::npos && text[first] == '[') {
    const json rows = json::parse(text, nullptr, false);
    if (rows.is_discarded() || !rows.is_array()) {
      throw usage_error(file + " is not a JSON array of rows");
    }
    for (const json &row : rows) {
      if (!row.is_object()) {
        throw usage_error(file + ": every row must be an object of column values");
      }
      field_values fields;
      fields.values.reserve(row.size());
      for (const auto &[name, value] : row.items()) {
        const column_info &column = column_named(columns, table, name);
        fields.add(column);
        from_json(column, value, fields.values.back());
      }
      add(fields);
    }
  } else {
    const std::vector<std::vector<std::string>> records = parse_csv(text);
    if (records.empty()) {
      throw usage_error(file + " holds no header line");
    }
    std::vector<const column_info *> header;
    for (const std::string &name : records.front()) {
      header.push_back(&column_named(columns, table, name));
    }
    for (size_t line = 1; line < records.size(); ++line) {
      if (records[line].size() != header.size()) {
        throw usage_error(file + ": record " + std::to_string(line) + " has " +
                          std::to_string(records[line].size()) + " fields, the header " +
                          std::to_string(header.size()));
      }
      field_values fields;
      fields.values.reserve(header.size());
      for (size_t at = 0; at < header.size(); ++at) {
        fields.add(*header[at]);
        from_text(*header[at], records[line][at], fields.values.back());
      }
      add(fields);
    }
  }
  s.changed(table);
}

}  // namespace qvreg
