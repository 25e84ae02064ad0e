// Persistent tables killed at random moments. A child process runs random
// transactions on a table: single changes through an implicitly controlled
// handle, multi-row transactions through an explicitly controlled one,
// appends and rewrites, aborts. Through a pipe it tells the parent each
// commit it is about to make and each state it has committed. The parent
// kills it with SIGKILL at a random moment and reopens the table in a tree
// of its own: the table must hold exactly the last state reported
// committed, or the one that was being committed, row by row, with its
// change counter. The next child carries on from what the parent found, so
// crashes pile up on one file: uncommitted tails, leftover rewrite files,
// half-made tables.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <iostream>
#include <map>
#include <optional>
#include <random>
#include <string>

#include "qv_sr.h"
#include "sr_killed_child.h"
#include "sr_versioned_rows.h"

namespace {

using namespace sr_versioned;

constexpr int Crash_Points = sr_killed_child::scaled_crash_points(300);

// Every this many crash points the table is removed, so that creation is
// killed too.
constexpr int Crash_Points_Per_Table = 50;

constexpr const char *Table_Path = "/disk/crash/t";
constexpr const char *Table_File = "crash,t";

// What a child writes. Row changes: payloads of 40 to about 900 bytes and
// 12 to 60 rows keep the file past the size at which rewrites start, and
// the pipe messages short. Schema changes: a table of a few thousand short
// rows, its columns changed again and again, rows changed in between.
struct writer_kind {
  bool schema_changes;
  uint32_t payload_spread;
  size_t fewest_rows;
  size_t most_rows;
};
constexpr writer_kind Row_Writer{false, 860, 12, 60};
constexpr writer_kind Schema_Writer{true, 60, 2000, 3000};

// The child: random transactions for ever, each reported to the parent. It
// writes lines "P <kind> <state>" before a commit may begin and
// "C <kind> <state>" once it has returned, or "E <what>" before it gives
// up. The kind of a commit is create, or one of random_changes; a reported
// commit that replaced the file says rewritten.
class child_writer {
 public:
  child_writer(std::string directory, uint32_t seed, int pipe_fd, writer_kind kind)
      : directory_(std::move(directory)),
        rng_(seed),
        kind_(kind),
        changes_{rng_, kind.payload_spread, kind.fewest_rows, kind.most_rows},
        pipe_fd_(pipe_fd) {}

  [[noreturn]] void run() {
    if ((tree_ = mounted_tree(directory_)) == nullptr) {
      fail("no tree");
    }
    open_or_create();
    for (;;) {
      const bool implicit = rng_() % 2 == 0;
      check(sr_close_table_1(table_), "sr_close_table_1");
      check(open_table(tree_, Table_Path, implicit ? Open_Implicit : Open_Explicit, &table_),
            "sr_open_hashed_key_table_1");
      for (uint32_t steps = 1 + rng_() % 10; steps > 0; --steps) {
        const char *p_kind = nullptr;
        const auto announce = [&](const char *p_what, const table_state &next) {
          p_kind = p_what;
          say(std::string("P ") + p_what + " " + describe(next));
        };
        // Implicit deletions by packed index: the row's place among the live rows.
        if (kind_.schema_changes && rng_() % 2 == 0) {
          no_problem(changes_.schema_change(table_, committed_, announce));
        } else {
          no_problem(implicit ? changes_.implicit_change(table_, committed_, true, announce)
                              : changes_.explicit_transaction(table_, committed_, 8, announce));
        }
        if (p_kind != nullptr) {
          confirm(p_kind);
        }
      }
    }
  }

 private:
  [[noreturn]] void fail(const std::string &what) {
    say("E " + what);
    _exit(2);
  }

  void say(const std::string &line) { sr_killed_child::say(pipe_fd_, line); }

  ino_t file_inode() const {
    struct stat status {};
    stat((directory_ + "/" + Table_File).c_str(), &status);
    return status.st_ino;
  }

  // Reports the state committed, and whether the commit replaced the file.
  void confirm(const char *p_kind) {
    const bool replaced = file_inode() != file_inode_ && std::strcmp(p_kind, "create") != 0;
    file_inode_ = file_inode();
    say(std::string("C ") + (replaced ? "rewritten" : p_kind) + " " + describe(committed_));
  }

  void check(int32_t rc, const char *p_call) {
    if (rc != 0) {
      fail(std::string(p_call) + " gave " + std::to_string(rc));
    }
  }
  void no_problem(const std::string &problem) {
    if (!problem.empty()) {
      fail(problem);
    }
  }

  void open_or_create() {
    const int32_t rc = open_table(tree_, Table_Path, Open_Implicit, &table_);
    if (rc == SR_E_NO_TABLE) {
      committed_ = {true, 1, {}, {}};
      say("P create " + describe(committed_));
      check(create_table(tree_, Table_Path,
                         kind_.schema_changes ? 4
                         : rng_() % 2         ? 0
                                              : 4,
                         &table_),
            "sr_create_hashed_key_table_1");
      confirm("create");
      if (kind_.schema_changes) {
        no_problem(changes_.fill(table_, committed_, static_cast<uint32_t>(kind_.fewest_rows),
                                 [&](const char *p_kind, const table_state &next) {
                                   say(std::string("P ") + p_kind + " " + describe(next));
                                 }));
        confirm("fill");
      }
    } else {
      check(rc, "sr_open_hashed_key_table_1");
      no_problem(read_rows(table_, committed_, kind_.payload_spread));
      file_inode_ = file_inode();
    }
    for (const auto &[id, version] : committed_.rows) {
      changes_.next_id = std::max(changes_.next_id, id + 1);
    }
  }

