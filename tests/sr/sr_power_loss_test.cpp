// Persistent tables after a power loss at every step of their writing. The
// file-system door is replaced by a "platter" that keeps, per file, the
// bytes a flush made durable apart from the bytes written since, and for
// the mount directory the names a flush of the directory made durable
// apart from the creations, renames and removals made since. A scripted
// run of transactions is repeated once per cut point; the power goes off
// before the chosen write, flush, truncation, rename or unlink, and what
// the platter then holds is opened as the table: it must be the last
// committed state, or the one being committed at the cut. The table must
// also take new transactions from there.
//
// What survives of a file's contents is modelled three ways: only the
// flushed bytes; every byte written (as after a crash of the process
// alone); and a random choice of the unflushed 512-byte sectors and
// truncations, since a disk may write back its cache in any order and tear
// a write between sectors.
//
// A file system that does not write directories synchronously (ext4, XFS)
// makes a new name, a rename or a removal durable only once the directory
// holding it is flushed (fsync on a descriptor of the directory); until
// then a power loss may undo it, so that the target of a rename names the
// file it replaced again and the source name is back. What survives of the
// directory's unflushed changes is modelled three ways too: none of them
// (the worst case); the first few, since a journal writes them in the
// order they were made; and all of them, as after a crash of the process.
// Every pairing of the two is opened.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <map>
#include <random>
#include <string>
#include <utility>
#include <vector>

#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "sr_namespace_operations.h"
#include "sr_versioned_rows.h"
#include "storage/sr_i_system_calls.h"
#include "tables/sr_i_table.h"

namespace {

using namespace sr_versioned;
using sr_test::file_bytes;

constexpr const char *Table_Path = "/disk/power/t";
// The script's seed; SR_POWER_LOSS_SEED runs another script.
uint32_t script_seed() {
  const char *p_seed = std::getenv("SR_POWER_LOSS_SEED");
  return p_seed != nullptr ? static_cast<uint32_t>(std::strtoul(p_seed, nullptr, 10)) : 5;
}
// Every cut point runs the whole script again: the cost grows with the
// square of its length.
#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr int Script_Steps = 50;
#else
constexpr int Script_Steps = 70;
#endif
constexpr size_t Sector = 512;

// ---- The platter ------------------------------------------------------

// A write (`bytes` at `offset`) or a truncation (to `offset`) not yet flushed.
struct unflushed_change {
  bool truncation;
  off_t offset;
  std::string bytes;
};

// A file as the platter holds it. Files are known by their number, not by
// their inode: a removed file's inode number can come back for a new file,
// while a power loss may yet bring the removed file back under its name.
struct platter_file {
  std::string durable;
  std::vector<unflushed_change> unflushed;
};

// The mount directory: the number of the file each name refers to.
using names = std::map<std::string, size_t>;

// A directory's files as a power loss leaves them, by name; and which
// survival of names and contents left them.
using image = std::map<std::string, std::string>;
using cut_image = std::pair<std::string, image>;

struct platter {
  std::string directory;
  struct stat directory_status {};
  std::vector<platter_file> files;
  std::map<ino_t, size_t> file_of_inode;
  names live;                          // as the calls have left it
  names durable_names;                 // as its last flush left it
  std::vector<names> unflushed_names;  // after each change since that flush
  uint64_t calls = 0;
  uint64_t renames = 0;
  uint64_t cut = UINT64_MAX;
  std::vector<cut_image> images;
  std::string problem;  // the model disagrees with the real files
};

platter *P_Platter = nullptr;

void note_problem(const std::string &problem) {
  if (P_Platter->problem.empty()) {
    P_Platter->problem = problem;
  }
}

ino_t inode_of(int fd) {
  struct stat status {};
  ::fstat(fd, &status);
  return status.st_ino;
}

// The platter's file behind a descriptor.
platter_file &file_of(int fd) {
  const auto found = P_Platter->file_of_inode.find(inode_of(fd));
  if (found != P_Platter->file_of_inode.end()) {
    return P_Platter->files[found->second];
  }
  note_problem("the platter did not see a file created");
  P_Platter->file_of_inode[inode_of(fd)] = P_Platter->files.size();
  return P_Platter->files.emplace_back();
}

// The name of a path in the mount directory.
std::string name_of(const std::string &path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos || path.substr(0, slash) != P_Platter->directory) {
    note_problem("a name outside the mount directory: " + path);
  }
  return path.substr(slash + 1);
}

