/* The codec's header compiled as C: a structured value holding a string goes
 * through the interface the way a C caller writes it. Returns 0, or the line
 * of the first check that failed. */

#include <stdlib.h>
#include <string.h>

#include "qv_pmsg.h"

int pmsg_c_interface_round_trip(void);

int pmsg_c_interface_round_trip(void) {
  unsigned char area[64];
  uint32_t offset = 0;
  qv_pmsg_value_t slot;
  qv_value_t value;
  int failed_line = 0;
  qv_structured_data_t *p_structured =
      calloc(1, sizeof *p_structured + sizeof(qv_structured_data_element_t));

  if (p_structured == NULL) {
    return __LINE__;
  }
  p_structured->element_count = 1;
  p_structured->elements[0].data_type = QV_CHAR_PTR;
  p_structured->elements[0].value.ptr_char = "from C";
  value.ptr_sd = p_structured;
  if (qv_pmsg_build_conv_protocol_value_1(NULL, 0, QV_SD_PTR, &value, &slot, area, sizeof area,
                                          &offset) != QV_PMSG_RESULT_OK ||
      slot.anchor.length != offset) {
    failed_line = __LINE__;
  }
  free(p_structured);
  if (failed_line != 0 ||
      qv_pmsg_build_conv_packed_client_value_1(NULL, 0, QV_SD_PTR, &value, &slot, area, offset) !=
          QV_PMSG_RESULT_OK) {
    return failed_line != 0 ? failed_line : __LINE__;
  }
  if (value.ptr_sd->element_count != 1 ||
      strcmp(value.ptr_sd->elements[0].value.ptr_char, "from C") != 0) {
    failed_line = __LINE__;
  }
  free(value.ptr_sd);
  return failed_line;
}
