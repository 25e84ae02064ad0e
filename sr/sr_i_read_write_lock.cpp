// sr_i_read_write_lock.cpp - the read-write lock of trees and tables.
//
// A mutex guards three counters; readers wait on one condition, writers on
// another. Readers never wait for waiting writers, and a writer leaving
// wakes all waiting readers before any writer, so reads are never starved;
// the last reader out wakes one writer.
//
// A thread cancelled inside a wait runs a clean-up handler that takes it off
// the waiting count. The condition wait has then re-acquired the mutex and
// the handler leaves it held: cancelling a thread that waits for a registry
// lock is not supported, only kept from corrupting the counters.

#include "sr_i_read_write_lock.h"

#include "sr_i_errors.h"

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
}

}  // namespace

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock) {
  p_rwlock->lock_count = 0;
  p_rwlock->waiting_readers = 0;
  p_rwlock->waiting_writers = 0;
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
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_readers;
  int wait_rc = 0;
  pthread_cleanup_push(decrement_readers_if_thread_cancelled, p_rwlock);
  while (p_rwlock->lock_count < 0 && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_rwlock->read_condition, &p_rwlock->lock);
  }
  pthread_cleanup_pop(0);
  if (wait_rc != 0) {
    --p_rwlock->waiting_readers;
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  ++p_rwlock->lock_count;
  --p_rwlock->waiting_readers;
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock) {
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  --p_rwlock->lock_count;
  if (p_rwlock->lock_count == 0) {
    if (const int rc = pthread_cond_signal(&p_rwlock->write_condition); rc != 0) {
      ++p_rwlock->lock_count;
      pthread_mutex_unlock(&p_rwlock->lock);
      return sr_i_raise_system_call("pthread_cond_signal", rc);
    }
  }
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock) {
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_writers;
  int wait_rc = 0;
  pthread_cleanup_push(decrement_writers_if_thread_cancelled, p_rwlock);
  while (p_rwlock->lock_count != 0 && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_rwlock->write_condition, &p_rwlock->lock);
  }
  pthread_cleanup_pop(0);
  if (wait_rc != 0) {
    pthread_mutex_unlock(&p_rwlock->lock);
    --p_rwlock->waiting_writers;
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  p_rwlock->lock_count = -1;
  if (const int rc = pthread_mutex_unlock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock) {
  if (const int rc = pthread_mutex_lock(&p_rwlock->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  const int32_t previous_count = p_rwlock->lock_count;
  p_rwlock->lock_count = 0;
  const bool wake_readers = p_rwlock->waiting_readers != 0;
  const int rc = wake_readers ? pthread_cond_broadcast(&p_rwlock->read_condition)
                              : pthread_cond_signal(&p_rwlock->write_condition);
  if (rc != 0) {
    p_rwlock->lock_count = previous_count;
    pthread_mutex_unlock(&p_rwlock->lock);
    return sr_i_raise_system_call(wake_readers ? "pthread_cond_broadcast" : "pthread_cond_signal",
                                  rc);
  }
  if (const int unlock_rc = pthread_mutex_unlock(&p_rwlock->lock); unlock_rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", unlock_rc);
  }
  return 0;
}