// The durable bytes of a file with the unflushed changes that `keep` lets
// through, in the order they were made.
template <typename Keep>
std::string surviving(const platter_file &file, Keep keep) {
  std::string bytes = file.durable;
  for (const unflushed_change &change : file.unflushed) {
    if (change.truncation) {
      if (keep()) {
        bytes.resize(static_cast<size_t>(change.offset), '\0');
      }
      continue;
    }
    // Sector by sector: a write may be torn at any sector boundary.
    for (size_t from = 0, to = 0; from < change.bytes.size(); from = to) {
      const size_t position = static_cast<size_t>(change.offset) + from;
      to = std::min(change.bytes.size(), from + Sector - position % Sector);
      if (keep()) {
        bytes.resize(std::max(bytes.size(), position + to - from), '\0');
        bytes.replace(position, to - from, change.bytes, from, to - from);
      }
    }
  }
  return bytes;
}

// The model against the real directory: the same names, holding every
// byte written.
void check_against_the_real_files() {
  size_t files = 0;
  for (const auto &entry : std::filesystem::directory_iterator(P_Platter->directory)) {
    const auto named = P_Platter->live.find(entry.path().filename());
    if (named == P_Platter->live.end() || surviving(P_Platter->files[named->second], [] {
                                            return true;
                                          }) != file_bytes(entry.path())) {
      note_problem("the platter model lost track of " + entry.path().filename().string());
    }
    ++files;
  }
  if (files != P_Platter->live.size()) {
    note_problem("the platter model names files the directory does not have");
  }
}

// The power goes off: what the directory may hold afterwards, for every
// pairing of what survives of its names and of its files' contents.
void lose_power() {
  platter &disk = *P_Platter;
  check_against_the_real_files();
  std::mt19937 rng(static_cast<uint32_t>(disk.cut));
  std::vector<std::array<std::string, 3>> contents;
  for (const platter_file &file : disk.files) {
    contents.push_back({file.durable, surviving(file, [&] { return rng() % 2 == 0; }),
                        surviving(file, [] { return true; })});
  }
  // Some of the changes, but not all or none, where there are two or more.
  const std::vector<names> &changes = disk.unflushed_names;
  const names &first_changes =
      changes.size() > 1 ? changes[rng() % (changes.size() - 1)] : disk.live;
  const std::pair<const char *, const names *> directories[] = {
      {"no unflushed name change", &disk.durable_names},
      {"the first unflushed name changes", &first_changes},
      {"every name change", &disk.live}};
  const char *kept_contents[] = {"flushed contents only", "random sectors", "every byte written"};
  disk.images.clear();
  for (const auto &[p_names_kept, p_names] : directories) {
    for (size_t kept = 0; kept < 3; ++kept) {
      cut_image &left = disk.images.emplace_back(
          std::string(p_names_kept) + " and " + kept_contents[kept], image{});
      for (const auto &[name, file] : *p_names) {
        left.second[name] = contents[file][kept];
      }
    }
  }
}

void count_call() {
  if (P_Platter->calls++ == P_Platter->cut) {
    lose_power();
  }
}

// A creation, rename or removal in the directory, not yet durable.
void name_change(const std::string &name, size_t file) {
  P_Platter->live[name] = file;
  P_Platter->unflushed_names.push_back(P_Platter->live);
}

