// The frame of the exported functions, exercised through the frame itself
// with entry points of the test's own: error information on success and
// failure, exceptions turned into codes, ForkMutex serialising the changing
// calls only, and the forked-child guard.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <functional>
#include <semaphore>
#include <stdexcept>
#include <string>
#include <thread>

#include "frame/sr_i_frame.h"
#include "sr_row_test_support.h"

namespace {

constexpr sr_i_entry_point_t Changing_Call{1, true};
constexpr sr_i_entry_point_t Reading_Call{45, false};

// What the body of an entry point ends with becomes the call's code and
// the thread's error: success clears a stale message, a raised error keeps
// its message, no memory is 12 naming the entry point, anything else 15.
TEST(Frame, TheBodysOutcomeBecomesTheCodeAndTheError) {
  const struct {
    std::function<int32_t()> body;
    int32_t code;
    std::string message_start;
  } cases[] = {
      {[] { return 0; }, 0, ""},
      {[] { return sr_i_raise(SR_E_NO_ROWS); }, 205,
       "2605-205 There are no rows to delete from the table.\n"},
      {[]() -> int32_t { throw std::bad_alloc(); }, 12,
       "2605-012 Memory could not be allocated in the TestBody function"},
      {[]() -> int32_t { throw std::runtime_error("unexpected"); }, 15, "2605-015 "},
  };
  for (const auto &one : cases) {
    cu_set_error_1(205, 0, "", 1, 22, "stale\n");
    EXPECT_EQ(sr_i_run_entry_point(Changing_Call, one.body), one.code);
    const auto [code, text] = sr_test::last_error();
    EXPECT_EQ(code, one.code);
    EXPECT_TRUE(text.starts_with(one.message_start)) << text;
    EXPECT_EQ(text.empty(), one.code == 0) << text;
  }
  EXPECT_NE(sr_test::last_error().second.find("of file tests/sr/sr_frame_test"), std::string::npos);
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
