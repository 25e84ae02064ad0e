// The input and output primitives of table files: bounded retries of
// interrupted calls, each failure raised once with its code (206 for a
// refused access, 16 naming the full filesystem, 10 naming the call), short
// and partial writes and reads, the diagnostic file of a failed flush, the
// per-descriptor file lock, and renames made durable by a directory flush.

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <filesystem>
#include <functional>
#include <regex>
#include <string>
#include <utility>
#include <vector>

#include "qv_sr.h"
#include "sr_row_test_support.h"
#include "storage/sr_i_files.h"
#include "storage/sr_i_system_calls.h"

namespace {

using sr_test::last_error;

// What the scripted calls do: the first `interruptions` attempts fail with
// EINTR, the next `good_attempts` reach the C library (moving at most
// `most_bytes`), and every later one fails with `failure`.
struct script_t {
  int interruptions = 0;
  int good_attempts = INT_MAX;
  int failure = 0;
  size_t most_bytes = SIZE_MAX;
  int attempts = 0;
  int pauses = 0;
  std::vector<std::pair<const iovec *, int>> vectors{};  // what each writev got
};
script_t Script;

bool scripted_failure() {
  ++Script.attempts;
  if (Script.attempts <= Script.interruptions) {
    errno = EINTR;
    return true;
  }
  if (Script.attempts - Script.interruptions > Script.good_attempts) {
    errno = Script.failure;
    return true;
  }
  return false;
}

int counting_usleep(useconds_t microseconds) {
  EXPECT_EQ(microseconds, 10000u);
  ++Script.pauses;
  return 0;
}
ssize_t scripted_write(int fd, const void *p_buffer, size_t length) {
  return scripted_failure() ? -1 : ::write(fd, p_buffer, std::min(length, Script.most_bytes));
}
ssize_t scripted_read(int fd, void *p_buffer, size_t length) {
  return scripted_failure() ? -1 : ::read(fd, p_buffer, std::min(length, Script.most_bytes));
}
int scripted_fsync(int fd) {
  return scripted_failure() ? -1 : ::fsync(fd);
}

// Writes the first `most_bytes` of the vector, the way a short writev does.
ssize_t scripted_writev(int fd, const iovec *p_io_vector, int count) {
  Script.vectors.emplace_back(p_io_vector, count);
  if (scripted_failure()) {
    return -1;
  }
  std::string bytes;
  for (int at = 0; at < count; ++at) {
    bytes.append(static_cast<const char *>(p_io_vector[at].iov_base), p_io_vector[at].iov_len);
  }
  return ::write(fd, bytes.data(), std::min(bytes.size(), Script.most_bytes));
}

class Files : public ::testing::Test {
 protected:
  void SetUp() override {
    Script = script_t{};
    Sr_File_System.usleep = counting_usleep;
    ASSERT_NE((directory_ = sr_test::new_directory("qv_files")), "");
    // A failed flush leaves its diagnostic file in the working directory.
    previous_directory_ = std::filesystem::current_path();
    std::filesystem::current_path(directory_);
    ASSERT_EQ(sr_i_open_file(path().c_str(), O_RDWR | O_CREAT, &fd_), 0);
    cu_set_no_error_1();
  }
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    ::close(fd_);
    std::filesystem::current_path(previous_directory_);
    std::filesystem::remove_all(directory_);
  }
  std::string path(const char *p_name = "table") const { return (directory_ / p_name).string(); }

  std::filesystem::path directory_;
  std::filesystem::path previous_directory_;
  int fd_ = -1;
};

// One primitive driven through the door entry it depends on.
struct primitive_t {
  const char *p_call;  // raised from the function "sr_i_<function>"
  const char *p_function;
  std::function<void()> script_door;
  std::function<int32_t(int fd, const char *p_path)> run;
};

std::vector<primitive_t> primitives() {
  static char buffer[8] = "abcdefg";
  static iovec vector[1];
  static uint32_t counter;
  return {
      {"write", "write", [] { Sr_File_System.write = scripted_write; },
       [](int fd, const char *p_path) { return sr_i_write(fd, p_path, buffer, 7); }},
      {"writev", "writev", [] { Sr_File_System.writev = scripted_writev; },
       [](int fd, const char *p_path) {
         vector[0] = {buffer, 7};
         return sr_i_writev(fd, p_path, vector, 1, 7, &counter);
       }},
      {"fdatasync", "flush_file", [] { Sr_File_System.fsync = scripted_fsync; },
       [](int fd, const char *p_path) { return sr_i_flush_file(fd, p_path); }},
      {"read", "read", [] { Sr_File_System.read = scripted_read; },
       [](int fd, const char *) { return sr_i_read(fd, buffer, 7, &counter); }},
  };
}

