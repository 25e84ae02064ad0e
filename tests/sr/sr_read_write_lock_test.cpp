// The read-write lock under real contention: readers sharing it, writers
// alone, readers preferred over waiting writers, readers counted in
// per-thread slots once two read together, and waiting threads cancelled.
// Threads say what they hold through semaphores and flags; what waits is
// read from the lock's waiting counts under its mutex, so every check is
// about state, never about timing.

#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/wait.h>

#include <atomic>
#include <barrier>
#include <chrono>
#include <csignal>
#include <functional>
#include <semaphore>
#include <thread>
#include <vector>

#include "frame/sr_i_frame.h"
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
  pthread_mutex_t *p_mutex = &sr_i_rw_waiting_place(&rwlock)->lock;
  pthread_mutex_lock(p_mutex);
  counters now{sr_i_rw_total_readers(&rwlock), rwlock.waiting_readers, rwlock.waiting_writers,
               rwlock.lock_count.load() < 0};
  pthread_mutex_unlock(p_mutex);
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

  // A writer that takes the lock, says so through `holds`, finds no reader
  // inside with it, and leaves.
  std::thread writer_alone(std::atomic<bool> &holds) {
    return std::thread([this, &holds] {
      ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
      holds = true;
      EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 0);
      ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
    });
  }

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
  std::thread writer = writer_alone(writer_holds);
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

// Two threads reading one lock together each mark their own line and leave
// the lock's count alone: the read path writes nothing both threads write.
// A writer still waits for either of them.
TEST_F(ReadWriteLock, ReadersTogetherMarkTheirOwnLinesAndAWriterStillWaitsForThem) {
  std::binary_semaphore other_inside(0), other_may_leave(0);
  std::thread other([&] {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    EXPECT_EQ(sr_i_rw_marks_of_this_thread(&rwlock_), 1);
    other_inside.release();
    other_may_leave.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
    EXPECT_EQ(sr_i_rw_marks_of_this_thread(&rwlock_), 0);
  });
  ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
  other_inside.acquire();
  EXPECT_EQ(sr_i_rw_marks_of_this_thread(&rwlock_), 1);
  EXPECT_EQ(rwlock_.lock_count.load(), 0);
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 2);

  std::atomic<bool> writer_holds{false};
  std::thread writer = writer_alone(writer_holds);
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });
  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  EXPECT_FALSE(writer_holds);  // the other thread's mark still holds it
  other_may_leave.release();
  other.join();
  writer.join();
  EXPECT_TRUE(writer_holds);
}

// A thread holding more read locks than it has marks, or the same lock
// again and again, counts the rest in the locks' own counts; whichever way
// each hold was counted, the lock is free again only after the last
// release.
TEST_F(ReadWriteLock, HoldsBeyondTheMarksAreCountedInTheLockAndReleasedRight) {
  constexpr int Holds = 12;  // more than the marks of one thread
  for (int hold = 0; hold < Holds; ++hold) {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
  }
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), Holds);
  EXPECT_GT(rwlock_.lock_count.load(), 0);

  std::vector<sr_i_read_write_lock_t> others(Holds);
  for (sr_i_read_write_lock_t &other : others) {
    sr_i_rw_open(&other);
  }
  // With every mark taken, the other locks are counted in their counts.
  for (sr_i_read_write_lock_t &other : others) {
    ASSERT_EQ(sr_i_rw_lock_read(&other), 0);
    EXPECT_EQ(sr_i_rw_total_readers(&other), 1);
  }

  std::atomic<int> writers_done{0};
  auto write_once = [&](sr_i_read_write_lock_t *p_lock) {
    ASSERT_EQ(sr_i_rw_lock_write(p_lock), 0);
    ASSERT_EQ(sr_i_rw_unlock_write(p_lock), 0);
    ++writers_done;
  };
  std::thread writer(write_once, &rwlock_);
  std::thread other_writer(write_once, &others.back());
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });
  wait_for(others.back(), [](counters now) { return now.waiting_writers == 1; });
  for (int hold = 1; hold < Holds; ++hold) {
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  }
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 1);
  EXPECT_EQ(writers_done.load(), 0);
  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  writer.join();
  EXPECT_EQ(writers_done.load(), 1);

  for (sr_i_read_write_lock_t &other : others) {
    ASSERT_EQ(sr_i_rw_unlock_read(&other), 0);
  }
  other_writer.join();
  EXPECT_EQ(writers_done.load(), 2);
  for (sr_i_read_write_lock_t &other : others) {
    EXPECT_EQ(sr_i_rw_total_readers(&other), 0);
    EXPECT_EQ(sr_i_rw_marks_of_this_thread(&other), 0);
    sr_i_rw_close(&other);
  }
}

