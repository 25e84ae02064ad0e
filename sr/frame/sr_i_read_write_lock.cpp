// sr_i_read_write_lock.cpp - the read-write lock of trees and tables, the
// waiting places every lock shares, and the readers' marks.
//
// Every live thread (up to Marked_Threads of them) owns one cache line of
// marks. A reader that finds no writer writes the lock's address into a
// free mark of its own line and takes it off again when it leaves: readers
// of one table on different processors write nothing another thread
// writes, and a lock costs no memory of its own for them. A writer reads
// the lines of the threads that ever had one. A thread without a line, or
// with every mark in use, counts itself in the lock's `lock_count`.
//
// Waiting happens in one of Waiting_Places pairs of a mutex and two
// conditions, chosen by the lock's address. Readers never wait for waiting
// writers, and a writer leaving wakes all waiting readers before any
// writer, so reads are never starved; a reader leaving while a writer
// waits wakes the place's writers to look again. Since a place serves
// several locks, every wake-up is a broadcast and every waiter looks at its
// own lock again.
//
// A thread cancelled inside a wait runs a clean-up handler that takes it off
// the waiting counts and unlocks the mutex the condition wait re-acquired,
// so the lock, and every other lock of the place, stays usable.

#include "frame/sr_i_read_write_lock.h"

#include <array>
#include <bit>
#include <new>

#include "frame/sr_i_errors.h"