// A file created now starts out empty, under a name not yet durable.
int platter_open(const char *p_path, int flags, mode_t mode) {
  struct stat status {};
  const bool existed = ::stat(p_path, &status) == 0;
  const int fd = Sr_Default_File_System.open(p_path, flags, mode);
  if (fd >= 0 && !existed) {
    P_Platter->file_of_inode[inode_of(fd)] = P_Platter->files.size();
    P_Platter->files.emplace_back();
    name_change(name_of(p_path), P_Platter->files.size() - 1);
  } else if (fd >= 0 && (flags & O_TRUNC) != 0 && S_ISREG(status.st_mode)) {
    // Emptied, as a truncation not yet flushed.
    file_of(fd).unflushed.push_back({true, 0, {}});
  }
  return fd;
}

ssize_t platter_writev(int fd, const struct iovec *p_io_vector, int count) {
  count_call();
  const off_t offset = ::lseek(fd, 0, SEEK_CUR);
  const ssize_t written = Sr_Default_File_System.writev(fd, p_io_vector, count);
  if (written > 0) {
    std::string bytes;
    for (int at = 0; at < count; ++at) {
      bytes.append(static_cast<const char *>(p_io_vector[at].iov_base), p_io_vector[at].iov_len);
    }
    bytes.resize(static_cast<size_t>(written));
    file_of(fd).unflushed.push_back({false, offset, bytes});
  }
  return written;
}

ssize_t platter_write(int fd, const void *p_buffer, size_t length) {
  const iovec whole{const_cast<void *>(p_buffer), length};
  return platter_writev(fd, &whole, 1);
}

// The platter takes the file, or the mount directory's names, as they are
// now. The real flush is left out: nothing here survives a real power
// loss, and the runs are many.
int platter_fsync(int fd) {
  count_call();
  struct stat status {};
  ::fstat(fd, &status);
  if (!S_ISDIR(status.st_mode)) {
    platter_file &file = file_of(fd);
    file.durable = file_bytes("/proc/self/fd/" + std::to_string(fd));
    file.unflushed.clear();
  } else if (status.st_dev == P_Platter->directory_status.st_dev &&
             status.st_ino == P_Platter->directory_status.st_ino) {
    P_Platter->durable_names = P_Platter->live;
    P_Platter->unflushed_names.clear();
  }
  return 0;
}

int platter_ftruncate(int fd, off_t length) {
  count_call();
  const int result = Sr_Default_File_System.ftruncate(fd, length);
  if (result == 0) {
    file_of(fd).unflushed.push_back({true, length, {}});
  }
  return result;
}

int platter_rename(const char *p_from, const char *p_to) {
  count_call();
  ++P_Platter->renames;
  const int result = Sr_Default_File_System.rename(p_from, p_to);
  const auto from = P_Platter->live.find(name_of(p_from));
  if (result == 0 && from == P_Platter->live.end()) {
    note_problem(std::string("the platter did not see ") + p_from + " created");
  } else if (result == 0) {
    const size_t file = from->second;
    P_Platter->live.erase(from);
    name_change(name_of(p_to), file);
  }
  return result;
}

int platter_unlink(const char *p_path) {
  count_call();
  const int result = Sr_Default_File_System.unlink(p_path);
  if (result == 0) {
    P_Platter->live.erase(name_of(p_path));
    P_Platter->unflushed_names.push_back(P_Platter->live);
  }
  return result;
}

// ---- The table and its script ------------------------------------------

// Payloads up to about 740 bytes: the file soon passes the size at which
// rewrites start.
constexpr uint32_t Payload_Spread = 700;

// The committed state of the table in `directory`, as a new program opens
// it; an empty string, or what went wrong.
std::string read_table(const std::string &directory, table_state &state) {
  return sr_versioned::read_table(directory, Table_Path, state, Payload_Spread);
}

