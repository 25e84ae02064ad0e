/*
 * sr_i_table_file.h - the file side of a persistent table: the descriptors
 * of its table file and rewrite file, their two paths, their lengths, and
 * where the committed and the applied commit records lie. A table owns one
 * through `p_file`; a transient table has none.
 *
 * Only the storage code changes it, under the table's write lock.
 */
#ifndef SR_I_TABLE_FILE_H
#define SR_I_TABLE_FILE_H

#include <cstdint>
#include <string>

#include "tables/sr_i_table.h"

/* Where one record lies in a file. */
struct sr_i_record_place_t {
  uint32_t offset = 0;
  uint32_t length = 0;
  uint32_t end() const { return offset + length; }
};

typedef struct sr_i_table_file_struct_t {
  std::string path;         /* the table file */
  std::string rewrite_path; /* the same with ".rewrite": a complete new file
                               while an apply by rewrite waits for commit */
  int fd = -1;              /* the table file; while the table is open for
                               writing it holds the file's lock */
  int rewrite_fd = -1;
  uint32_t length = 0;         /* bytes of the table file */
  uint32_t rewrite_length = 0; /* bytes of the rewrite file */
  /* The live commit record, where the committed state ends, and the one the
   * last apply wrote (in the table file, or in the rewrite file); the same
   * place while nothing is applied. */
  sr_i_record_place_t commit_record;
  sr_i_record_place_t applied_commit_record;
} sr_i_table_file_t;

/*
 * Gives `p_table` the bookkeeping of its file at `p_file_path`, nothing
 * open yet, and keeps `p_registry_path` (or null) as the name the caller
 * knows the table by. 0 or 12 (raised).
 */
int32_t sr_i_attach_table_file(sr_i_table_t *p_table, const char *p_file_path,
                               const char *p_registry_path);

/* Closes the descriptors, which ends the file lock, and frees the
 * bookkeeping. Null is ignored. */
void sr_i_close_table_file(sr_i_table_file_t *p_file);

#endif /* SR_I_TABLE_FILE_H */