namespace {

// A line holds eight marks: a thread rarely holds more than two locks (its
// tree's and a table's) for reading at once, and packing several tables
// takes one per table.
constexpr uint32_t Marks_Per_Thread = 8;
constexpr uint32_t Marked_Threads = 64;
constexpr uint32_t Waiting_Places = 128;

struct alignas(64) thread_marks {
  std::array<std::atomic<const sr_i_read_write_lock_t *>, Marks_Per_Thread> held{};
};

constinit thread_marks Marks[Marked_Threads];

// Lines handed out so far, highest first taken plus one: the lines a writer
// reads. Raised before the thread's first mark, so a writer that misses a
// line also misses its marks, which then see the writer.
std::atomic<uint32_t> Lines_Ever_Used{0};

// Live threads hold distinct lines, lowest free first; a line is given back
// when its thread ends, for the next thread to take.
std::atomic<uint64_t> Lines_In_Use{0};

constexpr uint32_t No_Line = Marked_Threads;

// The line of the calling thread plus one; 0 until the thread first asks.
// No_Line + 1 for a thread without a line, and for one whose line was given
// back while thread-local destructors still run.
[[gnu::tls_model("initial-exec")]] thread_local uint32_t This_Thread_Line_Plus_One = 0;

uint32_t take_line() {
  uint64_t in_use = Lines_In_Use.load(std::memory_order_relaxed);
  while (in_use != ~uint64_t{0}) {
    const auto lowest_free = static_cast<uint32_t>(std::countr_one(in_use));
    if (Lines_In_Use.compare_exchange_weak(in_use, in_use | (uint64_t{1} << lowest_free),
                                           std::memory_order_relaxed)) {
      uint32_t used = Lines_Ever_Used.load();
      while (used <= lowest_free && !Lines_Ever_Used.compare_exchange_weak(used, lowest_free + 1)) {
      }
      return lowest_free;
    }
  }
  return No_Line;
}

constinit sr_i_rw_waiting_place_t Places[Waiting_Places];

// Locks lie in objects many bytes apart; the multiplication spreads the
// bits above the alignment over the whole word.
uint64_t spread_address(const sr_i_read_write_lock_t *p_rwlock) {
  return (reinterpret_cast<uintptr_t>(p_rwlock) >> 3) * 0x9e3779b97f4a7c15u;
}

// The mark a reader of the lock tries first; bits below those that choose
// the waiting place.
uint32_t first_mark_for(const sr_i_read_write_lock_t *p_rwlock) {
  return static_cast<uint32_t>(spread_address(p_rwlock) >> 40) % Marks_Per_Thread;
}

// A thread whose line is given back while it still holds read locks (a
// thread-local destructor's) hands them to the locks' own counts, so the
// next owner of the line starts clean and those locks stay held until
// released.
void hand_marks_to_counts(thread_marks &line);

struct line_holder {
  uint32_t line = take_line();
  ~line_holder() {
    if (line == No_Line) {
      return;
    }
    hand_marks_to_counts(Marks[line]);
    This_Thread_Line_Plus_One = No_Line + 1;
    Lines_In_Use.fetch_and(~(uint64_t{1} << line), std::memory_order_relaxed);
  }
};

// The marks of the calling thread, or null for a thread without a line.
thread_marks *this_thread_marks() {
  if (This_Thread_Line_Plus_One == 0) [[unlikely]] {
    thread_local line_holder holder;
    This_Thread_Line_Plus_One = holder.line + 1;
  }
  const uint32_t line = This_Thread_Line_Plus_One - 1;
  return line == No_Line ? nullptr : &Marks[line];
}

// Marks the calling thread as a reader of the lock: the free mark it took,
// or null when it has none free (or no line).
std::atomic<const sr_i_read_write_lock_t *> *mark_reader(const sr_i_read_write_lock_t *p_rwlock) {
  thread_marks *p_line = this_thread_marks();
  if (p_line == nullptr) {
    return nullptr;
  }
  const uint32_t first = first_mark_for(p_rwlock);
  for (uint32_t step = 0; step < Marks_Per_Thread; ++step) {
    auto &mark = p_line->held[(first + step) % Marks_Per_Thread];
    if (mark.load(std::memory_order_relaxed) == nullptr) {
      // Sequentially consistent, as the writer's claim: the mark is seen
      // by a writer, or the reader then sees the writer's -1.
      mark.store(p_rwlock);
      return &mark;
    }
  }
  return nullptr;
}

// Takes one of the calling thread's marks of the lock off. False when the
// thread has none: it was counted in `lock_count`.
bool unmark_reader(const sr_i_read_write_lock_t *p_rwlock) {
  thread_marks *p_line = this_thread_marks();
  if (p_line == nullptr) {
    return false;
  }
  const uint32_t first = first_mark_for(p_rwlock);
  for (uint32_t step = 0; step < Marks_Per_Thread; ++step) {
    auto &mark = p_line->held[(first + step) % Marks_Per_Thread];
    if (mark.load(std::memory_order_relaxed) == p_rwlock) {
      mark.store(nullptr);
      return true;
    }
  }
  return false;
}

// Counts a reader in `lock_count` unless a writer holds or claims it.
bool count_reader(sr_i_read_write_lock_t *p_rwlock) {
  int32_t count = p_rwlock->lock_count.load();
  while (count >= 0) {
    if (p_rwlock->lock_count.compare_exchange_weak(count, count + 1)) {
      return true;
    }
  }
  return false;
}

// A reader enters: by a mark when it has one free, else by the count.
// False when a writer holds or claims the lock.
bool enter_as_reader(sr_i_read_write_lock_t *p_rwlock) {
  if (auto *p_mark = mark_reader(p_rwlock)) {
    if (p_rwlock->lock_count.load() >= 0) {
      return true;
    }
    p_mark->store(nullptr);
    return false;
  }
  return count_reader(p_rwlock);
}

int32_t marks_of(const sr_i_read_write_lock_t *p_rwlock) {
  const uint32_t lines = Lines_Ever_Used.load();
  int32_t marks = 0;
  for (uint32_t line = 0; line < lines; ++line) {
    for (const auto &mark : Marks[line].held) {
      marks += mark.load() == p_rwlock ? 1 : 0;
    }
  }
  return marks;
}

// The writer's claim, under the mutex: the lock becomes its own if its count
// is 0 and, once that is -1, no reader's mark holds it. Otherwise the claim
// is withdrawn; the readers it met wake the writer as they leave, and a
// reader that arrived meanwhile and took its mark off waits for the mutex,
// then finds the lock free.
bool try_take_for_writer(sr_i_read_write_lock_t *p_rwlock) {
  int32_t free_count = 0;
  if (!p_rwlock->lock_count.compare_exchange_strong(free_count, -1)) {
    return false;
  }
  if (marks_of(p_rwlock) == 0) {
    return true;
  }
  p_rwlock->lock_count.store(0);
  return false;
}

void hand_marks_to_counts(thread_marks &line) {
  for (auto &mark : line.held) {
    auto *p_rwlock = const_cast<sr_i_read_write_lock_t *>(mark.load());
    if (p_rwlock == nullptr) {
      continue;
    }
    // Under the mutex no writer is halfway through a claim, and none holds
    // the lock, since this thread reads it: the count is not -1.
    sr_i_rw_waiting_place_t *p_place = sr_i_rw_waiting_place(p_rwlock);
    pthread_mutex_lock(&p_place->lock);
    p_rwlock->lock_count.fetch_add(1);
    mark.store(nullptr);
    pthread_mutex_unlock(&p_place->lock);
  }
}

// Clean-up handlers of a thread cancelled inside a condition wait, which
// returns with the mutex held: the thread leaves the waiting counts and
// the mutex.
struct waiter {
  sr_i_read_write_lock_t *p_rwlock;
  sr_i_rw_waiting_place_t *p_place;
};

void leave_read_wait_when_cancelled(void *p_argument) {
  auto *p_waiter = static_cast<waiter *>(p_argument);
  if (p_waiter->p_rwlock->waiting_readers != 0) {
    --p_waiter->p_rwlock->waiting_readers;
  }
  pthread_mutex_unlock(&p_waiter->p_place->lock);
}

void leave_write_wait_when_cancelled(void *p_argument) {
  auto *p_waiter = static_cast<waiter *>(p_argument);
  if (p_waiter->p_rwlock->waiting_writers != 0) {
    --p_waiter->p_rwlock->waiting_writers;
  }
  p_waiter->p_rwlock->blocked_writers.fetch_sub(1);
  pthread_mutex_unlock(&p_waiter->p_place->lock);
}

}  // namespace

