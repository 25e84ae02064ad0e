// sr_i_update_metadata.cpp - the rebuilt image of a table whose columns
// grow, or one of whose columns is renamed or given a new default: a new
// memory-only table made from the full column list as a caller would give
// it (so the usual checks of a new table apply), filled with a copy of
// every committed row in packed-index order.
//
// The row layout depends only on the column types, so a rename or a new
// default copies each record as it is; added columns go behind the old
// ones, and each copied row is widened by their defaults.

#include <cstring>
#include <memory>
#include <vector>

#include "frame/sr_i_errors.h"
#include "queries/sr_i_select.h"
#include "rows/sr_i_rows.h"
#include "schema/sr_i_schema_changes.h"
#include "schema/sr_i_table_metadata.h"
#include "tables/sr_i_create_table.h"
#include "tables/sr_i_hash_table.h"
#include "tables/sr_i_record_buffer_pool.h"

namespace {

struct metadata_deleter {
  void operator()(sr_table_metadata_t *p_metadata) const { sr_i_free_table_metadata(p_metadata); }
};
using metadata_ptr = std::unique_ptr<sr_table_metadata_t, metadata_deleter>;

struct table_closer {
  sr_i_table_t *p_table;
  ~table_closer() { sr_i_close_table(p_table); }
};

// The visible column of that exact name among the described ones, or -1: an
// invisible column cannot be renamed or given a new default.
int32_t find_visible_column(const sr_table_metadata_t &metadata, const char *p_name) {
  for (uint32_t column = 0; column < metadata.number_of_columns; ++column) {
    const sr_column_t &definition = metadata.column_definitions[column];
    if ((definition.qualifier & SR_INVISIBLE) == 0 && std::strcmp(definition.name, p_name) == 0) {
      return static_cast<int32_t>(column);
    }
  }
  return -1;
}

// Pool room for every row of `p_table` copied with the added columns of
// `p_new_table` (those past the old count) at their defaults.
int32_t make_room_for_rows(const sr_i_table_t *p_table, sr_i_table_t *p_new_table) {
  uint64_t added_per_row = 0;
  for (uint32_t column = p_table->total_columns; column < p_new_table->total_columns; ++column) {
    const sr_column_t &definition = p_new_table->p_columns[column];
    added_per_row += Sr_Row_Slot_Length;
    if (sr_i_is_variable_length(definition.type)) {
      added_per_row += sr_i_slot_anchor(&definition.default_value).length;
    }
  }
  const uint64_t room = p_table->record_buffer_pool.used_bytes +
                        uint64_t{p_table->total_committed_rows} * added_per_row;
  if (room > UINT32_MAX) {
    return sr_i_raise_no_memory();
  }
  return room == 0
             ? 0
             : sr_i_rb_make_room(&p_new_table->record_buffer_pool, static_cast<uint32_t>(room));
}

// The added columns of a widened row, the same for every row: their slots
// (a variable-length one's anchor still relative to the default bodies) and
// the default bodies back to back. A widened record is the old header word
// and slots, these slots, the old variable part, and these bodies, so the
// old anchors stay good and only the new ones move by the old variable
// part's length.
class row_widener {
 public:
  row_widener(const sr_i_table_t *p_table, sr_i_table_t *p_new_table)
      : p_table_(p_table), p_new_table_(p_new_table) {
    for (uint32_t column = p_table->total_columns; column < p_new_table->total_columns; ++column) {
      const sr_column_t &definition = p_new_table->p_columns[column];
      unsigned char slot[Sr_Row_Slot_Length];
      std::memcpy(slot, &definition.default_value, sizeof slot);
      if (sr_i_is_variable_length(definition.type)) {
        const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(slot);
        const unsigned char *p_body = sr_i_default_data(p_new_table) + anchor.offset;
        const qv_pmsg_value_anchor_t moved{static_cast<uint32_t>(bodies_.size()), anchor.length};
        std::memcpy(slot, &moved, sizeof moved);
        anchored_.push_back(static_cast<uint32_t>(slots_.size()));
        bodies_.insert(bodies_.end(), p_body, p_body + anchor.length);
      }
      slots_.insert(slots_.end(), slot, slot + sizeof slot);
    }
  }

