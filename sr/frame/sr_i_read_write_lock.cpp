// sr_i_read_write_lock.cpp - the read-write lock of trees and tables, and the
// per-thread choice of the slot a reader counts itself in.
//
// A reader that finds no writer takes and leaves the lock with one atomic
// addition each way on a count no other thread writes once the lock has
// been read by two threads at once (see the header), so readers of one
// table on different processors do not pass a cache line between them. The
// mutex guards the waiting counts and every wait; readers wait on one
// condition, writers on another. Readers never wait for waiting writers,
// and a writer leaving wakes all waiting readers before any writer, so reads
// are never starved; a reader leaving while a writer waits wakes it to look
// again.
//
// A thread cancelled inside a wait runs a clean-up handler that takes it off
// the waiting counts and unlocks the mutex the condition wait re-acquired,
// so the lock stays usable by every other thread.

#include "frame/sr_i_read_write_lock.h"

#include <unistd.h>

#include <algorithm>
#include <bit>
#include <new>

#include "frame/sr_i_errors.h"

namespace {

constexpr long Maximum_Reader_Slots = 16;

// Live threads hold distinct small numbers, lowest free first, so that up to
// as many threads as there are slots count in different slots; a thread's
// number is given back when it ends, for the next thread to take. Past 64
// live threads, numbers are handed out in turn and shared.
constexpr uint32_t Reusable_Thread_Numbers = 64;
std::atomic<uint64_t> Thread_Numbers_In_Use{0};
std::atomic<uint32_t> Next_Shared_Thread_Number{Reusable_Thread_Numbers};

uint32_t take_thread_number() {
  uint64_t in_use = Thread_Numbers_In_Use.load(std::memory_order_relaxed);
  while (in_use != ~uint64_t{0}) {
    const int lowest_free = std::countr_one(in_use);
    if (Thread_Numbers_In_Use.compare_exchange_weak(in_use, in_use | (uint64_t{1} << lowest_free),
                                                    std::memory_order_relaxed)) {
      return static_cast<uint32_t>(lowest_free);
    }
  }
  return Next_Shared_Thread_Number.fetch_add(1, std::memory_order_relaxed);
}

struct thread_number_holder {
  uint32_t number = take_thread_number();
  ~thread_number_holder() {
    if (number < Reusable_Thread_Numbers) {
      Thread_Numbers_In_Use.fetch_and(~(uint64_t{1} << number), std::memory_order_relaxed);
    }
  }
};

// The slot of the calling thread, plus one; 0 until the thread first asks.
// It outlives the thread's number: a lock used by a thread-local destructor
// after the number was given back still counts in a valid slot.
[[gnu::tls_model("initial-exec")]] thread_local uint32_t This_Thread_Slot_Plus_One = 0;

uint32_t this_thread_slot() {
  if (This_Thread_Slot_Plus_One == 0) [[unlikely]] {
    thread_local thread_number_holder holder;
    This_Thread_Slot_Plus_One = holder.number % sr_i_rw_reader_slot_count() + 1;
  }
  return This_Thread_Slot_Plus_One - 1;
}

// The count the calling thread adds itself to or takes itself off.
std::atomic<int32_t> &reader_count(sr_i_read_write_lock_t *p_rwlock) {
  sr_i_reader_slot_t *p_slots = p_rwlock->p_reader_slots.load();
  return p_slots == nullptr ? p_rwlock->readers : p_slots[this_thread_slot()].readers;
}

// Gives the lock its slots, once two readers have been inside together.
// Without memory for them the readers go on sharing the lock's one count.
void spread_readers(sr_i_read_write_lock_t *p_rwlock) {
  auto *p_slots = new (std::nothrow) sr_i_reader_slot_t[sr_i_rw_reader_slot_count()]();
  if (p_slots == nullptr) {
    return;
  }
  sr_i_reader_slot_t *p_none = nullptr;
  if (!p_rwlock->p_reader_slots.compare_exchange_strong(p_none, p_slots)) {
    delete[] p_slots;  // another reader gave them first
  }
}

// The writer's claim, under the mutex: the lock becomes its own if no writer
// holds it and, once `writer` is set, every count sums to 0. Otherwise the
// claim is withdrawn; the readers it met wake the writer as they leave, and
// a reader that arrived meanwhile and backed off waits for the mutex, then
// finds the lock free.
bool try_take_for_writer(sr_i_read_write_lock_t *p_rwlock) {
  if (p_rwlock->writer.load() != 0 || sr_i_rw_total_readers(p_rwlock) != 0) {
    return false;
  }
  p_rwlock->writer.store(-1);
  if (sr_i_rw_total_readers(p_rwlock) == 0) {
    return true;
  }
  p_rwlock->writer.store(0);
  return false;
}

// Clean-up handlers of a thread cancelled inside a condition wait, which
// returns with the mutex held: the thread leaves the waiting counts and
// the mutex.
void leave_read_wait_when_cancelled(void *p_argument) {
  auto *p_rwlock = static_cast<sr_i_read_write_lock_t *>(p_argument);
  if (p_rwlock->waiting_readers != 0) {
    --p_rwlock->waiting_readers;
  }
  pthread_mutex_unlock(&p_rwlock->lock);
}

void leave_write_wait_when_cancelled(void *p_argument) {
  auto *p_rwlock = static_cast<sr_i_read_write_lock_t *>(p_argument);
  if (p_rwlock->waiting_writers != 0) {
    --p_rwlock->waiting_writers;
  }
  p_rwlock->blocked_writers.fetch_sub(1);
  pthread_mutex_unlock(&p_rwlock->lock);
}

}  // namespace

