// The read-write lock under real contention. Threads report what they hold
// through the lock's own counters, read under its mutex, so every check is
// about state, never about timing.

#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <semaphore>
#include <thread>
#include <vector>

#include "frame/sr_i_read_write_lock.h"

namespace {

struct counters {
  int32_t lock_count;
  int32_t waiting_readers;
  int32_t waiting_writers;
};

counters read_counters(sr_i_read_write_lock_t &rwlock) {
  pthread_mutex_lock(&rwlock.lock);
  counters now{rwlock.lock_count, rwlock.waiting_readers, rwlock.waiting_writers};
  pthread_mutex_unlock(&rwlock.lock);
  return now;
}

// Waits until the counters satisfy `condition`.
template <typename Condition>
void wait_for(sr_i_read_write_lock_t &rwlock, Condition condition) {
  while (!condition(read_counters(rwlock))) {
    std::this_thread::yield();
  }
}

class ReadWriteLock : public ::testing::Test {
 protected:
  void SetUp() override { sr_i_rw_open(&rwlock_); }
  void TearDown() override { sr_i_rw_close(&rwlock_); }
  sr_i_read_write_lock_t rwlock_;
};

TEST_F(ReadWriteLock, ReadersShareAndTheLastUnlockLetsTheWriterIn) {
  std::binary_semaphore release_first(0), release_second(0);
  auto reader = [&](std::binary_semaphore &release) {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    release.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  };
  std::thread first(reader, std::ref(release_first));
  std::thread second(reader, std::ref(release_second));
  wait_for(rwlock_, [](counters now) { return now.lock_count == 2; });

  std::atomic<bool> writer_holds{false};
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    writer_holds = true;
    EXPECT_EQ(read_counters(rwlock_).lock_count, -1);
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });

  release_first.release();
  first.join();
  EXPECT_EQ(read_counters(rwlock_).lock_count, 1);
  EXPECT_FALSE(writer_holds);  // one reader still holds it

  release_second.release();
  second.join();
  writer.join();
  EXPECT_TRUE(writer_holds);
  EXPECT_EQ(read_counters(rwlock_).lock_count, 0);
}

TEST_F(ReadWriteLock, WriterLeavingWakesTheWaitingReadersBeforeAWaitingWriter) {
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
  std::counting_semaphore<2> release_readers(0);
  std::vector<std::thread> readers;
  for (int reader = 0; reader < 2; ++reader) {
    readers.emplace_back([&] {
      ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
      release_readers.acquire();
      ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
    });
  }
  std::atomic<bool> second_writer_held{false};
  std::thread second_writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    second_writer_held = true;
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  // Both readers and the second writer wait (the first writer's count stays).
  wait_for(rwlock_,
           [](counters now) { return now.waiting_readers == 2 && now.waiting_writers == 2; });

  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  wait_for(rwlock_, [](counters now) { return now.lock_count == 2; });
  EXPECT_FALSE(second_writer_held);

  release_readers.release(2);
  for (std::thread &reader : readers) {
    reader.join();
  }
  second_writer.join();
  EXPECT_TRUE(second_writer_held);
}

TEST_F(ReadWriteLock, WritersExcludeEveryoneUnderHeavyMixedUse) {
  constexpr int Threads = 6;
  constexpr int Rounds = 2000;
  long shared_total = 0;  // guarded by rwlock_ alone
  std::atomic<int> writers_inside{0};
  std::atomic<int> readers_inside{0};
  std::atomic<bool> overlap_seen{false};
  std::atomic<long> writes{0};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < Threads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < Rounds; ++round) {
        if ((round + thread) % 3 == 0) {
          sr_i_write_guard guard(&rwlock_);
          ASSERT_EQ(guard.result(), 0);
          if (++writers_inside != 1 || readers_inside != 0) {
            overlap_seen = true;
          }
          ++shared_total;
          ++writes;
          --writers_inside;
        } else {
          sr_i_read_guard guard(&rwlock_);
          ASSERT_EQ(guard.result(), 0);
          ++readers_inside;
          const long seen = shared_total;
          if (writers_inside != 0 || seen != shared_total) {
            overlap_seen = true;
          }
          --readers_inside;
        }
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  EXPECT_FALSE(overlap_seen);
  EXPECT_EQ(shared_total, writes.load()) << "an increment under the write lock was lost";
  EXPECT_EQ(read_counters(rwlock_).lock_count, 0);
}

// A thread cancelled while it waits takes itself off the waiting count; the
// condition wait has re-acquired the mutex, which stays held.
struct cancelled_waiter {
  sr_i_read_write_lock_t *p_rwlock;
  bool as_writer;
};

void *wait_for_lock(void *p_argument) {
  auto *p_waiter = static_cast<cancelled_waiter *>(p_argument);
  if (p_waiter->as_writer) {
    sr_i_rw_lock_write(p_waiter->p_rwlock);
  } else {
    sr_i_rw_lock_read(p_waiter->p_rwlock);
  }
  return nullptr;
}

void cancel_a_waiter(bool as_writer) {
  // The lock is left with its mutex held, so it is never closed or reused.
  static sr_i_read_write_lock_t broken_locks[2];
  sr_i_read_write_lock_t &rwlock = broken_locks[as_writer ? 1 : 0];
  sr_i_rw_open(&rwlock);
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock), 0);
  cancelled_waiter waiter{&rwlock, as_writer};
  pthread_t thread;
  ASSERT_EQ(pthread_create(&thread, nullptr, wait_for_lock, &waiter), 0);
  wait_for(rwlock, [&](counters now) {
    return as_writer ? now.waiting_writers == 2 : now.waiting_readers == 1;
  });
  ASSERT_EQ(pthread_cancel(thread), 0);
  void *p_result = nullptr;
  ASSERT_EQ(pthread_join(thread, &p_result), 0);
  EXPECT_EQ(p_result, PTHREAD_CANCELED);
  EXPECT_EQ(pthread_mutex_trylock(&rwlock.lock), EBUSY);
  EXPECT_EQ(rwlock.waiting_readers, 0);
  EXPECT_EQ(rwlock.waiting_writers, 1);  // only the holder's own count remains
  EXPECT_EQ(rwlock.lock_count, -1);
}

TEST(ReadWriteLockCancellation, ACancelledReaderOrWriterLeavesTheCountsRight) {
  cancel_a_waiter(false);
  cancel_a_waiter(true);
}

}  // namespace