TEST_F(Files, InterruptsAreRetried100TimesAndEveryFailureIsRaisedWithItsCode) {
  struct case_t {
    int interruptions;
    int failure;
    int attempts;
  };
  for (const primitive_t &primitive : primitives()) {
    for (const auto &[interruptions, failure, attempts] :
         {case_t{100, 0, 101}, case_t{INT_MAX, 0, 101}, case_t{0, ENOSPC, 1}, case_t{0, EACCES, 1},
          case_t{0, EIO, 1}}) {
      SCOPED_TRACE(std::string(primitive.p_call) + " " + std::to_string(interruptions) + " " +
                   std::to_string(failure));
      Script = script_t{.interruptions = interruptions,
                        .good_attempts = failure == 0 ? INT_MAX : 0,
                        .failure = failure};
      Sr_File_System = Sr_Default_File_System;
      Sr_File_System.usleep = counting_usleep;
      primitive.script_door();
      cu_set_no_error_1();
      const int32_t rc = primitive.run(fd_, path().c_str());
      EXPECT_EQ(Script.attempts, attempts);
      EXPECT_EQ(Script.pauses, attempts - 1);

      // Reading meets neither a full disk nor a refusal: every failure is 10.
      const bool reading = primitive.p_call == std::string("read");
      const std::string text = last_error().second;
      if (failure == ENOSPC && !reading) {
        EXPECT_EQ(rc, SR_E_FILESYSTEM_FULL);
        EXPECT_TRUE(text.starts_with("2605-016 The filesystem containing the local tree is full"))
            << text;
      } else if (failure == EACCES && !reading) {
        EXPECT_EQ(rc, SR_E_ACCESS);
        EXPECT_TRUE(text.starts_with("2605-206 ")) << text;
      } else if (failure != 0 || interruptions == INT_MAX) {
        const int raised = failure != 0 ? failure : EINTR;
        EXPECT_EQ(rc, SR_E_SYSTEM_CALL);
        EXPECT_TRUE(text.starts_with(std::string("2605-010 The ") + primitive.p_call +
                                     " system call unexpectedly returned an errno of " +
                                     std::to_string(raised) + " to the sr_i_" +
                                     primitive.p_function + " function near line "))
            << text;
      } else {
        EXPECT_EQ(rc, 0);
        EXPECT_EQ(text, "");
      }
    }
  }
}

TEST_F(Files, ShortTransfersMoveEveryByte) {
  Sr_File_System.write = scripted_write;
  Sr_File_System.read = scripted_read;
  Script.most_bytes = 3;
  ASSERT_EQ(sr_i_write(fd_, path().c_str(), "0123456789", 10), 0);
  EXPECT_EQ(sr_test::file_bytes(path()), "0123456789");
  EXPECT_EQ(Script.attempts, 4);

  ASSERT_EQ(::lseek(fd_, 0, SEEK_SET), 0);
  char buffer[8];
  uint32_t bytes_read = 99;
  ASSERT_EQ(sr_i_read(fd_, buffer, 8, &bytes_read), 0);
  EXPECT_EQ(std::string(buffer, bytes_read), "01234567");
  ASSERT_EQ(sr_i_read(fd_, buffer, 8, &bytes_read), 0);
  EXPECT_EQ(std::string(buffer, bytes_read), "89");  // fewer only at the end of the file

  // A partial writev resumes inside the vector and counts every byte.
  Sr_File_System.writev = scripted_writev;
  ASSERT_EQ(::ftruncate(fd_, 0), 0);
  ASSERT_EQ(::lseek(fd_, 0, SEEK_SET), 0);
  char abc[] = "abc", defg[] = "defg", hij[] = "hij";
  iovec vector[] = {{abc, 3}, {defg, 4}, {nullptr, 0}, {hij, 3}};
  uint32_t counter = 5;
  ASSERT_EQ(sr_i_writev(fd_, path().c_str(), vector, 4, 10, &counter), 0);
  EXPECT_EQ(sr_test::file_bytes(path()), "abcdefghij");
  EXPECT_EQ(counter, 15u);
  // "abc" ends the first entry exactly: the next call still starts with it.
  const std::vector<std::pair<const iovec *, int>> expected = {
      {&vector[0], 4}, {&vector[0], 4}, {&vector[1], 3}, {&vector[3], 1}};
  EXPECT_EQ(Script.vectors, expected);
  EXPECT_EQ(vector[0].iov_len, 0u);

  // Bytes written before a failure stay written and counted.
  Script = script_t{.good_attempts = 1, .failure = ENOSPC, .most_bytes = 4};
  iovec rest[] = {{abc, 3}, {defg, 4}};
  counter = 0;
  EXPECT_EQ(sr_i_writev(fd_, path().c_str(), rest, 2, 7, &counter), SR_E_FILESYSTEM_FULL);
  EXPECT_EQ(counter, 4u);
  EXPECT_EQ(sr_test::file_bytes(path()), "abcdefghijabcd");
}

