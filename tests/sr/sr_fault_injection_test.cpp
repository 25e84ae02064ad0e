// Every file-system call of creating, opening, applying, committing and
// aborting a persistent table, made to fail one at a time. A counting proxy
// stands in the file-system door; each scripted step runs once to count its
// calls of each kind, then once per call and errno with exactly that call
// failing: ENOSPC, EIO, or EINTR on the call and on every retry of it. Each
// run checks the code and its message, that the table in memory goes on (a
// retried step or an abort, then a further transaction), and that the file,
// opened by another tree, holds a committed state: the old one, or the new
// one when the failed call came after the commit point.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "sr_i_errors.h"
#include "sr_i_file_system.h"
#include "sr_i_transaction.h"
#include "sr_row_test_support.h"

namespace {

using sr_test::column;
using sr_test::int32_value;
using sr_test::object;
using sr_test::string_value;

// ---- The proxy door ---------------------------------------------------

enum call_kind {
  Mkdir,
  Open,
  Close,
  Read,
  Write,
  Writev,
  Fsync,
  Lseek,
  Ftruncate,
  Rename,
  Unlink,
  Stat,
  Fstat,
  Lock,
  Total_Kinds
};
constexpr const char *Kind_Names[Total_Kinds] = {"mkdir",  "open",  "close", "read",      "write",
                                                 "writev", "fsync", "lseek", "ftruncate", "rename",
                                                 "unlink", "stat",  "fstat", "lock"};

// The one call to fail, and what the door saw.
struct injector_t {
  call_kind target = Total_Kinds;  // Total_Kinds: fail nothing
  int index = 0;                   // the target's ordinal among calls of its kind
  int error = 0;
  int counts[Total_Kinds] = {};
  // An interrupted call fails again on every retry: a retry is the same kind
  // of call after a pause, with no other call in between.
  call_kind interrupted = Total_Kinds;
  bool paused = false;
  int failures = 0;
};
injector_t Injector;

bool fails(call_kind kind) {
  const int ordinal = ++Injector.counts[kind];
  if (Injector.interrupted != Total_Kinds) {
    if (kind == Injector.interrupted && Injector.paused) {
      Injector.paused = false;
      ++Injector.failures;
      errno = EINTR;
      return true;
    }
    Injector.interrupted = Total_Kinds;
  }
  if (kind != Injector.target || ordinal != Injector.index) {
    return false;
  }
  ++Injector.failures;
  if (Injector.error == EINTR) {
    Injector.interrupted = kind;
    Injector.paused = false;
  }
  errno = Injector.error;
  return true;
}

const sr_i_file_system_calls_t &real() {
  return Sr_Default_File_System;
}

int proxy_mkdir(const char *p_path, mode_t mode) {
  return fails(Mkdir) ? -1 : real().mkdir(p_path, mode);
}
int proxy_open(const char *p_path, int flags, mode_t mode) {
  return fails(Open) ? -1 : real().open(p_path, flags, mode);
}
// Linux releases the descriptor even when close reports an error.
int proxy_close(int fd) {
  if (fails(Close)) {
    const int error_number = errno;
    real().close(fd);
    errno = error_number;
    return -1;
  }
  return real().close(fd);
}
ssize_t proxy_read(int fd, void *p_buffer, size_t length) {
  return fails(Read) ? -1 : real().read(fd, p_buffer, length);
}
ssize_t proxy_write(int fd, const void *p_buffer, size_t length) {
  return fails(Write) ? -1 : real().write(fd, p_buffer, length);
}
ssize_t proxy_writev(int fd, const struct iovec *p_io_vector, int count) {
  return fails(Writev) ? -1 : real().writev(fd, p_io_vector, count);
}
int proxy_fsync(int fd) {
  return fails(Fsync) ? -1 : real().fsync(fd);
}
off_t proxy_lseek(int fd, off_t offset, int whence) {
  return fails(Lseek) ? -1 : real().lseek(fd, offset, whence);
}
int proxy_ftruncate(int fd, off_t length) {
  return fails(Ftruncate) ? -1 : real().ftruncate(fd, length);
}
int proxy_rename(const char *p_from, const char *p_to) {
  return fails(Rename) ? -1 : real().rename(p_from, p_to);
}
int proxy_unlink(const char *p_path) {
  return fails(Unlink) ? -1 : real().unlink(p_path);
}
int proxy_stat(const char *p_path, struct stat *p_status) {
  return fails(Stat) ? -1 : real().stat(p_path, p_status);
}
int proxy_fstat(int fd, struct stat *p_status) {
  return fails(Fstat) ? -1 : real().fstat(fd, p_status);
}
int proxy_lock(int fd, int command, struct flock *p_lock) {
  return fails(Lock) ? -1 : real().lock(fd, command, p_lock);
}
// Retries come at once.
int proxy_usleep(useconds_t) {
  Injector.paused = Injector.interrupted != Total_Kinds;
  return 0;
}

constexpr sr_i_file_system_calls_t Proxy_Door = {
    .mkdir = proxy_mkdir,
    .open = proxy_open,
    .close = proxy_close,
    .read = proxy_read,
    .write = proxy_write,
    .writev = proxy_writev,
    .fsync = proxy_fsync,
    .lseek = proxy_lseek,
    .ftruncate = proxy_ftruncate,
    .rename = proxy_rename,
    .unlink = proxy_unlink,
    .stat = proxy_stat,
    .fstat = proxy_fstat,
    .lock = proxy_lock,
    .usleep = proxy_usleep,
};

// ---- Steps and what their failures must give ---------------------------

enum class step_t {
  create,
  open,
  apply_append,
  apply_rewrite,
  commit_append,
  commit_rewrite,
  abort_append,
  abort_rewrite
};

const char *name_of(step_t step) {
  constexpr const char *names[] = {
      "create",          "open",           "apply (append)", "apply (rewrite)", "commit (append)",
      "commit (rename)", "abort (append)", "abort (rewrite)"};
  return names[static_cast<int>(step)];
}

bool is_rewrite(step_t step) {
  return step == step_t::apply_rewrite || step == step_t::commit_rewrite ||
         step == step_t::abort_rewrite;
}
bool is_apply(step_t step) {
  return step == step_t::apply_append || step == step_t::apply_rewrite;
}
bool is_commit(step_t step) {
  return step == step_t::commit_append || step == step_t::commit_rewrite;
}
bool is_abort(step_t step) {
  return step == step_t::abort_append || step == step_t::abort_rewrite;
}

// The calls each step cannot do without; a step that made none of one would
// leave its failure untested.
std::vector<call_kind> essential_calls(step_t step) {
  switch (step) {
    case step_t::create:
      return {Open, Lock, Stat, Writev, Fsync, Rename};
    case step_t::open:
      return {Open, Lock, Lseek, Read};
    case step_t::apply_append:
      return {Lseek, Writev, Fsync};
    case step_t::apply_rewrite:
      return {Open, Lock, Writev, Fsync};
    case step_t::commit_append:
      return {Lseek, Write, Fsync};
    case step_t::commit_rewrite:
      return {Rename};
    case step_t::abort_append:
      return {Ftruncate, Fsync};
    case step_t::abort_rewrite:
      return {Unlink};
  }
  return {};
}

// What a failed call is reported as.
struct outcome_t {
  int32_t code;
  const char *p_call = nullptr;  // the system call that message 2605-010 names
};

outcome_t expected_outcome(step_t step, call_kind kind, int error) {
  // Abort ends at the committed state whatever the file system says.
  if (is_abort(step)) {
    return {0};
  }
  switch (kind) {
    case Close:
    case Unlink:
    case Ftruncate:
      return {0};
    case Stat:
    case Fstat:
      // Creation does not write over a file it cannot examine.
      if (step == step_t::create) {
        return {SR_E_TABLE_EXISTS};
      }
      break;
    case Open:
    case Rename:
    case Write:
    case Writev:
    case Fsync:
      if (error == ENOSPC) {
        return {SR_E_FILESYSTEM_FULL};
      }
      break;
    default:
      break;
  }
  constexpr const char *calls[Total_Kinds] = {
      "mkdir",   "open",      "close",  "read",   "write", "writev", "fdatasync",
      "lseek64", "ftruncate", "rename", "unlink", "stat",  "fstat",  "lockf"};
  return {SR_E_SYSTEM_CALL, calls[kind]};
}

// The calls the file layer repeats after EINTR.
bool retried_after_interruption(call_kind kind) {
  return kind == Open || kind == Read || kind == Write || kind == Writev || kind == Fsync ||
         kind == Lock;
}

enum class recovery_t { retry, abort };

struct fault_t {
  call_kind kind = Total_Kinds;  // Total_Kinds: a run that counts calls
  int index = 0;
  int error = 0;
  recovery_t recovery = recovery_t::retry;
};

std::string describe(step_t step, const fault_t &fault) {
  return std::string(name_of(step)) + ": " + Kind_Names[fault.kind] + " #" +
         std::to_string(fault.index) + " fails with errno " + std::to_string(fault.error) +
         (fault.recovery == recovery_t::abort ? ", then abort" : ", then retry");
}

// ---- Rows -------------------------------------------------------------

using rows_t = std::map<std::string, int32_t>;

const rows_t Committed_Rows = {{"a", 1}, {"b", 2}, {"c", 3}};
// More added rows than one gathered write takes, so that a write can fail
// after an earlier one went through.
constexpr int Added_Rows = 17;

std::string added_name(int number) {
  char name[8];
  std::snprintf(name, sizeof name, "d%02d", number);
  return name;
}

// Committed_Rows after the pending changes: "a" deleted, "b" set, rows added.
rows_t applied_rows() {
  rows_t rows = {{"b", 20}, {"c", 3}};
  for (int number = 0; number < Added_Rows; ++number) {
    rows[added_name(number)] = number;
  }
  return rows;
}

int32_t add_row(sr_opaque_handle_t table, const std::string &name, int32_t count) {
  qv_value_t key = string_value(name.c_str());
  qv_value_t number = int32_value(count);
  const char *names[] = {"name", "count"};
  qv_value_t *values[] = {&key, &number};
  return sr_add_row_1(table, names, values, 2);
}

// The rows of one view, by packed index; rows deleted in that view skipped.
rows_t rows_in(sr_opaque_handle_t table, uint32_t uncommitted) {
  rows_t rows;
  for (int32_t at = 0;; ++at) {
    qv_value_t name{};
    qv_value_t count{};
    const char *names[] = {"name", "count"};
    qv_value_t *values[] = {&name, &count};
    const int32_t rc =
        sr_get_fields_by_index_and_visibility_1(table, at, names, values, 2, uncommitted, nullptr);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      return rows;
    }
    if (rc == SR_E_ROW_DELETED) {
      continue;
    }
    if (rc != 0) {
      ADD_FAILURE() << "reading packed row " << at << " gave " << rc;
      return rows;
    }
    rows[name.ptr_char] = count.val_int32;
    std::free(name.ptr_char);
  }
}

