/*
 * persistence.c - what survives a crash. A writer process commits one row,
 * applies a second and dies before committing it. After the "restart" the
 * table holds exactly what was committed. Run it in an empty directory.
 */
#include <stdio.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <qv_sr.h>

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

static void add(sr_opaque_handle_t table, int32_t id) {
  const char *names[] = {"id"};
  qv_value_t key = {.val_int32 = id};
  qv_value_t *values[] = {&key};
  check(sr_add_row_1(table, names, values, 1), "sr_add_row_1");
}

/* The writer: its table file is written and flushed by each commit. */
static void writer(void) {
  sr_opaque_handle_t tree = mounted_tree(), table = NULL;
  sr_column_t id = {.name = "id", .type = QV_INT32, .qualifier = SR_PRIMARY_KEY};
  check(sr_create_table_1(tree, "/guide/events", &id, 1, SR_MODE_EXPLICIT_CONTROL, &table),
        "sr_create_table_1");
  add(table, 1);
  check(sr_apply_1(table, 0), "sr_apply_1");
  check(sr_commit_1(table), "sr_commit_1");
  add(table, 2);
  check(sr_apply_1(table, 0), "sr_apply_1");
  _exit(0); /* a crash: no commit, no close */
}

int main(void) {
  /* A process forked after its parent opened a tree may not change tables,
   * so the writer is forked first. */
  const pid_t child = fork();
  if (child == 0) {
    writer();
  }
  int status = 0;
  if (child < 0 || waitpid(child, &status, 0) != child || status != 0) {
    return 1;
  }

  /* The restart: a new tree loads the table from its file. */
  sr_opaque_handle_t tree = mounted_tree(), table = NULL;
  const char *paths[] = {"/guide/events"};
  check(sr_repair_tables_1(tree, paths, 1), "sr_repair_tables_1"); /* side files of a crash */
  check(sr_open_table_1(tree, "/guide/events", SR_MODE_READ, &table), "sr_open_table_1");
  for (int32_t id = 1; id <= 2; ++id) {
    qv_value_t key = {.val_int32 = id}, value;
    const int32_t rc = sr_get_field_by_key_1(table, key, "id", &value);
    printf("row %d: %s\n", (int)id, rc == 0 ? "there" : "gone");
  }
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
