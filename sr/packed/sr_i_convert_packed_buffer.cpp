// sr_i_convert_packed_buffer.cpp - taking a packed buffer written on a
// machine of the other byte order over to this one, in place and once: the
// header through libqv_pmsg (which marks it converted, so that a second
// call finds nothing to do), then the buffer slots, each table's four
// values, and inside every row record its header words and each column's
// value with that column's type.
//
// The codec trusts a top-level anchor when it converts, so every anchor is
// read in the writer's byte order and checked against the area it points
// into before its value is handed over; what the codec then finds wrong
// inside a body is the buffer's fault as well. Either way the buffer is
// refused with 14, partly converted.

#include <vector>

#include "frame/sr_i_errors.h"
#include "packed/sr_i_packed_buffer.h"
#include "packed/sr_i_packed_columns.h"
#include "tables/sr_i_columns.h"
#include "tables/sr_i_record_buffer_pool.h"

namespace {

constexpr uint32_t Row_Header_Word_Bytes = 4;

// An anchor still in the writer's byte order.
qv_pmsg_value_anchor_t foreign_anchor(const unsigned char *p_slot) {
  return {__builtin_bswap32(sr_i_load_u32(p_slot)), __builtin_bswap32(sr_i_load_u32(p_slot + 4))};
}

void reverse_word(unsigned char *p_word) {
  sr_i_store_u32(p_word, __builtin_bswap32(sr_i_load_u32(p_word)));
}

// Converts one value whose body, if any, must lie within `area_length`
// bytes of `p_area`.
int32_t convert_value(unsigned char *p_slot, qv_data_type_t type, unsigned char *p_area,
                      uint32_t area_length) {
  if (sr_i_is_variable_length(type)) {
    const qv_pmsg_value_anchor_t anchor = foreign_anchor(p_slot);
    if (!sr_i_packed_span_inside(anchor.offset, anchor.length, area_length)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
  }
  qv_pmsg_value_t slot;
  std::memcpy(&slot, p_slot, sizeof slot);
  const int32_t rc = qv_pmsg_convert_pmsg_value_1(&slot, type, p_area);
  if (rc == QV_PMSG_RESULT_MALFORMED) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  if (rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_convert_pmsg_value", rc);
  }
  std::memcpy(p_slot, &slot, sizeof slot);
  return 0;
}

// One row record, `length` bytes: the pool header (its length word must
// say `length`; the link is cleared), the row's header word, then each
// column's value, whose bodies lie in the record's variable part.
int32_t convert_row(unsigned char *p_element, uint32_t length,
                    const std::vector<qv_data_type_t> &types) {
  const uint64_t fixed_length = uint64_t{Sr_Record_Header_Length} + Row_Header_Word_Bytes +
                                uint64_t{Sr_Packed_Slot_Bytes} * types.size();
  if (length < fixed_length) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  reverse_word(p_element + offsetof(sr_i_record_metadata_t, record_length));
  if (sr_i_load_u32(p_element + offsetof(sr_i_record_metadata_t, record_length)) != length) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  std::memset(p_element + offsetof(sr_i_record_metadata_t, p_next), 0, sizeof(void *));
  reverse_word(p_element + offsetof(sr_i_record_metadata_t, type));
  reverse_word(p_element + offsetof(sr_i_record_metadata_t, disk_table_offset));
  unsigned char *p_record = p_element + Sr_Record_Header_Length;
  reverse_word(p_record);
  unsigned char *p_variable = p_element + fixed_length;
  const auto variable_length = static_cast<uint32_t>(length - fixed_length);
  for (size_t column = 0; column < types.size(); ++column) {
    unsigned char *p_slot = p_record + Row_Header_Word_Bytes + Sr_Packed_Slot_Bytes * column;
    if (const int32_t rc = convert_value(p_slot, types[column], p_variable, variable_length);
        rc != 0) {
      return rc;
    }
  }
  return 0;
}

// The rows of a table, once their array's own counts and anchors are in
// this machine's order.
int32_t convert_rows(const sr_i_packed_buffer_view &view, uint32_t table, uint32_t total_rows,
                     const std::vector<qv_data_type_t> &types) {
  qv_pmsg_value_anchor_t anchor;
  std::memcpy(&anchor, view.table_slot(table, SR_I_PACKED_ROWS), sizeof anchor);
  unsigned char *p_body = view.p_indirect + anchor.offset;
  uint32_t total_in_array = 0;
  if (!sr_i_packed_rows_count(p_body, anchor.length, total_in_array) ||
      total_in_array != total_rows) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  for (uint32_t row = 0; row < total_rows; ++row) {
    qv_pmsg_value_anchor_t element;
    if (!sr_i_packed_row_anchor(p_body, anchor.length, total_rows, row, element)) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    if (const int32_t rc = convert_row(p_body + element.offset, element.length, types); rc != 0) {
      return rc;
    }
  }
  return 0;
}

// A table's four values in turn; its fixed metadata, once converted, gives
// the row count and its column metadata the column types.
int32_t convert_table(const sr_i_packed_buffer_view &view, uint32_t table) {
  for (uint32_t slot = 0; slot < Sr_Packed_Slots_Per_Table; ++slot) {
    if (const int32_t rc =
            convert_value(view.table_slot(table, static_cast<sr_i_packed_table_slot>(slot)),
                          Sr_Packed_Table_Slot_Types[slot], view.p_indirect, view.indirect_length);
        rc != 0) {
      return rc;
    }
  }
  sr_i_packed_fixed_metadata fixed;
  if (const int32_t rc = sr_i_read_packed_fixed_metadata(view, table, fixed); rc != 0) {
    return rc;
  }
  if (fixed.total_rows == 0) {
    return 0;
  }
  qv_value_t column_metadata;
  if (const int32_t rc =
          sr_i_decode_packed_value(view, table, SR_I_PACKED_COLUMN_METADATA, &column_metadata);
      rc != 0) {
    return rc;
  }
  sr_i_unpacked_columns columns;
  if (const int32_t rc = sr_i_unpack_column_definitions(column_metadata.ptr_array, columns);
      rc != 0) {
    return rc;
  }
  if (columns.size() != fixed.total_columns) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  std::vector<qv_data_type_t> types(columns.size());
  for (uint32_t column = 0; column < columns.size(); ++column) {
    types[column] = columns[column].type;
  }
  return convert_rows(view, table, fixed.total_rows, types);
}

}  // namespace

int32_t sr_i_convert_packed_buffer(void *p_buffer, uint32_t header_already_converted,
                                   int32_t do_conversion) {
  auto *p_bytes = static_cast<unsigned char *>(p_buffer);
  int32_t conversion_required = do_conversion;
  if (header_already_converted == 0) {
    qv_pmsg_header_t header;
    std::memcpy(&header, p_bytes, sizeof header);
    int32_t header_converted = 0;
    const int32_t rc = qv_pmsg_cnv_required_1(&header, &conversion_required, &header_converted);
    if (rc == QV_PMSG_RESULT_MALFORMED) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
    if (rc != 0) {
      return sr_i_raise_library_call("qv_pmsg_cnv_required", rc);
    }
    std::memcpy(p_bytes, &header, sizeof header);
  }
  if (conversion_required == 0) {
    return 0;
  }
  // The buffer slots are read only once the header says they are there.
  uint32_t length;
  std::memcpy(&length, p_bytes, sizeof length);
  if (length < Sr_Packed_Empty_Buffer_Bytes) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  for (uint32_t slot = 0; slot < 4; ++slot) {
    if (const int32_t rc = convert_value(
            p_bytes + Sr_Packed_Header_Bytes + slot * Sr_Packed_Slot_Bytes, QV_UINT32, p_bytes, 0);
        rc != 0) {
      return rc;
    }
  }
  sr_i_packed_buffer_view view;
  if (const int32_t rc = sr_i_view_packed_buffer(p_buffer, view); rc != 0) {
    return rc;
  }
  for (uint32_t table = 0; table < view.total_tables; ++table) {
    if (const int32_t rc = convert_table(view, table); rc != 0) {
      return rc;
    }
  }
  return 0;
}
