/*
 * transactions.c - an explicitly controlled table: changes are pending,
 * then applied, then committed (or aborted). Readers of the committed view
 * see the last commit; readers of the applied view see the changes too.
 */
#include <stdio.h>
#include <stdlib.h>

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

static void set_limit(sr_opaque_handle_t table, int32_t id, int32_t limit) {
  qv_value_t key = {.val_int32 = id}, value = {.val_int32 = limit};
  check(sr_set_field_by_key_1(table, key, "limit", &value), "sr_set_field_by_key_1");
}

/* Prints row `id` as each view shows it, with its state in that view. */
static void show(sr_opaque_handle_t table, int32_t id, const char *p_when) {
  static const char *const states[] = {"committed", "added", "updated", "deleted", "no row"};
  printf("%s:\n", p_when);
  for (uint32_t applied_view = 0; applied_view <= 1; ++applied_view) {
    qv_value_t key = {.val_int32 = id}, limit = {.val_int32 = 0};
    sr_row_state_t state = SR_ROW_STATE_NO_ROW;
    const int32_t rc =
        sr_get_field_by_key_and_visibility_1(table, key, "limit", &limit, applied_view, &state);
    printf("  %s view: ", applied_view ? "applied  " : "committed");
    if (rc == 0) {
      printf("limit %d (%s)\n", (int)limit.val_int32, states[state]);
    } else {
      printf("returned %d\n", (int)rc);
    }
  }
}

int main(void) {
  sr_opaque_handle_t tree = NULL, table = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  sr_column_t columns[] = {{.name = "id", .type = QV_INT32, .qualifier = SR_PRIMARY_KEY},
                           {.name = "limit", .type = QV_INT32, .qualifier = SR_STANDARD}};
  check(sr_create_table_1(tree, "/guide/limits", columns, 2, SR_MODE_EXPLICIT_CONTROL, &table),
        "sr_create_table_1");

  const char *names[] = {"id", "limit"};
  qv_value_t id = {.val_int32 = 7}, limit = {.val_int32 = 100};
  qv_value_t *values[] = {&id, &limit};
  check(sr_add_row_1(table, names, values, 2), "sr_add_row_1");
  show(table, 7, "added, pending");
  check(sr_apply_1(table, 0), "sr_apply_1");
  printf("a change while applied returns %d\n",
         (int)sr_set_field_by_key_1(table, id, "limit", &limit));
  check(sr_commit_1(table), "sr_commit_1");
  show(table, 7, "committed");

  set_limit(table, 7, 200);
  show(table, 7, "set to 200, pending");
  check(sr_abort_1(table), "sr_abort_1");
  show(table, 7, "aborted");

  set_limit(table, 7, 300);
  check(sr_apply_1(table, 0), "sr_apply_1");
  check(sr_commit_1(table), "sr_commit_1");
  show(table, 7, "set to 300, applied and committed");
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
