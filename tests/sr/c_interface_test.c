/*
 * c_interface_test.c - proves the public headers are C: this translation
 * unit is compiled by the C compiler, links against the shared libraries and
 * checks the contract of the calls it makes. Exit status 0 means success.
 */
#include <stdarg.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include "qv_cu.h"
#include "qv_sr.h"
#include "qv_types.h"

static int failures = 0;

#define CHECK(condition)                                                      \
  do {                                                                        \
    if (!(condition)) {                                                       \
      fprintf(stderr, "%s:%d: failed: %s\n", __FILE__, __LINE__, #condition); \
      ++failures;                                                             \
    }                                                                         \
  } while (0)

static int32_t last_code(char *p_text, size_t size) {
  cu_error_t *p_error = NULL;
  int32_t code = -1;
  if (cu_get_error_1(&p_error) == 0) {
    code = p_error->code;
    snprintf(p_text, size, "%s", p_error->p_text);
    cu_rel_error_1(p_error);
  }
  return code;
}

static int32_t list_selected(sr_opaque_handle_t table, uint32_t *p_count, uint32_t **pp_rows,
                             const char *p_criteria, ...) {
  va_list ap;
  int32_t rc;
  va_start(ap, p_criteria);
  rc = sr_get_selected_rows_v_1(table, p_criteria, ap, 0, p_count, pp_rows);
  va_end(ap);
  return rc;
}

int main(void) {
  char text[512];
  sr_opaque_handle_t tree = NULL;
  sr_opaque_handle_t table = NULL;
  sr_opaque_handle_t result = NULL;
  sr_column_t column;
  qv_value_t value;
  const char *names[1] = {"Port"};
  qv_value_t *values[1] = {&value};
  uint32_t count = 0;
  uint32_t *p_rows = NULL;

  CHECK(sr_open_tree_1(NULL, 0, 0) == SR_E_INVALID_HANDLE);
  CHECK(last_code(text, sizeof text) == 100);
  CHECK(strcmp(text, "2605-100 A function was passed an invalid handle.\n") == 0);

  CHECK(sr_open_tree_1(&tree, 0, 0) == 0);
  CHECK(tree != NULL);
  CHECK(last_code(text, sizeof text) == 0);

  /* The types are usable from C with their documented sizes: a table of
   * one key column, a row added and read back. */
  CHECK(sizeof(qv_value_t) == 8);
  CHECK(sizeof(qv_structured_data_element_t) == 16);
  CHECK(sizeof(qv_resource_handle_t) == 20);
  memset(&column, 0, sizeof column);
  column.name = "Port";
  column.type = QV_UINT32;
  column.qualifier = (sr_qualifier_t)(SR_PRIMARY_KEY | SR_PROTECTED);
  CHECK(sr_create_table_1(tree, "/c/ports", &column, 1, 0, &table) == 0);
  value.val_uint32 = 8080;
  CHECK(sr_add_row_1(table, names, values, 1) == 0);
  value.val_uint32 = 0;
  CHECK(sr_get_field_by_index_1(table, 0, "Port", &value) == 0 && value.val_uint32 == 8080);
  /* The row was committed at once (implicit control): nothing pending, and
   * the key is held by that one row. */
  CHECK(sr_get_updated_rows_1(table, &count, &p_rows) == 0 && count == 0 && p_rows == NULL);
  value.val_uint32 = 8080;
  CHECK(sr_get_duplicate_rows_1(table, value, &count, &p_rows, 0) == 0 && count == 1 &&
        p_rows != NULL && p_rows[0] == 0);
  free(p_rows);
  value.val_uint32 = 8081;
  CHECK(sr_get_duplicate_rows_1(table, value, &count, &p_rows, 0) == SR_E_NO_ROW_FOR_KEY);
  /* Selection, with the format's values as C variadic arguments and as a
   * va_list (through a variadic helper of our own). */
  CHECK(sr_select_1(table, names, 1, &result, "Port == $ui", (uint32_t)8080) == 0);
  CHECK(sr_get_field_by_index_1(result, 0, "Port", &value) == 0 && value.val_uint32 == 8080);
  CHECK(sr_close_table_1(result) == 0);
  CHECK(list_selected(table, &count, &p_rows, "Port > $ui", (uint32_t)80) == 0 && count == 1 &&
        p_rows[0] == 0);
  free(p_rows);

  /* The named modes: a table created under explicit control keeps its
   * changes pending; a writable opening must ask for the same control, and
   * a mode naming no kind of opening is refused. The numbers stay valid. */
  CHECK(sr_create_table_1(tree, "/c/explicit", &column, 1, SR_MODE_EXPLICIT_CONTROL, &table) == 0);
  value.val_uint32 = 443;
  CHECK(sr_add_row_1(table, names, values, 1) == 0);
  CHECK(sr_get_updated_rows_1(table, &count, &p_rows) == 0 && count == 1);
  free(p_rows);
  CHECK(sr_open_table_1(tree, "/c/explicit", SR_MODE_WRITE, &result) == SR_E_EXCLUSIVE_MODES);
  CHECK(sr_open_table_1(tree, "/c/explicit", SR_MODE_EXPLICIT_CONTROL, &result) ==
        SR_E_INVALID_MODE);
  CHECK(sr_open_table_1(tree, "/c/explicit", SR_MODE_WRITE_EXPLICIT, &result) == 0);
  CHECK(sr_close_table_1(result) == 0);
  CHECK(sr_open_table_1(tree, "/c/explicit", 6, &result) == 0);
  CHECK(sr_close_table_1(result) == 0);
  CHECK(sr_open_table_1(tree, "/c/ports", SR_MODE_READ | SR_MODE_WRITE, &result) == 0);
  CHECK(sr_close_table_1(result) == 0);
  CHECK(sr_close_tree_1(tree) == 0);
  CHECK((cu_dtc_table_1[QV_CHAR_PTR_ARRAY] & CU_DTC_POINTER) != 0);
  CHECK(strcmp(cu_mesgtbl_qv_sr_set[0], "Reserved: DO NOT USE!") == 0);

  if (failures == 0) {
    printf("C interface: all checks passed\n");
  }
  return failures == 0 ? 0 : 1;
}
