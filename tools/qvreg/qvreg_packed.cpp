// qvreg_packed.cpp - pack and unpack: tables written into one packed
// buffer file, and what a packed buffer file holds, shown by unpacking each
// table into a tree of its own (a buffer from a machine of the other byte
// order is converted first).

#include <fstream>
#include <iostream>
#include <iterator>
#include <memory>

#include "qvreg_commands.h"
#include "qvreg_output.h"

namespace qvreg {

void pack_tables(session &s, const std::vector<std::string> &tables, const std::string &file) {
  std::vector<sr_opaque_handle_t> handles;
  for (const std::string &table : tables) {
    handles.push_back(s.open(table, false));
  }
  const std::vector<uint32_t> views(handles.size(), s.visibility());
  const std::vector<uint32_t> all_rows(handles.size(), 0);
  void *p_buffer = nullptr;
  check(sr_pack_tables_1(static_cast<uint32_t>(handles.size()), handles.data(), views.data(),
                         all_rows.data(), nullptr, &p_buffer));
  const std::unique_ptr<void, decltype(&std::free)> buffer(p_buffer, &std::free);
  uint32_t length = 0;
  std::memcpy(&length, p_buffer, sizeof length);
  std::ofstream out(file, std::ios::binary | std::ios::trunc);
  out.write(static_cast<const char *>(p_buffer), length);
  if (!out.flush()) {
    throw usage_error("cannot write " + file);
  }
}

void unpack_file(session &s, const std::string &file) {
  std::ifstream in(file, std::ios::binary);
  if (!in) {
    throw usage_error("cannot read " + file);
  }
  std::vector<char> bytes{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  // The library trusts the stated length as far as the caller vouches for
  // it: never further than the file's bytes.
  uint32_t stated = 0;
  if (bytes.size() >= sizeof stated) {
    std::memcpy(&stated, bytes.data(), sizeof stated);
  }
  if (bytes.size() < sizeof stated ||
      (stated > bytes.size() && __builtin_bswap32(stated) > bytes.size())) {
    throw refused(SR_E_TABLE_UNREADABLE, file + " is shorter than the buffer it holds\n");
  }
  check(sr_convert_packed_table_buffer_1(bytes.data(), 0, 1));
  uint32_t total = 0;
  check(sr_get_total_packed_tables_1(bytes.data(), &total));
  // Unpacked into a tree without mount points, so no name is taken for a
  // file and none meets a table of this run.
  sr_opaque_handle_t tree = nullptr;
  check(sr_open_tree_1(&tree, 0, 0));
  const std::unique_ptr<void, int32_t (*)(sr_opaque_handle_t)> closer(tree, sr_close_tree_1);
  grid contents{{"index", "table", "rows", "columns", "change_counter"}, {}};
  for (uint32_t at = 0; at < total; ++at) {
    const char *p_name = nullptr;
    check(sr_get_packed_table_name_1(bytes.data(), at, &p_name));
    sr_opaque_handle_t table = nullptr;
    check(sr_unpack_table_1(bytes.data(), 0, nullptr, nullptr, tree, at, &table));
    sr_table_metadata_t *p_metadata = nullptr;
    check(sr_get_table_metadata_1(table, 0, &p_metadata));
    contents.rows.push_back({at, p_name, p_metadata->number_of_rows, p_metadata->number_of_columns,
                             p_metadata->table_change_counter});
    sr_free_table_metadata_1(p_metadata);
  }
  print(std::cout, contents, s.settings().format);
}

}  // namespace qvreg
