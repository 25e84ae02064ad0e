// qvreg.cpp - the registry's command-line shell: one tree per run, the
// mount points asked for (or the default "/local" on ./qv_registry), one
// subcommand, its changes committed at the end. Exit status: 0 done, 1 the
// library refused (its message on standard error as it is), 2 a usage
// error.

#include <CLI/CLI.hpp>
#include <cstdint>
#include <iostream>
#include <optional>
#include <string>
#include <vector>

#include "qvreg_commands.h"

namespace {

using namespace qvreg;

// Adds a subcommand whose action runs in a session and commits it.
template <typename Action>
CLI::App *command(CLI::App &app, const options &given, const std::string &name,
                  const std::string &description, Action &&action) {
  CLI::App *p_command = app.add_subcommand(name, description);
  p_command->callback([&given, action]() {
    session s(given);
    action(s);
    s.commit();
  });
  return p_command;
}

}  // namespace

int main(int argc, char **argv) {
  CLI::App app{"qvreg - look into and change the tables of a qv registry"};
  app.require_subcommand(1);
  app.set_help_all_flag("--help-all", "Show the help of every subcommand");
  options given;
  app.add_option("--mount", given.mounts,
                 "Map REGISTRY_PATH onto DIRECTORY (REGISTRY_PATH=DIRECTORY, repeatable); "
                 "default /local=./qv_registry, or $QV_REGISTRY");
  app.add_flag("--uncommitted", given.uncommitted, "Read the applied view, not the committed one");
  app.add_option("--format", given.format, "Output: table, csv or json")->capture_default_str();

  std::string table, path, where, key, target, file, old_name, new_name, export_format;
  std::vector<std::string> items;
  std::vector<std::string> columns;
  std::optional<std::string> optional_key, optional_where;
  bool overwrite = false, internals = false;
  uint32_t hash_buckets = 0;

  app.add_subcommand("help", "Show this help")->callback([&]() { std::cout << app.help(); });

  command(app, given, "ls", "List the tables below a path",
          [&](session &s) { list_tables(s, path); })
      ->add_option("PATH", path, "Registry path (default /)")
      ->default_str("/");
  path = "/";

  CLI::App *p_schema = command(app, given, "schema", "Show a table's columns",
                               [&](session &s) { show_schema(s, table); });
  p_schema->add_option("TABLE", table, "Registry path of the table")->required();

  CLI::App *p_dump = command(app, given, "dump", "Show every row of a table", [&](session &s) {
    internals ? dump_internals(s, table) : dump_rows(s, table);
  });
  p_dump->add_option("TABLE", table, "Registry path of the table")->required();
  p_dump->add_flag("--internals", internals,
                   "Show the table's internals: row index, pool, hash table, file");

  CLI::App *p_select = command(app, given, "select", "Show the rows criteria pick",
                               [&](session &s) { select_rows(s, table, where, columns); });
  p_select->add_option("TABLE", table, "Registry path of the table")->required();
  p_select->add_option("--where", where, "Criteria, e.g. 'port > 1024 && host == \"a\"'");
  p_select->add_option("--columns", columns, "Columns to show (the key comes first)")
      ->delimiter(',');

  CLI::App *p_get = command(app, given, "get", "Show the row with a key",
                            [&](session &s) { get_row(s, table, key, items); });
  p_get->add_option("TABLE", table, "Registry path of the table")->required();
  p_get->add_option("KEY", key, "The key, typed as the key column")->required();
  p_get->add_option("COLUMN", items, "Columns to show (default all)");

  CLI::App *p_set = command(app, given, "set", "Change values of the row with a key",
                            [&](session &s) { set_row(s, table, key, items); });
  p_set->add_option("TABLE", table, "Registry path of the table")->required();
  p_set->add_option("KEY", key, "The key, typed as the key column")->required();
  p_set->add_option("COLUMN=VALUE", items, "New values")->required();

  CLI::App *p_add =
      command(app, given, "add", "Add a row", [&](session &s) { add_row(s, table, items); });
  p_add->add_option("TABLE", table, "Registry path of the table")->required();
  p_add->add_option("COLUMN=VALUE", items, "Values; the others take their defaults")->required();

  CLI::App *p_delete =
      command(app, given, "delete", "Delete the row with a key, or rows criteria pick",
              [&](session &s) { delete_rows(s, table, optional_key, optional_where); });
  p_delete->add_option("TABLE", table, "Registry path of the table")->required();
  p_delete->add_option("KEY", optional_key, "The key of the row");
  p_delete->add_option("--where", optional_where, "Criteria picking the rows");

  CLI::App *p_create = command(app, given, "create", "Create a table",
                               [&](session &s) { create_table(s, table, items, hash_buckets); });
  p_create->add_option("TABLE", table, "Registry path of the new table")->required();
  p_create->add_option("COLUMN", items, "NAME:TYPE[:QUALIFIER][=DEFAULT]; one column qualified key")
      ->required();
  p_create->add_option("--hashed", hash_buckets, "A key hash table of BUCKETS buckets");

  CLI::App *p_add_column = command(app, given, "add-column", "Add columns to a table",
                                   [&](session &s) { add_columns(s, table, items); });
  p_add_column->add_option("TABLE", table, "Registry path of the table")->required();
  p_add_column->add_option("COLUMN", items, "NAME:TYPE[:QUALIFIER][=DEFAULT]")->required();

  CLI::App *p_drop_column = command(app, given, "drop-column", "Delete columns of a table",
                                    [&](session &s) { drop_columns(s, table, items); });
  p_drop_column->add_option("TABLE", table, "Registry path of the table")->required();
  p_drop_column->add_option("COLUMN", items, "Names of the columns")->required();

  CLI::App *p_rename = command(app, given, "rename-column", "Rename a column",
                               [&](session &s) { rename_column(s, table, old_name, new_name); });
  p_rename->add_option("TABLE", table, "Registry path of the table")->required();
  p_rename->add_option("OLD", old_name, "The column's name")->required();
  p_rename->add_option("NEW", new_name, "Its new name")->required();

  for (const auto &[name, description, move] :
       {std::tuple{"cp", "Copy a table", false}, std::tuple{"mv", "Move a table", true}}) {
    CLI::App *p_copy = command(app, given, name, description, [&, move = move](session &s) {
      move ? move_table(s, table, target, overwrite) : copy_table(s, table, target, overwrite);
    });
    p_copy->add_option("SOURCE", table, "Registry path of the table")->required();
    p_copy->add_option("TARGET", target, "Registry path to copy to")->required();
    p_copy->add_flag("--overwrite", overwrite, "Replace a table at the target");
  }

  CLI::App *p_remove =
      command(app, given, "rm", "Delete a table", [&](session &s) { remove_table(s, table); });
  p_remove->add_option("TABLE", table, "Registry path of the table")->required();

  CLI::App *p_stat = command(app, given, "stat", "Show a table's size, rows and file",
                             [&](session &s) { show_stat(s, table); });
  p_stat->add_option("TABLE", table, "Registry path of the table")->required();

  CLI::App *p_repair = command(app, given, "repair", "Remove side files left by a crash",
                               [&](session &s) { repair_tables(s, items); });
  p_repair->add_option("PATH", items, "Registry paths of tables")->required();

  CLI::App *p_export = command(app, given, "export", "Write a table's rows as CSV or JSON",
                               [&](session &s) { export_rows(s, table, export_format); });
  p_export->add_option("TABLE", table, "Registry path of the table")->required();
  p_export->add_option("--format", export_format, "csv or json")->required();

  CLI::App *p_import = command(app, given, "import", "Add the rows of a CSV or JSON file",
                               [&](session &s) { import_rows(s, table, file); });
  p_import->add_option("TABLE", table, "Registry path of the table")->required();
  p_import->add_option("FILE", file, "Rows as export writes them")->required();

  CLI::App *p_pack = command(app, given, "pack", "Write tables into a packed buffer file",
                             [&](session &s) { pack_tables(s, items, file); });
  p_pack->add_option("TABLE", items, "Registry paths of the tables")->required();
  p_pack->add_option("-o", file, "The file to write")->required();

  CLI::App *p_unpack = command(app, given, "unpack", "Show the tables a packed buffer file holds",
                               [&](session &s) { unpack_file(s, file); });
  p_unpack->add_option("FILE", file, "A packed buffer file")->required();

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError &error) {
    const int code = app.exit(error);
    return code == 0 ? 0 : Exit_Usage;
  } catch (const refused &error) {
    std::cerr << error.what();
    if (std::string(error.what()).empty()) {
      std::cerr << "qvreg: the library refused with code " << error.code() << "\n";
    }
    return Exit_Refused;
  } catch (const usage_error &error) {
    std::cerr << "qvreg: " << error.what() << "\n";
    return Exit_Usage;
  } catch (const std::exception &error) {
    std::cerr << "qvreg: " << error.what() << "\n";
    return Exit_Refused;
  }
  return 0;
}
