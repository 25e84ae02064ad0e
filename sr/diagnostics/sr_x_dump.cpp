// sr_x_dump.cpp - sr_i_dump_table and sr_i_dump_tree: a readable picture of
// a table's internals, or of a tree and everything in it, on standard
// output, for people debugging a program or the library. The output is for
// reading, not parsing: its form may change between versions.
//
// A table is dumped under its read lock, a tree under its write lock (so
// no table enters or leaves it meanwhile) with each table's read lock in
// turn.

#include <cinttypes>
#include <cstdio>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_tree.h"
#include "rows/sr_i_rows.h"
#include "storage/sr_i_table_file.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_table.h"

namespace {

constexpr sr_i_entry_point_t Dump_Table{141, false};
constexpr sr_i_entry_point_t Dump_Tree{143, false};

// A row index position's records as the two views see it.
const char *row_state(const sr_i_index_entry_t &entry) {
  if (entry.p_applied == nullptr && entry.p_committed == nullptr) {
    return "free";
  }
  if (entry.p_committed == nullptr) {
    return "added";
  }
  if (entry.p_applied == nullptr) {
    return "deleted";
  }
  return entry.p_applied == entry.p_committed ? "committed" : "updated";
}

uint32_t record_length(const void *p_record) {
  return p_record != nullptr ? sr_i_rb_record_header(const_cast<void *>(p_record))->record_length
                             : 0;
}

void dump_columns(const sr_i_table_t *p_table) {
  std::printf("  columns(%u) variable_length(%u)\n", p_table->total_columns,
              p_table->total_variable_length_columns);
  for (uint32_t column = 0; column < p_table->total_columns; ++column) {
    const sr_column_t &definition = p_table->p_columns[column];
    std::printf("    [%u] name(%s) type(%d) qualifier(0x%x) properties(%d) sd_defn(%s)\n", column,
                definition.name, static_cast<int>(definition.type),
                static_cast<unsigned>(definition.qualifier), definition.properties,
                definition.sd_defn != nullptr ? "yes" : "no");
  }
}

void dump_rows(const sr_i_table_t *p_table) {
  std::printf("  rows: maximum(%u) applied(%u) committed(%u) applied_deletions(%u)\n",
              p_table->maximum_rows, p_table->total_applied_rows, p_table->total_committed_rows,
              p_table->applied_deletions);
  uint32_t free_entries = 0;
  for (uint32_t position = 0; position < p_table->maximum_rows; ++position) {
    const sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    if (entry.p_applied == nullptr && entry.p_committed == nullptr) {
      ++free_entries;
      continue;
    }
    std::printf(
        "    fixed(%u) packed(%u) state(%s) applied(%p,%u) committed(%p,%u) file_offset(%u) "
        "applied_file_offset(%u) pending(%s) hash_bucket(%u)\n",
        position, entry.packed_index, row_state(entry), entry.p_applied,
        record_length(entry.p_applied), entry.p_committed, record_length(entry.p_committed),
        entry.file_offset, entry.applied_file_offset,
        entry.p_pending_change != nullptr ? "yes" : "no", entry.hash_index);
  }
  std::printf("  free index entries(%u) first_free(%ld) never_used_from(%ld)\n", free_entries,
              p_table->p_rows_free_chain != nullptr
                  ? static_cast<long>(p_table->p_rows_free_chain - p_table->p_rows_fixed_index)
                  : -1L,
              p_table->p_rows_never_used != nullptr
                  ? static_cast<long>(p_table->p_rows_never_used - p_table->p_rows_fixed_index)
                  : -1L);
}

void dump_change_list(const char *p_name, const sr_i_change_entry_t *p_first,
                      const sr_i_table_t *p_table) {
  std::printf("  %s:", p_name);
  for (const sr_i_change_entry_t *p_change = p_first; p_change != nullptr;
       p_change = p_change->p_next) {
    std::printf(" fixed(%u)%s", sr_i_fixed_position(p_table, p_change->p_index_entry),
                p_change->deletion != 0 ? "-deleted" : "");
  }
  std::printf("\n");
}

void dump_pool(const sr_i_record_buffer_pool_t &pool) {
  std::printf("  pool: blocks(%u) total_bytes(%u) used_bytes(%u)\n", pool.total_blocks,
              pool.total_bytes, pool.used_bytes);
  for (const sr_i_record_buffer_t *p_block = pool.p_first_record_buffer; p_block != nullptr;
       p_block = p_block->p_next) {
    std::printf("    block(%p) bytes(%u)\n", static_cast<const void *>(p_block),
                p_block->total_bytes);
  }
  uint32_t free_records = 0;
  uint64_t free_bytes = 0;
  for (const sr_i_record_metadata_t *p_free = pool.p_free_chain; p_free != nullptr;
       p_free = p_free->p_next) {
    ++free_records;
    free_bytes += p_free->record_length;
  }
  std::printf("    free records(%u) bytes(%" PRIu64 ")\n", free_records, free_bytes);
}

void dump_hash_table(const sr_hash_table_t *p_hash_table) {
  if (p_hash_table == nullptr) {
    std::printf("  hash table: none\n");
    return;
  }
  uint32_t used_buckets = 0;
  uint32_t elements = 0;
  uint32_t longest = 0;
  for (uint32_t bucket = 0; bucket < p_hash_table->total_hash_buckets; ++bucket) {
    uint32_t chain = 0;
    for (const sr_hash_table_element_t *p_element = p_hash_table->p_elements[bucket];
         p_element != nullptr; p_element = p_element->p_next) {
      ++chain;
    }
    used_buckets += chain > 0 ? 1 : 0;
    elements += chain;
    longest = chain > longest ? chain : longest;
  }
  std::printf("  hash table: %s buckets(%u) used(%u) elements(%u) longest_chain(%u)\n",
              p_hash_table->p_hash_function != nullptr ? "client" : "built-in",
              p_hash_table->total_hash_buckets, used_buckets, elements, longest);
}

void dump_file(const sr_i_table_t *p_table) {
  if (p_table->p_file == nullptr) {
    std::printf("  file: none (transient)\n");
    return;
  }
  const sr_i_table_file_t &file = *p_table->p_file;
  std::printf(
      "  file: path(%s) fd(%d) length(%u) commit_record(%u,%u) applied_commit_record(%u,%u) "
      "rewrite_fd(%d) rewrite_length(%u) block_size(%u)\n",
      file.path.c_str(), file.fd, file.length, file.commit_record.offset, file.commit_record.length,
      file.applied_commit_record.offset, file.applied_commit_record.length, file.rewrite_fd,
      file.rewrite_length, p_table->block_size);
}

void dump_table(const sr_i_table_t *p_table) {
  std::printf("table(%p) name(%s) registry_path(%s)\n", static_cast<const void *>(p_table),
              p_table->p_name != nullptr ? p_table->p_name : "",
              p_table->p_persistent_table_registry_path != nullptr
                  ? p_table->p_persistent_table_registry_path
                  : "");
  std::printf(
      "  references(%u) mode(%u) implicitly_controlled(%u) uncommitted_updates_visible(%u) "
      "ready_for_commit(%u) change_counter(%" PRIu64 ") applied_change_counter(%" PRIu64 ")\n",
      p_table->references, p_table->mode, p_table->implicitly_controlled,
      p_table->uncommitted_updates_visible, p_table->ready_for_commit, p_table->change_counter,
      p_table->applied_change_counter);
  dump_columns(p_table);
  dump_rows(p_table);
  dump_change_list("changes", p_table->p_rows_change_list, p_table);
  dump_change_list("deletions", p_table->p_delete_rows_change_list, p_table);
  dump_pool(p_table->record_buffer_pool);
  dump_hash_table(p_table->p_rows_hash_table);
  dump_file(p_table);
}

// Dumps a table of a tree under its read lock.
int32_t dump_locked_table(sr_i_table_t *p_table) {
  sr_i_read_guard table_lock(&p_table->lock);
  if (table_lock.result() != 0) {
    return table_lock.result();
  }
  dump_table(p_table);
  return 0;
}

}  // namespace

