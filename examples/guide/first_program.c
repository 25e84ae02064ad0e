#include <stdio.h>

#include <qv_sr.h>

int main(void) {
  sr_opaque_handle_t tree;
  if (sr_open_tree_1(&tree, 0, 0) != 0) {
    cu_error_t *error; /* the thread's error information */
    cu_get_error_1(&error);
    fprintf(stderr, "%s", error->p_text); /* e.g. "2605-012 Memory could not ..." */
    cu_rel_error_1(error);
    return 1;
  }
  /* ... tables ... */
  return sr_close_tree_1(tree);
}
