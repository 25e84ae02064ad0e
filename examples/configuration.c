/*
 * configuration.c - a small configuration table kept in the registry.
 *
 * The table "/example/services" holds one row per service: its name (the
 * key), a port, an enabled flag, a weight and the list of hosts it runs on.
 * It is persistent: "/example" is mounted on a directory (by default
 * "qv_registry" below the working directory, or the first argument), so
 * every run starts from what the previous run committed.
 *
 * The first run creates the table with three services. Every run then
 * changes one service, deletes "db" while it exists and adds a queue, in one
 * explicit transaction. Before the commit it prints both views of the
 * table: the committed one, which other readers see, and the applied one,
 * with the transaction's changes. Then it commits, prints the result, and
 * selects the enabled services that run on one host.
 */
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <qv_sr.h>

/* Prints the thread's error information for a failed call and exits. */
static void check(int32_t rc, const char *p_call) {
  if (rc == 0) {
    return;
  }
  cu_error_t *p_error = NULL;
  cu_get_error_1(&p_error);
  fprintf(stderr, "%s failed (%d): %s", p_call, rc, p_error ? p_error->p_text : "\n");
  cu_rel_error_1(p_error);
  exit(1);
}

static sr_column_t column(const char *p_name, qv_data_type_t type, sr_qualifier_t qualifier) {
  sr_column_t definition = {0};
  definition.name = (char *)p_name;
  definition.type = type;
  definition.qualifier = qualifier;
  return definition;
}

/* Adds a service; `hosts` is a NULL-terminated list. */
static void add_service(sr_opaque_handle_t table, const char *p_name, int32_t port,
                        uint32_t enabled, double weight, const char *const *hosts) {
  uint32_t count = 0;
  while (hosts[count] != NULL) {
    ++count;
  }
  qv_array_t *p_hosts = malloc(sizeof(qv_array_t) + count * sizeof(qv_value_t));
  p_hosts->element_count = count;
  p_hosts->pad = 0;
  for (uint32_t at = 0; at < count; ++at) {
    p_hosts->elements[at].ptr_char = (char *)hosts[at];
  }
  qv_value_t name = {.ptr_char = (char *)p_name}, port_value = {.val_int32 = port},
             enabled_value = {.val_uint32 = enabled}, weight_value = {.val_float64 = weight},
             hosts_value = {.ptr_array = p_hosts};
  const char *names[] = {"name", "port", "enabled", "weight", "hosts"};
  qv_value_t *values[] = {&name, &port_value, &enabled_value, &weight_value, &hosts_value};
  check(sr_add_row_1(table, names, values, 5), "sr_add_row_1");
  free(p_hosts);
}

/* Prints every row of one view: the committed one, or the applied one. */
static void print_table(sr_opaque_handle_t table, uint32_t uncommitted, const char *p_title) {
  static const char *const state_names[] = {"committed", "added", "updated", "deleted", "none"};
  sr_table_metadata_t *p_metadata = NULL;
  check(sr_get_table_metadata_1(table, 0, &p_metadata), "sr_get_table_metadata_1");
  printf("%s (%u rows, change counter %llu)\n", p_title, p_metadata->number_of_rows,
         (unsigned long long)p_metadata->table_change_counter);
  sr_free_table_metadata_1(p_metadata);

  const char *names[] = {"name", "port", "enabled", "weight", "hosts"};
  for (int32_t row = 0;; ++row) {
    qv_value_t name, port, enabled, weight, hosts;
    qv_value_t *results[] = {&name, &port, &enabled, &weight, &hosts};
    sr_row_state_t state;
    const int32_t rc =
        sr_get_fields_by_index_and_visibility_1(table, row, names, results, 5, uncommitted, &state);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      break; /* past the last row */
    }
    if (rc == SR_E_ROW_DELETED) {
      continue; /* not in this view */
    }
    check(rc, "sr_get_fields_by_index_and_visibility_1");
    printf("  %-8s port %-5d %-8s weight %.2f hosts", name.ptr_char, port.val_int32,
           enabled.val_uint32 ? "enabled" : "disabled", weight.val_float64);
    for (uint32_t at = 0; at < hosts.ptr_array->element_count; ++at) {
      printf(" %s", hosts.ptr_array->elements[at].ptr_char);
    }
    printf("  [%s]\n", state_names[state]);
    free(name.ptr_char);
    free(hosts.ptr_array);
  }
}

/* The packed index of the row named `p_name` in the applied view, or -1. */
static int32_t find_row(sr_opaque_handle_t table, const char *p_name) {
  for (int32_t row = 0;; ++row) {
    qv_value_t name;
    const int32_t rc = sr_get_field_by_index_and_visibility_1(table, row, "name", &name, 1, NULL);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      return -1;
    }
    if (rc == SR_E_ROW_DELETED) {
      continue;
    }
    check(rc, "sr_get_field_by_index_and_visibility_1");
    const int found = strcmp(name.ptr_char, p_name) == 0;
    free(name.ptr_char);
    if (found) {
      return row;
    }
  }
}

/*
 * A selection: the enabled services that run on `p_host`, copied into a new
 * table of two columns (the key, name, always comes first), printed, and
 * closed again.
 */
