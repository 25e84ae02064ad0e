/* consumer.c - opens and closes a tree through an installed libqv_sr. */
#include <stdio.h>

#include <qv_sr.h>

int main(void) {
  sr_opaque_handle_t tree;
  if (sr_open_tree_1(&tree, 0, 0) != 0 || sr_close_tree_1(tree) != 0) {
    return 1;
  }
  puts("installed registry: tree opened and closed");
  return 0;
}
