// sr_i_overlay_memory.cpp - changes to the column definitions of the table
// in memory alone: a new default value, or new modifier flags of a standard
// column. No row is touched and nothing is written; the definitions live in
// the metadata record, so a later rewrite of a persistent table's file
// writes them as they then are.
//
// A variable-length default's body lies in the packed area behind the
// column array, next to the others, so a new one is encoded over the old
// one and may not need more room than it had.

#include <cstring>
#include <vector>

#include "frame/sr_i_errors.h"
#include "frame/sr_i_tree.h"
#include "qv_pmsg.h"
#include "rows/sr_i_rows.h"
#include "schema/sr_i_schema_changes.h"

namespace {

constexpr uint32_t Base_Qualifier_Bits = 15;

bool is_standard(uint32_t qualifier) {
  return (qualifier & Base_Qualifier_Bits) == SR_STANDARD;
}

// Encodes `value` into the room of the column's present default body and
// takes it as the default. 205 when it needs more room, 11 when the codec
// refuses it.
int32_t overlay_variable_length_default(sr_i_table_t *p_table, sr_column_t &definition,
                                        const qv_value_t &value) {
  const qv_pmsg_value_anchor_t anchor = sr_i_slot_anchor(&definition.default_value);
  std::vector<unsigned char> body(anchor.length);
  cu_iconv_t *p_conversion =
      p_table->p_tree != nullptr ? p_table->p_tree->p_to_table_string_conversion_handle : nullptr;
  const qv_value_t stored = sr_i_value_or_empty(definition.type, value);
  qv_pmsg_value_t slot{};
  uint32_t used = 0;
  const int32_t rc = qv_pmsg_build_conv_protocol_value_1(p_conversion, 0, definition.type, &stored,
                                                         &slot, body.data(), anchor.length, &used);
  if (rc == QV_PMSG_RESULT_NO_ROOM) {
    return sr_i_raise(SR_E_NO_ROWS);
  }
  if (rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_build_conv_protocol_value", rc);
  }
  auto *p_body = const_cast<unsigned char *>(sr_i_default_data(p_table)) + anchor.offset;
  std::memcpy(p_body, body.data(), used);
  const qv_pmsg_value_anchor_t new_anchor{anchor.offset, used};
  std::memcpy(&definition.default_value, &new_anchor, sizeof new_anchor);
  return 0;
}

}  // namespace

int32_t sr_i_overlay_memory_default_value(sr_i_table_t *p_table, const char *p_column_name,
                                          qv_value_t new_default_value) {
  const int32_t column = sr_i_find_column(p_table, p_column_name);
  if (column < 0) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  sr_column_t &definition = p_table->p_columns[column];
  if (sr_i_is_variable_length(definition.type)) {
    return overlay_variable_length_default(p_table, definition, new_default_value);
  }
  definition.default_value = new_default_value;
  return 0;
}

int32_t sr_i_overlay_memory_column_qualifier(sr_i_table_t *p_table, const char *p_column_name,
                                             sr_qualifier_t new_qualifier) {
  if (!is_standard(new_qualifier)) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  const int32_t column = sr_i_find_column(p_table, p_column_name);
  if (column < 0 || !is_standard(p_table->p_columns[column].qualifier)) {
    return sr_i_raise(SR_E_INVALID_COLUMN);
  }
  p_table->p_columns[column].qualifier = new_qualifier;
  return 0;
}