// A commit in the script: the calls at positions [first_call, end_call)
// of the run carry the table from the state before to `state`.
struct commit_window {
  uint64_t first_call;
  uint64_t end_call;
  table_state state;
  bool operator==(const commit_window &) const = default;
};

// The scripted run: creation, then phases of single changes through an
// implicitly controlled handle and of multi-row transactions through an
// explicitly controlled one, with a schema change every sixth step. The same seed gives the same
// calls in the same order on every run. Returns the commits of the run; `problem` is set when a
// call failed.
std::vector<commit_window> run_script(const std::string &directory, std::string &problem) {
  std::mt19937 rng(script_seed());
  random_changes changes{rng, Payload_Spread, 12, 50};
  table_state state{true, 1, {}, {}};
  sr_opaque_handle_t tree = mounted_tree(directory);
  sr_opaque_handle_t table = nullptr;
  const uint64_t first_call = P_Platter->calls;
  if (tree == nullptr || create_table(tree, Table_Path, 0, &table) != 0) {
    problem = "the creation failed";
    sr_close_tree_1(tree);
    return {};
  }
  std::vector<commit_window> windows = {{first_call, P_Platter->calls, state}};
  bool implicit = true;
  for (int step = 0; step < Script_Steps && problem.empty(); ++step) {
    if (step % 8 == 0) {
      implicit = !implicit;
      if (sr_close_table_1(table) != 0 ||
          open_table(tree, Table_Path, implicit ? Open_Implicit : Open_Explicit, &table) != 0) {
        problem = "reopening the table failed";
        break;
      }
    }
    uint64_t first = UINT64_MAX;
    const auto note_first_call = [&](const char *, const table_state &) {
      first = P_Platter->calls;
    };
    if (step % 6 == 5) {
      problem = changes.schema_change(table, state, note_first_call);
    } else {
      problem = implicit ? changes.implicit_change(table, state, false, note_first_call)
                         : changes.explicit_transaction(table, state, 6, note_first_call);
    }
    if (first != UINT64_MAX) {
      windows.push_back({first, P_Platter->calls, state});
    }
  }
  sr_close_tree_1(tree);
  return windows;
}

// The states a cut before call `cut` may leave: the last commit that
// finished before it, and the one under way at it.
std::vector<table_state> states_at(const std::vector<commit_window> &windows, uint64_t cut) {
  std::vector<table_state> states(1);  // before the creation: no table
  for (const commit_window &window : windows) {
    if (window.end_call <= cut) {
      states.assign(1, window.state);
    } else if (window.first_call < cut) {
      states.push_back(window.state);
    }
  }
  return states;
}

// ---- Copies, moves and deletions ----------------------------------------

namespace ns = sr_namespace_operations;

#if defined(__SANITIZE_THREAD__) || defined(__SANITIZE_ADDRESS__)
constexpr int Namespace_Steps = 24;
#else
constexpr int Namespace_Steps = 40;
#endif

// An operation of the namespace script: the calls at positions
// [first_call, end_call) of the run carry the three paths from `before` to
// what `step` leaves.
struct operation_window {
  uint64_t first_call;
  uint64_t end_call;
  ns::operation step;
  ns::files_t before;
  bool operator==(const operation_window &) const = default;
};

ns::files_t no_files() {
  ns::files_t files;
  for (const char *p_name : ns::Names) {
    files[p_name] = table_state{};
  }
  return files;
}

// The scripted run: random copies, moves and deletions between the three
// table files and memory, the same on every run. Returns the operations of
// the run; `problem` is set when a call failed.
std::vector<operation_window> run_namespace_script(const std::string &directory,
                                                   std::string &problem) {
  std::mt19937 rng(script_seed());
  ns::random_operations operations(rng, 1);
  sr_opaque_handle_t tree = mounted_tree(directory);
  problem = tree == nullptr ? "no tree" : operations.start(tree, no_files());
  std::vector<operation_window> windows;
  const ns::random_operations::listener announce = [&](const ns::operation &step) {
    windows.push_back({P_Platter->calls, UINT64_MAX, step, operations.files()});
  };
  const ns::random_operations::listener confirm = [&](const ns::operation &) {
    windows.back().end_call = P_Platter->calls;
  };
  for (int step = 0; step < Namespace_Steps && problem.empty(); ++step) {
    problem = operations.step(announce, confirm);
  }
  sr_close_tree_1(tree);
  return windows;
}

