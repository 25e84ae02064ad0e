/*
 * processes.c - processes share a persistent table: one makes it, then two
 * writers add rows to it at the same time. Each writer opens the table for
 * writing, which waits while the other has it open for writing, adds its
 * rows (each committed on the spot) and closes it again.
 * A process sees the commits of others when it next opens the table: a
 * persistent table is read from its file by the first opening in a tree
 * and dropped from memory when its last handle is closed.
 * Run it in an empty directory.
 */
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <qv_sr.h>

enum { Writers = 2, Rows_Per_Writer = 50 };

/* Stops with the thread's error information when a call fails. */
static void check(int32_t rc, const char *p_call) {
  if (rc != 0) {
    cu_error_t *p_error = NULL;
    cu_get_error_1(&p_error);
    fprintf(stderr, "%s returned %d: %s", p_call, (int)rc, p_error->p_text);
    cu_rel_error_1(p_error);
    exit(1);
  }
}

static sr_opaque_handle_t mounted_tree(void) {
  sr_opaque_handle_t tree = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  check(sr_mount_local_tree_1(tree, "/guide", "guide_registry", 1), "sr_mount_local_tree_1");
  return tree;
}

/* Makes the table, in a process of its own before the writers start. */
static int create_table(void) {
  sr_opaque_handle_t tree = mounted_tree(), table = NULL;
  sr_column_t columns[] = {{.name = "id", .type = QV_INT32, .qualifier = SR_PRIMARY_KEY},
                           {.name = "writer", .type = QV_INT32, .qualifier = SR_STANDARD}};
  check(sr_create_table_1(tree, "/guide/shared", columns, 2, SR_MODE_WRITE, &table),
        "sr_create_table_1");
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}

/* Writer `number` adds the ids number * 1000 + 0, 1, ... */
static int writer(int32_t number) {
  sr_opaque_handle_t tree = mounted_tree(), table = NULL;
  check(sr_open_table_1(tree, "/guide/shared", SR_MODE_WRITE, &table), "sr_open_table_1");
  const char *names[] = {"id", "writer"};
  for (int32_t row = 0; row < Rows_Per_Writer; ++row) {
    qv_value_t id = {.val_int32 = number * 1000 + row}, by = {.val_int32 = number};
    qv_value_t *values[] = {&id, &by};
    check(sr_add_row_1(table, names, values, 2), "sr_add_row_1");
  }
  check(sr_close_table_1(table), "sr_close_table_1");
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}

/* Waits for every child; 0 when all of them succeeded. */
static int wait_for_children(void) {
  int failed = 0, status = 0;
  while (wait(&status) > 0) {
    failed |= status != 0;
  }
  return failed;
}

int main(void) {
  /* The other processes are forked before this one opens a tree: a
   * process forked after that may read tables but not change them. */
  if (fork() == 0) {
    _exit(create_table());
  }
  if (wait_for_children() != 0) {
    return 1;
  }
  for (int32_t number = 1; number <= Writers; ++number) {
    if (fork() == 0) {
      _exit(writer(number));
    }
  }
  if (wait_for_children() != 0) {
    return 1;
  }

  sr_opaque_handle_t tree = mounted_tree(), table = NULL;
  check(sr_open_table_1(tree, "/guide/shared", SR_MODE_READ, &table), "sr_open_table_1");
  sr_table_metadata_t *p_metadata = NULL;
  check(sr_get_table_metadata_1(table, 0, &p_metadata), "sr_get_table_metadata_1");
  printf("%u rows, %llu commits\n", p_metadata->number_of_rows,
         (unsigned long long)p_metadata->table_change_counter);
  check(sr_free_table_metadata_1(p_metadata), "sr_free_table_metadata_1");
  for (int32_t number = 1; number <= Writers; ++number) {
    qv_value_t last = {.val_int32 = number * 1000 + Rows_Per_Writer - 1}, by;
    check(sr_get_field_by_key_1(table, last, "writer", &by), "sr_get_field_by_key_1");
    printf("row %d was added by writer %d\n", (int)last.val_int32, (int)by.val_int32);
  }
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