extern "C" int32_t sr_i_dump_table(sr_opaque_handle_t table_handle) {
  return sr_i_run_entry_point(Dump_Table, [&]() -> int32_t {
    if (table_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    const int32_t rc = dump_locked_table(static_cast<sr_i_table_t *>(table_handle));
    std::fflush(stdout);
    return rc;
  });
}

extern "C" int32_t sr_i_dump_tree(sr_opaque_handle_t tree_handle) {
  return sr_i_run_entry_point(Dump_Tree, [&]() -> int32_t {
    if (tree_handle == nullptr) {
      return sr_i_raise(SR_E_INVALID_HANDLE);
    }
    auto *p_tree = static_cast<sr_i_tree_t *>(tree_handle);
    sr_i_write_guard tree_lock(&p_tree->lock);
    if (tree_lock.result() != 0) {
      return tree_lock.result();
    }
    std::printf("tree(%p)\n  mount points(%zu)\n", static_cast<const void *>(p_tree),
                p_tree->mount_points.size());
    for (const auto &[name, mount_point] : p_tree->mount_points) {
      std::printf("    p_name(%s)\n    p_filesystem_path(%s)\n", name.c_str(),
                  mount_point.filesystem_path.c_str());
    }
    std::printf("  named tables(%zu)\n", p_tree->tables.size());
    for (const auto &[key, p_table] : p_tree->tables) {
      if (const int32_t rc = dump_locked_table(p_table); rc != 0) {
        return rc;
      }
    }
    std::printf("  unnamed tables(%zu)\n", p_tree->unnamed_tables.size());
    for (sr_i_table_t *p_table : p_tree->unnamed_tables) {
      if (const int32_t rc = dump_locked_table(p_table); rc != 0) {
        return rc;
      }
    }
    std::fflush(stdout);
    return 0;
  });
}
