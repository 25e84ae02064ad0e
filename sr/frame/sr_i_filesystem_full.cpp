// sr_i_filesystem_full.cpp - the "filesystem is full" error, which names the
// filesystem that filled up: its device and the directory it is mounted
// over, found in the mount table.
//
// The mount table lists one filesystem a line: device, mount directory,
// type, options. The filesystem holding a path is the one whose mount
// directory is the longest whole-component prefix of the path; of equal
// directories the later line wins, as a later mount covers an earlier one.
// The root filesystem is not matched as a prefix (every path would match);
// it is the answer when nothing else is.

#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_trace.h"

const char *Sr_Mount_Table_Path = "/etc/mtab";

namespace {

constexpr size_t Longest_Line = 4096;

// The mount table writes blanks and backslashes inside names as octal
// escapes ("\040"); undo them so that the directory compares with a path.
std::string unescape(std::string_view word) {
  std::string plain;
  for (size_t at = 0; at < word.size(); ++at) {
    const bool octal = word[at] == '\\' && at + 3 < word.size() &&
                       word.substr(at + 1, 3).find_first_not_of("01234567") == word.npos;
    if (octal) {
      plain += static_cast<char>((word[at + 1] - '0') * 64 + (word[at + 2] - '0') * 8 +
                                 (word[at + 3] - '0'));
      at += 3;
    } else {
      plain += word[at];
    }
  }
  return plain;
}

// The first `count` blank-separated words of a line.
size_t split_words(char *p_line, std::string_view *p_words, size_t count) {
  size_t found = 0;
  char *p_cursor = p_line;
  while (found < count) {
    p_cursor += std::strspn(p_cursor, " \t\n");
    if (*p_cursor == '\0') {
      break;
    }
    const size_t length = std::strcspn(p_cursor, " \t\n");
    p_words[found++] = std::string_view(p_cursor, length);
    p_cursor += length;
  }
  return found;
}

bool is_component_prefix(std::string_view directory, std::string_view path) {
  return path.substr(0, directory.size()) == directory &&
         (path.size() == directory.size() || path[directory.size()] == '/');
}

}  // namespace

bool get_filesystem_containing_file(const char *p_path, const char *p_mount_table,
                                    sr_i_filesystem_t &filesystem) {
  filesystem.device = "UNKNOWN";
  filesystem.directory = "UNKNOWN";
  FILE *p_table = std::fopen(p_mount_table, "re");
  if (p_table == nullptr) {
    return false;
  }
  const std::string_view path = p_path ? p_path : "";
  std::string root_device = "UNKNOWN";
  size_t best_length = 0;
  bool matched = false;
  char line[Longest_Line];
  while (std::fgets(line, sizeof line, p_table) != nullptr) {
    std::string_view words[3];
    if (split_words(line, words, 3) < 3) {
      continue;
    }
    const std::string directory = unescape(words[1]);
    if (directory == "/") {
      root_device = unescape(words[0]);
      continue;
    }
    if (is_component_prefix(directory, path) && directory.size() >= best_length) {
      best_length = directory.size();
      filesystem.device = unescape(words[0]);
      filesystem.directory = directory;
      matched = true;
    }
  }
  std::fclose(p_table);
  if (!matched) {
    filesystem.device = root_device;
    filesystem.directory = "/";
  }
  return true;
}

int32_t sr_i_raise_filesystem_full(const char *p_path) {
  // An unreadable mount table still gets the error raised, with the
  // filesystem "UNKNOWN": the caller must learn that the disk is full.
  sr_i_filesystem_t filesystem;
  get_filesystem_containing_file(p_path, Sr_Mount_Table_Path, filesystem);
  cu_set_error_1(SR_E_FILESYSTEM_FULL, 0, Sr_Message_Catalog, Sr_Message_Set,
                 SR_I_MESSAGE_FILESYSTEM_FULL, cu_mesgtbl_qv_sr_set[SR_I_MESSAGE_FILESYSTEM_FULL],
                 filesystem.device.c_str(), filesystem.directory.c_str());
  if (sr_i_trace_on(SR_I_TRACE_ERRORS)) {
    tr_record_strings_1(Sr_Trace_Component, 119, 2, filesystem.device.c_str(),
                        filesystem.directory.c_str());
  }
  return SR_E_FILESYSTEM_FULL;
}
