/*
 * selection.c - asking which rows match an expression (docs/expressions.md):
 * as a new table of copies (sr_select_1) or as fixed row indexes
 * (sr_get_selected_rows_v_1); which rows have pending changes
 * (sr_get_updated_rows_1); which rows share a key (sr_get_duplicate_rows_1,
 * for a key qualified SR_PRIMARY_KEY_NOCHECK).
 */
#include <stdarg.h>
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

static void add(sr_opaque_handle_t table, const char *p_host, int32_t port, uint32_t enabled) {
  const char *names[] = {"host", "port", "enabled"};
  qv_value_t host = {.ptr_char = (char *)p_host}, port_value = {.val_int32 = port},
             enabled_value = {.val_uint32 = enabled};
  qv_value_t *values[] = {&host, &port_value, &enabled_value};
  check(sr_add_row_1(table, names, values, 3), "sr_add_row_1");
}

static void print_indexes(const char *p_title, const uint32_t *p_rows, uint32_t count) {
  printf("%s:", p_title);
  for (uint32_t at = 0; at < count; ++at) {
    printf(" %u", p_rows[at]);
  }
  printf("\n");
}

/* The va_list form of the selection, called with variadic arguments. */
static void print_selected(sr_opaque_handle_t table, const char *p_criteria, ...) {
  uint32_t count = 0, *p_rows = NULL;
  va_list arguments;
  va_start(arguments, p_criteria);
  const int32_t rc = sr_get_selected_rows_v_1(table, p_criteria, arguments, 0, &count, &p_rows);
  va_end(arguments);
  check(rc, "sr_get_selected_rows_v_1");
  print_indexes(p_criteria, p_rows, count);
  free(p_rows);
}

int main(void) {
  sr_opaque_handle_t tree = NULL, table = NULL, selected = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  /* One row per service instance: a host may appear more than once. */
  sr_column_t columns[] = {
      {.name = "host", .type = QV_CHAR_PTR, .qualifier = SR_PRIMARY_KEY_NOCHECK},
      {.name = "port", .type = QV_INT32, .qualifier = SR_STANDARD},
      {.name = "enabled", .type = QV_UINT32, .qualifier = SR_STANDARD}};
  check(sr_create_table_1(tree, "/guide/instances", columns, 3, SR_MODE_EXPLICIT_CONTROL, &table),
        "sr_create_table_1");
  add(table, "alpha", 80, 1);
  add(table, "beta", 80, 0);
  add(table, "alpha", 443, 1);
  add(table, "gamma", 8080, 1);
  check(sr_apply_1(table, 0), "sr_apply_1");
  check(sr_commit_1(table), "sr_commit_1");

  /* A new table of the enabled instances below port 1024: the key column
   * first, then the columns named. */
  const char *port_column[] = {"port"};
  check(sr_select_1(table, port_column, 1, &selected, "enabled != 0 && port < $i", 1024),
        "sr_select_1");
  printf("enabled below 1024:");
  for (int32_t row = 0;; ++row) {
    qv_value_t host, port;
    const char *names[] = {"host", "port"};
    qv_value_t *results[] = {&host, &port};
    const int32_t rc = sr_get_fields_by_index_1(selected, row, names, results, 2);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      break;
    }
    check(rc, "sr_get_fields_by_index_1");
    printf(" %s:%d", host.ptr_char, (int)port.val_int32);
    free(host.ptr_char);
  }
  printf("\n");
  check(sr_close_table_1(selected), "sr_close_table_1");

  /* The same question as fixed row indexes. */
  print_selected(table, "port == $i", 80);
  print_selected(table, "host == $s", "alpha");

  /* Rows that share a key. */
  uint32_t count = 0, *p_rows = NULL;
  qv_value_t alpha = {.ptr_char = "alpha"};
  check(sr_get_duplicate_rows_1(table, alpha, &count, &p_rows, 0), "sr_get_duplicate_rows_1");
  print_indexes("rows of alpha", p_rows, count);
  free(p_rows);

  /* Pending changes: the added and updated rows (the count), then the
   * deleted ones. */
  qv_value_t disabled = {.val_uint32 = 0};
  check(sr_set_field_by_fixed_index_1(table, 3, "enabled", &disabled), "set");
  add(table, "delta", 22, 1);
  check(sr_delete_row_by_index_1(table, 1), "sr_delete_row_by_index_1");
  check(sr_get_updated_rows_1(table, &count, &p_rows), "sr_get_updated_rows_1");
  print_indexes("added or updated", p_rows, count);
  print_indexes("deleted", p_rows + count, 1); /* one deletion here */
  free(p_rows);
  check(sr_abort_1(table), "sr_abort_1");
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
