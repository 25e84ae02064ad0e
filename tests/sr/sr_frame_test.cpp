// The frame of the exported functions, exercised through the frame itself
// with entry points of the test's own: error information on success and
// failure, exceptions turned into codes, ForkMutex serialising the changing
// calls only, and the forked-child guard.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <semaphore>
#include <stdexcept>
#include <string>
#include <thread>

#include "sr_i_frame.h"

namespace {

constexpr sr_i_entry_point_t Changing_Call{1, true};
constexpr sr_i_entry_point_t Reading_Call{45, false};

struct last_error {
  int32_t code;
  std::string text;
};

last_error read_last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  last_error copy{p_error->code, p_error->p_text};
  cu_rel_error_1(p_error);
  return copy;
}

TEST(Frame, SuccessClearsAStaleMessage) {
  cu_set_error_1(205, 0, "", 1, 22, "stale\n");
  EXPECT_EQ(sr_i_run_entry_point(Reading_Call, [] { return 0; }), 0);
  EXPECT_EQ(read_last_error().code, 0);
  EXPECT_EQ(read_last_error().text, "");
}

TEST(Frame, FailureKeepsTheMessageRaisedWhereItHappened) {
  EXPECT_EQ(sr_i_run_entry_point(Changing_Call, [] { return sr_i_raise(SR_E_NO_ROWS); }), 205);
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, 205);
  EXPECT_EQ(error.text, "2605-205 There are no rows to delete from the table.\n");
}

TEST(Frame, OutOfMemoryBecomes12NamingTheEntryPoint) {
  const int32_t rc =
      sr_i_run_entry_point(Changing_Call, []() -> int32_t { throw std::bad_alloc(); });
  EXPECT_EQ(rc, SR_E_NO_MEMORY);
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, 12);
  EXPECT_EQ(error.text.rfind("2605-012 Memory could not be allocated in the TestBody function", 0),
            0u)
      << error.text;
  EXPECT_NE(error.text.find("of file tests/sr/sr_frame_test"), std::string::npos);
}

TEST(Frame, AnyOtherExceptionBecomes15) {
  const int32_t rc = sr_i_run_entry_point(
      Reading_Call, []() -> int32_t { throw std::runtime_error("unexpected"); });
  EXPECT_EQ(rc, SR_E_INTERNAL);
  EXPECT_EQ(read_last_error().code, 15);
}

TEST(Frame, ChangingCallsHoldForkMutexWhileReadingCallsDoNot) {
  std::binary_semaphore inside(0), leave(0);
  std::thread changer([&] {
    EXPECT_EQ(sr_i_run_entry_point(Changing_Call,
                                   [&] {
                                     inside.release();
                                     leave.acquire();
                                     return 0;
                                   }),
              0);
  });
  inside.acquire();
  EXPECT_EQ(pthread_mutex_trylock(&ForkMutex), EBUSY);
  // A reading call goes ahead while the changing call is inside.
  EXPECT_EQ(sr_i_run_entry_point(Reading_Call, [] { return 0; }), 0);
  leave.release();
  changer.join();
  ASSERT_EQ(pthread_mutex_trylock(&ForkMutex), 0);
  pthread_mutex_unlock(&ForkMutex);
}

TEST(Frame, ForkedChildRefusesChangingCallsButStillReads) {
  sr_opaque_handle_t tree = nullptr;
  ASSERT_EQ(sr_open_tree_1(&tree, 0, 0), 0);  // installs the fork handler
  // ForkMutex is held at the fork, as it would be by a thread of the parent
  // in the middle of a change: the child must not wait for it.
  pthread_mutex_lock(&ForkMutex);
  cu_set_error_1(204, 0, "", 1, 21, "before the fork\n");
  const pid_t child = fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    bool body_ran = false;
    const int32_t changing = sr_i_run_entry_point(Changing_Call, [&] {
      body_ran = true;
      return 0;
    });
    cu_error_t *p_error = nullptr;
    cu_get_error_1(&p_error);
    const bool message_untouched = p_error->code == 204;
    cu_rel_error_1(p_error);
    const int32_t reading = sr_i_run_entry_point(Reading_Call, [] { return 0; });
    _exit(changing == 15 && !body_ran && message_untouched && reading == 0 ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  pthread_mutex_unlock(&ForkMutex);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  // The parent is not a forked child: its changing calls run.
  bool body_ran = false;
  EXPECT_EQ(sr_i_run_entry_point(Changing_Call,
                                 [&] {
                                   body_ran = true;
                                   return 0;
                                 }),
            0);
  EXPECT_TRUE(body_ran);
  EXPECT_EQ(sr_close_tree_1(tree), 0);
}

}  // namespace
