// sr_i_table_file.cpp - making and freeing the file side of a persistent
// table (sr_i_table_file.h). The rewrite file's path is kept beside the
// table file's as a string of its own, so no user has to turn one into the
// other and back.

#include "storage/sr_i_table_file.h"

#include <cstdlib>
#include <cstring>
#include <new>

#include "frame/sr_i_errors.h"
#include "storage/sr_i_files.h"

int32_t sr_i_attach_table_file(sr_i_table_t *p_table, const char *p_file_path,
                               const char *p_registry_path) {
  char *p_registry_copy = nullptr;
  if (p_registry_path != nullptr && (p_registry_copy = strdup(p_registry_path)) == nullptr) {
    return sr_i_raise_no_memory();
  }
  auto *p_file = new (std::nothrow) sr_i_table_file_t;
  if (p_file == nullptr) {
    std::free(p_registry_copy);
    return sr_i_raise_no_memory();
  }
  try {
    p_file->path = p_file_path;
    p_file->rewrite_path = p_file->path + ".rewrite";
  } catch (const std::bad_alloc &) {
    delete p_file;
    std::free(p_registry_copy);
    return sr_i_raise_no_memory();
  }
  p_table->p_file = p_file;
  p_table->p_persistent_table_registry_path = p_registry_copy;
  return 0;
}

void sr_i_close_table_file(sr_i_table_file_t *p_file) {
  if (p_file == nullptr) {
    return;
  }
  sr_i_close_file(p_file->fd);
  sr_i_close_file(p_file->rewrite_fd);
  delete p_file;
}
