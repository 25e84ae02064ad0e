// sr_i_fork.cpp - what a forked child must know: the child-only fork
// handler, installed once per process, sets In_Child_Process so that the
// frame refuses every changing call there. No prepare or parent handler is
// installed: the locks are not taken around fork(), so a lock held by
// another thread of the parent at the fork stays held, for ever, in the
// child; refusing the changing calls keeps the child from waiting on it.
// The waiting places the locks share are made new in the child: one whose
// mutex a parent thread held at the fork for some other lock would
// otherwise block the child's use of every lock that waits there.

#include <cstdio>
#include <cstdlib>

#include "frame/sr_i_frame.h"
#include "frame/sr_i_read_write_lock.h"

pthread_mutex_t ForkMutex = PTHREAD_MUTEX_INITIALIZER;
std::atomic<int> In_Child_Process{0};

namespace {

pthread_once_t ForkHandlersAreEstablished = PTHREAD_ONCE_INIT;

void ForkChildHandler() {
  In_Child_Process.store(1, std::memory_order_relaxed);
  sr_i_rw_renew_waiting_places_in_child();
}

void sr_reg_once() {
  // Without the handler a forked child could hang on a lock held at the
  // fork; a process that cannot have it must not go on.
  if (pthread_atfork(nullptr, nullptr, ForkChildHandler) != 0) {
    std::fputs("qv_sr: the fork handler could not be installed\n", stderr);
    std::abort();
  }
}

}  // namespace

void sr_i_establish_fork_handlers() {
  pthread_once(&ForkHandlersAreEstablished, sr_reg_once);
}