// What the three paths may hold after a cut before call `cut`: what the
// last operation that returned before it left, or any outcome of the one
// under way at it.
std::vector<ns::files_t> files_at(const std::vector<operation_window> &windows, uint64_t cut) {
  std::vector<ns::files_t> allowed = {no_files()};
  for (const operation_window &window : windows) {
    if (window.end_call <= cut) {
      allowed = {ns::after(window.before, window.step)};
    } else if (window.first_call < cut) {
      allowed = ns::outcomes(window.before, window.step);
    }
  }
  return allowed;
}

class PowerLoss : public ::testing::Test {
 protected:
  // The image of a failure is kept for a look.
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    if (!HasFailure()) {
      std::filesystem::remove_all(restored_);
    }
  }

  // The restored images and what is written to them afterwards need not
  // survive a real power loss: no real flushes, which would only slow the
  // many runs down.
  static int no_flush(int) { return 0; }

  // Runs `script` (`run_script` or `run_namespace_script`) on a new, empty
  // mount directory, taken to be durable already, with the platter in the
  // door; the power goes off before call `disk.cut`.
  template <typename Script>
  static auto run_on(platter &disk, std::string &problem, Script script) {
    disk.directory = sr_test::new_directory("qv_power");
    ::stat(disk.directory.c_str(), &disk.directory_status);
    P_Platter = &disk;
    Sr_File_System.open = platter_open;
    Sr_File_System.write = platter_write;
    Sr_File_System.writev = platter_writev;
    Sr_File_System.fsync = platter_fsync;
    Sr_File_System.ftruncate = platter_ftruncate;
    Sr_File_System.rename = platter_rename;
    Sr_File_System.unlink = platter_unlink;
    const auto windows = script(disk.directory, problem);
    if (disk.cut == disk.calls) {
      lose_power();  // after the last call: the power goes off at rest
    }
    Sr_File_System = Sr_Default_File_System;
    Sr_File_System.fsync = no_flush;
    P_Platter = nullptr;
    std::filesystem::remove_all(disk.directory);
    return windows;
  }

  // Writes an image into restored_, in place of the one before.
  void restore(const image &files) {
    for (const auto &entry : std::filesystem::directory_iterator(restored_)) {
      std::filesystem::remove(entry.path());
    }
    for (const auto &[name, bytes] : files) {
      sr_test::write_file(restored_ + "/" + name, bytes);
    }
  }

  // After the power is back a writer carries on: an appended row, then a
  // change written by a rewrite, each of them found by the next reader.
  static std::string carry_on(const std::string &directory, table_state state) {
    sr_opaque_handle_t tree = mounted_tree(directory);
    sr_opaque_handle_t table = nullptr;
    if (tree == nullptr || open_table(tree, Table_Path, Open_Implicit, &table) != 0 ||
        add_row(table, 100000, 1, Payload_Spread) != 0) {
      sr_close_tree_1(tree);
      return "the implicit addition failed";
    }
    sr_close_table_1(table);
    state.rows[100000] = 1;
    ++state.counter;
    table_state found;
    std::string problem = read_table(directory, found);
    if (problem.empty() && !(found == state)) {
      problem = "after an appended row: " + describe(found);
    }
    if (problem.empty() &&
        (open_table(tree, Table_Path, Open_Explicit, &table) != 0 ||
         set_row(table, 100000, 2, Payload_Spread) != 0 ||
         sr_i_apply(static_cast<sr_i_table_t *>(table), 1, 0) != 0 || sr_commit_1(table) != 0)) {
      problem = "the rewrite failed";
    }
    sr_close_tree_1(tree);
    state.rows[100000] = 2;
    ++state.counter;
    if (problem.empty() && (problem = read_table(directory, found)).empty() && !(found == state)) {
      problem = "after a rewrite: " + describe(found);
    }
    return problem;
  }

  // After the power is back each table found copies to another path by
  // name, and each path takes a copy of a table in memory: side files left
  // by the cut stop neither.
  static std::string copy_on(const std::string &directory, const ns::files_t &found) {
    sr_opaque_handle_t tree = mounted_tree(directory);
    sr_opaque_handle_t table = nullptr;
    if (tree == nullptr || create_table(tree, "/m/new", 0, &table) != 0 ||
        add_row(table, 1, 1, ns::Payload_Spread) != 0) {
      sr_close_tree_1(tree);
      return "the table in memory failed";
    }
    std::string problem;
    for (const auto &[name, state] : found) {
      const std::string path = ns::path_of(name);
      table_state copied;
      if (state.exists &&
          (sr_copy_table_by_name_1(tree, path.c_str(), "/disk/ns/z", 1) != 0 ||
           !sr_versioned::read_table(directory, "/disk/ns/z", copied, ns::Payload_Spread).empty() ||
           !(copied == state))) {
        problem = "copying " + name + " on failed";
        break;
      }
      if (sr_copy_table_by_handle_1(table, path.c_str(), 1) != 0 ||
          !sr_versioned::read_table(directory, path.c_str(), copied, ns::Payload_Spread).empty() ||
          copied.rows.size() != 1) {
        problem = "copying onto " + name + " failed";
        break;
      }
    }
    sr_close_tree_1(tree);
    return problem;
  }

  const std::string restored_ = sr_test::new_directory("qv_power");
};