sr_i_rw_waiting_place_t *sr_i_rw_waiting_place(const sr_i_read_write_lock_t *p_rwlock) {
  return &Places[spread_address(p_rwlock) >> (64 - std::countr_zero(Waiting_Places))];
}

void sr_i_rw_renew_waiting_places_in_child() {
  for (sr_i_rw_waiting_place_t &place : Places) {
    new (&place) sr_i_rw_waiting_place_t;
  }
}

int32_t sr_i_rw_total_readers(const sr_i_read_write_lock_t *p_rwlock) {
  const int32_t count = p_rwlock->lock_count.load();
  return (count < 0 ? 0 : count) + marks_of(p_rwlock);
}

int32_t sr_i_rw_marks_of_this_thread(const sr_i_read_write_lock_t *p_rwlock) {
  const thread_marks *p_line = this_thread_marks();
  int32_t marks = 0;
  if (p_line != nullptr) {
    for (const auto &mark : p_line->held) {
      marks += mark.load() == p_rwlock ? 1 : 0;
    }
  }
  return marks;
}

void sr_i_rw_open(sr_i_read_write_lock_t *p_rwlock) {
  p_rwlock->lock_count.store(0);
  p_rwlock->blocked_writers.store(0);
  p_rwlock->waiting_readers = 0;
  p_rwlock->waiting_writers = 0;
}

void sr_i_rw_close(sr_i_read_write_lock_t *) {}