static void print_services_on(sr_opaque_handle_t table, const char *p_host) {
  const char *columns[] = {"port"};
  sr_opaque_handle_t selected = NULL;
  check(sr_select_1(table, columns, 1, &selected, "enabled != 0 && $s in hosts", p_host),
        "sr_select_1");
  printf("Enabled services on %s:", p_host);
  const char *names[] = {"name", "port"};
  for (int32_t row = 0;; ++row) {
    qv_value_t name, port;
    qv_value_t *results[] = {&name, &port};
    const int32_t rc = sr_get_fields_by_index_1(selected, row, names, results, 2);
    if (rc == SR_E_NO_ROW_FOR_INDEX) {
      break;
    }
    check(rc, "sr_get_fields_by_index_1");
    printf(" %s (port %d)", name.ptr_char, port.val_int32);
    free(name.ptr_char);
  }
  printf("\n");
  check(sr_close_table_1(selected), "sr_close_table_1");
}

/*
 * Rows are found by name through a hash table of 64 buckets. Without one, a
 * table keyed by strings checks a new key by comparing it with every live
 * row in row order, which also compares a row that reuses the place of a
 * deleted one with itself and refuses it.
 */
enum { Name_Buckets = 64 };

static uint32_t hash_name(const void *p_key) {
  uint32_t hash = 2166136261u; /* FNV-1a */
  for (const unsigned char *p = p_key; *p != 0; ++p) {
    hash = (hash ^ *p) * 16777619u;
  }
  return hash % Name_Buckets;
}

static int32_t compare_names(const void *p_stored_key, const void *p_key) {
  return strcmp(p_stored_key, p_key);
}

/* Creates the table with its first three services. */
static sr_opaque_handle_t create_services(sr_opaque_handle_t tree) {
  sr_column_t columns[] = {
      column("name", QV_CHAR_PTR, SR_PRIMARY_KEY), column("port", QV_INT32, SR_STANDARD),
      column("enabled", QV_UINT32, SR_STANDARD), column("weight", QV_FLOAT64, SR_STANDARD),
      column("hosts", QV_CHAR_PTR_ARRAY, SR_STANDARD)};
  columns[2].default_value.val_uint32 = 1;
  columns[3].default_value.val_float64 = 1.0;
  sr_opaque_handle_t table = NULL;
  check(
      sr_create_hashed_key_table_1(tree, "/example/services", columns, 5, SR_MODE_EXPLICIT_CONTROL,
                                   Name_Buckets, hash_name, compare_names, &table),
      "sr_create_hashed_key_table_1");
  const char *const web_hosts[] = {"alpha", "beta", NULL};
  const char *const db_hosts[] = {"gamma", NULL};
  const char *const cache_hosts[] = {"alpha", "delta", "epsilon", NULL};
  add_service(table, "web", 8080, 1, 2.5, web_hosts);
  add_service(table, "db", 5432, 1, 1.0, db_hosts);
  add_service(table, "cache", 6379, 0, 0.5, cache_hosts);
  check(sr_apply_1(table, 0), "sr_apply_1");
  check(sr_commit_1(table), "sr_commit_1");
  return table;
}

int main(int argc, char **argv) {
  /* The registry's files live in this directory; a second run finds the
   * state the first one committed. */
  const char *p_directory = argc > 1 ? argv[1] : "qv_registry";
  sr_opaque_handle_t tree = NULL, table = NULL;
  check(sr_open_tree_1(&tree, 0, 0), "sr_open_tree_1");
  check(sr_mount_local_tree_1(tree, "/example", p_directory, 1), "sr_mount_local_tree_1");
  const int32_t rc = sr_open_hashed_key_table_1(tree, "/example/services", SR_MODE_WRITE_EXPLICIT,
                                                Name_Buckets, hash_name, compare_names, &table);
  if (rc == SR_E_NO_TABLE) {
    table = create_services(tree);
  } else {
    check(rc, "sr_open_hashed_key_table_1");
  }
  printf("Table /example/services in %s/services\n", p_directory);
  print_table(table, 0, "Committed at start");

  /* One transaction: move web to the next port, enable the cache, drop db
   * when it is still there, and add a queue named after the change counter. */
  qv_value_t web = {.ptr_char = "web"}, port;
  check(sr_get_field_by_key_1(table, web, "port", &port), "sr_get_field_by_key_1");
  port.val_int32 += 1;
  check(sr_set_field_by_key_1(table, web, "port", &port), "sr_set_field_by_key_1");
  qv_value_t cache = {.ptr_char = "cache"}, enabled = {.val_uint32 = 1};
  check(sr_set_field_by_key_1(table, cache, "enabled", &enabled), "sr_set_field_by_key_1");
  const int32_t db = find_row(table, "db");
  if (db >= 0) {
    check(sr_delete_row_by_index_1(table, (uint32_t)db), "sr_delete_row_by_index_1");
  }
  sr_table_metadata_t *p_metadata = NULL;
  check(sr_get_table_metadata_1(table, 0, &p_metadata), "sr_get_table_metadata_1");
  char queue_name[32];
  snprintf(queue_name, sizeof queue_name, "queue-%llu",
           (unsigned long long)p_metadata->table_change_counter);
  sr_free_table_metadata_1(p_metadata);
  const char *const queue_hosts[] = {"beta", NULL};
  add_service(table, queue_name, 5672, 1, 1.5, queue_hosts);
  check(sr_apply_1(table, 0), "sr_apply_1");

  print_table(table, 0, "Committed view, before the commit");
  print_table(table, 1, "Applied view, before the commit");
  check(sr_commit_1(table), "sr_commit_1");
  print_table(table, 0, "After the commit");
  print_services_on(table, "alpha");

  check(sr_close_table_1(table), "sr_close_table_1");
  check(sr_close_tree_1(tree), "sr_close_tree_1");
  return 0;
}