// The cut points include the first call after a creation or a rewriting
// commit returned: its rename must be durable by then, so that even the
// images that keep no unflushed name change hold the new state.
TEST_F(PowerLoss, EveryCutLeavesACommittedStateThatTakesNewTransactions) {
  // A first run counts the calls and places the commits among them.
  platter counting;
  std::string problem;
  const std::vector<commit_window> windows = run_on(counting, problem, run_script);
  ASSERT_EQ(problem, "");
  const uint64_t total_calls = counting.calls;
  ASSERT_GT(counting.renames, 1u) << "no commit of the script rewrote the file";
  int images_checked = 0;
  int new_states = 0;
  for (uint64_t cut = 0; cut <= total_calls; ++cut) {
    platter disk;
    disk.cut = cut;
    const std::vector<commit_window> again = run_on(disk, problem, run_script);
    ASSERT_EQ(problem, "") << "cut " << cut;
    ASSERT_TRUE(disk.calls == total_calls && again == windows) << "the run is not repeatable";
    ASSERT_EQ(disk.problem, "") << "cut " << cut;
    const std::vector<table_state> allowed = states_at(windows, cut);
    std::vector<image> opened;
    for (const auto &[kept, files] : disk.images) {
      if (std::find(opened.begin(), opened.end(), files) != opened.end()) {
        continue;
      }
      opened.push_back(files);
      restore(files);
      table_state found;
      problem = read_table(restored_, found);
      if (problem.empty() && std::find(allowed.begin(), allowed.end(), found) == allowed.end()) {
        problem = "found " + describe(found);
      }
      if (problem.empty() && found.exists) {
        problem = carry_on(restored_, found);
      }
      if (!problem.empty()) {
        std::string expected;
        for (const table_state &state : allowed) {
          expected += "\n  or " + describe(state);
        }
        FAIL() << "script seed " << script_seed()
               << " (SR_POWER_LOSS_SEED), power lost before call " << cut << " of " << total_calls
               << ", keeping " << kept << ": " << problem << "\n  expected" << expected
               << "\n  image kept in " << restored_;
      }
      new_states += allowed.size() > 1 && found == allowed.back() ? 1 : 0;
      ++images_checked;
    }
  }
  std::cout << "cut points tried: " << total_calls + 1 << " (script seed " << script_seed() << ", "
            << windows.size() << " commits in the script, " << counting.renames - 1
            << " of them by rewriting the file), images opened: " << images_checked
            << ", of which showed the commit in flight as done: " << new_states << "\n";
  RecordProperty("cut_points", static_cast<int>(total_calls + 1));
}

