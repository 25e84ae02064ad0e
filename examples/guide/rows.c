/*
 * rows.c - adding, reading, setting and deleting rows. A row is named by
 * its key, by its packed index (its place among the rows, from 0; it moves
 * as rows come and go) or by its fixed index (stable while the row lives).
 */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

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

enum { Buckets = 64 };
static uint32_t hash_name(const void *p_key) {
  uint32_t hash = 2166136261u; /* FNV-1a */
  for (const unsigned char *p = p_key; *p != 0; ++p) {
    hash = (hash ^ *p) * 16777619u;
  }
  return hash % Buckets;
}
static int32_t compare_names(const void *p_stored_key, const void *p_key) {
  return strcmp(p_stored_key, p_key);
}

static void add(sr_opaque_handle_t table, const char *p_name, int32_t port) {
  const char *names[] = {"name", "port"}; /* "weight" takes its default */
  qv_value_t name = {.ptr_char = (char *)p_name}, port_value = {.val_int32 = port};
  qv_value_t *values[] = {&name, &port_value};
  check(sr_add_row_1(table, names, values, 2), "sr_add_row_1");
}

/* Every row by packed index, until there is none. */
static void print_rows(sr_opaque_handle_t table) {
  const char *names[] = {"name", "port", "weight"};
  for (int32_t row = 0;; ++row) {
    qv_value_t name, port, weight;
    qv_value_t *results[] = {&name, &port, &weight};
    const int32_t rc = sr_get_fields_by_index_1(table, row, names, results, 3);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      break;
    }
    check(rc, "sr_get_fields_by_index_1");
    printf("  %d: %s port %d weight %.1f\n", (int)row, name.ptr_char, (int)port.val_int32,
           weight.val_float64);
    free(name.ptr_char); /* a string read is the caller's */
  }
}

int main(void) {
  sr_opaque_handle_t tree = NULL, table = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  sr_column_t columns[] = {{.name = "name", .type = QV_CHAR_PTR, .qualifier = SR_PRIMARY_KEY},
                           {.name = "port", .type = QV_INT32, .qualifier = SR_STANDARD},
                           {.name = "weight", .type = QV_FLOAT64, .qualifier = SR_STANDARD}};
  columns[2].default_value.val_float64 = 1.0;
  check(sr_create_hashed_key_table_1(tree, "/guide/services", columns, 3, SR_MODE_WRITE, Buckets,
                                     hash_name, compare_names, &table),
        "sr_create_hashed_key_table_1");
  add(table, "web", 8080);
  add(table, "db", 5432);
  add(table, "cache", 6379);
  printf("added:\n");
  print_rows(table);

  /* By key: read one value, set two. */
  qv_value_t web = {.ptr_char = "web"}, port;
  check(sr_get_field_by_key_1(table, web, "port", &port), "sr_get_field_by_key_1");
  port.val_int32 += 1;
  qv_value_t weight = {.val_float64 = 2.5};
  const char *names[] = {"port", "weight"};
  qv_value_t *values[] = {&port, &weight};
  check(sr_set_fields_by_key_1(table, web, names, values, 2), "sr_set_fields_by_key_1");

  /* The fixed index of "cache" stays while "db" goes. */
  qv_value_t cache = {.ptr_char = "cache"};
  uint32_t cache_row = 0;
  check(sr_get_fixed_row_index_for_key_1(table, cache, &cache_row), "fixed index");
  check(sr_delete_rows_1(table, "name == $s", "db"), "sr_delete_rows_1");
  qv_value_t cache_port;
  check(sr_get_field_by_fixed_index_and_visibility_1(table, (int32_t)cache_row, "port", &cache_port,
                                                     0, NULL),
        "sr_get_field_by_fixed_index_and_visibility_1");
  printf("after setting web and deleting db (cache still at fixed index %u, port %d):\n", cache_row,
         (int)cache_port.val_int32);
  print_rows(table);

  qv_value_t db = {.ptr_char = "db"};
  printf("reading db now returns %d\n", (int)sr_get_field_by_key_1(table, db, "port", &port));
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
