// sr_namespace_operations.h - random copies, moves and deletions of tables
// between three table files of one mount directory and memory, and what
// each may leave on the disk when it is stopped half way: the operations
// the crash and power-loss tests of the namespace interrupt. Tables are
// those of sr_versioned_rows.h, so a table read back is known by its rows,
// their versions and its change counter.

#ifndef SR_NAMESPACE_OPERATIONS_H
#define SR_NAMESPACE_OPERATIONS_H

#include <array>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "sr_versioned_rows.h"

namespace sr_namespace_operations {

using sr_versioned::table_state;

// Payloads of 40 to about 900 bytes and 12 to 60 rows: files of tens of
// kilobytes, and descriptions short enough for a pipe message.
inline constexpr uint32_t Payload_Spread = 860;
inline constexpr size_t Fewest_Rows = 12;
inline constexpr size_t Most_Rows = 60;

// The three table files, by their names; "/disk" is mounted on the
// directory that holds them.
inline constexpr std::array<const char *, 3> Names = {"a", "b", "c"};
inline std::string path_of(const std::string &name) {
  return "/disk/ns/" + name;
}
inline std::string file_of(const std::string &name) {
  return "ns," + name;
}
inline constexpr const char *Memory_Path = "/m/x";
inline constexpr const char *Moved_In_Memory_Path = "/m/y";

// What each of the three paths holds.
using files_t = std::map<std::string, table_state>;

inline std::string describe(const files_t &files) {
  std::string text;
  for (const auto &[name, state] : files) {
    text += "\n    " + name + ": " + sr_versioned::describe(state);
  }
  return text;
}

// An operation: its kind, source and target names (a name of Names, or
// "-" for memory), and the table it carries.
struct operation {
  std::string kind;
  std::string source;
  std::string target;
  table_state carried;
  bool operator==(const operation &) const = default;
};

// As one line, after a tag ("P", "C"), and back.
inline std::string line_of(const char *p_tag, const operation &step) {
  return std::string(p_tag) + " " + step.kind + " " + step.source + " " + step.target + " " +
         sr_versioned::describe(step.carried);
}

inline operation parse_operation(const std::string &line) {
  operation step;
  size_t from = line.find(' ') + 1;
  for (std::string *p_word : {&step.kind, &step.source, &step.target}) {
    const size_t space = line.find(' ', from);
    *p_word = line.substr(from, space - from);
    from = space + 1;
  }
  step.carried = sr_versioned::parse_state(line.substr(from));
  return step;
}

// What the paths hold once `step` has returned.
inline files_t after(files_t files, const operation &step) {
  if (step.kind.starts_with("move-") && step.source != "-") {
    files[step.source] = table_state{};
  }
  if (step.kind == "delete") {
    files[step.target] = table_state{};
  } else if (step.target != "-") {
    files[step.target] = step.carried;
  }
  return files;
}

// What the paths may hold when `step` was stopped half way: as before it,
// or as after it. A move within one directory is one rename, whether or
// not the file is open, so a moved table is never at both paths.
inline std::vector<files_t> outcomes(const files_t &before, const operation &step) {
  return {before, after(before, step)};
}

// Makes random operations in a tree with "/disk" mounted, keeping the
// state of every path as it goes.
class random_operations {
 public:
  using listener = std::function<void(const operation &)>;

  random_operations(std::mt19937 &rng, int32_t first_id)
      : rng_(rng), changes_{rng, Payload_Spread, Fewest_Rows, Most_Rows} {
    changes_.next_id = first_id;
  }

  // Starts in `tree`, whose paths hold `files`: makes the table in memory
  // that is copied to disk. "" or what failed.
  std::string start(sr_opaque_handle_t tree, const files_t &files) {
    tree_ = tree;
    files_ = files;
    memory_state_ = {true, 1, {}, {}};
    return sr_versioned::create_table(tree_, Memory_Path, 0, &memory_) == 0
               ? ""
               : "creating the table in memory failed";
  }

  const files_t &files() const { return files_; }

  // The table in memory changed a little, so that each copy of it carries
  // a table the disk has not seen, then one copy, move or deletion,
  // announced to `announce` before it begins and to `confirm` once it has
  // returned. "" or what failed.
  std::string step(const listener &announce, const listener &confirm) {
    for (int changes = static_cast<int>(rng_() % 4);
         changes-- > 0 || memory_state_.rows.size() < Fewest_Rows;) {
      if (const std::string problem = changes_.implicit_change(memory_, memory_state_, false);
          !problem.empty()) {
        return problem;
      }
    }
    announce_ = &announce;
    confirm_ = &confirm;
    problem_.clear();
    one_operation();
    return problem_;
  }

 private:
  bool check(int32_t rc, const std::string &call) {
    if (rc != 0 && problem_.empty()) {
      problem_ = call + " gave " + std::to_string(rc);
    }
    return rc == 0;
  }

  std::string any_name() { return Names[rng_() % Names.size()]; }
  std::string another_name(const std::string &name) {
    std::string other;
    while ((other = any_name()) == name) {
    }
    return other;
  }
  std::optional<std::string> a_table_file() {
    std::vector<std::string> present;
    for (const auto &[name, state] : files_) {
      if (state.exists) {
        present.push_back(name);
      }
    }
    if (present.empty()) {
      return std::nullopt;
    }
    return present[rng_() % present.size()];
  }

