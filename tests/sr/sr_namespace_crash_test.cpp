// Copies, moves and deletions of tables killed at random moments. A child
// process carries tables between three table files of one mount directory
// and memory: a table in memory copied or moved to disk, a file copied to
// another by name (now and then onto a target it has open) or through an
// open handle, a file moved by name or through an open handle (one rename
// either way), a file moved into memory
// and from there onto disk again, a file deleted. Through a pipe it tells
// the parent each operation it is about to make and each one that has
// returned. The parent kills it with SIGKILL at a random moment and reads
// the three paths in a tree of its own. Each target must hold its old
// table or the whole new one; a copy's source is untouched; a moved table
// is found at its source or at its target, never at both. The next child carries on from what the
// parent found, on the side files the kills left behind, and any side file still there at the end
// must not stop a copy onto its target.

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <map>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "sr_killed_child.h"
#include "sr_namespace_operations.h"
#include "sr_versioned_rows.h"

namespace {

using namespace sr_versioned;
using namespace sr_namespace_operations;

constexpr int Crash_Points = sr_killed_child::scaled_crash_points(200);

// The child: random operations for ever, each announced ("P ...") and
// confirmed ("C ...") on the pipe, from what the parent found on the disk.
[[noreturn]] void move_tables(const std::string &directory, uint32_t seed, int32_t first_id,
                              int pipe_fd) {
  const auto fail = [&](const std::string &what) {
    sr_killed_child::say(pipe_fd, "E " + what);
    _exit(2);
  };
  files_t files;
  for (const char *p_name : Names) {
    if (const std::string problem =
            read_table(directory, path_of(p_name).c_str(), files[p_name], Payload_Spread);
        !problem.empty()) {
      fail(problem);
    }
  }
  std::mt19937 rng(seed);
  random_operations operations(rng, first_id);
  const sr_opaque_handle_t tree = mounted_tree(directory);
  if (tree == nullptr) {
    fail("no tree");
  }
  if (const std::string problem = operations.start(tree, files); !problem.empty()) {
    fail(problem);
  }
  const random_operations::listener announce = [&](const operation &step) {
    sr_killed_child::say(pipe_fd, line_of("P", step));
  };
  const random_operations::listener confirm = [&](const operation &step) {
    sr_killed_child::say(pipe_fd, line_of("C", step));
  };
  for (;;) {
    if (const std::string problem = operations.step(announce, confirm); !problem.empty()) {
      fail(problem);
    }
  }
}

// What one child left in the pipe: the operations that returned, and the
// one announced after them, if any.
struct child_report {
  std::vector<operation> done;
  std::optional<operation> announced;
  std::string error;
};

void take_line(const std::string &line, child_report &report) {
  if (line.starts_with("E ")) {
    report.error = line.substr(2);
  } else if (line.starts_with("P ")) {
    report.announced = parse_operation(line);
  } else {
    report.done.push_back(parse_operation(line));
    report.announced.reset();
  }
}

class NamespaceCrash : public ::testing::Test {
 protected:
  // On a disk: its flushes take long enough for the kills to land inside
  // the operations.
  void SetUp() override {
    ASSERT_NE(directory_ = sr_test::new_directory("qv_ns_crash", false), "");
  }
  void TearDown() override {
    if (!HasFailure()) {
      std::filesystem::remove_all(directory_);
    }
  }

  // The three paths as a new program reads them; "" or the problem.
  std::string read_files(files_t &files) const {
    for (const char *p_name : Names) {
      const std::string problem =
          read_table(directory_, path_of(p_name).c_str(), files[p_name], Payload_Spread);
      if (!problem.empty()) {
        return std::string(p_name) + ": " + problem;
      }
    }
    return "";
  }

  // The names in the mount directory that are neither a table file nor
  // ",Lock"; side files of a table file are counted in `rewrite_files`.
  std::vector<std::string> stray_files(int &rewrite_files) const {
    std::set<std::string> expected = {",Lock"};
    for (const char *p_name : Names) {
      expected.insert(file_of(p_name));
    }
    std::vector<std::string> strays;
    for (const auto &entry : std::filesystem::directory_iterator(directory_)) {
      const std::string name = entry.path().filename();
      if (name.ends_with(".rewrite") && expected.contains(name.substr(0, name.size() - 8))) {
        ++rewrite_files;
      } else if (!expected.contains(name)) {
        strays.push_back(name);
      }
    }
    return strays;
  }

