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

#include <dirent.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "rows/sr_i_transaction.h"
#include "sr_versioned_rows.h"
#include "storage/sr_i_system_calls.h"
#include "tables/sr_i_table.h"

namespace {

using namespace sr_versioned;

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

struct unflushed_change {
  bool truncation;
  off_t offset;  // the new length of a truncation
  std::string bytes;
};

// What survives a power loss, of everything written to a file's contents.
enum survival { flushed_only, random_sectors, everything };
constexpr const char *Survival_Names[] = {"flushed contents only", "random sectors",
                                          "every byte written"};
// ... and of the creations, renames and removals in its directory.
enum names_survival { no_name_changes, first_name_changes, every_name_change };
constexpr const char *Names_Survival_Names[] = {
    "no unflushed name change", "the first unflushed name changes", "every name change"};

// A file as the platter holds it. Files are known by their number, not by
// their inode: a removed file's inode number can come back for a new file,
// while a power loss may yet bring the removed file back under its name.
struct platter_file {
  std::string durable;
  std::vector<unflushed_change> unflushed;
};

// The mount directory: the number of the file each name refers to.
using names = std::map<std::string, size_t>;

// A directory's files as the platter holds them, by name.
using image = std::map<std::string, std::string>;

// What a cut leaves, and which survival made it.
struct cut_image {
  std::string kept;
  image files;
};

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

std::string file_contents(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

std::string file_contents(int fd) {
  return file_contents("/proc/self/fd/" + std::to_string(fd));
}

// The platter's file behind a descriptor.
platter_file &file_of(int fd) {
  const ino_t inode = inode_of(fd);
  const auto found = P_Platter->file_of_inode.find(inode);
  if (found != P_Platter->file_of_inode.end()) {
    return P_Platter->files[found->second];
  }
  note_problem("the platter did not see a file created");
  P_Platter->file_of_inode[inode] = P_Platter->files.size();
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

// The directory after a creation, rename or removal, not yet durable.
void record_name_change() {
  P_Platter->unflushed_names.push_back(P_Platter->live);
}

void put_bytes(std::string &file, off_t offset, const std::string &bytes) {
  const auto at = static_cast<size_t>(offset);
  if (file.size() < at + bytes.size()) {
    file.resize(at + bytes.size(), '\0');
  }
  file.replace(at, bytes.size(), bytes);
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
    size_t from = 0;
    while (from < change.bytes.size()) {
      const size_t position = static_cast<size_t>(change.offset) + from;
      const size_t to = std::min(change.bytes.size(), from + Sector - position % Sector);
      if (keep()) {
        put_bytes(bytes, static_cast<off_t>(position), change.bytes.substr(from, to - from));
      }
      from = to;
    }
  }
  return bytes;
}

// The model against the real directory: the same names for the same
// files, holding every byte written.
void check_against_the_real_files() {
  DIR *p_directory = ::opendir(P_Platter->directory.c_str());
  size_t files = 0;
  while (const dirent *p_entry = ::readdir(p_directory)) {
    const std::string name = p_entry->d_name;
    const std::string path = P_Platter->directory + "/" + name;
    struct stat status {};
    if (::stat(path.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
      continue;
    }
    ++files;
    const auto named = P_Platter->live.find(name);
    const auto file = P_Platter->file_of_inode.find(status.st_ino);
    if (named == P_Platter->live.end() || file == P_Platter->file_of_inode.end() ||
        named->second != file->second ||
        surviving(P_Platter->files[file->second], [] { return true; }) != file_contents(path)) {
      note_problem("the platter model lost track of " + name);
    }
  }
  ::closedir(p_directory);
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
  const std::array<const names *, 3> directories = {&disk.durable_names, &first_changes,
                                                    &disk.live};
  disk.images.clear();
  for (const names_survival kept_names : {no_name_changes, first_name_changes, every_name_change}) {
    for (const survival kept : {flushed_only, random_sectors, everything}) {
      cut_image left{std::string(Names_Survival_Names[kept_names]) + " and " + Survival_Names[kept],
                     {}};
      for (const auto &[name, file] : *directories[kept_names]) {
        left.files[name] = contents[file][kept];
      }
      disk.images.push_back(left);
    }
  }
}

void count_call() {
  if (P_Platter->calls++ == P_Platter->cut) {
    lose_power();
  }
}

// A file created now starts out empty, under a name not yet durable.
int platter_open(const char *p_path, int flags, mode_t mode) {
  struct stat status {};
  const bool existed = ::stat(p_path, &status) == 0;
  const int fd = Sr_Default_File_System.open(p_path, flags, mode);
  if (fd >= 0 && !existed) {
    P_Platter->file_of_inode[inode_of(fd)] = P_Platter->files.size();
    P_Platter->live[name_of(p_path)] = P_Platter->files.size();
    P_Platter->files.emplace_back();
    record_name_change();
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
  if (S_ISDIR(status.st_mode)) {
    if (status.st_dev == P_Platter->directory_status.st_dev &&
        status.st_ino == P_Platter->directory_status.st_ino) {
      P_Platter->durable_names = P_Platter->live;
      P_Platter->unflushed_names.clear();
    }
    return 0;
  }
  platter_file &file = file_of(fd);
  file.durable = file_contents(fd);
  file.unflushed.clear();
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
  if (result == 0) {
    const auto from = P_Platter->live.find(name_of(p_from));
    if (from == P_Platter->live.end()) {
      note_problem(std::string("the platter did not see ") + p_from + " created");
      return result;
    }
    const size_t file = from->second;
    P_Platter->live.erase(from);
    P_Platter->live[name_of(p_to)] = file;
    record_name_change();
  }
  return result;
}

int platter_unlink(const char *p_path) {
  count_call();
  const int result = Sr_Default_File_System.unlink(p_path);
  if (result == 0) {
    P_Platter->live.erase(name_of(p_path));
    record_name_change();
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
// explicitly controlled one, appended or rewritten, committed or aborted.
// The same seed gives the same calls in the same order on every run.
class script {
 public:
  explicit script(const std::string &directory) : directory_(directory), rng_(script_seed()) {}

  // The commits of the run; `problem` set when a call failed.
  std::vector<commit_window> run(std::string &problem) {
    tree_ = mounted_tree(directory_);
    if (tree_ == nullptr) {
      problem = "no tree with the mount point";
      return {};
    }
    state_ = {true, 1, {}};
    uint64_t first = P_Platter->calls;
    check(create_table(tree_, Table_Path, 0, &table_), "sr_create_hashed_key_table_1");
    windows_.push_back({first, P_Platter->calls, state_});
    bool implicit = true;
    for (int step = 0; step < Script_Steps && problem_.empty(); ++step) {
      if (step % 8 == 0) {
        implicit = !implicit;
        check(sr_close_table_1(table_), "sr_close_table_1");
        check(open_table(tree_, Table_Path, implicit ? Open_Implicit : Open_Explicit, &table_),
              "open");
      }
      if (problem_.empty()) {
        implicit ? implicit_change() : explicit_transaction();
      }
    }
    sr_close_tree_1(tree_);
    problem = problem_;
    return windows_;
  }

 private:
  void check(int32_t rc, const char *p_call) {
    if (rc != 0 && problem_.empty()) {
      problem_ = std::string(p_call) + " gave " + std::to_string(rc);
    }
  }

  void implicit_change() {
    const uint64_t first = P_Platter->calls;
    problem_ = changes_.implicit_change(table_, state_, false);
    windows_.push_back({first, P_Platter->calls, state_});
  }

  void explicit_transaction() {
    table_state next = state_;
    problem_ = changes_.transaction(table_, state_, next, 1 + rng_() % 6);
    const uint64_t counter = rng_() % 2 ? 0 : state_.counter + 2;
    next.counter = counter == 0 ? state_.counter + 1 : counter;
    auto *p_table = static_cast<sr_i_table_t *>(table_);
    const uint64_t first = P_Platter->calls;
    switch (rng_() % 8) {
      case 0:  // appended, then cut off again
        check(sr_apply_1(table_, counter), "sr_apply_1");
        check(sr_abort_1(table_), "sr_abort_1");
        return;
      case 1:  // a new file written, then removed
        check(sr_i_apply(p_table, 1, counter), "sr_i_apply");
        check(sr_abort_1(table_), "sr_abort_1");
        return;
      case 2:
      case 3:
        check(sr_i_apply(p_table, 1, counter), "sr_i_apply");
        break;
      default:  // appended, or rewritten when the file is mostly dead records
        check(sr_apply_1(table_, counter), "sr_apply_1");
        break;
    }
    check(sr_commit_1(table_), "sr_commit_1");
    state_ = next;
    windows_.push_back({first, P_Platter->calls, state_});
  }

  std::string directory_;
  std::mt19937 rng_;
  random_changes changes_{rng_, Payload_Spread, 12, 50};
  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t table_ = nullptr;
  table_state state_;
  std::vector<commit_window> windows_;
  std::string problem_;
};

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

class PowerLoss : public ::testing::Test {
 protected:
  void TearDown() override {
    Sr_File_System = Sr_Default_File_System;
    for (const std::string &directory : directories_) {
      std::filesystem::remove_all(directory);
    }
  }

  // In memory where the system offers it: the platter is modelled anyway,
  // and the runs create and remove many small directories.
  std::string new_directory() {
    for (const char *p_place : {"/dev/shm", "/tmp"}) {
      std::string pattern = std::string(p_place) + "/qv_power_XXXXXX";
      if (mkdtemp(pattern.data()) != nullptr) {
        directories_.push_back(pattern);
        return pattern;
      }
    }
    ADD_FAILURE() << "no temporary directory";
    return "/nonexistent";
  }

  // The restored images and what is written to them afterwards need not
  // survive a real power loss: no real flushes, which would only slow the
  // many runs down.
  static int no_flush(int) { return 0; }

  // The platter in the door, on a new, empty mount directory; the
  // directory itself is taken to be durable already.
  void install_platter(platter &disk) {
    disk.directory = new_directory();
    ::stat(disk.directory.c_str(), &disk.directory_status);
    P_Platter = &disk;
    Sr_File_System.open = platter_open;
    Sr_File_System.write = platter_write;
    Sr_File_System.writev = platter_writev;
    Sr_File_System.fsync = platter_fsync;
    Sr_File_System.ftruncate = platter_ftruncate;
    Sr_File_System.rename = platter_rename;
    Sr_File_System.unlink = platter_unlink;
  }

  static void remove_platter() {
    Sr_File_System = Sr_Default_File_System;
    Sr_File_System.fsync = no_flush;
    P_Platter = nullptr;
  }

  // Runs the script with the power going off before call `cut`.
  std::vector<commit_window> run_script(platter &disk, std::string &problem) {
    install_platter(disk);
    std::vector<commit_window> windows = script(disk.directory).run(problem);
    remove_platter();
    return windows;
  }

  // Writes an image into a directory of its own.
  std::string restore(const image &files) {
    const std::string directory = new_directory();
    for (const auto &[name, bytes] : files) {
      std::ofstream(directory + "/" + name, std::ios::binary) << bytes;
    }
    return directory;
  }

  // After the power is back a writer carries on: an appended row, then a
  // change written by a rewrite, each of them found by the next reader.
  std::string carry_on(const std::string &directory, table_state state) {
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

  // The power goes off now, with the platter in the door: an empty string
  // when every image it can leave holds `expected`, or what one holds.
  std::string every_image_holds(const table_state &expected) {
    lose_power();
    const sr_i_file_system_calls_t door = Sr_File_System;
    Sr_File_System = Sr_Default_File_System;
    std::string problem;
    for (const cut_image &left : P_Platter->images) {
      const std::string directory = restore(left.files);
      table_state found;
      problem = read_table(directory, found);
      if (problem.empty() && !(found == expected)) {
        problem = "found " + describe(found);
      }
      if (!problem.empty()) {
        problem = "keeping " + left.kept + ": " + problem;
        break;
      }
    }
    Sr_File_System = door;
    return P_Platter->problem.empty() ? problem : P_Platter->problem;
  }

  std::vector<std::string> directories_;
};

// Creating a table and committing a transaction that rewrote its file both
// end with a rename; when the call returns, a power loss must not undo it.
TEST_F(PowerLoss, ANewTableAndARewritingCommitSurviveAPowerLossRightAfterwards) {
  platter disk;
  install_platter(disk);
  sr_opaque_handle_t tree = mounted_tree(disk.directory);
  ASSERT_NE(tree, nullptr);
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(create_table(tree, Table_Path, 0, &table), 0);
  table_state state{true, 1, {}};
  EXPECT_EQ(every_image_holds(state), "") << "after the creation";

  // Past the size at which rewrites start, then mostly dead records.
  ASSERT_EQ(sr_close_table_1(table), 0);
  ASSERT_EQ(open_table(tree, Table_Path, Open_Explicit, &table), 0);
  for (int32_t id = 1; id <= 60; ++id) {
    ASSERT_EQ(add_row(table, id, 1, Payload_Spread), 0);
    state.rows[id] = 1;
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  ++state.counter;
  for (int32_t id = 1; id <= 56; ++id) {
    ASSERT_EQ(sr_delete_rows_1(table, "Id == $i", id), 0);
    state.rows.erase(id);
  }
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  ++state.counter;
  ASSERT_EQ(set_row(table, 60, 2, Payload_Spread), 0);
  state.rows[60] = 2;
  // The directory is flushed here, so that only the commit's own rename is
  // at stake below.
  const int directory = ::open(disk.directory.c_str(), O_RDONLY | O_DIRECTORY);
  ASSERT_GE(directory, 0);
  ASSERT_EQ(Sr_File_System.fsync(directory), 0);
  ::close(directory);
  const uint64_t renames = disk.renames;
  ASSERT_EQ(sr_apply_1(table, 0), 0);
  ASSERT_EQ(sr_commit_1(table), 0);
  ++state.counter;
  ASSERT_EQ(disk.renames, renames + 1) << "the commit did not rewrite the file";
  EXPECT_EQ(every_image_holds(state), "") << "after the rewriting commit";
  sr_close_tree_1(tree);
}

TEST_F(PowerLoss, EveryCutLeavesACommittedStateThatTakesNewTransactions) {
  // A first run counts the calls and places the commits among them.
  platter counting;
  std::string problem;
  const std::vector<commit_window> windows = run_script(counting, problem);
  ASSERT_EQ(problem, "");
  const uint64_t total_calls = counting.calls;
  ASSERT_GT(total_calls, 0u);
  int images_checked = 0;
  int new_states = 0;
  for (uint64_t cut = 0; cut <= total_calls; ++cut) {
    platter disk;
    disk.cut = cut;
    const std::vector<commit_window> again = run_script(disk, problem);
    ASSERT_EQ(problem, "") << "cut " << cut;
    ASSERT_TRUE(disk.calls == total_calls && again == windows) << "the run is not repeatable";
    if (cut == total_calls) {
      P_Platter = &disk;  // after the last call: the power goes off at rest
      lose_power();
      P_Platter = nullptr;
    }
    ASSERT_EQ(disk.problem, "") << "cut " << cut;
    const std::vector<table_state> allowed = states_at(windows, cut);
    std::vector<image> opened;
    for (const cut_image &left : disk.images) {
      if (std::find(opened.begin(), opened.end(), left.files) != opened.end()) {
        continue;
      }
      opened.push_back(left.files);
      const std::string directory = restore(left.files);
      table_state found;
      problem = read_table(directory, found);
      if (problem.empty() && std::find(allowed.begin(), allowed.end(), found) == allowed.end()) {
        problem = "found " + describe(found);
      }
      if (problem.empty() && found.exists) {
        problem = carry_on(directory, found);
      }
      if (!problem.empty()) {
        directories_.pop_back();  // kept for a look
        std::string expected;
        for (const table_state &state : allowed) {
          expected += "\n  or " + describe(state);
        }
        FAIL() << "script seed " << script_seed()
               << " (SR_POWER_LOSS_SEED), power lost before call " << cut << " of " << total_calls
               << ", keeping " << left.kept << ": " << problem << "\n  expected" << expected
               << "\n  image kept in " << directory;
      }
      new_states += allowed.size() > 1 && found == allowed.back() ? 1 : 0;
      std::filesystem::remove_all(directory);
      directories_.pop_back();
      ++images_checked;
    }
    std::filesystem::remove_all(disk.directory);
    directories_.erase(std::find(directories_.begin(), directories_.end(), disk.directory));
  }
  std::cout << "cut points tried: " << total_calls + 1 << " (script seed " << script_seed() << ", "
            << windows.size() << " commits in the script, " << counting.renames - 1
            << " of them by rewriting the file), images opened: " << images_checked
            << ", of which showed the commit in flight as done: " << new_states << "\n";
  RecordProperty("cut_points", static_cast<int>(total_calls + 1));
}

}  // namespace