  // Announces `step`, makes it through `call`, and confirms it.
  template <typename Call>
  bool carry_out(const operation &step, Call call) {
    (*announce_)(step);
    if (!check(call(), step.kind + " " + step.source + " " + step.target)) {
      return false;
    }
    files_ = after(files_, step);
    (*confirm_)(step);
    return true;
  }

  void one_operation() {
    const std::optional<std::string> source = a_table_file();
    const uint32_t kind = source ? rng_() % 7 : 0;
    const std::string target = source ? another_name(*source) : any_name();
    // A missing target needs no overwrite; one that exists is replaced.
    const int32_t overwrite = files_[target].exists || rng_() % 2 == 0 ? 1 : 0;
    const std::string target_path = path_of(target);
    switch (kind) {
      case 0:
        // Memory to disk.
        carry_out({"copy-memory", "-", target, memory_state_}, [&] {
          return sr_copy_table_by_handle_1(memory_, target_path.c_str(), overwrite);
        });
        break;
      case 1:
        copy_file(*source, target, overwrite);
        break;
      case 2:
      case 4:
        through_open_source(kind == 4, *source, target, overwrite);
        break;
      case 3:
        // Disk to disk by one rename.
        carry_out({"move-file", *source, target, files_[*source]}, [&] {
          return sr_move_table_by_name_1(tree_, path_of(*source).c_str(), target_path.c_str(),
                                         overwrite);
        });
        break;
      case 5:
        into_memory_and_back(*source, target);
        break;
      default:
        carry_out({"delete", "-", *source, {}},
                  [&] { return sr_delete_table_1(tree_, path_of(*source).c_str()); });
    }
  }

  // Disk to disk, byte for byte; now and then onto a target open here,
  // which is read again from its new file and must show it.
  void copy_file(const std::string &source, const std::string &target, int32_t overwrite) {
    const std::string target_path = path_of(target);
    sr_opaque_handle_t open_target = nullptr;
    if (files_[target].exists && rng_() % 3 == 0 &&
        !check(sr_versioned::open_table(tree_, target_path.c_str(), sr_versioned::Open_Implicit,
                                        &open_target),
               "opening the target")) {
      return;
    }
    const bool copied = carry_out({"copy-file", source, target, files_[source]}, [&] {
      return sr_copy_table_by_name_1(tree_, path_of(source).c_str(), target_path.c_str(),
                                     overwrite);
    });
    if (open_target == nullptr) {
      return;
    }
    table_state seen;
    const std::string problem = sr_versioned::read_rows(open_target, seen, Payload_Spread);
    if (copied && problem_.empty() && !(problem.empty() && seen == files_[target])) {
      problem_ =
          "the open target reads " + (problem.empty() ? sr_versioned::describe(seen) : problem);
    }
    check(sr_close_table_1(open_target), "closing the target");
  }

  // Disk to disk through an open source, written from memory; a move then
  // removes the source.
  void through_open_source(bool move, const std::string &source, const std::string &target,
                           int32_t overwrite) {
    const std::string target_path = path_of(target);
    sr_opaque_handle_t table = nullptr;
    const int32_t mode =
        move || rng_() % 2 ? sr_versioned::Open_Implicit : sr_versioned::Open_For_Reading;
    if (!check(sr_versioned::open_table(tree_, path_of(source).c_str(), mode, &table),
               "opening the source")) {
      return;
    }
    carry_out({move ? "move-open" : "copy-open", source, target, files_[source]}, [&] {
      return move ? sr_move_table_by_handle_1(table, target_path.c_str(), overwrite)
                  : sr_copy_table_by_handle_1(table, target_path.c_str(), overwrite);
    });
    check(sr_close_table_1(table), "closing the source");
  }

  // Disk to memory, the source file removed; then the table, which now
  // lives in memory alone, moved back to disk.
  void into_memory_and_back(const std::string &source, const std::string &target) {
    const table_state moved = files_[source];
    if (!carry_out({"move-to-memory", source, "-", moved}, [&] {
          return sr_move_table_by_name_1(tree_, path_of(source).c_str(), Moved_In_Memory_Path, 1);
        })) {
      return;
    }
    sr_opaque_handle_t table = nullptr;
    if (!check(sr_versioned::open_table(tree_, Moved_In_Memory_Path, sr_versioned::Open_Implicit,
                                        &table),
               "opening the table moved into memory")) {
      return;
    }
    carry_out({"move-memory", "-", target, moved},
              [&] { return sr_move_table_by_handle_1(table, path_of(target).c_str(), 1); });
    check(sr_close_table_1(table), "closing the table moved to disk");
  }

  std::mt19937 &rng_;
  sr_versioned::random_changes changes_;
  sr_opaque_handle_t tree_ = nullptr;
  sr_opaque_handle_t memory_ = nullptr;
  table_state memory_state_;
  files_t files_;
  const listener *announce_ = nullptr;
  const listener *confirm_ = nullptr;
  std::string problem_;
};

}  // namespace sr_namespace_operations

#endif  // SR_NAMESPACE_OPERATIONS_H