int32_t packed_index_of(sr_opaque_handle_t table, const char *p_name) {
  for (int32_t at = 0;; ++at) {
    qv_value_t name{};
    if (sr_get_field_by_index_1(table, at, "name", &name) != 0) {
      return -1;
    }
    const bool found = std::string(name.ptr_char) == p_name;
    std::free(name.ptr_char);
    if (found) {
      return at;
    }
  }
}

std::string last_error_text(int32_t *p_code) {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  *p_code = p_error->code;
  std::string text = p_error->p_text;
  cu_rel_error_1(p_error);
  return text;
}

// ---- The fixture ------------------------------------------------------

class FaultInjection : public ::testing::Test {
 protected:
  void SetUp() override {
    // tmpfs where there is one: the runs flush a few thousand times.
    const std::filesystem::path base = std::filesystem::exists("/dev/shm")
                                           ? std::filesystem::path("/dev/shm")
                                           : std::filesystem::temp_directory_path();
    std::string pattern = (base / "qv_fault_XXXXXX").string();
    ASSERT_NE(mkdtemp(pattern.data()), nullptr);
    root_ = pattern;
    mount_directory_ = (root_ / "tables").string();
    // A failed flush leaves its diagnostic file in the working directory.
    previous_directory_ = std::filesystem::current_path();
    std::filesystem::current_path(root_);
    // The full filesystem is named from a mount table of our own.
    mount_table_ = (root_ / "mtab").string();
    std::ofstream(mount_table_) << "qv_fault_device " << mount_directory_ << " tmpfs rw 0 0\n";
    saved_mount_table_ = Sr_Mount_Table_Path;
    Sr_Mount_Table_Path = mount_table_.c_str();
    Sr_File_System = Proxy_Door;
    Injector = injector_t{};
  }
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    Sr_Mount_Table_Path = saved_mount_table_;
    std::filesystem::current_path(previous_directory_);
    std::filesystem::remove_all(root_);
  }

  // Runs `step` once to count its calls, then once per call of each kind
  // and errno with that call failing, and once more with an abort after the
  // failure where the step leaves something to abort.
  void fail_every_call(step_t step) {
    run(step, fault_t{});
    ASSERT_FALSE(HasFatalFailure()) << name_of(step) << " fails without any fault";
    int counts[Total_Kinds];
    std::copy(std::begin(step_counts_), std::end(step_counts_), counts);
    for (const call_kind kind : essential_calls(step)) {
      EXPECT_GT(counts[kind], 0) << name_of(step) << " made no " << Kind_Names[kind] << " call";
    }
    for (int kind = 0; kind < Total_Kinds; ++kind) {
      for (int index = 1; index <= counts[kind]; ++index) {
        for (const int error : {ENOSPC, EIO, EINTR}) {
          ++injected_;
          for (const recovery_t recovery : {recovery_t::retry, recovery_t::abort}) {
            const fault_t fault{static_cast<call_kind>(kind), index, error, recovery};
            if (!worth_running(step, fault)) {
              continue;
            }
            SCOPED_TRACE(describe(step, fault));
            run(step, fault);
            if (HasFatalFailure()) {
              return;
            }
            ++runs_;
          }
        }
      }
    }
  }

  // Abort is a recovery only where a failed apply or commit leaves applied
  // or pending changes.
  static bool worth_running(step_t step, const fault_t &fault) {
    const bool failed = expected_outcome(step, fault.kind, fault.error).code != 0;
    if (fault.recovery == recovery_t::abort) {
      return failed && (is_apply(step) || is_commit(step));
    }
    return true;
  }

  void report(const char *p_what) const {
    std::printf("[ injected ] %s: %d calls x errnos, %d runs\n", p_what, injected_, runs_);
  }

  // ---- One run ----

  void run(step_t step, const fault_t &fault) {
    std::filesystem::remove_all(mount_directory_);
    std::filesystem::create_directory(mount_directory_);
    sr_opaque_handle_t tree = mounted_tree();
    ASSERT_NE(tree, nullptr);
    tree_ = tree;
    run_in(step, fault);
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
  }

  void run_in(step_t step, const fault_t &fault) {
    sr_opaque_handle_t table = nullptr;
    const bool rewrite = is_rewrite(step);
    std::vector<unsigned char> file_before;
    if (step != step_t::create) {
      ASSERT_EQ(create_table(&table), 0);
      for (const auto &[name, count] : Committed_Rows) {
        ASSERT_EQ(add_row(table, name, count), 0);
      }
      ASSERT_EQ(sr_apply_1(table, 0), 0);
      ASSERT_EQ(sr_commit_1(table), 0);
    }
    if (step == step_t::open) {
      // Another program opens the file.
      ASSERT_EQ(sr_close_tree_1(tree_), 0);
      tree_ = mounted_tree();
      ASSERT_NE(tree_, nullptr);
      file_before = table_file_bytes();
    }
    if (is_apply(step) || is_commit(step) || is_abort(step)) {
      ASSERT_NO_FATAL_FAILURE(make_pending_changes(table));
    }
    if (is_commit(step) || is_abort(step)) {
      ASSERT_EQ(apply(table, rewrite), 0);
    }

    cu_set_no_error_1();
    arm(fault);
    const int32_t rc = take_step(step, &table);
    disarm();
    const outcome_t expected =
        fault.kind == Total_Kinds ? outcome_t{0} : expected_outcome(step, fault.kind, fault.error);
    ASSERT_EQ(rc, expected.code);
    if (rc != 0) {
      expect_message(expected, fault.error);
    }
    if (fault.error == EINTR && retried_after_interruption(fault.kind)) {
      EXPECT_EQ(Injector.failures, 101)
          << "an interrupted call is tried once and retried 100 times";
    }

    // What the file holds now, and what the table takes on from.
    rows_t committed = step == step_t::create ? rows_t{} : Committed_Rows;
    switch (step) {
      case step_t::create:
        if (rc != 0) {
          EXPECT_FALSE(std::filesystem::exists(table_file())) << "a failed creation left its file";
          EXPECT_FALSE(std::filesystem::exists(table_file() + ".rewrite"))
              << "a failed creation left its rewrite file";
          ASSERT_EQ(create_table(&table), 0);
        }
        EXPECT_EQ(rows_on_disk(), committed);
        break;
      case step_t::open:
        EXPECT_EQ(table_file_bytes(), file_before) << "opening changed the file";
        if (rc != 0) {
          ASSERT_EQ(sr_open_table_1(tree_, "/disk/t", 6, &table), 0);
        }
        EXPECT_EQ(rows_in(table, 0), committed);
        break;
      case step_t::apply_append:
      case step_t::apply_rewrite:
      case step_t::commit_append:
      case step_t::commit_rewrite: {
        const bool committed_now = is_commit(step) && rc == 0;
        EXPECT_EQ(rows_on_disk(), committed_now ? applied_rows() : committed);
        // A failed rewriting apply removes its file; a failed rename keeps
        // it for the retried commit.
        if (rewrite && rc != 0 && is_apply(step)) {
          EXPECT_FALSE(std::filesystem::exists(table_file() + ".rewrite"))
              << "a failed rewrite left its file";
        }
        if (rc != 0 && fault.recovery == recovery_t::abort) {
          ASSERT_EQ(sr_abort_1(table), 0);
        } else {
          if (rc != 0 && is_apply(step)) {
            ASSERT_EQ(apply(table, rewrite), 0) << "the apply cannot be retried";
          }
          if (!committed_now) {
            ASSERT_EQ(sr_commit_1(table), 0) << "the commit cannot be retried";
          }
          committed = applied_rows();
        }
        break;
      }
      case step_t::abort_append:
      case step_t::abort_rewrite:
        EXPECT_EQ(rows_in(table, 1), committed) << "abort kept changes";
        break;
    }
    EXPECT_EQ(rows_on_disk(), committed);
    EXPECT_EQ(rows_in(table, 0), committed);

    // The table takes a further transaction, the same way.
    ASSERT_EQ(add_row(table, "late", 99), 0);
    ASSERT_EQ(apply(table, rewrite), 0);
    ASSERT_EQ(sr_commit_1(table), 0);
    committed["late"] = 99;
    EXPECT_EQ(rows_on_disk(), committed);
    EXPECT_EQ(rows_in(table, 0), committed);
  }

  // ---- Helpers ----

  sr_opaque_handle_t mounted_tree() const {
    sr_opaque_handle_t tree = nullptr;
    EXPECT_EQ(sr_open_tree_1(&tree, 0, 0), 0);
    EXPECT_EQ(sr_mount_local_tree_1(tree, "/disk", mount_directory_.c_str(), 0), 0);
    return tree;
  }

  // An explicitly controlled table keyed by "name", with "count". The key
  // is not checked on adding: a checked key without a hash table is scanned
  // for, and that scan refuses any row that takes the entry of a deleted
  // one, which the further transactions here would do.
  int32_t create_table(sr_opaque_handle_t *p_table) const {
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY_NOCHECK),
                                        column("count", QV_INT32, SR_STANDARD)};
    return sr_create_table_1(tree_, "/disk/t", columns.data(), 2, sr_test::Explicit, p_table);
  }

  static void make_pending_changes(sr_opaque_handle_t table) {
    qv_value_t twenty = int32_value(20);
    ASSERT_EQ(sr_set_field_by_key_1(table, string_value("b"), "count", &twenty), 0);
    const int32_t packed = packed_index_of(table, "a");
    ASSERT_GE(packed, 0);
    ASSERT_EQ(sr_delete_row_by_index_1(table, static_cast<uint32_t>(packed)), 0);
    for (int number = 0; number < Added_Rows; ++number) {
      ASSERT_EQ(add_row(table, added_name(number), number), 0);
    }
  }

  // A rewrite is asked for directly: the exported apply rewrites only large,
  // mostly dead files.
  static int32_t apply(sr_opaque_handle_t table, bool rewrite) {
    return rewrite ? sr_i_apply(object(table), 1, 0) : sr_apply_1(table, 0);
  }

  int32_t take_step(step_t step, sr_opaque_handle_t *p_table) const {
    switch (step) {
      case step_t::create:
        return create_table(p_table);
      case step_t::open:
        return sr_open_table_1(tree_, "/disk/t", 6, p_table);
      case step_t::apply_append:
      case step_t::apply_rewrite:
        return apply(*p_table, is_rewrite(step));
      case step_t::commit_append:
      case step_t::commit_rewrite:
        return sr_commit_1(*p_table);
      case step_t::abort_append:
      case step_t::abort_rewrite:
        return sr_abort_1(*p_table);
    }
    return -1;
  }

  void arm(const fault_t &fault) {
    Injector = injector_t{};
    Injector.target = fault.kind;
    Injector.index = fault.index;
    Injector.error = fault.error;
  }

  void disarm() {
    std::copy(std::begin(Injector.counts), std::end(Injector.counts), std::begin(step_counts_));
    Injector.target = Total_Kinds;
    Injector.interrupted = Total_Kinds;
  }

  void expect_message(const outcome_t &expected, int error) const {
    int32_t code = 0;
    const std::string text = last_error_text(&code);
    EXPECT_EQ(code, expected.code);
    if (expected.code == SR_E_FILESYSTEM_FULL) {
      EXPECT_EQ(text,
                "2605-016 The filesystem containing the local tree is full: "
                "mounted(qv_fault_device) mounted_over(" +
                    mount_directory_ + ").\n");
    } else if (expected.code == SR_E_SYSTEM_CALL) {
      const std::string start = "2605-010 The " + std::string(expected.p_call) +
                                " system call unexpectedly returned an errno of " +
                                std::to_string(error) + " to the ";
      EXPECT_EQ(text.rfind(start, 0), 0u) << text;
      EXPECT_NE(text.find(" of file sr/sr_"), std::string::npos) << text;
    } else {
      EXPECT_EQ(text.rfind("2605-" + std::to_string(expected.code) + " ", 0), 0u) << text;
    }
  }

  std::string table_file() const { return mount_directory_ + "/t"; }

  std::vector<unsigned char> table_file_bytes() const {
    std::ifstream in(table_file(), std::ios::binary);
    return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  }

  // The committed rows another program finds in the file.
  rows_t rows_on_disk() const {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree, "/disk/t", 1, &table);
    rows_t rows;
    if (rc == 0) {
      rows = rows_in(table, 0);
    } else {
      rows["<the file does not open: " + std::to_string(rc) + ">"] = rc;
    }
    EXPECT_EQ(sr_close_tree_1(tree), 0);
    return rows;
  }

  std::filesystem::path root_;
  std::filesystem::path previous_directory_;
  std::string mount_directory_;
  std::string mount_table_;
  const char *saved_mount_table_ = nullptr;
  sr_opaque_handle_t tree_ = nullptr;
  int step_counts_[Total_Kinds] = {};
  int injected_ = 0;  // failing calls: call sites times errnos
  int runs_ = 0;      // each with its recovery
};

TEST_F(FaultInjection, CreateAndOpenFailuresLeaveNoFileOrTheFileAsItWas) {
  for (const step_t step : {step_t::create, step_t::open}) {
    fail_every_call(step);
    ASSERT_FALSE(HasFatalFailure());
  }
  report("create and open");
}

TEST_F(FaultInjection, ApplyFailuresKeepTheCommittedFileAndThePendingChanges) {
  for (const step_t step : {step_t::apply_append, step_t::apply_rewrite}) {
    fail_every_call(step);
    ASSERT_FALSE(HasFatalFailure());
  }
  report("apply");
}

TEST_F(FaultInjection, CommitAndAbortFailuresLeaveACommittedState) {
  for (const step_t step : {step_t::commit_append, step_t::commit_rewrite, step_t::abort_append,
                            step_t::abort_rewrite}) {
    fail_every_call(step);
    ASSERT_FALSE(HasFatalFailure());
  }
  report("commit and abort");
}

}  // namespace
