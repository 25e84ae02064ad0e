/*
 * open_tree.c - the smallest program on the registry's C interface: opens a
 * tree, closes it, then makes a call fail on purpose and prints the error
 * information the library left for the thread.
 */
#include <stdio.h>

#include "qv_sr.h"

/* Prints the calling thread's last error information. */
static void print_last_error(void) {
  cu_error_t *p_error = NULL;
  if (cu_get_error_1(&p_error) == 0) {
    printf("  error information: code %d, message %d: %s", (int)p_error->code,
           (int)p_error->message, p_error->p_text[0] ? p_error->p_text : "(none)\n");
    cu_rel_error_1(p_error);
  }
}

int main(void) {
  sr_opaque_handle_t tree = NULL;
  int32_t rc = sr_open_tree_1(&tree, 0, 0);
  printf("sr_open_tree_1 returned %d\n", (int)rc);
  if (rc != 0) {
    print_last_error();
    return 1;
  }
  rc = sr_close_tree_1(tree);
  printf("sr_close_tree_1 returned %d\n", (int)rc);
  print_last_error();

  /* The same handle again: the tree is gone, so the call is refused. */
  rc = sr_close_tree_1(tree);
  printf("sr_close_tree_1 on the closed tree returned %d\n", (int)rc);
  print_last_error();
  return rc == SR_E_INVALID_HANDLE ? 0 : 1;
}
