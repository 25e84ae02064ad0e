/*
 * trees_and_mounts.c - a tree, a mount point, and where tables live.
 * Tables below the mount point "/guide" are files in ./guide_registry;
 * the others live in memory only. Run it in an empty directory.
 */
#include <stdio.h>
#include <stdlib.h>
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

/* Creates a table of one integer key column at `p_path`. */
static int32_t create(sr_opaque_handle_t tree, const char *p_path) {
  sr_column_t id = {.name = "id", .type = QV_INT32, .qualifier = SR_PRIMARY_KEY};
  sr_opaque_handle_t table = NULL;
  const int32_t rc = sr_create_table_1(tree, p_path, &id, 1, SR_MODE_WRITE, &table);
  if (rc == 0) {
    check(sr_close_table_1(table), "sr_close_table_1");
  }
  return rc;
}

int main(void) {
  sr_opaque_handle_t tree = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  check(sr_mount_local_tree_1(tree, "/guide", "guide_registry", 1), "sr_mount_local_tree_1");

  /* Below the mount point: one file, named by the rest of the path. */
  check(create(tree, "/guide/settings/limits"), "create /guide/settings/limits");
  printf("/guide/settings/limits is a file: %s\n",
         access("guide_registry/settings,limits", F_OK) == 0 ? "yes" : "no");

  /* Elsewhere, and without the leading "/", tables are in memory only:
   * "guide/settings/limits" is not the table above. */
  check(create(tree, "/scratch/limits"), "create /scratch/limits");
  check(create(tree, "guide/settings/limits"), "create guide/settings/limits");
  printf("/guide/settings/limits exists already: %d\n",
         (int)create(tree, "/guide/settings/limits"));

  /* Letters, digits, "_" and "/" only. */
  printf("/guide/my-table: %d\n", (int)create(tree, "/guide/my-table"));

  /* Closing the tree closes its tables and mount points. */
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
