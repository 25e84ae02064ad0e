// Every file-system call of creating, opening, applying, committing and
// aborting a persistent table, and of changing its schema, made to fail one
// at a time. A counting proxy
// stands in the file-system door; each scripted step runs once to count its
// calls of each kind, then once per call and errno with exactly that call
// failing: ENOSPC, EIO, or EINTR on the call and on every retry of it. Each
// run checks the code and its message, that the table in memory goes on (a
// retried step or an abort, then a further transaction), and that the file,
// opened by another tree, holds a committed state: the old one, or the new
// one when the failed call came after the commit point. Then copies, moves
// and deletions of tables, each failing call leaving the target and the
// source as they were and no side file; last, a read-only table read again
// for writing, once with a read that fails.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <string>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "sr_row_test_support.h"
#include "storage/sr_i_system_calls.h"

namespace {

using namespace sr_test;

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
  Opendir,
  Readdir,
  Closedir,
  Total_Kinds
};
// As message 2605-010 names them.
constexpr const char *Call_Names[Total_Kinds] = {
    "mkdir",  "open",   "close", "read",  "write", "writev",  "fdatasync", "lseek64", "ftruncate",
    "rename", "unlink", "stat",  "fstat", "lockf", "opendir", "readdir",   "closedir"};

// The one call to fail, and what the door saw.
struct injector_t {
  call_kind target = Total_Kinds;  // Total_Kinds: fail nothing
  int index = 0;                   // the target's ordinal among calls of its kind
  int error = 0;
  int counts[Total_Kinds] = {};
  // An interrupted call fails again on every retry: a retry is the same kind
  // of call after a pause. Calls of other kinds may come between (a failed
  // flush writes its diagnostic file before the retry).
  call_kind interrupted = Total_Kinds;
  bool paused = false;
  int failures = 0;
};
injector_t Injector;

