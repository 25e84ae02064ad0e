/*
 * creating_tables.c - columns, a key hash table for string keys, and why a
 * table whose rows are ever deleted needs one.
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

/* A string key's hash: the library passes the characters and wants a
 * bucket number below the bucket count given at creation. */
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

/* Adds the rows "a", "b" and "c", deletes "a" (committed at once: the mode
 * is SR_MODE_WRITE), then returns what adding "d" returns. */
static int32_t add_after_a_deletion(sr_opaque_handle_t table) {
  const char *names[] = {"name"};
  const char *keys[] = {"a", "b", "c", "d"};
  for (int at = 0; at < 3; ++at) {
    qv_value_t key = {.ptr_char = (char *)keys[at]};
    qv_value_t *values[] = {&key};
    check(sr_add_row_1(table, names, values, 1), "sr_add_row_1");
  }
  check(sr_delete_row_by_index_1(table, 0), "sr_delete_row_by_index_1");
  qv_value_t key = {.ptr_char = "d"};
  qv_value_t *values[] = {&key};
  return sr_add_row_1(table, names, values, 1);
}

int main(void) {
  sr_opaque_handle_t tree = NULL, services = NULL, unhashed = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");

  /* Exactly one key column (it becomes column 0); defaults for the rest. */
  sr_column_t columns[] = {{.name = "name", .type = QV_CHAR_PTR, .qualifier = SR_PRIMARY_KEY},
                           {.name = "port", .type = QV_INT32, .qualifier = SR_STANDARD},
                           {.name = "enabled", .type = QV_UINT32, .qualifier = SR_STANDARD},
                           {.name = "hosts", .type = QV_CHAR_PTR_ARRAY, .qualifier = SR_STANDARD}};
  columns[2].default_value.val_uint32 = 1;
  check(sr_create_hashed_key_table_1(tree, "/guide/services", columns, 4, SR_MODE_WRITE, Buckets,
                                     hash_name, compare_names, &services),
        "sr_create_hashed_key_table_1");

  sr_table_metadata_t *p_metadata = NULL;
  check(sr_get_table_metadata_1(services, -1, &p_metadata), "sr_get_table_metadata_1");
  printf("%s:", p_metadata->name);
  for (uint32_t at = 0; at < p_metadata->number_of_columns; ++at) {
    printf(" %s", p_metadata->column_definitions[at].name);
  }
  printf("\n");
  check(sr_free_table_metadata_1(p_metadata), "sr_free_table_metadata_1");

  /* The trap: without a key hash table, an SR_PRIMARY_KEY table refuses
   * every add once a row before the last has been deleted. */
  check(sr_create_table_1(tree, "/guide/unhashed", columns, 1, SR_MODE_WRITE, &unhashed),
        "sr_create_table_1");
  printf("add after a deletion, without a key hash table: %d\n",
         (int)add_after_a_deletion(unhashed));
  printf("add after a deletion, with a key hash table: %d\n", (int)add_after_a_deletion(services));

  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
