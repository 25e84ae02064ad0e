// sr_i_transaction.cpp - apply, commit and abort of a table's changes in
// memory, and the implicit apply and commit of an implicitly controlled
// table.
//
// A pending change is a change entry on one of the table's two lists
// (additions and updates; deletions) pointing at its row's index entry.
// Apply only marks the table ready for commit: the rows' applied records
// are already what readers of uncommitted updates see. Commit makes each
// listed row's applied record its committed one, or, for a deleted row,
// frees the row and compacts the packed index; abort does the reverse.
//
// Every step writes a development trace record (kept only when development
// tracing is on) with the table's transaction state.

#include "rows/sr_i_transaction.h"

#include <pthread.h>

#include <cassert>
#include <cstdint>

#include "frame/sr_i_source_location.h"
#include "frame/sr_i_trace.h"
#include "rows/sr_i_rows.h"
#include "schema/sr_i_application_metadata.h"
#include "storage/sr_i_storage.h"
#include "storage/sr_i_table_file.h"
#include "tables/sr_i_hash_table.h"

namespace {

// The address as the records show it: its low 32 bits in hexadecimal.
unsigned int trace_address(const sr_i_table_t *p_table) {
  return static_cast<unsigned int>(reinterpret_cast<uintptr_t>(p_table));
}

// What the records show of a table's file; a transient table has none.
const sr_i_table_file_t &file_of(const sr_i_table_t *p_table) {
  static const sr_i_table_file_t No_File;
  return p_table->p_file != nullptr ? *p_table->p_file : No_File;
}

void trace_apply(const sr_i_table_t *p_table, uint32_t rewrite,
                 sr_i_source_location where = sr_i_source_location::current()) {
  const sr_i_table_file_t &file = file_of(p_table);
  tr_record_fmt_string_1(Sr_Trace_Component, TR_DEVELOPMENT_RECORD_ID,
                         "DV|APP|%.3d|%x|%u|%u|%u|%u|%u|%d|%d|%u", static_cast<int>(where.line()),
                         trace_address(p_table), p_table->ready_for_commit,
                         file.commit_record.offset, file.applied_commit_record.offset, file.length,
                         file.rewrite_length, file.fd, file.rewrite_fd, rewrite);
}

// Commit and abort records share their fields.
void trace_step(const char *p_step, const sr_i_table_t *p_table,
                sr_i_source_location where = sr_i_source_location::current()) {
  const sr_i_table_file_t &file = file_of(p_table);
  tr_record_fmt_string_1(
      Sr_Trace_Component, TR_DEVELOPMENT_RECORD_ID, "DV|%s|%.3d|%x|%u|%u|%u|%u|%u|%d|%d", p_step,
      static_cast<int>(where.line()), trace_address(p_table), p_table->ready_for_commit,
      file.commit_record.offset, file.applied_commit_record.offset, file.length,
      file.rewrite_length, file.fd, file.rewrite_fd);
}

// Takes a row whose change is undone or whose deletion is committed out of
// the hash table, the packed index and the row index.
void free_row(sr_i_table_t *p_table, sr_i_index_entry_t *p_entry) {
  if (p_table->p_rows_hash_table != nullptr && p_entry->p_hash_table_element != nullptr) {
    sr_i_hash_table_remove_element(p_table->p_rows_hash_table, p_entry->hash_index,
                                   p_entry->p_hash_table_element);
  }
  sr_i_remove_from_packed_index(p_table, p_entry->packed_index);
  sr_i_rows_free_chain_insert(p_table, p_entry);
}

void release_record(sr_i_table_t *p_table, void *p_record) {
  if (p_record != nullptr) {
    sr_i_rb_free_record(&p_table->record_buffer_pool, p_record);
  }
}

// The settled end of commit and abort: no change entries, nothing applied.
void settle(sr_i_table_t *p_table) {
  sr_i_free_change_lists(p_table);
  p_table->applied_deletions = 0;
  p_table->ready_for_commit = Sr_Nothing_Applied;
}

// Commit must not be cut short by a thread cancellation halfway through;
// this holds cancellation off for one scope.
class cancellation_held_off {
 public:
  cancellation_held_off() {
    [[maybe_unused]] const int pthread_rc = pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &old_);
    assert(pthread_rc == 0);
  }
  ~cancellation_held_off() {
    [[maybe_unused]] const int pthread_rc = pthread_setcancelstate(old_, nullptr);
    assert(pthread_rc == 0);
  }
  cancellation_held_off(const cancellation_held_off &) = delete;
  cancellation_held_off &operator=(const cancellation_held_off &) = delete;

 private:
  int old_ = PTHREAD_CANCEL_ENABLE;
};

// After a rewrite every row lies somewhere new in the file, not only the
// changed ones.
void take_rewritten_offsets(sr_i_table_t *p_table) {
  uint32_t seen = 0;
  for (uint32_t position = 0;
       position < p_table->maximum_rows && seen < p_table->total_committed_rows; ++position) {
    sr_i_index_entry_t &entry = p_table->p_rows_fixed_index[position];
    if (entry.p_committed == nullptr) {
      continue;
    }
    ++seen;
    if (entry.applied_file_offset != 0) {
      entry.file_offset = entry.applied_file_offset;
      entry.applied_file_offset = 0;
    }
  }
}

}  // namespace

