/*
 * sr_i_read_write_lock.h - the read-write lock of every tree and table: many
 * readers or one writer, readers preferred, neither recursive nor
 * upgradable, consistent and usable again when a waiting thread is
 * cancelled. Failures of the underlying pthread calls are raised as 10
 * naming the pthread function.
 */
#ifndef SR_I_READ_WRITE_LOCK_H
#define SR_I_READ_WRITE_LOCK_H

#include <pthread.h>

#include <atomic>
#include <cstdint>

/* One reader count on a cache line of its own, so that threads counting
 * themselves in different slots never write the same line. */
struct alignas(64) sr_i_reader_slot_t {
  std::atomic<int32_t> readers{0};
};

/*
 * Readers count themselves without the mutex, and a reader that finds no
 * writer writes only its own count: at first the lock's one count
 * (`readers`), and once two readers have been inside together, the slot of
 * its thread in `p_reader_slots`, one cache line per slot. A reader may
 * leave through another count than it came in by (the slots appear while
 * it reads); only the sum of all counts is the number of readers.
 *
 * A writer claims the lock under the mutex by setting `writer` and then
 * finding every count summed to 0; a reader counts itself first and then
 * looks at `writer`, so one of the two always sees the other. A reader that
 * sees a writer takes itself off again and waits under the mutex.
 */
typedef struct sr_i_read_write_lock_struct_t {
  pthread_mutex_t lock{};           /* guards the waiting counts and every wait */
  pthread_cond_t read_condition{};  /* readers wait here */
  pthread_cond_t write_condition{}; /* writers wait here */
  /* -1 while a writer holds the lock or, under the mutex, is claiming it;
   * 0 otherwise. Only a thread holding the mutex changes it. */
  std::atomic<int32_t> writer{0};
  /* The readers until the slots exist; after that, what is left of the
   * readers who came in before them. */
  std::atomic<int32_t> readers{0};
  /* Null until two readers are first inside together; then
   * sr_i_rw_reader_slot_count() slots, freed by sr_i_rw_close. */
  std::atomic<sr_i_reader_slot_t *> p_reader_slots{nullptr};
  int32_t waiting_readers = 0; /* readers waiting or about to wait */
  /* Counted up when a writer starts to wait and down only when its wait fails
   * or it is cancelled; no decision reads it, it is a record of demand. */
  int32_t waiting_writers = 0;
  /* Writers inside their wait loop right now: a reader leaving takes the
   * mutex to wake one only when this is not 0. */
  std::atomic<int32_t> blocked_writers{0};

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

/* The slots a lock gets once it is read by two threads at once: one per
 * processor online, at least one and at most 16. The same for the whole
 * process. */
uint32_t sr_i_rw_reader_slot_count();

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock);
void sr_i_rw_close(sr_i_read_write_lock_t *p_rwlock);
/* Each returns 0 or 10 (raised). */
int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock);
int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock);

/* The readers inside now: the sum of every count. Exact only while no
 * reader comes or goes; for checks and diagnostics. */
int32_t sr_i_rw_total_readers(const sr_i_read_write_lock_t *p_rwlock);

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
