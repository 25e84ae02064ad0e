// Persistent tables shared by processes. Writers in different processes
// are serialised by the lock on the table file: each one waits in its open
// until the other has closed the table, and then reads what the other
// committed, so no update is lost. A reader takes no lock and, while a
// writer appends, rewrites or changes the schema, only ever finds committed
// states. Copies onto one table file from two processes are serialised by
// the mount directory's ",Lock" file, and a reader finds one whole copy.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <map>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "frame/sr_i_frame.h"
#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "sr_versioned_rows.h"
#include "tables/sr_i_table.h"

namespace {

using namespace sr_versioned;

constexpr const char *Table_Path = "/disk/shared/t";
constexpr const char *Table_File = "shared,t";

class Processes : public ::testing::Test {
 protected:
  void SetUp() override {
    char pattern[] = "/tmp/qv_processes_XXXXXX";
    ASSERT_NE(mkdtemp(pattern), nullptr);
    directory_ = pattern;
  }
  void TearDown() override { std::filesystem::remove_all(directory_); }

  sr_opaque_handle_t mounted_tree() const { return sr_versioned::mounted_tree(directory_); }

  void create_table(int32_t mode) {
    sr_opaque_handle_t tree = mounted_tree();
    ASSERT_NE(tree, nullptr);
    sr_opaque_handle_t table = nullptr;
    EXPECT_EQ(sr_versioned::create_table(tree, Table_Path, mode, &table), 0);
    EXPECT_EQ(sr_close_tree_1(tree), 0);
  }

  // The committed state as a new reader finds it, checking each row's
  // payload against its Id and Version; an empty string or the problem.
  std::string read_table(table_state &state, uint32_t payload_spread) const {
    return sr_versioned::read_table(directory_, Table_Path, state, payload_spread);
  }

  // Runs `body` in a child process, which stands for another program; its
  // result is the child's exit status.
  template <typename Body>
  static pid_t start_process(Body body) {
    const pid_t child = fork();
    if (child == 0) {
      // This process runs no other thread and holds no registry lock at
      // the fork, so the guard that keeps forked children from changing
      // tables can be lifted.
      In_Child_Process.store(0);
      _exit(body());
    }
    return child;
  }