bool fails(call_kind kind) {
  const int ordinal = ++Injector.counts[kind];
  if (kind == Injector.interrupted) {
    if (Injector.paused) {
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

// A door entry that fails when the injector says so and otherwise makes the
// real call.
template <call_kind Kind, auto Entry>
constexpr auto proxy = [](auto... arguments) {
  using result = decltype((Sr_Default_File_System.*Entry)(arguments...));
  return fails(Kind) ? result(-1) : (Sr_Default_File_System.*Entry)(arguments...);
};

using door = sr_i_file_system_calls_t;
constexpr door Proxy_Door = {
    .mkdir = proxy<Mkdir, &door::mkdir>,
    .open = proxy<Open, &door::open>,
    // Linux releases the descriptor even when close reports an error.
    .close =
        [](int fd) {
          if (!fails(Close)) {
            return Sr_Default_File_System.close(fd);
          }
          const int error = errno;
          Sr_Default_File_System.close(fd);
          errno = error;
          return -1;
        },
    .read = proxy<Read, &door::read>,
    .write = proxy<Write, &door::write>,
    .writev = proxy<Writev, &door::writev>,
    .fsync = proxy<Fsync, &door::fsync>,
    .lseek = proxy<Lseek, &door::lseek>,
    .ftruncate = proxy<Ftruncate, &door::ftruncate>,
    .rename = proxy<Rename, &door::rename>,
    .unlink = proxy<Unlink, &door::unlink>,
    .stat = proxy<Stat, &door::stat>,
    .fstat = proxy<Fstat, &door::fstat>,
    .lock = proxy<Lock, &door::lock>,
    // The directory calls report failure by a null pointer.
    .opendir =
        [](const char *p_path) {
          return fails(Opendir) ? nullptr : Sr_Default_File_System.opendir(p_path);
        },
    .readdir =
        [](DIR *p_directory) {
          return fails(Readdir) ? nullptr : Sr_Default_File_System.readdir(p_directory);
        },
    .closedir = proxy<Closedir, &door::closedir>,
    // Retries come at once.
    .usleep =
        [](useconds_t) {
          Injector.paused = Injector.interrupted != Total_Kinds;
          return 0;
        },
};

// ---- Steps and what their failures must give ---------------------------

enum phase_t { Creating, Opening, Applying, Committing, Aborting };

struct step_t {
  const char *p_name;
  phase_t phase;
  bool rewrite;
  // The calls the step cannot do without; a step that made none of one
  // would leave its failure untested.
  std::vector<call_kind> essential;
};

const step_t Steps[] = {
    {"create", Creating, false, {Open, Lock, Stat, Writev, Fsync, Rename}},
    {"open", Opening, false, {Open, Lock, Lseek, Read}},
    {"apply (append)", Applying, false, {Lseek, Writev, Fsync}},
    {"apply (rewrite)", Applying, true, {Open, Lock, Writev, Fsync}},
    {"commit (append)", Committing, false, {Lseek, Write, Fsync}},
    {"commit (rename)", Committing, true, {Rename}},
    {"abort (append)", Aborting, false, {Ftruncate, Fsync}},
    {"abort (rewrite)", Aborting, true, {Unlink}},
};

// The code a failed call is reported with; 2605-010 names the call.
int32_t expected_code(const step_t &step, call_kind kind, int error) {
  // Abort ends at the committed state whatever the file system says.
  if (step.phase == Aborting || kind == Close || kind == Unlink || kind == Ftruncate) {
    return 0;
  }
  // Creation does not write over a file it cannot examine.
  if ((kind == Stat || kind == Fstat) && step.phase == Creating) {
    return SR_E_TABLE_EXISTS;
  }
  const bool writes =
      kind == Open || kind == Rename || kind == Write || kind == Writev || kind == Fsync;
  return writes && error == ENOSPC ? SR_E_FILESYSTEM_FULL : SR_E_SYSTEM_CALL;
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

std::string describe(const step_t &step, const fault_t &fault) {
  return std::string(step.p_name) + ": " + Call_Names[fault.kind] + " #" +
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

rows_t rows_in(sr_opaque_handle_t table, uint32_t uncommitted) {
  return sr_test::rows_in<std::string>(table, "name", uncommitted);
}

std::string table_image(sr_opaque_handle_t table);

// ---- The fixture ------------------------------------------------------

class FaultInjection : public ::testing::Test {
 protected:
  void SetUp() override {
    // In memory where the system offers it: the runs flush a few thousand times.
    ASSERT_NE((root_ = new_directory("qv_fault")), "");
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

  // Runs each step of `phases` once to count its calls, then once per call
  // of each kind and errno with that call failing, and once more with an
  // abort after the failure where the step leaves something to abort.
  void fail_every_call_of(std::initializer_list<phase_t> phases, const char *p_what) {
    int injected = 0;  // failing calls: call sites times errnos
    int runs = 0;      // each with its recovery
    for (const step_t &step : Steps) {
      if (std::find(phases.begin(), phases.end(), step.phase) == phases.end()) {
        continue;
      }
      run(step, fault_t{});
      ASSERT_FALSE(HasFatalFailure()) << step.p_name << " fails without any fault";
      int counts[Total_Kinds];
      std::copy(std::begin(step_counts_), std::end(step_counts_), counts);
      for (const call_kind kind : step.essential) {
        EXPECT_GT(counts[kind], 0) << step.p_name << " made no " << Call_Names[kind] << " call";
      }
      for (int kind = 0; kind < Total_Kinds; ++kind) {
        for (int index = 1; index <= counts[kind]; ++index) {
          for (const int error : {ENOSPC, EIO, EINTR}) {
            ++injected;
            for (const recovery_t recovery : {recovery_t::retry, recovery_t::abort}) {
              const fault_t fault{static_cast<call_kind>(kind), index, error, recovery};
              // Abort is a recovery only where a failed apply or commit
              // leaves applied or pending changes.
              if (recovery == recovery_t::abort &&
                  (expected_code(step, fault.kind, error) == 0 ||
                   (step.phase != Applying && step.phase != Committing))) {
                continue;
              }
              SCOPED_TRACE(describe(step, fault));
              run(step, fault);
              ASSERT_FALSE(HasFatalFailure());
              ++runs;
            }
          }
        }
      }
    }
    std::printf("[ injected ] %s: %d calls x errnos, %d runs\n", p_what, injected, runs);
  }

  // ---- One run ----

  void run(const step_t &step, const fault_t &fault) {
    std::filesystem::remove_all(mount_directory_);
    std::filesystem::create_directory(mount_directory_);
    tree_ = mounted_tree(mount_directory_);
    ASSERT_NE(tree_, nullptr);
    run_in(step, fault);
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
  }

  void run_in(const step_t &step, const fault_t &fault) {
    sr_opaque_handle_t table = nullptr;
    std::string file_before;
    if (step.phase != Creating) {
      ASSERT_NO_FATAL_FAILURE(create_committed(&table));
    }
    if (step.phase == Opening) {
      // Another program opens the file.
      ASSERT_EQ(sr_close_tree_1(tree_), 0);
      ASSERT_NE(tree_ = mounted_tree(mount_directory_), nullptr);
      file_before = file_bytes(table_file());
    } else if (step.phase != Creating) {
      // "b" set, "a" deleted, rows added; applied for a commit or abort.
      qv_value_t twenty = int32_value(20);
      ASSERT_EQ(sr_set_field_by_key_1(table, string_value("b"), "count", &twenty), 0);
      ASSERT_EQ(sr_delete_rows_1(table, "name == $s", "a"), 0);
      for (int number = 0; number < Added_Rows; ++number) {
        ASSERT_EQ(add_named(table, added_name(number).c_str(), number), 0);
      }
      if (step.phase != Applying) {
        ASSERT_EQ(apply(table, step.rewrite), 0);
      }
    }

    cu_set_no_error_1();
    Injector = injector_t{.target = fault.kind, .index = fault.index, .error = fault.error};
    const int32_t rc = take_step(step, &table);
    std::copy(std::begin(Injector.counts), std::end(Injector.counts), std::begin(step_counts_));
    Injector.target = Injector.interrupted = Total_Kinds;
    const int32_t expected =
        fault.kind == Total_Kinds ? 0 : expected_code(step, fault.kind, fault.error);
    ASSERT_EQ(rc, expected);
    if (rc != 0) {
      expect_message(rc, fault);
    }
    if (fault.error == EINTR && retried_after_interruption(fault.kind)) {
      EXPECT_EQ(Injector.failures, 101)
          << "an interrupted call is tried once and retried 100 times";
    }

    // What the file holds now, and what the table takes on from.
    rows_t committed = step.phase == Creating ? rows_t{} : Committed_Rows;
    switch (step.phase) {
      case Creating:
        if (rc != 0) {
          EXPECT_FALSE(std::filesystem::exists(table_file())) << "a failed creation left its file";
          EXPECT_FALSE(std::filesystem::exists(table_file() + ".rewrite"))
              << "a failed creation left its rewrite file";
          ASSERT_EQ(create_table(&table), 0);
        }
        break;
      case Opening:
        EXPECT_EQ(file_bytes(table_file()), file_before) << "opening changed the file";
        if (rc != 0) {
          ASSERT_EQ(sr_open_table_1(tree_, "/disk/t", 6, &table), 0);
        }
        break;
      case Applying:
      case Committing: {
        // Once the rename is done the new file is the table's: a failed
        // flush of its directory after it still leaves the new state.
        const bool flushing_the_directory =
            step.phase == Committing && step.rewrite && (fault.kind == Open || fault.kind == Fsync);
        const bool committed_now = step.phase == Committing && (rc == 0 || flushing_the_directory);
        EXPECT_EQ(rows_on_disk(), committed_now ? applied_rows() : committed);
        // A failed rewriting apply removes its file; a failed rename keeps
        // it for the retried commit.
        if (step.rewrite && rc != 0 && step.phase == Applying) {
          EXPECT_FALSE(std::filesystem::exists(table_file() + ".rewrite"))
              << "a failed rewrite left its file";
        }
        if (rc != 0 && fault.recovery == recovery_t::abort) {
          ASSERT_EQ(sr_abort_1(table), 0);
          if (committed_now) {
            committed = applied_rows();  // nothing left to abort
          }
        } else {
          if (rc != 0 && step.phase == Applying) {
            ASSERT_EQ(apply(table, step.rewrite), 0) << "the apply cannot be retried";
          }
          if (!committed_now) {
            ASSERT_EQ(sr_commit_1(table), 0) << "the commit cannot be retried";
          }
          committed = applied_rows();
        }
        break;
      }
      case Aborting:
        EXPECT_EQ(rows_in(table, 1), committed) << "abort kept changes";
        break;
    }
    EXPECT_EQ(rows_on_disk(), committed);
    EXPECT_EQ(rows_in(table, 0), committed);

    // The table takes a further transaction, the same way.
    ASSERT_EQ(add_named(table, "late", 99), 0);
    ASSERT_EQ(apply(table, step.rewrite), 0);
    ASSERT_EQ(sr_commit_1(table), 0);
    committed["late"] = 99;
    EXPECT_EQ(rows_on_disk(), committed);
    EXPECT_EQ(rows_in(table, 0), committed);
  }

  // ---- Helpers ----

  // The table with Committed_Rows.
  void create_committed(sr_opaque_handle_t *p_table, const char *p_path = "/disk/t",
                        const rows_t &rows = Committed_Rows) const {
    ASSERT_EQ(create_table(p_table, p_path), 0);
    for (const auto &[name, count] : rows) {
      ASSERT_EQ(add_named(*p_table, name.c_str(), count), 0);
    }
    ASSERT_EQ(sr_apply_1(*p_table, 0), 0);
    ASSERT_EQ(sr_commit_1(*p_table), 0);
  }

  // An explicitly controlled table keyed by "name", with "count". The key
  // is not checked on adding: a checked key without a hash table is scanned
  // for, and that scan refuses any row that takes the entry of a deleted
  // one, which the further transactions here would do.
  int32_t create_table(sr_opaque_handle_t *p_table, const char *p_path = "/disk/t") const {
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY_NOCHECK),
                                        column("count", QV_INT32, SR_STANDARD)};
    return sr_create_table_1(tree_, p_path, columns.data(), 2, sr_test::Explicit, p_table);
  }

  // A rewrite is asked for directly: the exported apply rewrites only large,
  // mostly dead files.
  static int32_t apply(sr_opaque_handle_t table, bool rewrite) {
    return rewrite ? sr_i_apply(object(table), 1, 0) : sr_apply_1(table, 0);
  }

  int32_t take_step(const step_t &step, sr_opaque_handle_t *p_table) const {
    switch (step.phase) {
      case Creating:
        return create_table(p_table);
      case Opening:
        return sr_open_table_1(tree_, "/disk/t", 6, p_table);
      case Applying:
        return apply(*p_table, step.rewrite);
      case Committing:
        return sr_commit_1(*p_table);
      case Aborting:
        return sr_abort_1(*p_table);
    }
    return -1;
  }

  void expect_message(int32_t code, const fault_t &fault) const {
    const auto [raised, text] = last_error();
    EXPECT_EQ(raised, code);
    if (code == SR_E_FILESYSTEM_FULL) {
      EXPECT_EQ(text,
                "2605-016 The filesystem containing the local tree is full: "
                "mounted(qv_fault_device) mounted_over(" +
                    mount_directory_ + ").\n");
    } else if (code == SR_E_SYSTEM_CALL) {
      EXPECT_TRUE(text.starts_with("2605-010 The " + std::string(Call_Names[fault.kind]) +
                                   " system call unexpectedly returned an errno of " +
                                   std::to_string(fault.error) + " to the "))
          << text;
      EXPECT_NE(text.find(" of file sr/storage/sr_"), std::string::npos) << text;
    } else {
      EXPECT_TRUE(text.starts_with("2605-" + std::to_string(code) + " ")) << text;
    }
  }

  std::string table_file() const { return mount_directory_ + "/t"; }

  // The table as another program finds it in the file.
  std::string image_on_disk() const {
    sr_opaque_handle_t tree = mounted_tree(mount_directory_);
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree, "/disk/t", 1, &table);
    std::string image =
        rc == 0 ? table_image(table) : "<the file does not open: " + std::to_string(rc) + ">";
    EXPECT_EQ(sr_close_tree_1(tree), 0);
    return image;
  }

  // The committed rows another program finds in the file.
  rows_t rows_on_disk() const {
    sr_opaque_handle_t tree = mounted_tree(mount_directory_);
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree, "/disk/t", 1, &table);
    rows_t rows = rc == 0 ? rows_in(table, 0) : rows_t{{"<the file does not open>", rc}};
    EXPECT_EQ(sr_close_tree_1(tree), 0);
    return rows;
  }

  // The committed rows another program finds at `p_path`; one "<code>"
  // entry when the table does not open.
  rows_t rows_at(const char *p_path) const {
    sr_opaque_handle_t tree = mounted_tree(mount_directory_);
    sr_opaque_handle_t table = nullptr;
    const int32_t rc = sr_open_table_1(tree, p_path, 1, &table);
    rows_t rows = rc == 0 ? rows_in(table, 0) : rows_t{{"<" + std::to_string(rc) + ">", rc}};
    EXPECT_EQ(sr_close_tree_1(tree), 0);
    return rows;
  }

  // The side files in the mount directory.
  std::vector<std::string> side_files() const {
    std::vector<std::string> found;
    for (const auto &entry : std::filesystem::directory_iterator(mount_directory_)) {
      if (entry.path().filename().string().ends_with(".rewrite")) {
        found.push_back(entry.path().filename());
      }
    }
    return found;
  }

  std::filesystem::path root_;
  std::filesystem::path previous_directory_;
  std::string mount_directory_;
  std::string mount_table_;
  const char *saved_mount_table_ = nullptr;
  sr_opaque_handle_t tree_ = nullptr;
  int step_counts_[Total_Kinds] = {};
};

TEST_F(FaultInjection, CreateAndOpenFailuresLeaveNoFileOrTheFileAsItWas) {
  fail_every_call_of({Creating, Opening}, "create and open");
}

TEST_F(FaultInjection, ApplyFailuresKeepTheCommittedFileAndThePendingChanges) {
  fail_every_call_of({Applying}, "apply");
}

TEST_F(FaultInjection, CommitAndAbortFailuresLeaveACommittedState) {
  fail_every_call_of({Committing, Aborting}, "commit and abort");
}

// ---- Schema changes ---------------------------------------------------

// A table as text: each column's name and default, then each row's values
// in packed order (the columns here are strings and int32s).
std::string table_image(sr_opaque_handle_t table) {
  sr_table_metadata_t *p_metadata = nullptr;
  if (const int32_t rc = sr_get_table_metadata_1(table, -1, &p_metadata); rc != 0) {
    return "<metadata " + std::to_string(rc) + ">";
  }
  std::string image;
  std::vector<const char *> names;
  for (uint32_t column = 0; column < p_metadata->number_of_columns; ++column) {
    const sr_column_t &definition = p_metadata->column_definitions[column];
    names.push_back(definition.name);
    image += std::string(definition.name) + "=" +
             (definition.type == QV_INT32 ? std::to_string(definition.default_value.val_int32)
                                          : std::string(definition.default_value.ptr_char)) +
             " ";
  }
  for (int32_t at = 0;; ++at) {
    std::vector<qv_value_t> values(names.size());
    std::vector<qv_value_t *> pointers;
    for (qv_value_t &value : values) {
      pointers.push_back(&value);
    }
    const int32_t rc = sr_get_fields_by_index_1(table, at, names.data(), pointers.data(),
                                                static_cast<uint32_t>(names.size()));
    if (rc != 0) {
      image += rc == SR_E_NO_ROW_FOR_INDEX ? "" : "<row " + std::to_string(rc) + ">";
      break;
    }
    image += "|";
    for (uint32_t column = 0; column < names.size(); ++column) {
      if (p_metadata->column_definitions[column].type == QV_INT32) {
        image += " " + std::to_string(values[column].val_int32);
      } else {
        image += " " + std::string(values[column].ptr_char);
        std::free(values[column].ptr_char);
      }
    }
  }
  sr_free_table_metadata_1(p_metadata);
  return image;
}

struct schema_change_t {
  const char *p_name;
  int32_t (*change)(sr_opaque_handle_t table);
};

const schema_change_t Schema_Changes[] = {
    {"add a column",
     [](sr_opaque_handle_t table) {
       sr_column_t port = column("port", QV_INT32);
       port.default_value.val_int32 = 80;
       return sr_add_columns_1(table, &port, 1);
     }},
    {"delete a column",
     [](sr_opaque_handle_t table) {
       const char *count = "count";
       return sr_delete_columns_1(table, &count, 1);
     }},
    {"rename a column",
     [](sr_opaque_handle_t table) { return sr_change_column_name_1(table, "count", "total"); }},
    {"change a default",
     [](sr_opaque_handle_t table) {
       return sr_change_default_value_1(table, "count", int32_value(5));
     }},
};

// A failed schema change leaves the table in memory and its file as they
// were and can be retried, unless the call that failed was the flush of the
// directory after the new file took the old one's name: then both hold the
// new table, and the code says the rename may not be durable.
TEST_F(FaultInjection, SchemaChangeFailuresLeaveTheTableAndItsFileAsTheyWere) {
  const step_t schema_step{"schema change", Committing, true, {}};
  int injected = 0;
  for (const schema_change_t &change : Schema_Changes) {
    // A first run counts the calls and gives the images before and after.
    std::filesystem::remove_all(mount_directory_);
    std::filesystem::create_directory(mount_directory_);
    ASSERT_NE(tree_ = mounted_tree(mount_directory_), nullptr);
    sr_opaque_handle_t table = nullptr;
    ASSERT_NO_FATAL_FAILURE(create_committed(&table));
    const std::string old_image = table_image(table);
    Injector = injector_t{};
    ASSERT_EQ(change.change(table), 0) << change.p_name;
    int counts[Total_Kinds];
    std::copy(std::begin(Injector.counts), std::end(Injector.counts), counts);
    const std::string new_image = table_image(table);
    ASSERT_NE(new_image, old_image);
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
    for (const call_kind kind : {Open, Lock, Writev, Fsync, Rename}) {
      EXPECT_GT(counts[kind], 0) << change.p_name << " made no " << Call_Names[kind] << " call";
    }

    for (int kind = 0; kind < Total_Kinds; ++kind) {
      for (int index = 1; index <= counts[kind]; ++index) {
        for (const int error : {ENOSPC, EIO, EINTR}) {
          const fault_t fault{static_cast<call_kind>(kind), index, error, recovery_t::retry};
          SCOPED_TRACE(std::string(change.p_name) + ": " + Call_Names[kind] + " #" +
                       std::to_string(index) + " fails with errno " + std::to_string(error));
          ++injected;
          std::filesystem::remove_all(mount_directory_);
          std::filesystem::create_directory(mount_directory_);
          ASSERT_NE(tree_ = mounted_tree(mount_directory_), nullptr);
          ASSERT_NO_FATAL_FAILURE(create_committed(&table));
          cu_set_no_error_1();
          Injector = injector_t{.target = fault.kind, .index = index, .error = error};
          const int32_t rc = change.change(table);
          Injector.target = Injector.interrupted = Total_Kinds;
          ASSERT_GT(Injector.failures, 0) << "the call did not fail";
          ASSERT_EQ(rc, expected_code(schema_step, fault.kind, error));
          if (rc != 0) {
            expect_message(rc, fault);
          }
          const std::string image = table_image(table);
          const bool renamed = image == new_image;
          if (renamed && rc != 0) {
            EXPECT_TRUE(fault.kind == Open || fault.kind == Fsync)
                << "only a failed flush of the directory may follow the rename";
          }
          if (!renamed) {
            EXPECT_EQ(image, old_image) << "the table in memory changed";
            EXPECT_EQ(image_on_disk(), old_image) << "the file changed";
            EXPECT_FALSE(std::filesystem::exists(table_file() + ".rewrite"));
            ASSERT_EQ(change.change(table), 0) << "the change cannot be retried";
          }
          EXPECT_EQ(table_image(table), new_image);
          EXPECT_EQ(image_on_disk(), new_image);
          // The rebuilt table takes a further transaction into its new file.
          ASSERT_EQ(add_fields(table, {{"name", string_value("late")}}), 0);
          ASSERT_EQ(sr_apply_1(table, 0), 0);
          ASSERT_EQ(sr_commit_1(table), 0);
          EXPECT_EQ(image_on_disk(), table_image(table));
          EXPECT_EQ(sr_close_tree_1(tree_), 0);
        }
      }
    }
  }
  std::printf("[ injected ] schema changes: %d calls x errnos\n", injected);
}

// ---- Copies, moves and deletions ---------------------------------------

// The table "/disk/t" (or "/m/s" in memory) goes to "/disk/u", which holds
// Old_Target_Rows, or is missing, or is open here; or "/disk/t" goes into
// memory as "/m/y", or is deleted.
struct namespace_step_t {
  const char *p_name;
  enum { From_Memory, From_File, From_Open_File } source;
  bool move;
  enum { Target_Exists, Target_Missing, Target_Open, Into_Memory, Deletion } target;
};

const namespace_step_t Namespace_Steps[] = {
    {"copy memory to disk", namespace_step_t::From_Memory, false, namespace_step_t::Target_Exists},
    {"copy memory to a new file", namespace_step_t::From_Memory, false,
     namespace_step_t::Target_Missing},
    {"move memory to disk", namespace_step_t::From_Memory, true, namespace_step_t::Target_Exists},
    {"copy a file by name", namespace_step_t::From_File, false, namespace_step_t::Target_Exists},
    {"copy a file onto an open target", namespace_step_t::From_File, false,
     namespace_step_t::Target_Open},
    {"copy an open file", namespace_step_t::From_Open_File, false, namespace_step_t::Target_Exists},
    {"move a file by name", namespace_step_t::From_File, true, namespace_step_t::Target_Exists},
    {"move an open file", namespace_step_t::From_Open_File, true, namespace_step_t::Target_Exists},
    {"move a file into memory", namespace_step_t::From_File, true, namespace_step_t::Into_Memory},
    {"delete a file", namespace_step_t::From_File, false, namespace_step_t::Deletion},
};

const rows_t Old_Target_Rows = {{"old", 7}};
const rows_t No_Table = {{"<200>", 200}};

class NamespaceFaults : public FaultInjection {
 protected:
  // What the paths hold: "/disk/t", "/disk/u", and "/m/y" in this tree.
  struct paths_t {
    rows_t source;
    rows_t target;
    rows_t in_memory;
    bool operator==(const paths_t &) const = default;
  };

  paths_t before(const namespace_step_t &step) const {
    return {step.source == namespace_step_t::From_Memory ? No_Table : Committed_Rows,
            step.target == namespace_step_t::Target_Exists ||
                    step.target == namespace_step_t::Target_Open
                ? Old_Target_Rows
                : No_Table,
            No_Table};
  }
  paths_t after(const namespace_step_t &step) const {
    paths_t paths = before(step);
    if (step.target == namespace_step_t::Deletion) {
      paths.source = No_Table;
      return paths;
    }
    if (step.move) {
      paths.source = No_Table;
    }
    (step.target == namespace_step_t::Into_Memory ? paths.in_memory : paths.target) =
        Committed_Rows;
    return paths;
  }

  paths_t paths_now() const {
    sr_opaque_handle_t table = nullptr;
    rows_t in_memory = No_Table;
    if (const int32_t rc = sr_open_table_1(tree_, "/m/y", 1, &table); rc == 0) {
      in_memory = rows_in(table, 0);
      EXPECT_EQ(sr_close_table_1(table), 0);
    }
    return {rows_at("/disk/t"), rows_at("/disk/u"), in_memory};
  }

  // Makes the tables of `step`: the source, open in `*p_source` unless it
  // is a file no one has open, and the target, open in `*p_target` when
  // the step copies onto an open one.
  void prepare(const namespace_step_t &step, sr_opaque_handle_t *p_source,
               sr_opaque_handle_t *p_target) {
    std::filesystem::remove_all(mount_directory_);
    std::filesystem::create_directory(mount_directory_);
    ASSERT_NE(tree_ = mounted_tree(mount_directory_), nullptr);
    ASSERT_NO_FATAL_FAILURE(create_committed(
        p_source, step.source == namespace_step_t::From_Memory ? "/m/s" : "/disk/t"));
    if (step.source == namespace_step_t::From_File) {
      ASSERT_EQ(sr_close_table_1(*p_source), 0);
      *p_source = nullptr;
    }
    if (step.target == namespace_step_t::Target_Exists ||
        step.target == namespace_step_t::Target_Open) {
      ASSERT_NO_FATAL_FAILURE(create_committed(p_target, "/disk/u", Old_Target_Rows));
      if (step.target == namespace_step_t::Target_Exists) {
        ASSERT_EQ(sr_close_table_1(*p_target), 0);
        *p_target = nullptr;
      }
    }
  }

  int32_t take_step(const namespace_step_t &step, sr_opaque_handle_t source) const {
    const char *p_target = step.target == namespace_step_t::Into_Memory ? "/m/y" : "/disk/u";
    if (step.target == namespace_step_t::Deletion) {
      return sr_delete_table_1(tree_, "/disk/t");
    }
    if (source == nullptr) {
      return step.move ? sr_move_table_by_name_1(tree_, "/disk/t", p_target, 1)
                       : sr_copy_table_by_name_1(tree_, "/disk/t", p_target, 1);
    }
    return step.move ? sr_move_table_by_handle_1(source, p_target, 1)
                     : sr_copy_table_by_handle_1(source, p_target, 1);
  }

  // The code a failed call of a copy, move or deletion gives: a full
  // filesystem for a call that makes, writes, cuts, renames or removes a
  // file.
  static int32_t failure_code(call_kind kind, int error) {
    const bool writes = kind == Open || kind == Rename || kind == Write || kind == Writev ||
                        kind == Ftruncate || kind == Fsync || kind == Unlink;
    return writes && error == ENOSPC ? SR_E_FILESYSTEM_FULL : SR_E_SYSTEM_CALL;
  }

  // One run of `step` with `fault`; the calls it made go to step_counts_.
  void run_namespace(const namespace_step_t &step, const fault_t &fault) {
    sr_opaque_handle_t source = nullptr, target = nullptr;
    ASSERT_NO_FATAL_FAILURE(prepare(step, &source, &target));
    cu_set_no_error_1();
    Injector = injector_t{.target = fault.kind, .index = fault.index, .error = fault.error};
    const int32_t rc = take_step(step, source);
    std::copy(std::begin(Injector.counts), std::end(Injector.counts), std::begin(step_counts_));
    Injector.target = Injector.interrupted = Total_Kinds;
    if (rc != 0) {
      EXPECT_EQ(rc, failure_code(fault.kind, fault.error));
      expect_message(rc, fault);
    }
    const paths_t old_paths = before(step), new_paths = after(step);
    paths_t found = paths_now();
    if (fault.kind == Total_Kinds) {
      ASSERT_EQ(rc, 0);
    } else {
      ASSERT_GT(Injector.failures, 0) << "the call did not fail";
    }
    // A move through a handle has written its target when it removes the
    // source; a failure then is no failure of the move, and may leave both.
    const bool source_removal = step.move && step.source == namespace_step_t::From_Open_File &&
                                found.target == Committed_Rows;
    if (rc == 0) {
      paths_t both = new_paths;
      both.source = Committed_Rows;
      EXPECT_TRUE(found == new_paths || (source_removal && found == both))
          << "a call failed and the step said it succeeded";
      EXPECT_TRUE(fault.kind == Total_Kinds || fault.kind == Close || fault.kind == Unlink ||
                  source_removal)
          << "the failure went unreported";
    } else {
      // Once the new file has taken the target's name, or the source file
      // is gone, only the flush of the directory may have failed: the step
      // is done (a move through a handle stops before it removes the
      // source), and the code says it may not be durable.
      paths_t both = new_paths;
      both.source = Committed_Rows;
      if (found == new_paths || (step.move && found == both)) {
        EXPECT_TRUE(fault.kind == Open || fault.kind == Fsync)
            << "only a failed flush of the directory may follow the rename or unlink";
      } else {
        EXPECT_EQ(found.source, old_paths.source) << "the source changed";
        EXPECT_EQ(found.target, old_paths.target) << "the target changed";
        EXPECT_EQ(found.in_memory, old_paths.in_memory) << "a table reached memory";
        if (step.target == namespace_step_t::Target_Open) {
          EXPECT_EQ(rows_in(target, 0), Old_Target_Rows) << "the open target changed";
        }
        // A retry succeeds.
        cu_set_no_error_1();
        ASSERT_EQ(take_step(step, source), 0) << "the step cannot be retried";
        found = paths_now();
        EXPECT_EQ(found, new_paths);
      }
    }
    EXPECT_EQ(side_files(), std::vector<std::string>{}) << "a side file was left";
    if (step.target == namespace_step_t::Target_Open) {
      // The open target shows the new table and writes on into its file.
      EXPECT_EQ(rows_in(target, 0), found.target);
      ASSERT_EQ(add_named(target, "late", 99), 0);
      ASSERT_EQ(sr_apply_1(target, 0), 0);
      ASSERT_EQ(sr_commit_1(target), 0);
      rows_t rows = found.target;
      rows["late"] = 99;
      EXPECT_EQ(rows_at("/disk/u"), rows);
    }
    EXPECT_EQ(sr_close_tree_1(tree_), 0);
  }
};

// Each call site of every step fails in turn with ENOSPC, EIO and EINTR
// past its retries: the right code and message; no side file left; the
// source where it was and the target as it was, unless only the flush of
// the directory failed after the new name was in place; and the step then
// succeeds when tried again.
TEST_F(NamespaceFaults, EveryFailedCallLeavesTheSourceAndTheTargetAsTheyWereAndCanBeRetried) {
  int injected = 0;
  for (const namespace_step_t &step : Namespace_Steps) {
    SCOPED_TRACE(step.p_name);
    run_namespace(step, fault_t{});
    ASSERT_FALSE(HasFatalFailure()) << step.p_name << " fails without any fault";
    int counts[Total_Kinds];
    std::copy(std::begin(step_counts_), std::end(step_counts_), counts);
    const std::vector<call_kind> essential =
        step.target == namespace_step_t::Deletion ? std::vector<call_kind>{Unlink, Open, Fsync}
        : step.target == namespace_step_t::Into_Memory
            ? std::vector<call_kind>{Open, Read, Unlink, Fsync}
        // A move within the directory is one rename, whether the file is
        // open here or not.
        : step.move && step.source != namespace_step_t::From_Memory
            ? std::vector<call_kind>{Open, Lock, Rename, Fsync}
            : std::vector<call_kind>{Open, Lock, Write, Fsync, Rename};
    for (const call_kind kind : essential) {
      EXPECT_GT(counts[kind] + (kind == Write ? counts[Writev] : 0), 0)
          << step.p_name << " made no " << Call_Names[kind] << " call";
    }
    for (int kind = 0; kind < Total_Kinds; ++kind) {
      for (int index = 1; index <= counts[kind]; ++index) {
        for (const int error : {ENOSPC, EIO, EINTR}) {
          const fault_t fault{static_cast<call_kind>(kind), index, error, recovery_t::retry};
          SCOPED_TRACE(describe(Steps[0], fault).substr(std::strlen(Steps[0].p_name) + 2));
          run_namespace(step, fault);
          ASSERT_FALSE(HasFatalFailure());
          ++injected;
        }
      }
    }
  }
  std::printf("[ injected ] copies, moves and deletions: %d calls x errnos\n", injected);
}

// A read-only table turning writable is read again from its file, and finds
// what another program committed meanwhile. When that read fails the table
// stays read-only with the references it had; once it succeeds both handles
// write, and closing them drops the table from memory.
TEST_F(FaultInjection, AReadOnlyTableIsReadAgainForWritingAndAFailedReadKeepsItAsItWas) {
  std::filesystem::create_directory(mount_directory_);
  ASSERT_NE(tree_ = mounted_tree(mount_directory_), nullptr);
  sr_opaque_handle_t table = nullptr;
  ASSERT_NO_FATAL_FAILURE(create_committed(&table));
  ASSERT_EQ(sr_close_table_1(table), 0);
  sr_opaque_handle_t reader = nullptr;
  ASSERT_EQ(sr_open_table_1(tree_, "/disk/t", 1, &reader), 0);
  sr_opaque_handle_t other = mounted_tree(mount_directory_);
  ASSERT_EQ(sr_open_table_1(other, "/disk/t", 2, &table), 0);
  ASSERT_EQ(add_named(table, "late", 5), 0);
  ASSERT_EQ(sr_close_tree_1(other), 0);

  Injector = injector_t{.target = Read, .index = 1, .error = EIO};
  sr_opaque_handle_t writer = nullptr;
  EXPECT_EQ(sr_open_table_1(tree_, "/disk/t", 2, &writer), SR_E_SYSTEM_CALL);
  EXPECT_EQ(Injector.failures, 1);
  Injector.target = Total_Kinds;
  EXPECT_EQ(object(reader)->references, 1u);
  EXPECT_EQ(rows_in(reader, 0), Committed_Rows);
  EXPECT_EQ(add_named(reader, "mine", 6), SR_E_ACCESS);

  ASSERT_EQ(sr_open_table_1(tree_, "/disk/t", 2, &writer), 0);
  EXPECT_EQ(writer, reader);
  EXPECT_EQ(object(reader)->references, 2u);
  EXPECT_EQ(add_named(reader, "mine", 6), 0);
  rows_t rows = Committed_Rows;
  rows["late"] = 5;
  rows["mine"] = 6;
  EXPECT_EQ(rows_in(writer, 0), rows);
  ASSERT_EQ(sr_close_table_1(reader), 0);
  ASSERT_EQ(sr_close_table_1(writer), 0);
  EXPECT_TRUE(static_cast<sr_i_tree_t *>(tree_)->tables.empty())
      << "the table outlived its last handle";
  EXPECT_EQ(sr_close_tree_1(tree_), 0);
}

}  // namespace