int32_t sr_i_rw_lock_read(sr_i_read_write_lock_t *p_rwlock) {
  if (enter_as_reader(p_rwlock)) {
    return 0;
  }
  sr_i_rw_waiting_place_t *p_place = sr_i_rw_waiting_place(p_rwlock);
  if (const int rc = pthread_mutex_lock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_readers;
  int wait_rc = 0;
  waiter self{p_rwlock, p_place};
  pthread_cleanup_push(leave_read_wait_when_cancelled, &self);
  // Writers claim only under the mutex, so a reader that finds no writer
  // here enters for sure.
  while (p_rwlock->lock_count.load() < 0 && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_place->read_condition, &p_place->lock);
  }
  pthread_cleanup_pop(0);
  --p_rwlock->waiting_readers;
  if (wait_rc != 0) {
    pthread_mutex_unlock(&p_place->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  enter_as_reader(p_rwlock);  // sure to succeed: no writer can claim meanwhile
  if (const int rc = pthread_mutex_unlock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_read(sr_i_read_write_lock_t *p_rwlock) {
  if (!unmark_reader(p_rwlock)) {
    p_rwlock->lock_count.fetch_sub(1);
  }
  if (p_rwlock->blocked_writers.load() == 0) {
    return 0;
  }
  // A writer waits for the readers it met to leave; it is woken to look
  // again. The mutex orders the broadcast after its wait began.
  sr_i_rw_waiting_place_t *p_place = sr_i_rw_waiting_place(p_rwlock);
  if (const int rc = pthread_mutex_lock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  const int wake_rc = pthread_cond_broadcast(&p_place->write_condition);
  if (const int rc = pthread_mutex_unlock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  if (wake_rc != 0) {
    return sr_i_raise_system_call("pthread_cond_broadcast", wake_rc);
  }
  return 0;
}

int32_t sr_i_rw_lock_write(sr_i_read_write_lock_t *p_rwlock) {
  sr_i_rw_waiting_place_t *p_place = sr_i_rw_waiting_place(p_rwlock);
  if (const int rc = pthread_mutex_lock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  ++p_rwlock->waiting_writers;
  // Before any claim, so a reader leaving after the claim saw it knows to
  // wake this writer.
  p_rwlock->blocked_writers.fetch_add(1);
  int wait_rc = 0;
  waiter self{p_rwlock, p_place};
  pthread_cleanup_push(leave_write_wait_when_cancelled, &self);
  while (!try_take_for_writer(p_rwlock) && wait_rc == 0) {
    wait_rc = pthread_cond_wait(&p_place->write_condition, &p_place->lock);
  }
  pthread_cleanup_pop(0);
  p_rwlock->blocked_writers.fetch_sub(1);
  if (wait_rc != 0) {
    --p_rwlock->waiting_writers;
    pthread_mutex_unlock(&p_place->lock);
    return sr_i_raise_system_call("pthread_cond_wait", wait_rc);
  }
  if (const int rc = pthread_mutex_unlock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}

int32_t sr_i_rw_unlock_write(sr_i_read_write_lock_t *p_rwlock) {
  sr_i_rw_waiting_place_t *p_place = sr_i_rw_waiting_place(p_rwlock);
  if (const int rc = pthread_mutex_lock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_lock", rc);
  }
  p_rwlock->lock_count.store(0);
  int wake_rc = 0;
  if (p_rwlock->waiting_readers != 0) {
    wake_rc = pthread_cond_broadcast(&p_place->read_condition);
  } else if (p_rwlock->blocked_writers.load() != 0) {
    wake_rc = pthread_cond_broadcast(&p_place->write_condition);
  }
  // The lock is free either way: readers may already have taken it, so a
  // failed wake is reported, not undone.
  if (wake_rc != 0) {
    pthread_mutex_unlock(&p_place->lock);
    return sr_i_raise_system_call("pthread_cond_broadcast", wake_rc);
  }
  if (const int rc = pthread_mutex_unlock(&p_place->lock); rc != 0) {
    return sr_i_raise_system_call("pthread_mutex_unlock", rc);
  }
  return 0;
}
