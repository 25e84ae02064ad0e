// The read-write lock under real contention: readers sharing it, writers
// alone, readers preferred over waiting writers, readers counted in
// per-thread slots once two read together, and waiting threads cancelled.
// Threads say what they hold through semaphores and flags; what waits is
// read from the lock's waiting counts under its mutex, so every check is
// about state, never about timing.

#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <functional>
#include <semaphore>
#include <thread>
#include <vector>

#include "frame/sr_i_read_write_lock.h"

namespace {

struct counters {
  int32_t readers;
  int32_t waiting_readers;
  int32_t waiting_writers;
  bool writer_holds;
};

// Read under the mutex: no writer is halfway through a claim, and the
// waiting counts are exact.
counters read_counters(sr_i_read_write_lock_t &rwlock) {
  pthread_mutex_lock(&rwlock.lock);
  counters now{sr_i_rw_total_readers(&rwlock), rwlock.waiting_readers, rwlock.waiting_writers,
               rwlock.writer.load() != 0};
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
  std::counting_semaphore<2> inside(0);
  std::binary_semaphore release_first(0), release_second(0);
  auto reader = [&](std::binary_semaphore &release) {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    inside.release();
    release.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  };
  std::thread first(reader, std::ref(release_first));
  std::thread second(reader, std::ref(release_second));
  inside.acquire();
  inside.acquire();
  EXPECT_EQ(read_counters(rwlock_).readers, 2);

  std::atomic<bool> writer_holds{false};
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    writer_holds = true;
    EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 0);
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });

  release_first.release();
  first.join();
  EXPECT_EQ(read_counters(rwlock_).readers, 1);
  EXPECT_FALSE(writer_holds);  // one reader still holds it

  release_second.release();
  second.join();
  writer.join();
  EXPECT_TRUE(writer_holds);
  const counters after = read_counters(rwlock_);
  EXPECT_EQ(after.readers, 0);
  EXPECT_FALSE(after.writer_holds);
}

// Two threads hand the read lock to each other, each entering before the
// other leaves, while a writer waits: readers never wait for a waiting
// writer, so the relay runs to its end with the writer still outside, and
// the writer gets in only once the last reader has left.
TEST_F(ReadWriteLock, ReadersKeepEnteringWhileAWriterWaits) {
  constexpr int Handovers = 500;
  ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
  std::atomic<bool> writer_holds{false};
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    writer_holds = true;
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });

  // The main thread holds the lock at the start of each round; the partner
  // enters, the main thread leaves and enters again, the partner leaves.
  std::binary_semaphore partner_go(0), partner_inside(0), main_inside_again(0);
  std::atomic<bool> writer_seen_inside{false};
  std::thread partner([&] {
    for (int round = 0; round < Handovers; ++round) {
      partner_go.acquire();
      ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
      writer_seen_inside = writer_seen_inside || writer_holds;
      partner_inside.release();
      main_inside_again.acquire();
      ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
    }
  });
  for (int round = 0; round < Handovers; ++round) {
    partner_go.release();
    partner_inside.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    writer_seen_inside = writer_seen_inside || writer_holds;
    main_inside_again.release();
  }
  partner.join();
  EXPECT_FALSE(writer_seen_inside);
  EXPECT_FALSE(writer_holds);
  EXPECT_EQ(read_counters(rwlock_).waiting_writers, 1);

  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  writer.join();
  EXPECT_TRUE(writer_holds);
  EXPECT_EQ(read_counters(rwlock_).readers, 0);
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
  wait_for(rwlock_, [](counters now) { return now.readers == 2; });
  EXPECT_FALSE(second_writer_held);

  release_readers.release(2);
  for (std::thread &reader : readers) {
    reader.join();
  }
  second_writer.join();
  EXPECT_TRUE(second_writer_held);
}