// More threads than there are lines read at once: those without a line are
// counted in the lock's count, and a writer waits for every one of them.
TEST_F(ReadWriteLock, ThreadsBeyondTheLinesAreCountedAndWaitedFor) {
  constexpr int Readers = 80;
  std::counting_semaphore<Readers> inside(0);
  std::binary_semaphore leave(0);
  std::atomic<int> still_inside{0};
  std::vector<std::thread> readers;
  for (int reader = 0; reader < Readers; ++reader) {
    readers.emplace_back([&] {
      ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
      ++still_inside;
      inside.release();
      leave.acquire();
      --still_inside;
      ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
      leave.release();  // the next reader may leave
    });
  }
  for (int reader = 0; reader < Readers; ++reader) {
    inside.acquire();
  }
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), Readers);
  EXPECT_GT(rwlock_.lock_count.load(), 0);

  std::atomic<int> readers_seen_by_writer{-1};
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
    readers_seen_by_writer = still_inside.load();
    ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
  });
  wait_for(rwlock_, [](counters now) { return now.waiting_writers == 1; });
  leave.release();
  for (std::thread &reader : readers) {
    reader.join();
  }
  writer.join();
  EXPECT_EQ(readers_seen_by_writer.load(), 0);
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 0);
}

// A thread that ends still holding a read lock hands its mark to the lock's
// count: the lock stays held until someone releases it, and the next thread
// to get that line finds it clean.
TEST_F(ReadWriteLock, AThreadEndingWithAReadLockHandsItToTheLock) {
  std::thread([&] { ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0); }).join();
  EXPECT_EQ(rwlock_.lock_count.load(), 1);
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 1);
  std::thread([&] {
    ASSERT_EQ(sr_i_rw_lock_read(&rwlock_), 0);
    EXPECT_EQ(sr_i_rw_marks_of_this_thread(&rwlock_), 1);  // a clean line
    EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 2);
    ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);
  }).join();
  ASSERT_EQ(sr_i_rw_unlock_read(&rwlock_), 0);  // released for the ended thread
  EXPECT_EQ(sr_i_rw_total_readers(&rwlock_), 0);
  ASSERT_EQ(sr_i_rw_lock_write(&rwlock_), 0);
  ASSERT_EQ(sr_i_rw_unlock_write(&rwlock_), 0);
}