  std::string directory_;
  std::mt19937 rng_;
  writer_kind kind_;
  random_changes changes_;
  int pipe_fd_;
  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t table_ = nullptr;
  table_state committed_;
  ino_t file_inode_ = 0;
};

// What one child left in the pipe: the last state reported committed and
// the commit announced after it, if any.
struct child_report {
  std::optional<table_state> committed;
  std::optional<table_state> announced;
  std::string announced_kind;
  std::string error;
  int commits = 0;
  int rewrites = 0;
};

void take_line(const std::string &line, child_report &report) {
  if (line.rfind("E ", 0) == 0) {
    report.error = line.substr(2);
    return;
  }
  const size_t space = line.find(' ', 2);
  const std::string kind = line.substr(2, space - 2);
  const table_state state = parse_state(line.substr(space + 1));
  if (line[0] == 'P') {
    report.announced = state;
    report.announced_kind = kind;
    return;
  }
  report.committed = state;
  report.announced.reset();
  ++report.commits;
  report.rewrites += kind == "rewritten" ? 1 : 0;
}

class Crash : public ::testing::Test {
 protected:
  // On a disk: its flushes take long enough for the kills to land inside
  // commits, creations among them.
  void SetUp() override { ASSERT_NE(directory_ = sr_test::new_directory("qv_crash", false), ""); }
  void TearDown() override { std::filesystem::remove_all(directory_); }

  // Runs one child with `seed`, kills it once it has sent `messages` lines
  // and `delay` microseconds more have passed, and collects its report.
  child_report kill_a_writer(writer_kind kind, uint32_t seed, int messages, useconds_t delay) {
    child_report report;
    const std::string problem = sr_killed_child::run_and_kill(
        messages, delay, [&](int pipe_fd) { child_writer(directory_, seed, pipe_fd, kind).run(); },
        [&](const std::string &line) { take_line(line, report); });
    if (report.error.empty()) {
      report.error = problem;
    }
    return report;
  }

  // Keeps the table file of a failure for a later look.
  std::string keep_files(int point) {
    const std::string kept = directory_ + "-kept-" + std::to_string(point);
    std::filesystem::copy(directory_, kept, std::filesystem::copy_options::recursive);
    return kept;
  }

  // Kills `crash_points` writers of `kind`, one after another on one table
  // file, and checks after each what a new reader finds.
  void kill_writers(writer_kind kind, int crash_points) {
    uint32_t seed = std::random_device{}();
    if (const char *p_seed = std::getenv("SR_CRASH_SEED")) {
      seed = static_cast<uint32_t>(std::strtoul(p_seed, nullptr, 10));
    }
    std::mt19937 rng(seed);
    table_state known;  // absent
    int in_flight = 0;
    int new_state_found = 0;
    int commits = 0;
    int rewrites = 0;
    std::map<std::string, int> in_flight_kinds;
    int point = 0;
    for (; point < crash_points; ++point) {
      if (point % Crash_Points_Per_Table == 0) {
        std::filesystem::remove(directory_ + "/" + Table_File);
        known = table_state{};
      }
      // On a new table the first message announces its creation: killed soon
      // after it, the child is often still creating.
      const bool new_table = point % Crash_Points_Per_Table == 0;
      const int messages = new_table ? 1 : static_cast<int>(rng() % 30);
      const auto delay = static_cast<useconds_t>(rng() % (new_table ? 1000 : 3000));
      const uint32_t child_seed = seed + static_cast<uint32_t>(point);
      const child_report report = kill_a_writer(kind, child_seed, messages, delay);
      ASSERT_EQ(report.error, "") << "seed " << seed << ", crash point " << point;
      commits += report.commits;
      rewrites += report.rewrites;
      if (report.committed) {
        known = *report.committed;
      }
      table_state found;
      const std::string problem = read_table(directory_, Table_Path, found, kind.payload_spread);
      const bool read = problem.empty();
      const bool old_state = read && found == known;
      const bool new_state = read && report.announced && found == *report.announced;
      if (report.announced) {
        ++in_flight;
        ++in_flight_kinds[report.announced_kind];
      }
      if (!old_state && !new_state) {
        ADD_FAILURE() << "seed " << seed << " (SR_CRASH_SEED), crash point " << point
                      << ", child seed " << child_seed << ", killed after " << messages
                      << " messages + " << delay
                      << " us\n  found:     " << (read ? describe(found) : problem)
                      << "\n  committed: " << describe(known) << "\n  announced: "
                      << (report.announced
                              ? report.announced_kind + " " + describe(*report.announced)
                              : "none")
                      << "\n  files kept in " << keep_files(point);
        break;
      }
      if (new_state && !old_state) {
        ++new_state_found;
        known = found;
      }
    }
    std::cout << "crash points tried: " << point << " (seed " << seed
              << "); a commit was in flight at " << in_flight << " of them (";
    for (const auto &[kind, count] : in_flight_kinds) {
      std::cout << kind << " " << count << ", ";
    }
    std::cout << "), the new state had reached the file at " << new_state_found
              << "; commits reported " << commits << ", of which rewrote the file " << rewrites
              << "\n";
    RecordProperty("crash_points", point);
    RecordProperty("commits_in_flight", in_flight);
  }

  std::string directory_;
};

TEST_F(Crash, AKilledWriterLeavesTheLastCommittedStateOrTheOneInFlight) {
  kill_writers(Row_Writer, Crash_Points);
}

// A schema change rewrites the whole file: killed anywhere in it, the table
// has the old columns with all its rows or the new ones with all of them.
TEST_F(Crash, AKilledSchemaChangeLeavesTheOldTableOrTheNewOne) {
  kill_writers(Schema_Writer, Crash_Points * 2 / 3);
}

}  // namespace
