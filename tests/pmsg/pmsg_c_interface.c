/* The codec's header compiled as C: a string and a structured value go
 * through the interface the way a C caller writes them. Returns 0, or the
 * line of the first check that failed. */

#include <stdlib.h>
#include <string.h>

#include "qv_pmsg.h"

int pmsg_c_interface_round_trip(void);

int pmsg_c_interface_round_trip(void) {
  unsigned char area[64];
  uint32_t offset = 0;
  qv_pmsg_value_t slots[2];
  qv_value_t text, decoded;
  int failed_line = 0;
  qv_structured_data_t *p_structured;

  text.ptr_char = "from C";
  if (qv_pmsg_build_conv_protocol_value_1(NULL, 0, QV_CHAR_PTR, &text, &slots[0], area, sizeof area,
                                          &offset) != QV_PMSG_RESULT_OK ||
      offset != 7) {
    return __LINE__;
  }
  p_structured = calloc(1, sizeof *p_structured + sizeof(qv_structured_data_element_t));
  if (p_structured == NULL) {
    return __LINE__;
  }
  p_structured->element_count = 1;
  p_structured->elements[0].data_type = QV_CHAR_PTR;
  p_structured->elements[0].value = text;
  decoded.ptr_sd = p_structured;
  failed_line = qv_pmsg_build_conv_protocol_value_1(NULL, 0, QV_SD_PTR, &decoded, &slots[1], area,
                                                    sizeof area, &offset) != QV_PMSG_RESULT_OK
                    ? __LINE__
                    : 0;
  free(p_structured);
  if (failed_line != 0) {
    return failed_line;
  }
  if (qv_pmsg_build_conv_packed_client_value_1(NULL, 0, QV_SD_PTR, &decoded, &slots[1], area,
                                               offset) != QV_PMSG_RESULT_OK) {
    return __LINE__;
  }
  if (decoded.ptr_sd->element_count != 1 ||
      strcmp(decoded.ptr_sd->elements[0].value.ptr_char, "from C") != 0) {
    failed_line = __LINE__;
  }
  free(decoded.ptr_sd);
  return failed_line;
}