// The script's operations publish each target by a rename and remove a
// moved source by an unlink, each followed by a flush of the directory:
// at every cut each table is whole at its source or its target, and one
// whose copy or move returned before the cut is where it went. Afterwards
// every table copies on, and every path takes a new copy, whatever side
// files the cut left.
TEST_F(PowerLoss, EveryCutLeavesEachCopiedOrMovedTableWholeAtItsSourceOrItsTarget) {
  platter counting;
  std::string problem;
  const std::vector<operation_window> windows = run_on(counting, problem, run_namespace_script);
  ASSERT_EQ(problem, "");
  const uint64_t total_calls = counting.calls;
  std::map<std::string, int> kinds;
  for (const operation_window &window : windows) {
    ++kinds[window.step.kind];
  }
  ASSERT_GE(kinds.size(), 6u) << "the script leaves kinds of operation out";
  int images_checked = 0;
  int new_outcomes = 0;
  for (uint64_t cut = 0; cut <= total_calls; ++cut) {
    platter disk;
    disk.cut = cut;
    const std::vector<operation_window> again = run_on(disk, problem, run_namespace_script);
    ASSERT_EQ(problem, "") << "cut " << cut;
    ASSERT_TRUE(disk.calls == total_calls && again == windows) << "the run is not repeatable";
    ASSERT_EQ(disk.problem, "") << "cut " << cut;
    const std::vector<ns::files_t> allowed = files_at(windows, cut);
    std::vector<image> opened;
    for (const auto &[kept, files] : disk.images) {
      if (std::find(opened.begin(), opened.end(), files) != opened.end()) {
        continue;
      }
      opened.push_back(files);
      restore(files);
      ns::files_t found;
      for (const char *p_name : ns::Names) {
        if (problem.empty()) {
          problem = sr_versioned::read_table(restored_, ns::path_of(p_name).c_str(), found[p_name],
                                             ns::Payload_Spread);
        }
      }
      const auto match = std::find(allowed.begin(), allowed.end(), found);
      if (problem.empty() && match == allowed.end()) {
        problem = "found" + ns::describe(found);
      }
      if (problem.empty()) {
        problem = copy_on(restored_, found);
      }
      if (!problem.empty()) {
        std::string expected;
        for (const ns::files_t &state : allowed) {
          expected += (expected.empty() ? "" : "\n  or") + ns::describe(state);
        }
        FAIL() << "script seed " << script_seed()
               << " (SR_POWER_LOSS_SEED), power lost before call " << cut << " of " << total_calls
               << ", keeping " << kept << ": " << problem << "\n  expected" << expected
               << "\n  image kept in " << restored_;
      }
      new_outcomes += match - allowed.begin() >= 1 ? 1 : 0;
      ++images_checked;
    }
  }
  std::cout << "cut points tried: " << total_calls + 1 << " (script seed " << script_seed() << ", "
            << windows.size() << " operations: ";
  for (const auto &[kind, count] : kinds) {
    std::cout << kind << " " << count << ", ";
  }
  std::cout << "), images opened: " << images_checked
            << ", of which showed the operation in flight done or half done: " << new_outcomes
            << "\n";
  RecordProperty("cut_points", static_cast<int>(total_calls + 1));
}

}  // namespace
