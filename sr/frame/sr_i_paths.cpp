// sr_i_paths.cpp - registry path syntax, resolution through the tree's
// mount points, and creation of mount directories.
//
// The syntax check keeps its tests in a fixed order, each raising from its
// own line so that a trace tells which one refused the path. Some of the
// later tests cannot fail once the character test has passed; they stay as
// a second line of defence should the character set ever be widened.

#include "frame/sr_i_paths.h"

#include <cctype>
#include <cstring>
#include <string_view>

#include "frame/sr_i_errors.h"
#include "storage/sr_i_files.h"

namespace {

constexpr size_t Longest_Path = 255;

bool is_path_character(unsigned char byte) {
  return std::isalnum(byte) || byte == '_' || byte == '/';
}

}  // namespace

int32_t sr_i_check_path_syntax(const char *p_path) {
  if (p_path == nullptr) {
    return sr_i_raise_invalid_path(nullptr);
  }
  const std::string_view path = p_path;
  if (path.empty() || path.size() > Longest_Path) {
    return sr_i_raise_invalid_path(p_path);
  }
  if (path[0] == '\0') {
    return sr_i_raise_invalid_path(p_path);
  }
  for (const char character : path) {
    const auto byte = static_cast<unsigned char>(character);
    if (std::isspace(byte)) {
      return sr_i_raise_invalid_path(p_path);
    }
    if (!is_path_character(byte)) {
      return sr_i_raise_invalid_path(p_path);
    }
  }
  if (path.find(',') != path.npos) {
    return sr_i_raise_invalid_path(p_path);
  }
  if (path.find("//") != path.npos) {
    return sr_i_raise_invalid_path(p_path);
  }
  if (path.find("/./") != path.npos) {
    return sr_i_raise_invalid_path(p_path);
  }
  if (path.find("/../") != path.npos) {
    return sr_i_raise_invalid_path(p_path);
  }
  if (const size_t last_slash = path.rfind('/'); last_slash != path.npos) {
    const std::string_view last = path.substr(last_slash);
    if (last == "/." || last == "/..") {
      return sr_i_raise_invalid_path(p_path);
    }
  }
  return 0;
}

const sr_i_mount_point_t *sr_i_find_mount_point(const sr_i_tree_t *p_tree,
                                                const std::string &path) {
  // Mount point names end in "/": try every prefix of the path that ends
  // in "/", longest first, so the deepest mount point wins.
  for (size_t slash = path.rfind('/'); slash != path.npos;
       slash = slash == 0 ? path.npos : path.rfind('/', slash - 1)) {
    const auto found = p_tree->mount_points.find(std::string_view(path).substr(0, slash + 1));
    if (found != p_tree->mount_points.end()) {
      return &found->second;
    }
  }
  return nullptr;
}

int32_t sr_i_resolve_path(const sr_i_tree_t *p_tree, const char *p_registry_path, std::string &key,
                          uint32_t &persistent) {
  if (const int32_t rc = sr_i_check_path_syntax(p_registry_path); rc != 0) {
    return rc;
  }
  key = p_registry_path;
  persistent = 0;
  const sr_i_mount_point_t *p_mount_point = sr_i_find_mount_point(p_tree, key);
  if (p_mount_point == nullptr) {
    return 0;
  }
  // The rest of the path, from the "/" that ends the mount point's name,
  // with every later "/" turned into ",": one flat file in the directory.
  std::string file_path = p_mount_point->filesystem_path;
  const size_t suffix_start = file_path.size();
  file_path.append(key, p_mount_point->name.size() - 1);
  for (size_t at = suffix_start + 1; at < file_path.size(); ++at) {
    if (file_path[at] == '/') {
      file_path[at] = ',';
    }
  }
  key = std::move(file_path);
  persistent = p_mount_point->block_size;
  return 0;
}

int32_t sr_i_create_all_directories_in_path(const std::string &path) {
  for (size_t slash = path.find('/', 1); slash != path.npos; slash = path.find('/', slash + 1)) {
    if (const int32_t rc = sr_i_make_directory(path.substr(0, slash).c_str()); rc != 0) {
      return rc;
    }
  }
  return sr_i_make_directory(path.c_str());
}