  int32_t copy(const void *p_record) {
    const uint32_t old_fixed = sr_i_row_fixed_length(p_table_);
    const uint32_t old_length = sr_i_rb_record_header(const_cast<void *>(p_record))->record_length -
                                Sr_Record_Header_Length;
    const uint32_t variable = old_length - old_fixed;
    void *p_new_record = nullptr;
    if (const int32_t rc =
            sr_i_reserve_record(&p_new_table_->record_buffer_pool,
                                old_length + static_cast<uint32_t>(slots_.size() + bodies_.size()),
                                SR_I_RECORD_ROW, &p_new_record);
        rc != 0) {
      return rc;
    }
    auto *p_to = static_cast<unsigned char *>(p_new_record);
    const auto *p_from = static_cast<const unsigned char *>(p_record);
    std::memcpy(p_to, p_from, old_fixed);
    p_to += old_fixed;
    std::memcpy(p_to, slots_.data(), slots_.size());
    for (const uint32_t at : anchored_) {
      qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(p_to + at);
      anchor.offset += variable;
      std::memcpy(p_to + at, &anchor, sizeof anchor);
    }
    p_to += slots_.size();
    std::memcpy(p_to, p_from + old_fixed, variable);
    if (!bodies_.empty()) {
      std::memcpy(p_to + variable, bodies_.data(), bodies_.size());
    }
    p_record_ = p_new_record;
    return 0;
  }

  void *record() const { return p_record_; }

 private:
  const sr_i_table_t *p_table_;
  sr_i_table_t *p_new_table_;
  std::vector<unsigned char> slots_;
  std::vector<uint32_t> anchored_; /* where in slots_ the anchors are */
  std::vector<unsigned char> bodies_;
  void *p_record_ = nullptr;
};

// Copies every committed row of `p_table` into `p_new_table`, in packed
// order, widened by the added columns' defaults, then makes the new table's
// packed index and hash elements.
int32_t copy_rows(const sr_i_table_t *p_table, sr_i_table_t *p_new_table) {
  const bool widened = p_new_table->total_columns != p_table->total_columns;
  row_widener widener(p_table, p_new_table);
  for (uint32_t packed = 0; packed < p_table->total_committed_rows; ++packed) {
    const sr_i_index_entry_t &entry =
        p_table->p_rows_fixed_index[p_table->p_rows_packed_index[packed]];
    if (!widened) {
      if (const int32_t rc = sr_i_copy_row(p_table, entry.p_committed, p_new_table, nullptr);
          rc != 0) {
        return rc;
      }
      continue;
    }
    if (const int32_t rc = widener.copy(entry.p_committed); rc != 0) {
      return rc;
    }
    sr_i_index_entry_t *p_entry = sr_i_rows_free_chain_remove(p_new_table);
    if (p_entry == nullptr) {
      return sr_i_raise_internal();  // the index was sized for every row
    }
    p_entry->p_applied = widener.record();
    p_entry->p_committed = widener.record();
    ++p_new_table->total_applied_rows;
  }
  p_new_table->total_committed_rows = p_new_table->total_applied_rows;
  return sr_i_establish_secondary_row_access(p_new_table);
}

}  // namespace

int32_t sr_i_update_metadata(sr_i_table_t *p_table, const sr_column_t *p_new_columns,
                             uint32_t total_new_columns, const char *p_old_column_name,
                             const char *p_new_column_name, const qv_value_t *p_new_value,
                             sr_i_table_t **pp_result_table) {
  if (const int32_t rc = sr_i_check_rebuildable(p_table); rc != 0) {
    return rc;
  }
  sr_table_metadata_t *p_described = nullptr;
  if (const int32_t rc = sr_i_get_table_metadata(p_table, -1, &p_described); rc != 0) {
    return rc;
  }
  const metadata_ptr metadata(p_described);
  std::vector<sr_column_t> columns(metadata->column_definitions,
                                   metadata->column_definitions + metadata->number_of_columns);
  columns.insert(columns.end(), p_new_columns, p_new_columns + total_new_columns);
  if (p_old_column_name != nullptr) {
    const int32_t column = find_visible_column(*metadata, p_old_column_name);
    if (column < 0) {
      return sr_i_raise(SR_E_INVALID_COLUMN);
    }
    if (p_new_column_name != nullptr) {
      columns[column].name = const_cast<char *>(p_new_column_name);
    } else {
      columns[column].default_value = *p_new_value;
    }
  }
  sr_hash_table_t *p_hash_table = nullptr;
  if (const int32_t rc = sr_i_hash_table_open_like(p_table->p_rows_hash_table, &p_hash_table);
      rc != 0) {
    return rc;
  }
  sr_i_table_t *p_new_table = nullptr;
  if (const int32_t rc = sr_i_create_transient_table(
          p_table->p_tree, p_table->p_name, columns.data(), static_cast<uint32_t>(columns.size()),
          SR_MODE_WRITE, p_hash_table, &p_new_table, p_table->total_committed_rows);
      rc != 0) {
    return rc;
  }
  table_closer closer{p_new_table};
  if (const int32_t rc = make_room_for_rows(p_table, p_new_table); rc != 0) {
    return rc;
  }
  if (const int32_t rc = copy_rows(p_table, p_new_table); rc != 0) {
    return rc;
  }
  *pp_result_table = p_new_table;
  closer.p_table = nullptr;
  return 0;
}