int32_t sr_i_apply(sr_i_table_t *p_table, uint32_t rewrite, uint64_t change_counter) {
  if (p_table->ready_for_commit != Sr_Nothing_Applied) {
    trace_apply(p_table, rewrite);
    return sr_i_raise(SR_E_APPLIED_UNCOMMITTED);
  }
  p_table->applied_change_counter = (change_counter == 0 || p_table->implicitly_controlled != 0)
                                        ? p_table->change_counter + 1
                                        : change_counter;
  uint32_t applied = Sr_Applied_In_Place;
  int32_t rc = 0;
  if (p_table->p_file != nullptr) {
    // A failed append leaves bytes behind the live commit record, where no
    // reader looks and the next apply writes over them; a failed rewrite
    // removes its file itself.
    rc = sr_i_apply_to_file(p_table, rewrite, &applied);
  }
  if (rc == 0) {
    p_table->ready_for_commit = applied;
  }
  trace_apply(p_table, rewrite);
  return rc;
}

int32_t sr_i_commit_in_memory(sr_i_table_t *p_table, sr_i_change_entry_t *p_first) {
  for (sr_i_change_entry_t *p_change = p_first; p_change != nullptr; p_change = p_change->p_next) {
    sr_i_index_entry_t *p_entry = p_change->p_index_entry;
    if (p_entry->p_applied == nullptr) {
      release_record(p_table, p_entry->p_committed);
      p_entry->p_committed = nullptr;
      free_row(p_table, p_entry);
      continue;
    }
    if (p_entry->p_committed != p_entry->p_applied) {
      release_record(p_table, p_entry->p_committed);
      p_entry->p_committed = p_entry->p_applied;
      if (p_entry->p_hash_table_element != nullptr) {
        p_entry->p_hash_table_element->p_key_value = sr_i_row_key(p_table, p_entry->p_applied);
      }
    }
    p_entry->file_offset = p_entry->applied_file_offset;
    p_entry->applied_file_offset = 0;
    p_entry->p_pending_change = nullptr;
  }
  return 0;
}

int32_t sr_i_abort_in_memory(sr_i_table_t *p_table, sr_i_change_entry_t *p_first) {
  for (sr_i_change_entry_t *p_change = p_first; p_change != nullptr; p_change = p_change->p_next) {
    sr_i_index_entry_t *p_entry = p_change->p_index_entry;
    if (p_entry->p_committed == nullptr) {
      release_record(p_table, p_entry->p_applied);
      p_entry->p_applied = nullptr;
      free_row(p_table, p_entry);
      continue;
    }
    if (p_entry->p_applied != p_entry->p_committed) {
      release_record(p_table, p_entry->p_applied);
    }
    p_entry->p_applied = p_entry->p_committed;
    p_entry->applied_file_offset = 0;
    p_entry->p_pending_change = nullptr;
  }
  return 0;
}

int32_t sr_i_commit(sr_i_table_t *p_table) {
  trace_step("COM", p_table);
  if (p_table->ready_for_commit == Sr_Nothing_Applied) {
    if (p_table->p_rows_change_list == nullptr && p_table->p_delete_rows_change_list == nullptr) {
      return 0;
    }
    return sr_i_raise(SR_E_NOT_APPLIED);
  }
  cancellation_held_off no_cancellation;
  const bool rewritten = p_table->ready_for_commit == Sr_Applied_By_Rewrite;
  int32_t rc = 0;
  if (p_table->p_file != nullptr) {
    bool file_committed = false;
    rc = sr_i_commit_file(p_table, p_table->ready_for_commit, &file_committed);
    if (!file_committed) {
      trace_step("COM", p_table);
      return rc;
    }
  }
  // From here the new state is the file's (a failure is one of making it
  // durable), so memory follows it whatever the code.
  sr_i_commit_in_memory(p_table, p_table->p_rows_change_list);
  sr_i_commit_in_memory(p_table, p_table->p_delete_rows_change_list);
  p_table->change_counter = p_table->applied_change_counter;
  p_table->total_committed_rows = p_table->total_applied_rows;
  if (rewritten) {
    take_rewritten_offsets(p_table);
  }
  sr_i_commit_application_metadata_buffer_updates(p_table->p_application_metadata);
  settle(p_table);
  trace_step("COM", p_table);
  return rc;
}

int32_t sr_i_abort(sr_i_table_t *p_table) {
  trace_step("ABT", p_table);
  if (p_table->p_file != nullptr) {
    sr_i_abort_file(p_table, p_table->ready_for_commit);
  }
  sr_i_abort_in_memory(p_table, p_table->p_rows_change_list);
  sr_i_abort_in_memory(p_table, p_table->p_delete_rows_change_list);
  sr_i_abort_application_metadata_buffer_updates(p_table->p_application_metadata);
  settle(p_table);
  trace_step("ABT", p_table);
  return 0;
}

int32_t sr_i_apply_and_commit_implicitly(sr_i_table_t *p_table) {
  if (const int32_t rc = sr_i_apply(p_table, sr_i_rewrite_wanted(p_table), 0); rc != 0) {
    sr_i_abort(p_table);
    return rc;
  }
  return sr_i_commit(p_table);
}
