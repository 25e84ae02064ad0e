// qvreg_commands.h - the subcommands of qvreg, one function each. Each one
// works through the session's tree, prints to standard output, and throws
// `refused` or `usage_error` (qvreg_session.h) when it cannot go on; main
// turns those into the exit code.

#ifndef QVREG_COMMANDS_H
#define QVREG_COMMANDS_H

#include <optional>
#include <string>
#include <vector>

#include "qvreg_session.h"

namespace qvreg {

// Rows (qvreg_rows.cpp).
void dump_rows(session &s, const std::string &table);
void select_rows(session &s, const std::string &table, const std::string &where,
                 const std::vector<std::string> &columns);
void get_row(session &s, const std::string &table, const std::string &key,
             const std::vector<std::string> &columns);
void set_row(session &s, const std::string &table, const std::string &key,
             const std::vector<std::string> &assignments);
void add_row(session &s, const std::string &table, const std::vector<std::string> &assignments);
void delete_rows(session &s, const std::string &table, const std::optional<std::string> &key,
                 const std::optional<std::string> &where);
void export_rows(session &s, const std::string &table, const std::string &format);
void import_rows(session &s, const std::string &table, const std::string &file);

// Tables (qvreg_tables.cpp).
void list_tables(session &s, const std::string &path);
void show_schema(session &s, const std::string &table);
void show_stat(session &s, const std::string &table);
void create_table(session &s, const std::string &table, const std::vector<std::string> &specs,
                  uint32_t hash_buckets);
void add_columns(session &s, const std::string &table, const std::vector<std::string> &specs);
void drop_columns(session &s, const std::string &table, const std::vector<std::string> &names);
void rename_column(session &s, const std::string &table, const std::string &old_name,
                   const std::string &new_name);
void copy_table(session &s, const std::string &from, const std::string &to, bool overwrite);
void move_table(session &s, const std::string &from, const std::string &to, bool overwrite);
void remove_table(session &s, const std::string &table);
void repair_tables(session &s, const std::vector<std::string> &paths);
void dump_internals(session &s, const std::string &table);

// Packed buffers (qvreg_packed.cpp).
void pack_tables(session &s, const std::vector<std::string> &tables, const std::string &file);
void unpack_file(session &s, const std::string &file);

}  // namespace qvreg

#endif  // QVREG_COMMANDS_H
