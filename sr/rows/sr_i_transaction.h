/*
 * sr_i_transaction.h - the life of a change: pending (on the table's change
 * lists), applied (`ready_for_commit` set; further updates refused with 212),
 * committed. Apply, commit and abort, and the step every changing call of an
 * implicitly controlled table ends with: apply and commit at once, or abort
 * when the apply fails.
 *
 * All of it runs under the table's write lock.
 */
#ifndef SR_I_TRANSACTION_H
#define SR_I_TRANSACTION_H

#include <cstdint>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_read_write_lock.h"
#include "qv_sr.h"
#include "tables/sr_i_table.h"

/* Moves the pending changes to applied. `change_counter` 0, or any value on
 * an implicitly controlled table, means the committed counter plus 1.
 * 212 when changes are applied already (raised). */
int32_t sr_i_apply(sr_i_table_t *p_table, uint32_t rewrite, uint64_t change_counter);

/* Makes the applied changes committed. 0 with nothing applied and nothing
 * pending; 210 (raised) with pending changes not applied. */
int32_t sr_i_commit(sr_i_table_t *p_table);

/* Throws away pending and applied changes. */
int32_t sr_i_abort(sr_i_table_t *p_table);

/* Commits or aborts one change list in memory. Return 0. */
int32_t sr_i_commit_in_memory(sr_i_table_t *p_table, sr_i_change_entry_t *p_first);
int32_t sr_i_abort_in_memory(sr_i_table_t *p_table, sr_i_change_entry_t *p_first);

/* After a successful change of an implicitly controlled table: apply and
 * commit, or abort and return the apply's code. */
int32_t sr_i_apply_and_commit_implicitly(sr_i_table_t *p_table);

/* The common body of the calls that change a table in any way: 100 for a
 * null handle, the table's write lock, then `body(p_table)` under it. */
template <typename Body>
int32_t sr_i_with_table_locked_for_writing(sr_opaque_handle_t table_handle, Body &&body) {
  if (table_handle == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  auto *p_table = static_cast<sr_i_table_t *>(table_handle);
  sr_i_write_guard table_lock(&p_table->lock);
  if (table_lock.result() != 0) {
    return table_lock.result();
  }
  return body(p_table);
}

/* sr_i_with_table_locked_for_writing for the calls that act on a table
 * opened for writing: 206 unless it is. */
template <typename Body>
int32_t sr_i_with_writable_table(sr_opaque_handle_t table_handle, Body &&body) {
  return sr_i_with_table_locked_for_writing(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
    if ((p_table->mode & Sr_Mode_Writable) == 0) {
      return sr_i_raise(SR_E_ACCESS);
    }
    return body(p_table);
  });
}

/* sr_i_with_writable_table for a change of rows or metadata: a success on
 * an implicitly controlled table is applied and committed before the lock
 * is released. */
template <typename Change>
int32_t sr_i_change_table(sr_opaque_handle_t table_handle, Change &&change) {
  return sr_i_with_writable_table(table_handle, [&](sr_i_table_t *p_table) -> int32_t {
    const int32_t rc = change(p_table);
    if (rc != 0 || p_table->implicitly_controlled == 0) {
      return rc;
    }
    return sr_i_apply_and_commit_implicitly(p_table);
  });
}

/* The common body of the calls that read a table: 100 for a null handle,
 * the table's read lock, then `read(p_table)`. */
template <typename Read>
int32_t sr_i_read_table(sr_opaque_handle_t table_handle, Read &&read) {
  if (table_handle == nullptr) {
    return sr_i_raise(SR_E_INVALID_HANDLE);
  }
  auto *p_table = static_cast<sr_i_table_t *>(table_handle);
  sr_i_read_guard table_lock(&p_table->lock);
  if (table_lock.result() != 0) {
    return table_lock.result();
  }
  return read(p_table);
}

#endif /* SR_I_TRANSACTION_H */
