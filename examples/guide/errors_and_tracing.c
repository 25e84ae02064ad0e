/*
 * errors_and_tracing.c - every call returns a code; a failing call also
 * leaves a message for the calling thread, which the next successful call
 * clears. Run it with QV_TRACE_LEVELS=_SRA=1 to see the calls traced.
 */
#include <stdio.h>
#include <stdlib.h>

#include <qv_sr.h>

/* Prints the calling thread's error information. */
static void print_error(const char *p_call, int32_t rc) {
  cu_error_t *p_error = NULL;
  if (cu_get_error_1(&p_error) != 0) {
    exit(1);
  }
  printf("%s returned %d; error information: code %d, message %d: %s", p_call, (int)rc,
         (int)p_error->code, (int)p_error->message,
         p_error->code != 0 ? p_error->p_text : "(none)\n");
  cu_rel_error_1(p_error); /* the copy is the caller's */
}

int main(void) {
  sr_opaque_handle_t tree = NULL, table = NULL;
  int32_t rc = sr_open_tree_1(&tree, 0, 0);
  if (rc != 0) {
    print_error("sr_open_tree_1", rc);
    return 1;
  }

  /* A path with a character that paths may not hold. */
  sr_column_t id = {.name = "id", .type = QV_INT32, .qualifier = SR_PRIMARY_KEY};
  rc = sr_create_table_1(tree, "/guide/bad path", &id, 1, SR_MODE_WRITE, &table);
  print_error("sr_create_table_1", rc);

  /* A row that is not there: the message names the key and the table. */
  rc = sr_create_table_1(tree, "/guide/ids", &id, 1, SR_MODE_WRITE, &table);
  print_error("sr_create_table_1", rc);
  qv_value_t key = {.val_int32 = 42}, value;
  rc = sr_get_field_by_key_1(table, key, "id", &value);
  print_error("sr_get_field_by_key_1", rc);

  /* A null handle. */
  rc = sr_close_table_1(NULL);
  print_error("sr_close_table_1", rc);
  return sr_close_tree_1(tree);
}