  // The exit status of `child`, or -1 when it has not ended within a
  // generous limit (a writer hung on the lock): then it is killed.
  static int finish(pid_t child) {
    const auto limit = std::chrono::steady_clock::now() + std::chrono::minutes(2);
    int status = 0;
    while (waitpid(child, &status, WNOHANG) == 0) {
      if (std::chrono::steady_clock::now() > limit) {
        kill(child, SIGKILL);
        waitpid(child, &status, 0);
        return -1;
      }
      std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }

  ino_t table_inode() const {
    struct stat status {};
    stat((directory_ + "/" + Table_File).c_str(), &status);
    return status.st_ino;
  }

  std::string directory_;
};

TEST_F(Processes, OfTwoCreatorsOneWinsAndTheOtherIsTold) {
  for (int round = 0; round < 20; ++round) {
    std::filesystem::remove(directory_ + "/" + Table_File);
    auto creator = [this] {
      sr_opaque_handle_t tree = mounted_tree(), table = nullptr;
      if (tree == nullptr) {
        return 99;
      }
      const int32_t rc = sr_versioned::create_table(tree, Table_Path, 0, &table);
      sr_close_tree_1(tree);
      return rc == 0 ? 0 : rc == SR_E_TABLE_EXISTS ? 1 : 2;
    };
    const pid_t first = start_process(creator);
    const pid_t second = start_process(creator);
    const int results = finish(first) * 10 + finish(second);
    EXPECT_TRUE(results == 1 || results == 10) << "round " << round << ": " << results;
    table_state state;
    EXPECT_EQ(read_table(state, 0), "") << "round " << round;
    EXPECT_FALSE(std::filesystem::exists(directory_ + "/" + Table_File + ".rewrite"));
  }
}

TEST_F(Processes, TwoWritersLoseNoRow) {
  constexpr int Writers = 2;
  constexpr int Rounds = 10;
  constexpr int Rows_Per_Round = 20;
  constexpr uint32_t Payload_Spread = 24;
  create_table(0);
  const ino_t inode = table_inode();
  // Each writer opens the table, adds a round of rows, one implicit commit
  // each, and closes it again, so that the two take turns many times.
  auto writer = [this](int number) {
    return [this, number] {
      sr_opaque_handle_t tree = mounted_tree();
      if (tree == nullptr) {
        return 2;
      }
      for (int round = 0; round < Rounds; ++round) {
        sr_opaque_handle_t table = nullptr;
        if (open_table(tree, Table_Path, Open_Implicit, &table) != 0) {
          return 3;
        }
        for (int row = 0; row < Rows_Per_Round; ++row) {
          if (add_row(table, number * 100000 + round * Rows_Per_Round + row, number,
                      Payload_Spread) != 0) {
            return 4;
          }
        }
        if (sr_close_table_1(table) != 0) {
          return 5;
        }
      }
      return sr_close_tree_1(tree) == 0 ? 0 : 6;
    };
  };
  std::vector<pid_t> children;
  for (int number = 1; number <= Writers; ++number) {
    children.push_back(start_process(writer(number)));
  }
  for (const pid_t child : children) {
    EXPECT_EQ(finish(child), 0) << "a writer failed or hung (-1)";
  }

  table_state expected;
  expected.exists = true;
  expected.counter = 1 + Writers * Rounds * Rows_Per_Round;  // one commit per row
  for (int number = 1; number <= Writers; ++number) {
    for (int row = 0; row < Rounds * Rows_Per_Round; ++row) {
      expected.rows[number * 100000 + row] = number;
    }
  }
  table_state found;
  ASSERT_EQ(read_table(found, Payload_Spread), "");
  EXPECT_EQ(found.rows.size(), expected.rows.size());
  EXPECT_TRUE(found == expected) << describe(found);
  // Rewrites, which replace the file, are not this test's subject.
  EXPECT_EQ(table_inode(), inode) << "the file was rewritten";
}

// The state after transaction `t` of the writer below: block t (ids 10t to
// 10t+9) added; every third transaction deletes block t-2, every fourth
// sets block t-1 to version t; counter 100 + t.
table_state state_after(int t) {
  table_state state;
  state.exists = true;
  state.counter = t == 0 ? 1 : 100 + static_cast<uint64_t>(t);
  for (int done = 1; done <= t; ++done) {
    for (int row = 0; row < 10; ++row) {
      state.rows[done * 10 + row] = done;
    }
    if (done % 3 == 0) {
      for (int row = 0; row < 10; ++row) {
        state.rows.erase((done - 2) * 10 + row);
      }
    }
    if (done % 4 == 0) {
      for (int row = 0; row < 10; ++row) {
        if (state.rows.count((done - 1) * 10 + row) != 0) {
          state.rows[(done - 1) * 10 + row] = done;
        }
      }
    }
  }
  return state;
}

TEST_F(Processes, AReaderSeesOnlyCommittedStatesWhileAWriterWorks) {
  constexpr int Transactions = 120;
  constexpr uint32_t Payload_Spread = 300;
  create_table(4);
  const pid_t writer = start_process([this] {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    if (tree == nullptr || open_table(tree, Table_Path, Open_Explicit, &table) != 0) {
      return 2;
    }
    for (int t = 1; t <= Transactions; ++t) {
      const table_state before = state_after(t - 1);
      for (int row = 0; row < 10; ++row) {
        if (add_row(table, t * 10 + row, t, Payload_Spread) != 0) {
          return 3;
        }
      }
      if (t % 3 == 0 && t > 2 &&
          sr_delete_rows_1(table, "Id >= $i && Id < $i", (t - 2) * 10, (t - 1) * 10) != 0) {
        return 4;
      }
      for (int row = 0; t % 4 == 0 && row < 10; ++row) {
        const int32_t id = (t - 1) * 10 + row;
        if (before.rows.count(id) != 0 && set_row(table, id, t, Payload_Spread) != 0) {
          return 5;
        }
      }
      // Every fifth transaction writes a new file, which is renamed over
      // the one the reader may be opening.
      const int32_t applied = t % 5 == 0
                                  ? sr_i_apply(static_cast<sr_i_table_t *>(table), 1, 100 + t)
                                  : sr_apply_1(table, 100 + static_cast<uint64_t>(t));
      if (applied != 0 || sr_commit_1(table) != 0) {
        return 6;
      }
    }
    return sr_close_tree_1(tree) == 0 ? 0 : 7;
  });

  // Reads until the writer has ended: the last read comes after its end.
  int reads = 0, status = 0;
  std::set<uint64_t> states_seen;
  table_state found;
  const auto limit = std::chrono::steady_clock::now() + std::chrono::minutes(2);
  for (pid_t ended = 0; ended == 0; ++reads) {
    ended = waitpid(writer, &status, WNOHANG);
    if (ended == 0 && std::chrono::steady_clock::now() > limit) {
      kill(writer, SIGKILL);
      waitpid(writer, &status, 0);
      FAIL() << "the writer hung";
    }
    ASSERT_EQ(read_table(found, Payload_Spread), "") << "read " << reads;
    const int t = found.counter == 1 ? 0 : static_cast<int>(found.counter) - 100;
    ASSERT_TRUE(t >= 0 && t <= Transactions && found == state_after(t))
        << "read " << reads << " found a state never committed: " << describe(found);
    states_seen.insert(found.counter);
  }
  ASSERT_TRUE(WIFEXITED(status)) << status;
  EXPECT_EQ(WEXITSTATUS(status), 0) << "the writer failed";
  EXPECT_TRUE(found == state_after(Transactions)) << describe(found);
  std::cout << "reads: " << reads << ", distinct committed states seen: " << states_seen.size()
            << " of " << Transactions + 1 << "\n";
}

// The columns added behind Id, Version and Payload after `k` schema
// changes: change j adds "C<j>" (default j) when j % 4 is 1, renames the
// newest column to "R<j>" when 2, gives the oldest the default j when 3,
// and deletes the oldest when 0.
using added_columns = std::vector<std::pair<std::string, int32_t>>;
added_columns columns_after(int k) {
  added_columns columns;
  for (int j = 1; j <= k; ++j) {
    switch (j % 4) {
      case 1:
        columns.emplace_back("C" + std::to_string(j), j);
        break;
      case 2:
        columns.back().first = "R" + std::to_string(j);
        break;
      case 3:
        columns.front().second = j;
        break;
      default:
        columns.erase(columns.begin());
    }
  }
  return columns;
}

// Makes schema change j of a table whose columns are `before`.
int32_t change_schema(sr_opaque_handle_t table, int j, const added_columns &before) {
  switch (j % 4) {
    case 1: {
      const std::string name = "C" + std::to_string(j);
      sr_column_t added = sr_test::column(name.c_str(), QV_INT32);
      added.default_value.val_int32 = j;
      return sr_add_columns_1(table, &added, 1);
    }
    case 2:
      return sr_change_column_name_1(table, before.back().first.c_str(),
                                     ("R" + std::to_string(j)).c_str());
    case 3:
      return sr_change_default_value_1(table, before.front().first.c_str(), int32_value(j));
    default: {
      const char *p_name = before.front().first.c_str();
      return sr_delete_columns_1(table, &p_name, 1);
    }
  }
}

// Each schema change writes a new file and renames it over the old one: a
// reader opening the table meanwhile finds the old table or the new one,
// all of its rows with all of their columns.
TEST_F(Processes, AReaderSeesTheOldOrTheNewSchemaWhileAWriterChangesIt) {
  constexpr int Changes = 60;
  constexpr uint32_t Payload_Spread = 100;
  constexpr uint64_t Filled_Counter = 2;
  create_table(4);
  {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    ASSERT_EQ(open_table(tree, Table_Path, Open_Explicit, &table), 0);
    std::mt19937 rng(1);
    random_changes changes{rng, Payload_Spread, 0, 0};
    table_state filled{true, 1, {}, {}};
    ASSERT_EQ(changes.fill(table, filled, 500), "");
    ASSERT_EQ(filled.counter, Filled_Counter);
    ASSERT_EQ(sr_close_tree_1(tree), 0);
  }
  table_state expected;
  ASSERT_EQ(read_table(expected, Payload_Spread), "");
  const pid_t writer = start_process([this] {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    if (tree == nullptr || open_table(tree, Table_Path, Open_Explicit, &table) != 0) {
      return 2;
    }
    for (int j = 1; j <= Changes; ++j) {
      if (change_schema(table, j, columns_after(j - 1)) != 0) {
        return 3;
      }
    }
    return sr_close_tree_1(tree) == 0 ? 0 : 4;
  });

  int reads = 0, status = 0;
  std::set<uint64_t> states_seen;
  table_state found;
  for (pid_t ended = 0; ended == 0; ++reads) {
    ended = waitpid(writer, &status, WNOHANG);
    ASSERT_EQ(read_table(found, Payload_Spread), "") << "read " << reads;
    const auto k = static_cast<int>(found.counter - Filled_Counter);
    expected.counter = found.counter;
    expected.columns = columns_after(k);
    ASSERT_TRUE(k >= 0 && k <= Changes && found == expected)
        << "read " << reads << " found a table never committed: " << describe(found);
    states_seen.insert(found.counter);
  }
  ASSERT_TRUE(WIFEXITED(status)) << status;
  EXPECT_EQ(WEXITSTATUS(status), 0) << "the writer failed";
  EXPECT_EQ(found.counter, Filled_Counter + Changes);
  std::cout << "reads: " << reads << ", distinct schemas seen: " << states_seen.size() << " of "
            << Changes + 1 << "\n";
}

// The rows copy `round` of process `number` carries: its own ids, all at
// version `round`.
std::map<int32_t, int32_t> copied_rows(int number, int round) {
  constexpr int Rows = 400;
  std::map<int32_t, int32_t> rows;
  for (int row = 0; row < Rows; ++row) {
    rows[number * 100000 + row] = round;
  }
  return rows;
}

// A creator writes the new table's first file as the side file, under its
// lock, before it renames it into place; a copy onto the same new path
// writes that side file too. Of a creator and a copier started together
// exactly one makes the table, the other is told it exists, and the table
// is the whole of what the winner wrote.
TEST_F(Processes, OfACreatorAndACopierOntoOneNewPathOneWinsAndTheTableIsWhole) {
  constexpr int Rounds = 20;
  constexpr uint32_t Payload_Spread = 8;
  int creations = 0;
  for (int round = 0; round < Rounds; ++round) {
    std::filesystem::remove(directory_ + "/" + Table_File);
    const auto outcome = [](int32_t rc) { return rc == 0 ? 0 : rc == SR_E_TABLE_EXISTS ? 1 : 2; };
    const pid_t creator = start_process([&] {
      // Later and later in the copier's work, so that each wins some rounds.
      std::this_thread::sleep_for(std::chrono::microseconds(round % 8 * 300));
      sr_opaque_handle_t tree = mounted_tree(), table = nullptr;
      const int32_t rc = sr_versioned::create_table(tree, Table_Path, 0, &table);
      return sr_close_tree_1(tree) == 0 ? outcome(rc) : 3;
    });
    const pid_t copier = start_process([&] {
      sr_opaque_handle_t tree = mounted_tree(), table = nullptr;
      if (sr_versioned::create_table(tree, "/m/source", 4, &table) != 0) {
        return 3;
      }
      for (const auto &[id, version] : copied_rows(1, round)) {
        if (add_row(table, id, version, Payload_Spread) != 0) {
          return 4;
        }
      }
      if (sr_apply_1(table, 0) != 0 || sr_commit_1(table) != 0) {
        return 5;
      }
      const int32_t rc = sr_copy_table_by_handle_1(table, Table_Path, 0);
      return sr_close_tree_1(tree) == 0 ? outcome(rc) : 6;
    });
    const int created = finish(creator), copied = finish(copier);
    const int results = created * 10 + copied;
    ASSERT_TRUE(results == 1 || results == 10)
        << "round " << round << ": creator " << created << ", copier " << copied;
    table_state state;
    ASSERT_EQ(read_table(state, Payload_Spread), "") << "round " << round;
    if (results == 1) {
      ++creations;
      EXPECT_TRUE(state.rows.empty()) << "round " << round << ": " << describe(state);
    } else {
      EXPECT_TRUE(state.rows == copied_rows(1, round))
          << "round " << round << ": " << describe(state);
    }
    EXPECT_FALSE(std::filesystem::exists(directory_ + "/" + Table_File + ".rewrite"));
  }
  std::cout << "[ creator ] won " << creations << " of " << Rounds << " rounds\n";
}

// Two processes copy tables of their own onto one table file again and
// again while this one reads it. Each copy writes the side file beside the
// target and renames it: without the ",Lock" file the two would write into
// one side file at once. Every read must find one whole copy, never rows of
// both or of two rounds.
TEST_F(Processes, TwoCopiersOntoOneTableAreSerialisedAndAReaderSeesOneWholeCopy) {
  constexpr int Rounds = 25;
  constexpr uint32_t Payload_Spread = 200;
  const auto copy_rounds = [this](int number) {
    return [this, number] {
      sr_opaque_handle_t tree = mounted_tree();
      if (tree == nullptr) {
        return 2;
      }
      for (int round = 1; round <= Rounds; ++round) {
        const std::string path = "/m/copy" + std::to_string(round);
        sr_opaque_handle_t table = nullptr;
        if (sr_versioned::create_table(tree, path.c_str(), 4, &table) != 0) {
          return 3;
        }
        for (const auto &[id, version] : copied_rows(number, round)) {
          if (add_row(table, id, version, Payload_Spread) != 0) {
            return 4;
          }
        }
        if (sr_apply_1(table, 0) != 0 || sr_commit_1(table) != 0 ||
            sr_copy_table_by_handle_1(table, Table_Path, 1) != 0 ||
            sr_delete_table_1(tree, path.c_str()) != 0) {
          return 5;
        }
      }
      return sr_close_tree_1(tree) == 0 ? 0 : 6;
    };
  };
  // The target exists from the start: process 0, round 0.
  {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    ASSERT_EQ(sr_versioned::create_table(tree, Table_Path, 0, &table), 0);
    for (const auto &[id, version] : copied_rows(0, 0)) {
      ASSERT_EQ(add_row(table, id, version, Payload_Spread), 0);
    }
    ASSERT_EQ(sr_close_tree_1(tree), 0);
  }
  const pid_t copiers[2] = {start_process(copy_rounds(1)), start_process(copy_rounds(2))};
  int statuses[2] = {};
  bool ended[2] = {};
  int reads = 0;
  std::set<std::pair<int, int>> copies_seen;
  table_state found;
  // Reads until both copiers have ended: the last read comes after both.
  for (; !(ended[0] && ended[1]); ++reads) {
    for (int copier = 0; copier < 2; ++copier) {
      ended[copier] =
          ended[copier] || waitpid(copiers[copier], &statuses[copier], WNOHANG) == copiers[copier];
    }
    ASSERT_EQ(read_table(found, Payload_Spread), "") << "read " << reads;
    ASSERT_FALSE(found.rows.empty()) << "read " << reads << " found no table";
    const int number = found.rows.begin()->first / 100000;
    const int round = found.rows.begin()->second;
    ASSERT_TRUE(found.rows == copied_rows(number, round))
        << "read " << reads << " found a mixture: " << describe(found);
    copies_seen.emplace(number, round);
  }
  for (const int status : statuses) {
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "a copier failed: " << status;
  }
  // The last copy of one of the two is what stays.
  EXPECT_TRUE(found.rows == copied_rows(1, Rounds) || found.rows == copied_rows(2, Rounds))
      << describe(found);
  EXPECT_FALSE(std::filesystem::exists(directory_ + "/" + Table_File + ".rewrite"));
  std::cout << "reads: " << reads << ", distinct copies seen: " << copies_seen.size() << " of "
            << 2 * Rounds + 1 << "\n";
}

// A move by name waits for a writer of the source in another process to
// close it, and takes along what that writer committed, even by writing a
// new file over the old one: the table ends at the target alone.
TEST_F(Processes, AMoveByNameWaitsForAWriterOfTheSourceAndTakesWhatItCommitted) {
  constexpr uint32_t Payload_Spread = 100;
  create_table(4);
  int ready[2];
  ASSERT_EQ(pipe(ready), 0);
  const pid_t writer = start_process([&] {
    sr_opaque_handle_t tree = mounted_tree();
    sr_opaque_handle_t table = nullptr;
    if (tree == nullptr || open_table(tree, Table_Path, Open_Explicit, &table) != 0) {
      return 2;
    }
    if (write(ready[1], "!", 1) != 1) {
      return 3;
    }
    // Two commits, each writing a new file renamed over the table's name.
    for (int32_t id = 1; id <= 2; ++id) {
      std::this_thread::sleep_for(std::chrono::milliseconds(100));
      if (add_row(table, id, 1, Payload_Spread) != 0 ||
          sr_i_apply(static_cast<sr_i_table_t *>(table), 1, 0) != 0 || sr_commit_1(table) != 0) {
        return 4;
      }
    }
    return sr_close_tree_1(tree) == 0 ? 0 : 5;
  });
  close(ready[1]);
  char signal = 0;
  ASSERT_EQ(read(ready[0], &signal, 1), 1);
  close(ready[0]);
  sr_opaque_handle_t tree = mounted_tree();
  ASSERT_EQ(sr_move_table_by_name_1(tree, Table_Path, "/disk/shared/u", 0), 0);
  EXPECT_EQ(sr_close_tree_1(tree), 0);
  EXPECT_EQ(finish(writer), 0);
  EXPECT_FALSE(std::filesystem::exists(directory_ + "/" + Table_File))
      << "the writer's commit brought the table back to its old name";
  table_state moved;
  ASSERT_EQ(sr_versioned::read_table(directory_, "/disk/shared/u", moved, Payload_Spread), "");
  EXPECT_EQ(moved.rows, (std::map<int32_t, int32_t>{{1, 1}, {2, 1}}));
}

}  // namespace