// Tables are made and freed by the thousand: a lock costs a few words, and
// locks opened where closed ones were (as the heap hands the same memory
// out again) start free, whatever the old ones went through.
TEST(ReadWriteLocks, ManyLocksOpenedAndClosedStartFreeAndCostAFewWords) {
  EXPECT_LE(sizeof(sr_i_read_write_lock_t), 4 * sizeof(void *));
  constexpr size_t Locks = 10000;
  auto *p_locks =
      static_cast<sr_i_read_write_lock_t *>(::operator new(Locks * sizeof(sr_i_read_write_lock_t)));
  for (int generation = 0; generation < 3; ++generation) {
    for (size_t lock = 0; lock < Locks; ++lock) {
      new (&p_locks[lock]) sr_i_read_write_lock_t;
      sr_i_rw_open(&p_locks[lock]);
      ASSERT_EQ(sr_i_rw_total_readers(&p_locks[lock]), 0) << lock;
    }
    // Two threads read each lock together and keep a third of them while
    // the main thread looks; every hold is released before the locks close.
    std::barrier step(3);
    auto read_all = [&] {
      for (size_t lock = 0; lock < Locks; ++lock) {
        ASSERT_EQ(sr_i_rw_lock_read(&p_locks[lock]), 0);
        if (lock % 3 != 0) {
          ASSERT_EQ(sr_i_rw_unlock_read(&p_locks[lock]), 0);
        }
      }
      step.arrive_and_wait();
      step.arrive_and_wait();
      for (size_t lock = 0; lock < Locks; lock += 3) {
        ASSERT_EQ(sr_i_rw_unlock_read(&p_locks[lock]), 0);
      }
    };
    std::thread first(read_all), second(read_all);
    step.arrive_and_wait();
    for (size_t lock = 0; lock < Locks; lock += 4) {
      EXPECT_EQ(sr_i_rw_total_readers(&p_locks[lock]), lock % 3 == 0 ? 2 : 0) << lock;
    }
    step.arrive_and_wait();
    first.join();
    second.join();
    for (size_t lock = 0; lock < Locks; lock += 4) {
      ASSERT_EQ(sr_i_rw_lock_write(&p_locks[lock]), 0);
      ASSERT_EQ(sr_i_rw_unlock_write(&p_locks[lock]), 0);
    }
    for (size_t lock = 0; lock < Locks; ++lock) {
      EXPECT_EQ(sr_i_rw_total_readers(&p_locks[lock]), 0) << lock;
      sr_i_rw_close(&p_locks[lock]);
      p_locks[lock].~sr_i_read_write_lock_t();
    }
  }
  ::operator delete(p_locks);
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

// Two locks whose waiting place is the same, each with waiting readers and
// writers: waking the waiters of one lets in only its own, and mixed use of
// both from many threads keeps each lock's writers alone.
class SharedWaitingPlace : public ::testing::Test {
 protected:
  void SetUp() override {
    for (sr_i_read_write_lock_t &lock : candidates_) {
      sr_i_rw_open(&lock);
    }
    for (size_t first = 0; first < candidates_.size() && p_second_ == nullptr; ++first) {
      for (size_t second = first + 1; second < candidates_.size(); ++second) {
        if (sr_i_rw_waiting_place(&candidates_[first]) ==
            sr_i_rw_waiting_place(&candidates_[second])) {
          p_first_ = &candidates_[first];
          p_second_ = &candidates_[second];
          break;
        }
      }
    }
    ASSERT_NE(p_second_, nullptr) << "no two of the locks share a waiting place";
  }
  void TearDown() override {
    for (sr_i_read_write_lock_t &lock : candidates_) {
      sr_i_rw_close(&lock);
    }
  }
  std::vector<sr_i_read_write_lock_t> candidates_ = std::vector<sr_i_read_write_lock_t>(1000);
  sr_i_read_write_lock_t *p_first_ = nullptr;
  sr_i_read_write_lock_t *p_second_ = nullptr;
};

TEST_F(SharedWaitingPlace, WakingOneLocksWaitersLetsInOnlyThem) {
  ASSERT_EQ(sr_i_rw_lock_write(p_first_), 0);
  ASSERT_EQ(sr_i_rw_lock_write(p_second_), 0);
  std::atomic<bool> first_reader_in{false}, second_reader_in{false}, first_writer_in{false};
  std::binary_semaphore first_reader_may_leave(0);
  std::thread first_reader([&] {
    ASSERT_EQ(sr_i_rw_lock_read(p_first_), 0);
    first_reader_in = true;
    first_reader_may_leave.acquire();
    ASSERT_EQ(sr_i_rw_unlock_read(p_first_), 0);
  });
  std::thread second_reader([&] {
    ASSERT_EQ(sr_i_rw_lock_read(p_second_), 0);
    second_reader_in = true;
    ASSERT_EQ(sr_i_rw_unlock_read(p_second_), 0);
  });
  std::thread first_writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(p_first_), 0);
    first_writer_in = true;
    ASSERT_EQ(sr_i_rw_unlock_write(p_first_), 0);
  });
  wait_for(*p_first_,
           [](counters now) { return now.waiting_readers == 1 && now.waiting_writers == 2; });
  wait_for(*p_second_, [](counters now) { return now.waiting_readers == 1; });

  ASSERT_EQ(sr_i_rw_unlock_write(p_second_), 0);
  second_reader.join();
  EXPECT_TRUE(second_reader_in);
  EXPECT_FALSE(first_reader_in);
  EXPECT_FALSE(first_writer_in);
  EXPECT_EQ(read_counters(*p_first_).waiting_readers, 1);  // woken, looked, waits again

  ASSERT_EQ(sr_i_rw_unlock_write(p_first_), 0);
  wait_for(*p_first_, [](counters now) { return now.readers == 1; });
  // The reader is counted in before it can say so.
  while (!first_reader_in) {
    std::this_thread::yield();
  }
  EXPECT_FALSE(first_writer_in);  // readers first
  first_reader_may_leave.release();
  first_reader.join();
  first_writer.join();
  EXPECT_TRUE(first_writer_in);
}