TEST_F(Files, EveryFailedFlushRewritesTheDiagnosticFile) {
  Sr_File_System.fsync = scripted_fsync;
  const std::string diagnostic = "reginfo_pid." + std::to_string(getpid());
  const std::regex line_format(
      "function\\(fdatasync\\) errno\\(([0-9]+)\\) line\\([0-9]+\\) sccsid\\([^)]+\\)\n");
  std::smatch match;

  Script.interruptions = 1;  // recorded although the retry succeeds
  EXPECT_EQ(sr_i_flush_file(fd_, path().c_str()), 0);
  std::string text = sr_test::file_bytes(diagnostic);
  ASSERT_TRUE(std::regex_match(text, match, line_format)) << text;
  EXPECT_EQ(match[1], "4");

  Script = script_t{.good_attempts = 0, .failure = EIO};
  EXPECT_EQ(sr_i_flush_file(fd_, path().c_str()), SR_E_SYSTEM_CALL);
  text = sr_test::file_bytes(diagnostic);
  ASSERT_TRUE(std::regex_match(text, match, line_format)) << text;  // one line: truncated
  EXPECT_EQ(match[1], "5");
}

bool refused(int fd) {
  bool locked = true;
  return sr_i_try_lock_file(fd, &locked) == 0 && !locked;
}

TEST_F(Files, TheLockBelongsToTheDescriptorThatTookIt) {
  ASSERT_FALSE(refused(fd_));
  int second = -1;
  ASSERT_EQ(sr_i_open_file(path().c_str(), O_RDWR, &second), 0);
  EXPECT_TRUE(refused(second));

  // A process-wide lock would vanish here; this one stays with fd_.
  int third = -1;
  ASSERT_EQ(sr_i_open_file(path().c_str(), O_RDWR, &third), 0);
  sr_i_close_file(third);
  EXPECT_TRUE(refused(second));

  const pid_t child = ::fork();
  ASSERT_NE(child, -1);
  if (child == 0) {
    const int own = ::open(path().c_str(), O_RDWR);
    ::_exit(refused(own) ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

  ::close(fd_);
  fd_ = -1;
  EXPECT_EQ(sr_i_lock_file(second), 0);
  ::close(second);
}

// The door calls of the namespace, in order, with the directory flushes
// they are followed by.
std::vector<std::string> Namespace_Calls;

TEST_F(Files, RenamesRemovalsAndNewDirectoriesAreFlushedIntoTheirDirectory) {
  Namespace_Calls.clear();
  Sr_File_System.open = [](const char *p_path, int flags, mode_t mode) {
    if ((flags & O_DIRECTORY) != 0) {
      Namespace_Calls.push_back("open " + std::filesystem::path(p_path).filename().string());
    }
    return Sr_Default_File_System.open(p_path, flags, mode);
  };
  Sr_File_System.fsync = [](int fd) {
    Namespace_Calls.push_back("fsync");
    return Sr_Default_File_System.fsync(fd);
  };
  Sr_File_System.rename = [](const char *p_from, const char *p_to) {
    Namespace_Calls.push_back("rename");
    return Sr_Default_File_System.rename(p_from, p_to);
  };
  Sr_File_System.mkdir = [](const char *p_path, mode_t mode) {
    Namespace_Calls.push_back("mkdir");
    return Sr_Default_File_System.mkdir(p_path, mode);
  };
  Sr_File_System.unlink = [](const char *p_path) {
    Namespace_Calls.push_back("unlink");
    return Sr_Default_File_System.unlink(p_path);
  };
  const std::string directory_name = directory_.filename().string();

  bool renamed = false;
  ASSERT_EQ(sr_i_rename_durably(path().c_str(), path("moved").c_str(), &renamed), 0);
  EXPECT_TRUE(renamed);
  EXPECT_TRUE(std::filesystem::exists(path("moved")));
  EXPECT_EQ(Namespace_Calls,
            (std::vector<std::string>{"rename", "open " + directory_name, "fsync"}));

  Namespace_Calls.clear();
  ASSERT_EQ(sr_i_make_directory(path("sub").c_str()), 0);
  ASSERT_EQ(sr_i_make_directory(path("sub").c_str()), 0);  // there already: nothing to flush
  EXPECT_EQ(Namespace_Calls,
            (std::vector<std::string>{"mkdir", "open " + directory_name, "fsync", "mkdir"}));

  // A rename that fails leaves the name as it was and says so; a missing
  // file is no table.
  renamed = true;
  EXPECT_EQ(sr_i_rename_durably(path("absent").c_str(), path("moved").c_str(), &renamed),
            SR_E_NO_TABLE);
  EXPECT_FALSE(renamed);

  // A removal is flushed into its directory too; a missing file is no table.
  sr_test::write_file(path("doomed"), "x");
  Namespace_Calls.clear();
  ASSERT_EQ(sr_i_remove_file_durably(path("doomed").c_str()), 0);
  EXPECT_EQ(Namespace_Calls,
            (std::vector<std::string>{"unlink", "open " + directory_name, "fsync"}));
  EXPECT_EQ(sr_i_remove_file_durably(path("doomed").c_str()), SR_E_NO_TABLE);
}

}  // namespace
