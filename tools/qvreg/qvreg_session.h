// qvreg_session.h - what one run of qvreg holds: a tree with its mount
// points, the tables it opened, and the way every failure leaves the
// program (the library's refusal: exit 1, its message on standard error; a
// usage error: exit 2).

#ifndef QVREG_SESSION_H
#define QVREG_SESSION_H

#include <cstdint>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "qv_sr.h"

namespace qvreg {

inline constexpr int Exit_Refused = 1;
inline constexpr int Exit_Usage = 2;

// The library refused a call; its message is the thread's error text.
class refused : public std::runtime_error {
 public:
  refused(int32_t code, const std::string &message) : std::runtime_error(message), code_(code) {}
  int32_t code() const { return code_; }

 private:
  int32_t code_;
};

// The command line asked for something that cannot be done as asked.
class usage_error : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Throws `refused` with the library's message unless `rc` is 0.
void check(int32_t rc);

// The global options every subcommand shares.
struct options {
  std::vector<std::string> mounts; /* REGISTRY_PATH=DIRECTORY */
  bool uncommitted = false;        /* read the applied view */
  std::string format = "table";    /* table, csv or json */
};

// One tree for the run. Tables opened for writing are opened under explicit
// control; `commit` applies and commits those that hold changes, and a
// session that ends without it aborts what they hold.
class session {
 public:
  explicit session(const options &given);
  ~session();
  session(const session &) = delete;
  session &operator=(const session &) = delete;

  sr_opaque_handle_t tree() const { return tree_; }
  const options &settings() const { return options_; }
  uint32_t visibility() const { return options_.uncommitted ? 1 : 0; }

  // The table at `path`, opened once per run: for reading, or for writing.
  sr_opaque_handle_t open(const std::string &path, bool writing);

  // Notes that the table opened for writing at `path` holds changes.
  void changed(const std::string &path) { changed_.insert(path); }

  // Applies and commits every table that holds changes.
  void commit();

  // The file of a registry path below a mount point: the rest of the path
  // in the mount directory with "," for "/"; "" for a transient path.
  std::string file_of(const std::string &path) const;

 private:
  options options_;
  sr_opaque_handle_t tree_ = nullptr;
  std::map<std::string, std::string> mounts_; /* registry path to directory */
  std::map<std::string, sr_opaque_handle_t> readers_;
  std::map<std::string, sr_opaque_handle_t> writers_;
  std::set<std::string> changed_;
};

}  // namespace qvreg

#endif  // QVREG_SESSION_H
