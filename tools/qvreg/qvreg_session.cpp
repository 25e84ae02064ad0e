// qvreg_session.cpp - the tree of one qvreg run: the mount points given
// with --mount, or the embedded default "/local" on ./qv_registry (or
// $QV_REGISTRY), created on first use; the tables the run opens; commit at
// the end, abort when the run fails.

#include "qvreg_session.h"

#include <cstdlib>

namespace qvreg {

namespace {

constexpr const char *Default_Mount = "/local";

std::string last_error_text() {
  cu_error_t *p_error = nullptr;
  if (cu_get_error_1(&p_error) != 0 || p_error == nullptr) {
    return "";
  }
  std::string text = p_error->p_text;
  cu_rel_error_1(p_error);
  return text;
}

}  // namespace

void check(int32_t rc) {
  if (rc != 0) {
    throw refused(rc, last_error_text());
  }
}

session::session(const options &given) : options_(given) {
  if (options_.format != "table" && options_.format != "csv" && options_.format != "json") {
    throw usage_error("--format must be table, csv or json, not \"" + options_.format + "\"");
  }
  for (const std::string &mount : options_.mounts) {
    const size_t equals = mount.find('=');
    if (equals == std::string::npos || equals == 0 || equals + 1 == mount.size()) {
      throw usage_error("--mount takes REGISTRY_PATH=DIRECTORY, not \"" + mount + "\"");
    }
    mounts_[mount.substr(0, equals)] = mount.substr(equals + 1);
  }
  if (mounts_.empty()) {
    const char *p_directory = std::getenv("QV_REGISTRY");
    mounts_[Default_Mount] =
        p_directory != nullptr && *p_directory != '\0' ? p_directory : "./qv_registry";
  }
  check(sr_open_tree_1(&tree_, 0, 0));
  for (const auto &[path, directory] : mounts_) {
    check(sr_mount_local_tree_1(tree_, path.c_str(), directory.c_str(), 1));
  }
}

session::~session() {
  // Whatever was not committed is dropped with the tree.
  for (const auto &[path, table] : writers_) {
    sr_abort_1(table);
  }
  sr_close_tree_1(tree_);
}

sr_opaque_handle_t session::open(const std::string &path, bool writing) {
  auto &opened = writing ? writers_ : readers_;
  if (const auto found = opened.find(path); found != opened.end()) {
    return found->second;
  }
  sr_opaque_handle_t table = nullptr;
  check(sr_open_table_1(tree_, path.c_str(), writing ? SR_MODE_WRITE_EXPLICIT : SR_MODE_READ,
                        &table));
  opened[path] = table;
  return table;
}

void session::commit() {
  for (const std::string &path : changed_) {
    const sr_opaque_handle_t table = writers_.at(path);
    check(sr_apply_1(table, 0));
    check(sr_commit_1(table));
  }
  changed_.clear();
}

std::string session::file_of(const std::string &path) const {
  // The deepest mount point that contains the path, whole components.
  const std::pair<const std::string, std::string> *p_mount = nullptr;
  for (const auto &mount : mounts_) {
    const std::string &name = mount.first;
    const bool contains =
        path.rfind(name, 0) == 0 &&
        (path.size() == name.size() || name.back() == '/' || path[name.size()] == '/');
    if (contains && (p_mount == nullptr || name.size() > p_mount->first.size())) {
      p_mount = &mount;
    }
  }
  if (p_mount == nullptr) {
    return "";
  }
  std::string rest = path.substr(p_mount->first.size());
  rest.erase(0, rest.find_first_not_of('/'));
  for (char &letter : rest) {
    letter = letter == '/' ? ',' : letter;
  }
  return p_mount->second + "/" + rest;
}

}  // namespace qvreg
