/*
 * sr_i_read_write_lock.h - the read-write lock of every tree and table: many
 * readers or one writer, readers preferred, neither recursive nor
 * upgradable, consistent and usable again when a waiting thread is
 * cancelled. Failures of the underlying pthread calls are raised as 10
 * naming the pthread function.
 *
 * A lock is a few counters; what is heavy lives once in the process and is
 * shared by every lock (sr_i_read_write_lock.cpp): the place where threads
 * wait (a mutex and two conditions, chosen by the lock's address) and the
 * readers' marks (one cache line per live thread, where a reader writes
 * the address of each lock it holds).
 */
#ifndef SR_I_READ_WRITE_LOCK_H
#define SR_I_READ_WRITE_LOCK_H

#include <pthread.h>

#include <atomic>
#include <cstdint>

/*
 * A reader that finds no writer marks itself in its own thread's line
 * (nothing another thread writes) and then looks at `lock_count`; a thread
 * with no line or no free mark in it counts itself in `lock_count` instead.
 * The readers inside are `lock_count` (when not -1) plus the marks holding
 * the lock's address.
 *
 * A writer claims the lock under its waiting place's mutex by turning
 * `lock_count` from 0 to -1 and then finding no mark of the lock; a reader
 * marks itself first and then looks at `lock_count`, so one of the two
 * always sees the other. A reader that sees -1 takes its mark off again
 * and waits.
 */
typedef struct sr_i_read_write_lock_struct_t {
  /* -1 while a writer holds the lock or, under the mutex, is claiming it;
   * otherwise the readers counted here rather than by a mark. Only a thread
   * holding the mutex sets -1 or leaves it. */
  std::atomic<int32_t> lock_count{0};
  /* Writers inside their wait loop right now: a reader leaving takes the
   * mutex to wake them only when this is not 0. */
  std::atomic<int32_t> blocked_writers{0};
  int32_t waiting_readers = 0; /* readers waiting or about to wait; under the mutex */
  /* Counted up when a writer starts to wait and down only when its wait fails
   * or it is cancelled; no decision reads it, it is a record of demand. */
  int32_t waiting_writers = 0;

  sr_i_read_write_lock_struct_t() = default;
  /* A lock belongs to the place it is in, not to the contents of the object
   * around it: a table whose contents are replaced (sr_i_swap_table_contents)
   * keeps its lock, held by the writer doing it, while readers may be
   * counting themselves in it. So copying a lock copies nothing: a copy is
   * a lock never opened, and assigning leaves the target as it was. */
  sr_i_read_write_lock_struct_t(const sr_i_read_write_lock_struct_t &)
      : sr_i_read_write_lock_struct_t() {}
  sr_i_read_write_lock_struct_t &operator=(const sr_i_read_write_lock_struct_t &) { return *this; }
} sr_i_read_write_lock_t;

/* Where the threads of a lock wait: shared by every lock whose address
 * leads to it, so a wake-up may be for another lock and every waiter looks
 * at its own lock again before it goes on. */
typedef struct sr_i_rw_waiting_place_struct_t {
  /* Initialised in the constant image of the program, so a lock works
   * from the first static constructor on and nothing can fail to start. */
  pthread_mutex_t lock = PTHREAD_MUTEX_INITIALIZER; /* guards the waiting counts and every wait */
  pthread_cond_t read_condition = PTHREAD_COND_INITIALIZER;  /* readers wait here */
  pthread_cond_t write_condition = PTHREAD_COND_INITIALIZER; /* writers wait here */
} sr_i_rw_waiting_place_t;

/* The waiting place of a lock: always the same one for the same address. */
sr_i_rw_waiting_place_t *sr_i_rw_waiting_place(const sr_i_read_write_lock_t *p_rwlock);

/* In a forked child only, from its fork handler: every waiting place made
 * new. The child is a copy of the forking thread alone, so a place's mutex
 * that another thread held at the fork, for whatever lock, would otherwise
 * stay held for ever, and nobody waits in the child yet. */
void sr_i_rw_renew_waiting_places_in_child();

/* Opening zeroes the counters; closing has nothing to give back. Both are a
 * few stores, since tables are made and freed often. */
void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock);
void sr_i_rw_close(sr_i_read_write_lock_t *p_rwlock);
/* Each returns 0 or 10 (raised). */
int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock);

/* The readers inside now: `lock_count` (unless a writer holds it) and every
 * mark of the lock. Exact only while no reader comes or goes; for checks
 * and diagnostics. */
int32_t sr_i_rw_total_readers(const sr_i_read_write_lock_t *p_rwlock);

/* The readers of the lock counted by a mark in the calling thread's line:
 * 0 for a thread that has none. For checks. */
int32_t sr_i_rw_marks_of_this_thread(const sr_i_read_write_lock_t *p_rwlock);

/*
 * Holds a read-write lock for one scope:
 *   sr_i_write_guard guard(&tree->lock);
 *   if (guard.result() != 0) return guard.result();
 * The destructor releases the lock if it was taken and not yet released;
 * release() does so early and returns the unlock's code.
 */
template <int32_t (*Lock)(sr_i_read_write_lock_t *), int32_t (*Unlock)(sr_i_read_write_lock_t *)>
class sr_i_lock_guard {
 public:
  explicit sr_i_lock_guard(sr_i_read_write_lock_t *p_rwlock)
      : p_rwlock_(p_rwlock), result_(Lock(p_rwlock)) {}
  ~sr_i_lock_guard() { release(); }
  sr_i_lock_guard(const sr_i_lock_guard &) = delete;
  sr_i_lock_guard &operator=(const sr_i_lock_guard &) = delete;

  int32_t result() const { return result_; }

  int32_t release() {
    if (result_ != 0 || p_rwlock_ == nullptr) {
      return 0;
    }
    sr_i_read_write_lock_t *p_rwlock = p_rwlock_;
    p_rwlock_ = nullptr;
    return Unlock(p_rwlock);
  }

 private:
  sr_i_read_write_lock_t *p_rwlock_;
  int32_t result_;
};

using sr_i_read_guard = sr_i_lock_guard<sr_i_rw_lock_read, sr_i_rw_unlock_read>;
using sr_i_write_guard = sr_i_lock_guard<sr_i_rw_lock_write, sr_i_rw_unlock_write>;

#endif /* SR_I_READ_WRITE_LOCK_H */