uint32_t sr_i_rw_reader_slot_count() {
  static const auto Slots =
      static_cast<uint32_t>(std::clamp(sysconf(_SC_NPROCESSORS_ONLN), 1L, Maximum_Reader_Slots));
  return Slots;
}

int32_t sr_i_rw_total_readers(const sr_i_read_write_lock_t *p_rwlock) {
  // Counts wrap as they will: a reader may come in by one and leave by
  // another, and only their sum means anything.
  auto total = static_cast<uint32_t>(p_rwlock->readers.load());
  if (const sr_i_reader_slot_t *p_slots = p_rwlock->p_reader_slots.load()) {
    for (uint32_t slot = 0; slot < sr_i_rw_reader_slot_count(); ++slot) {
      total += static_cast<uint32_t>(p_slots[slot].readers.load());
    }
  }
  return static_cast<int32_t>(total);
}

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock) {
  p_rwlock->writer.store(0);
  p_rwlock->readers.store(0);
  p_rwlock->p_reader_slots.store(nullptr);
  p_rwlock->waiting_readers = 0;
  p_rwlock->waiting_writers = 0;
  p_rwlock->blocked_writers.store(0);
  pthread_mutex_init(&p_rwlock->lock, nullptr);
  pthread_cond_init(&p_rwlock->read_condition, nullptr);
  pthread_cond_init(&p_rwlock->write_condition, nullptr);
}

void sr_i_rw_close(sr_i_read_write_lock_t *p_rwlock) {
  pthread_mutex_destroy(&p_rwlock->lock);
  pthread_cond_destroy(&p_rwlock->write_condition);
  pthread_cond_destroy(&p_rwlock->read_condition);
  delete[] p_rwlock->p_reader_slots.exchange(nullptr);
}

int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock) {
  // Counted first, then the writer looked at; a writer sets `writer` first,
  // then sums the counts. Both sequentially consistent, so of a reader and a
  // writer arriving together at least one sees the other.
  std::atomic<int32_t> &count = reader_count(p_rwlock);
  const int32_t readers_before = count.fetch_add(1);
  if (p_rwlock->writer.load() == 0) {
    if (readers_before > 0 && &count == &p_rwlock->readers) {
      spread_readers(p_rwlock);
    }
    return 0;
  }
  count.fetch_sub(1);

  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_readers;
  int wait_rc = 0;
  pthread_cleanup_push(leave_read_wait_when_cancelled, p_rwlock);
  while (p_rwlock->writer.load() != 0 && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_rwlock->read_condition, &p_rwlock->lock);
  }
  pthread_cleanup_pop(0);
  --p_rwlock->waiting_readers;
  if (wait_rc != 0) {
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  // Writers claim only under the mutex, so this count is seen by the next.
  reader_count(p_rwlock).fetch_add(1);
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock) {
  reader_count(p_rwlock).fetch_sub(1);
  if (p_rwlock->blocked_writers.load() == 0) {
    return 0;
  }
  // A writer waits for the readers it met to leave; it is woken to sum the
  // counts again. The mutex orders the signal after its wait began.
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  const int signal_rc = pthread_cond_signal(&p_rwlock->write_condition);
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  if (signal_rc != 0) {
    return sr_i_raise_system_call("pthread_cond_signal", signal_rc);
  }
  return 0;
}

int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock) {
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_writers;
  // Before any claim, so a reader leaving after the claim saw it knows to
  // wake this writer.
  p_rwlock->blocked_writers.fetch_add(1);
  int wait_rc = 0;
  pthread_cleanup_push(leave_write_wait_when_cancelled, p_rwlock);
  while (!try_take_for_writer(p_rwlock) && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_rwlock->write_condition, &p_rwlock->lock);
  }
  pthread_cleanup_pop(0);
  p_rwlock->blocked_writers.fetch_sub(1);
  if (wait_rc != 0) {
    --p_rwlock->waiting_writers;
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock) {
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  p_rwlock->writer.store(0);
  const bool wake_readers = p_rwlock->waiting_readers != 0;
  const int rc = wake_readers ? pthread_cond_broadcast(&p_rwlock->read_condition)
                              : pthread_cond_signal(&p_rwlock->write_condition);
  // The lock is free either way: readers may already have taken it, so a
  // failed wake is reported, not undone.
  if (rc != 0) {
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call(wake_readers ? "pthread_cond_broadcast" : "pthread_cond_signal",
                                  rc);
  }
  if (const int unlock_rc = pthread_mutex_unlock(&p_rwlock->lock); unlock_rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", unlock_rc);
  }
  return 0;
}
