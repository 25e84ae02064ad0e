// sr_killed_child.h - a child process that stands for another program,
// killed with SIGKILL at a chosen moment: the crash tests' way of stopping
// a writer anywhere inside a call. The child tells the parent what it does
// in lines on a pipe ("P ..." before a change may begin, "C ..." once it
// has returned, "E ..." before it gives up); the parent kills it once it
// has read a number of lines and a delay more has passed, and hands every
// complete line on. A line cut short by the kill is dropped.

#ifndef SR_KILLED_CHILD_H
#define SR_KILLED_CHILD_H

#include <poll.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "frame/sr_i_frame.h"

namespace sr_killed_child {

#if defined(__has_feature)
#define SR_HAS_FEATURE(feature) __has_feature(feature)
#else
#define SR_HAS_FEATURE(feature) 0
#endif

// The kills a crash test makes in this build for `normal` in a plain one:
// every child runs slower under a sanitizer, so a half under ASan and a
// third under TSan keep the suite's time in bounds.
constexpr int scaled_crash_points(int normal) {
#if defined(__SANITIZE_THREAD__) || SR_HAS_FEATURE(thread_sanitizer)
  return normal / 3;
#elif defined(__SANITIZE_ADDRESS__) || SR_HAS_FEATURE(address_sanitizer)
  return normal / 2;
#else
  return normal;
#endif
}

// Writes one line to the parent; a child that cannot is of no more use.
inline void say(int pipe_fd, const std::string &line) {
  const std::string text = line + "\n";
  // Short enough to go through the pipe in one piece.
  if (write(pipe_fd, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    _exit(3);
  }
}

// Runs `body(pipe_fd)` in a child process, which must not return, hands
// each line it writes to `take_line`, and kills it once `messages` lines
// have come and `delay` microseconds more have passed. Returns "" when the
// child died of the kill, or what went wrong instead: it hung (said nothing
// for a minute) or ended by itself.
template <typename Body, typename Take_Line>
std::string run_and_kill(int messages, useconds_t delay, Body body, Take_Line take_line) {
  int ends[2];
  if (pipe(ends) != 0) {
    return "pipe";
  }
  const pid_t child = fork();
  if (child == 0) {
    close(ends[0]);
    // The child stands for another program. This process runs no other
    // thread and holds no registry lock at the fork, so the guard that
    // keeps forked children from changing tables can be lifted.
    In_Child_Process.store(0);
    body(ends[1]);
    _exit(4);
  }
  close(ends[1]);
  std::string problem;
  std::string pending;
  int lines = 0;
  bool killed = false;
  char buffer[8192];
  for (;;) {
    if (!killed && lines >= messages) {
      usleep(delay);
      kill(child, SIGKILL);
      killed = true;
    }
    pollfd readable{ends[0], POLLIN, 0};
    if (!killed && poll(&readable, 1, 60000) == 0) {
      kill(child, SIGKILL);
      killed = true;
      problem = "the child hung after " + std::to_string(lines) + " messages";
    }
    const ssize_t got = read(ends[0], buffer, sizeof buffer);
    if (got < 0 && errno == EINTR) {
      continue;
    }
    if (got <= 0) {
      break;
    }
    pending.append(buffer, static_cast<size_t>(got));
    for (size_t end; (end = pending.find('\n')) != std::string::npos;) {
      take_line(pending.substr(0, end));
      pending.erase(0, end + 1);
      ++lines;
    }
  }
  close(ends[0]);
  int status = 0;
  waitpid(child, &status, 0);
  if (problem.empty() && !(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)) {
    problem = "the child ended by itself, status " + std::to_string(status);
  }
  return problem;
}

}  // namespace sr_killed_child

#endif  // SR_KILLED_CHILD_H
