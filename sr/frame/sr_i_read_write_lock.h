/*
 * sr_i_read_write_lock.h - the read-write lock of every tree and table: many
 * readers or one writer, readers preferred, neither recursive nor
 * upgradable, consistent when a waiting thread is cancelled. Failures of the
 * underlying pthread calls are raised as 10 naming the pthread function.
 */
#ifndef SR_I_READ_WRITE_LOCK_H
#define SR_I_READ_WRITE_LOCK_H

#include <pthread.h>

#include <atomic>
#include <cstdint>

/*
 * Readers take and leave the lock with one atomic operation on lock_count
 * while no writer holds it; the mutex is taken only to wait, to wake, and by
 * writers. A writer changes lock_count from 0 to -1 under the mutex, so a
 * reader that waits (under the mutex) cannot miss the writer's release.
 */
typedef struct sr_i_read_write_lock_struct_t {
  pthread_mutex_t lock;            /* guards the waiting counts and the waits */
  pthread_cond_t read_condition;   /* readers wait here */
  pthread_cond_t write_condition;  /* writers wait here */
  std::atomic<int32_t> lock_count; /* 0 free, n > 0 readers, -1 a writer */
  int32_t waiting_readers;         /* readers waiting or about to wait */
  /* Counted up when a writer starts to wait and down only when its wait fails
   * or it is cancelled; no decision reads it, it is a record of demand. */
  int32_t waiting_writers;
  /* Writers inside their wait loop right now: the last reader out takes the
   * mutex to wake one only when this is not 0. */
  std::atomic<int32_t> blocked_writers;

  sr_i_read_write_lock_struct_t() = default;
  /* A table object swaps its whole contents with another and then swaps
   * the two locks back (sr_i_swap_table_contents), so a lock is only ever
   * copied to be put back where it was, with no thread waiting on it. */
  sr_i_read_write_lock_struct_t(const sr_i_read_write_lock_struct_t &other) { *this = other; }
  sr_i_read_write_lock_struct_t &operator=(const sr_i_read_write_lock_struct_t &other) {
    lock = other.lock;
    read_condition = other.read_condition;
    write_condition = other.write_condition;
    lock_count.store(other.lock_count.load());
    waiting_readers = other.waiting_readers;
    waiting_writers = other.waiting_writers;
    blocked_writers.store(other.blocked_writers.load());
    return *this;
  }
} sr_i_read_write_lock_t;

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock);
void sr_i_rw_close(sr_i_read_write_lock_t *p_rwlock);
/* Each returns 0 or 10 (raised). */
int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock);

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
