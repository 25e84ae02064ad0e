/*
 * sr_i_frame.h - the frame every exported function runs in:
 *
 *   1. fork guard: a call that changes state returns 15 at once in a forked
 *      child, with no message, no trace and no lock;
 *   2. entry trace record;
 *   3. ForkMutex for calls that change state, held to the end, so that all
 *      changing calls of the process run one at a time;
 *   4-8. the body: handle checks, the tree or table lock (by guard), the
 *      internal call; locks released in reverse order, then ForkMutex;
 *   9. on success the thread's error information is cleared;
 *   10. exit trace record with the code.
 *
 * No C++ exception leaves the frame: std::bad_alloc becomes 12, anything else
 * 15, each raised with the entry point as the raising site. A thread
 * cancelled inside the body unwinds through the frame untouched.
 */
#ifndef SR_I_FRAME_H
#define SR_I_FRAME_H

#include <pthread.h>

#include <cxxabi.h>
#include <atomic>
#include <cstdint>
#include <new>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_source_location.h"
#include "frame/sr_i_trace.h"
#include "qv_cu.h"
#include "qv_sr.h"

/* What the frame needs to know of an exported function. */
struct sr_i_entry_point_t {
  uint32_t trace_id;  /* entry record; the exit record is trace_id + 1 */
  bool changes_state; /* fork guard and ForkMutex */
};

/* Serialises the calls that change state; statically initialised. */
extern pthread_mutex_t ForkMutex;
/* 1 in a child process forked after the fork handler was installed. */
extern std::atomic<int> In_Child_Process;

/* Installs, once per process, the fork handler that marks forked children. */
void sr_i_establish_fork_handlers();

inline bool sr_i_in_child_process() {
  return In_Child_Process.load(std::memory_order_relaxed) != 0;
}

/* Holds ForkMutex for the calls that change state (its result, like a
 * default mutex's, is not checked). */
class sr_i_fork_mutex_guard {
 public:
  explicit sr_i_fork_mutex_guard(bool take) : taken_(take) {
    if (taken_) {
      pthread_mutex_lock(&ForkMutex);
    }
  }
  ~sr_i_fork_mutex_guard() {
    if (taken_) {
      pthread_mutex_unlock(&ForkMutex);
    }
  }
  sr_i_fork_mutex_guard(const sr_i_fork_mutex_guard &) = delete;
  sr_i_fork_mutex_guard &operator=(const sr_i_fork_mutex_guard &) = delete;

 private:
  bool taken_;
};

/*
 * Runs `body` (a callable returning the int32_t code) in the frame of the
 * exported function described by `entry`, and returns the code.
 */
template <typename Body>
int32_t sr_i_run_entry_point(const sr_i_entry_point_t &entry, Body &&body,
                             sr_i_source_location where = sr_i_source_location::current()) {
  if (entry.changes_state && sr_i_in_child_process()) {
    return SR_E_INTERNAL;
  }
  if (sr_i_trace_on(SR_I_TRACE_API)) {
    tr_record_id_1(Sr_Trace_Component, entry.trace_id);
  }
  int32_t rc;
  {
    sr_i_fork_mutex_guard fork_mutex(entry.changes_state);
    try {
      rc = body();
    } catch (const std::bad_alloc &) {
      rc = sr_i_raise_no_memory(where);
    } catch (const abi::__forced_unwind &) {
      throw;  // thread cancellation: let it unwind
    } catch (...) {
      rc = sr_i_raise_internal(where);
    }
  }
  if (rc == 0) {
    cu_set_no_error_1();
  }
  if (sr_i_trace_on(SR_I_TRACE_API)) {
    tr_record_values_32_1(Sr_Trace_Component, entry.trace_id + 1, 1, static_cast<uint32_t>(rc));
  }
  return rc;
}

#endif /* SR_I_FRAME_H */