// A forked child is a copy of one thread: a waiting place's mutex that
// another thread of the parent held at the fork, for some other lock, would
// stay held in the child for ever. A child leaving a lock whose copied state
// shows a waiting writer goes through that place to wake it, and must get
// through.
TEST_F(SharedWaitingPlace, AForkedChildGetsThroughAPlaceAParentThreadHeldAtTheFork) {
  sr_i_establish_fork_handlers();
  ASSERT_EQ(sr_i_rw_lock_read(p_first_), 0);
  std::thread writer([&] {
    ASSERT_EQ(sr_i_rw_lock_write(p_first_), 0);
    ASSERT_EQ(sr_i_rw_unlock_write(p_first_), 0);
  });
  wait_for(*p_first_, [](counters now) { return now.waiting_writers == 1; });
  pthread_mutex_t *p_shared_mutex = &sr_i_rw_waiting_place(p_second_)->lock;
  std::binary_semaphore held(0), may_release(0);
  std::thread holder([&] {
    pthread_mutex_lock(p_shared_mutex);
    held.release();
    may_release.acquire();
    pthread_mutex_unlock(p_shared_mutex);
  });
  held.acquire();

  const pid_t child = fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    _exit(sr_i_rw_unlock_read(p_first_) == 0 && sr_i_rw_lock_read(p_second_) == 0 ? 0 : 1);
  }
  int status = 0;
  pid_t waited = 0;
  for (int tenth = 0; tenth < 200 && waited == 0; ++tenth) {
    waited = waitpid(child, &status, WNOHANG);
    if (waited == 0) {
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
  }
  if (waited == 0) {
    kill(child, SIGKILL);
    waitpid(child, &status, 0);
  }
  may_release.release();
  holder.join();
  ASSERT_EQ(sr_i_rw_unlock_read(p_first_), 0);
  writer.join();
  ASSERT_EQ(waited, child) << "the child hung on the mutex held at the fork";
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST_F(SharedWaitingPlace, MixedUseOfBothLocksKeepsEachWriterAlone) {
  constexpr int Threads = 6;
  constexpr int Rounds = 1500;
  struct guarded {
    sr_i_read_write_lock_t *p_lock;
    long total = 0;  // guarded by *p_lock alone
    std::atomic<int> writers_inside{0};
    std::atomic<int> readers_inside{0};
    std::atomic<long> writes{0};
  };
  guarded both[2];
  both[0].p_lock = p_first_;
  both[1].p_lock = p_second_;
  std::atomic<bool> overlap_seen{false};
  std::vector<std::thread> threads;
  for (int thread = 0; thread < Threads; ++thread) {
    threads.emplace_back([&, thread] {
      for (int round = 0; round < Rounds; ++round) {
        guarded &one = both[(round / 2 + thread) % 2];
        if ((round + thread) % 4 == 0) {
          sr_i_write_guard guard(one.p_lock);
          ASSERT_EQ(guard.result(), 0);
          if (++one.writers_inside != 1 || one.readers_inside != 0) {
            overlap_seen = true;
          }
          ++one.total;
          ++one.writes;
          --one.writers_inside;
        } else {
          sr_i_read_guard guard(one.p_lock);
          ASSERT_EQ(guard.result(), 0);
          ++one.readers_inside;
          const long seen = one.total;
          if (one.writers_inside != 0 || seen != one.total) {
            overlap_seen = true;
          }
          --one.readers_inside;
        }
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  EXPECT_FALSE(overlap_seen);
  for (guarded &one : both) {
    EXPECT_EQ(one.total, one.writes.load());
    EXPECT_EQ(sr_i_rw_total_readers(one.p_lock), 0);
    EXPECT_EQ(one.p_lock->lock_count.load(), 0);
    EXPECT_EQ(one.p_lock->blocked_writers.load(), 0);
  }
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
