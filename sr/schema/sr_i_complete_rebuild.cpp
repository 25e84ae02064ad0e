// sr_i_complete_rebuild.cpp - the end every rebuilding schema change shares:
// the check that nothing is on the way, making the rebuilt image durable,
// and the exchange of images that lets every handle see it at once.
//
// A persistent table's rebuilt image is written as a complete new file
// beside the table file and renamed over it (the apply-by-rewrite and
// commit of any transaction), through the rebuilt object: it borrows the
// open table's path and descriptor for the length of the write. A crash
// before the rename leaves the old file, which the next open finds whole;
// after it, the new one.

#include <utility>

#include "frame/sr_i_errors.h"
#include "rows/sr_i_transaction.h"
#include "schema/sr_i_application_metadata.h"
#include "schema/sr_i_schema_changes.h"
#include "storage/sr_i_table_file.h"

namespace {

// Gives the rebuilt table the open table's file: its path, its descriptor
// (and with it the file's lock), and where its commit record lies, and for
// the commit record it writes, a copy of the committed application
// metadata. Pending metadata of the open table stays pending there.
int32_t lend_file(const sr_i_table_t *p_table, sr_i_table_t *p_new_table) {
  const sr_i_table_file_t &file = *p_table->p_file;
  if (const int32_t rc = sr_i_attach_table_file(p_new_table, file.path.c_str(), nullptr); rc != 0) {
    return rc;
  }
  sr_i_table_file_t &lent = *p_new_table->p_file;
  lent.fd = file.fd;
  lent.length = file.length;
  lent.commit_record = file.commit_record;
  lent.applied_commit_record = file.commit_record;
  sr_i_application_metadata_t *p_committed_metadata = nullptr;
  if (const int32_t rc = sr_i_duplicate_application_metadata_buffer(p_table->p_application_metadata,
                                                                    &p_committed_metadata);
      rc != 0) {
    return rc;
  }
  sr_i_free_application_metadata(
      std::exchange(p_new_table->p_application_metadata, p_committed_metadata));
  p_new_table->block_size = p_table->block_size;
  p_new_table->change_counter = p_table->change_counter;
  return 0;
}

// Writes the rebuilt image as the table's file. Returns whether the file
// now holds it (possibly with a failure to make the rename durable, in the
// code); when it does not, the rewrite file is gone and the old file is
// the table's as before.
bool write_rebuilt_file(sr_i_table_t *p_new_table, int32_t &rc) {
  rc = sr_i_apply(p_new_table, 1, 0);
  if (rc != 0) {
    return false;
  }
  rc = sr_i_commit(p_new_table);
  if (p_new_table->ready_for_commit == Sr_Nothing_Applied) {
    return true;
  }
  sr_i_abort(p_new_table);
  return false;
}

}  // namespace

int32_t sr_i_check_rebuildable(const sr_i_table_t *p_table) {
  if ((p_table->mode & Sr_Mode_Writable) == 0) {
    return sr_i_raise(SR_E_ACCESS);
  }
  if (p_table->ready_for_commit != Sr_Nothing_Applied || p_table->p_rows_change_list != nullptr ||
      p_table->p_delete_rows_change_list != nullptr) {
    return sr_i_raise(SR_E_UNCOMMITTED);
  }
  return 0;
}

void sr_i_swap_after_metadata_update(sr_i_table_t *p_table, sr_i_table_t *p_new_table) {
  sr_i_table_t &a = *p_table;
  sr_i_table_t &b = *p_new_table;
  std::swap(a.p_metadata_record_data, b.p_metadata_record_data);
  std::swap(a.p_columns, b.p_columns);
  std::swap(a.total_columns, b.total_columns);
  std::swap(a.total_variable_length_columns, b.total_variable_length_columns);
  std::swap(a.maximum_rows, b.maximum_rows);
  std::swap(a.total_applied_rows, b.total_applied_rows);
  std::swap(a.total_committed_rows, b.total_committed_rows);
  std::swap(a.p_rows_fixed_index, b.p_rows_fixed_index);
  // The packed index and the never-used mark describe the row index they
  // came with; left behind, they would point into the other image.
  std::swap(a.p_rows_packed_index, b.p_rows_packed_index);
  std::swap(a.p_rows_never_used, b.p_rows_never_used);
  std::swap(a.p_rows_free_chain, b.p_rows_free_chain);
  std::swap(a.change_counter, b.change_counter);
  std::swap(a.applied_change_counter, b.applied_change_counter);
  // The file bookkeeping goes with the image it describes: after a
  // rewrite, the descriptor, the length and the commit record's place are
  // the new file's.
  std::swap(a.p_file, b.p_file);
  std::swap(a.record_buffer_pool, b.record_buffer_pool);
  std::swap(a.p_rows_hash_table, b.p_rows_hash_table);
}

int32_t sr_i_complete_rebuild(sr_i_table_t *p_table, sr_i_table_t *p_new_table) {
  int32_t rc = 0;
  if (p_table->p_file != nullptr) {
    rc = lend_file(p_table, p_new_table);
    const bool replaced = rc == 0 && write_rebuilt_file(p_new_table, rc);
    if (!replaced) {
      if (p_new_table->p_file != nullptr) {
        p_new_table->p_file->fd = -1;  // still the open table's
      }
      sr_i_close_table(p_new_table);
      return rc;
    }
    // The commit closed the old file's descriptor and kept the new file's:
    // the old bookkeeping, going out with the old image, must close
    // nothing.
    sr_i_swap_after_metadata_update(p_table, p_new_table);
    p_new_table->p_file->fd = -1;
  } else {
    p_new_table->change_counter = p_table->change_counter + 1;
    p_new_table->applied_change_counter = p_new_table->change_counter;
    sr_i_swap_after_metadata_update(p_table, p_new_table);
  }
  sr_i_close_table(p_new_table);
  return rc;
}
