// sr_i_read_write_lock.cpp - the read-write lock of trees and tables.
//
// The holder count is atomic: a reader takes and leaves a lock no writer
// holds with one compare-and-swap or one decrement, without the mutex. The
// mutex guards the waiting counts and every wait; readers wait on one
// condition, writers on another. Readers never wait for waiting writers,
// and a writer leaving wakes all waiting readers before any writer, so reads
// are never starved; the last reader out wakes one blocked writer.
//
// A thread cancelled inside a wait runs a clean-up handler that takes it off
// the waiting count. The condition wait has then re-acquired the mutex and
// the handler leaves it held: cancelling a thread that waits for a registry
// lock is not supported, only kept from corrupting the counters.

#include "frame/sr_i_read_write_lock.h"

#include "frame/sr_i_errors.h"

namespace {

void decrement_readers_if_thread_cancelled(void *p_argument) {
  auto *p_rwlock = static_cast<sr_i_read_write_lock_t *>(p_argument);
  if (p_rwlock->waiting_readers != 0) {
    --p_rwlock->waiting_readers;
  }
}

void decrement_writers_if_thread_cancelled(void *p_argument) {
  auto *p_rwlock = static_cast<sr_i_read_write_lock_t *>(p_argument);
  if (p_rwlock->waiting_writers != 0) {
    --p_rwlock->waiting_writers;
  }
  p_rwlock->blocked_writers.fetch_sub(1);
}

// One more reader, unless a writer holds the lock.
bool try_add_reader(sr_i_read_write_lock_t *p_rwlock) {
  int32_t count = p_rwlock->lock_count.load(std::memory_order_relaxed);
  while (count >= 0) {
    if (p_rwlock->lock_count.compare_exchange_weak(count, count + 1, std::memory_order_acquire,
                                                   std::memory_order_relaxed)) {
      return true;
    }
  }
  return false;
}

// The writer's claim: a free lock becomes held by it. Sequentially
// consistent, with the blocked-writer count, so that a reader leaving at the
// same moment either lets this succeed or sees the writer blocked.
bool try_take_for_writer(sr_i_read_write_lock_t *p_rwlock) {
  int32_t expected = 0;
  return p_rwlock->lock_count.compare_exchange_strong(expected, -1);
}

}  // namespace

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock) {
  p_rwlock->lock_count.store(0);
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
}

int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock) {
  if (try_add_reader(p_rwlock)) {
    return 0;
  }
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_readers;
  int wait_rc = 0;
  pthread_cleanup_push(decrement_readers_if_thread_cancelled, p_rwlock);
  // A writer releases the lock only under the mutex, so the release cannot
  // fall between this check and the wait.
  while (!try_add_reader(p_rwlock) && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_rwlock->read_condition, &p_rwlock->lock);
  }
  pthread_cleanup_pop(0);
  --p_rwlock->waiting_readers;
  if (wait_rc != 0) {
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock) {
  if (p_rwlock->lock_count.fetch_sub(1) != 1 || p_rwlock->blocked_writers.load() == 0) {
    return 0;
  }
  // The last reader out wakes a blocked writer. The mutex orders the signal
  // after the writer's wait began.
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
  p_rwlock->blocked_writers.fetch_add(1);
  int wait_rc = 0;
  pthread_cleanup_push(decrement_writers_if_thread_cancelled, p_rwlock);
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
  p_rwlock->lock_count.store(0, std::memory_order_release);
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