  std::string directory_;
};

TEST_F(NamespaceCrash, AKilledCopyOrMoveLeavesEachTableWholeAtItsSourceOrItsTarget) {
  uint32_t seed = std::random_device{}();
  if (const char *p_seed = std::getenv("SR_CRASH_SEED")) {
    seed = static_cast<uint32_t>(std::strtoul(p_seed, nullptr, 10));
  }
  std::mt19937 rng(seed);
  files_t known;
  for (const char *p_name : Names) {
    known[p_name] = table_state{};
  }
  std::map<std::string, int> in_flight;  // by kind
  std::map<std::string, int> done;       // by kind
  int new_outcomes = 0;
  int rewrite_files = 0;  // side files found after a kill
  int point = 0;
  for (; point < Crash_Points; ++point) {
    const int messages = static_cast<int>(rng() % 24);
    const auto delay = static_cast<useconds_t>(rng() % 4000);
    const uint32_t child_seed = seed + static_cast<uint32_t>(point);
    child_report report;
    const std::string problem = sr_killed_child::run_and_kill(
        messages, delay,
        [&](int pipe_fd) { move_tables(directory_, child_seed, 1 + 10000 * (point + 1), pipe_fd); },
        [&](const std::string &line) { take_line(line, report); });
    const std::string where = "seed " + std::to_string(seed) + " (SR_CRASH_SEED), crash point " +
                              std::to_string(point) + ", killed after " + std::to_string(messages) +
                              " messages + " + std::to_string(delay) + " us";
    ASSERT_EQ(report.error.empty() ? problem : report.error, "") << where;
    for (const operation &step : report.done) {
      known = after(known, step);
      ++done[step.kind];
    }
    files_t found;
    const std::string read_problem = read_files(found);
    std::vector<files_t> allowed = {known};
    if (report.announced) {
      allowed = outcomes(known, *report.announced);
      ++in_flight[report.announced->kind];
    }
    const auto match = std::find(allowed.begin(), allowed.end(), found);
    if (!read_problem.empty() || match == allowed.end()) {
      std::string expected;
      for (const files_t &files : allowed) {
        expected += (expected.empty() ? "" : "\n  or") + describe(files);
      }
      FAIL() << where << "\n  in flight: "
             << (report.announced ? line_of("P", *report.announced) : "nothing")
             << "\n  found: " << (read_problem.empty() ? describe(found) : read_problem)
             << "\n  expected" << expected << "\n  files kept in " << directory_;
    }
    new_outcomes += match - allowed.begin() == 1 ? 1 : 0;
    known = found;
    const std::vector<std::string> strays = stray_files(rewrite_files);
    ASSERT_TRUE(strays.empty()) << where << ": a file that is no table: " << strays.front();
  }
  // A side file left by a kill stops no copy onto its target, and goes.
  sr_opaque_handle_t tree = mounted_tree(directory_);
  ASSERT_NE(tree, nullptr);
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(create_table(tree, "/m/last", 0, &table), 0);
  ASSERT_EQ(add_row(table, 1, 1, Payload_Spread), 0);
  for (const char *p_name : Names) {
    const std::string side_file = directory_ + "/" + file_of(p_name) + ".rewrite";
    if (!std::filesystem::exists(side_file)) {
      sr_test::write_file(side_file, "left by a killed copy");
    }
    ASSERT_EQ(sr_copy_table_by_handle_1(table, path_of(p_name).c_str(), 1), 0) << p_name;
    EXPECT_FALSE(std::filesystem::exists(side_file)) << p_name;
    table_state found;
    ASSERT_EQ(read_table(directory_, path_of(p_name).c_str(), found, Payload_Spread), "");
    EXPECT_EQ(found.rows, (std::map<int32_t, int32_t>{{1, 1}})) << p_name;
  }
  EXPECT_EQ(sr_close_tree_1(tree), 0);

  std::cout << "crash points tried: " << point << " (seed " << seed
            << "); an operation was in flight at ";
  int total_in_flight = 0;
  for (const auto &[kind, count] : in_flight) {
    std::cout << kind << " " << count << ", ";
    total_in_flight += count;
  }
  std::cout << "in all " << total_in_flight << "; its outcome had reached the disk at "
            << new_outcomes << "; side files found after kills: " << rewrite_files
            << "; operations done: ";
  for (const auto &[kind, count] : done) {
    std::cout << kind << " " << count << ", ";
  }
  std::cout << "\n";
  RecordProperty("crash_points", point);
  RecordProperty("operations_in_flight", total_in_flight);
}

}  // namespace