// A lock read by one thread at a time keeps its one count and costs no
// slots; the first time two readers are inside together it gets its slots.
// Readers who came in by the one count and leave by their slots still let
// a writer in, and a writer still waits for a reader counted in a slot.
TEST_F(ReadWriteLock, ReadersMoveToSlotsOnceTwoReadTogetherAndStillCountRight) {
  for (int round = 0; round < 100; ++round) {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  }
  EXPECT_EQ(rwlock_.p_reader_slots.load(), nullptr);

  ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);  // by the one count
  std::binary_semaphore other_inside(0), other_may_leave(0), other_left(0);
  std::thread other([&] {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);  // the second reader inside
    other_inside.release();
    other_may_leave.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
    other_left.release();
    // Now counted in this thread's slot, while the main thread writes.
    other_may_leave.acquire();
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    other_inside.release();
    other_may_leave.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  });
  other_inside.acquire();
  ASSERT_NE(rwlock_.p_reader_slots.load(), nullptr);
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 2);

  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);  // by this thread's slot
  other_may_leave.release();
  other_left.acquire();
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 0);
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);  // would wait for ever on a wrong sum
  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);

  other_may_leave.release();
  other_inside.acquire();
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 1);
  std::atomic<bool> writer_holds{false};
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    writer_holds = true;
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 2; });
  EXPECT_FALSE(writer_holds);
  other_may_leave.release();
  other.join();
  writer.join();
  EXPECT_TRUE(writer_holds);
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
  const counters after = read_counters(rwlock_);
  EXPECT_EQ(after.readers, 0);
  EXPECT_FALSE(after.writer_holds);
  EXPECT_EQ(after.waiting_readers, 0);
  EXPECT_EQ(rwlock_.blocked_writers.load(), 0);
}

// A thread cancelled while it waits takes itself off the waiting counts and
// leaves the mutex free: the lock goes on serving every other thread.
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

void cancel(pthread_t thread) {
  ASSERT_EQ(pthread_cancel(thread), 0);
  void *p_result = nullptr;
  ASSERT_EQ(pthread_join(thread, &p_result), 0);
  EXPECT_EQ(p_result, PTHREAD_CANCELED);
}

TEST_F(ReadWriteLock, ACancelledWaitingReaderLeavesTheLockUsable) {
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
  cancelled_waiter waiter{&rwlock_, false};
  pthread_t thread;
  ASSERT_EQ(pthread_create(&thread, nullptr, wait_for_lock, &waiter), 0);
  wait_for(rwlock_, [](counters now) { return now.waiting_readers == 1; });
  cancel(thread);

  const counters after = read_counters(rwlock_);  // would hang on a mutex left held
  EXPECT_EQ(after.waiting_readers, 0);
  EXPECT_TRUE(after.writer_holds);
  EXPECT_EQ(after.readers, 0);
  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  std::thread reader([&] {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  });
  reader.join();
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
}

// Two writers wait for a reader; one is cancelled. The other still gets the
// lock when the reader leaves, and a third writer after it.
TEST_F(ReadWriteLock, ACancelledWaitingWriterLeavesTheLockUsable) {
  ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
  cancelled_waiter waiter{&rwlock_, true};
  pthread_t thread;
  ASSERT_EQ(pthread_create(&thread, nullptr, wait_for_lock, &waiter), 0);
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });
  std::atomic<bool> other_writer_held{false};
  std::thread other_writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    other_writer_held = true;
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 2; });
  cancel(thread);

  const counters after = read_counters(rwlock_);  // would hang on a mutex left held
  EXPECT_EQ(after.waiting_writers, 1);
  EXPECT_EQ(rwlock_.blocked_writers.load(), 1);
  EXPECT_EQ(after.readers, 1);
  EXPECT_FALSE(other_writer_held);

  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  other_writer.join();
  EXPECT_TRUE(other_writer_held);
  EXPECT_EQ(rwlock_.blocked_writers.load(), 0);
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
}

}  // namespace
