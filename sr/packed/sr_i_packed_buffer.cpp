// sr_i_packed_buffer.cpp - reading a packed table buffer that is in this
// machine's byte order: the header and buffer slots checked, a table's
// name found in place, its values decoded by libqv_pmsg within the bounds
// of the indirect area, and its fixed metadata read.
//
// Nothing a buffer says is believed before it is checked against the
// buffer's own length: the length itself must be repeated in slot 2, and
// every anchor must lie inside the indirect area. What the codec finds
// malformed inside a body is the buffer's fault too (14), not the codec's.

#include <cstdlib>

#include "frame/sr_i_errors.h"
#include "packed/sr_i_packed_buffer.h"

namespace {

// The number in the first half of buffer slot `slot`.
uint32_t buffer_slot_number(const unsigned char *p_buffer, uint32_t slot) {
  return sr_i_load_u32(p_buffer + Sr_Packed_Header_Bytes + slot * Sr_Packed_Slot_Bytes);
}

constexpr uint32_t Fixed_Metadata_Elements = 5;
constexpr qv_data_type_t Fixed_Metadata_Types[Fixed_Metadata_Elements] = {
    QV_CHAR_PTR, QV_UINT32, QV_UINT32, QV_UINT64, QV_INT32};

}  // namespace

int32_t sr_i_view_packed_buffer(const void *p_buffer, sr_i_packed_buffer_view &view) {
  auto *p_bytes = static_cast<unsigned char *>(const_cast<void *>(p_buffer));
  qv_pmsg_header_t header;
  std::memcpy(&header, p_bytes, sizeof header);
  if (header.qv_pmsg_version != QV_PMSG_VERSION ||
      header.qv_pmsg_arch_props != QV_PMSG_ARCH_LOCAL ||
      header.qv_pmsg_proto_type != Sr_Packed_Protocol_Type ||
      header.qv_pmsg_length < Sr_Packed_Empty_Buffer_Bytes) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  // Slot 2 repeats the length from the header only once the header is
  // known to hold at least the four slots.
  const uint32_t total_tables = buffer_slot_number(p_bytes, SR_I_PACKED_TABLE_COUNT_SLOT);
  const uint64_t fixed_part = sr_i_packed_fixed_part_bytes(total_tables);
  if (buffer_slot_number(p_bytes, SR_I_PACKED_ZERO_SLOT) != 0 ||
      buffer_slot_number(p_bytes, SR_I_PACKED_ONE_SLOT) != 1 ||
      buffer_slot_number(p_bytes, SR_I_PACKED_LENGTH_SLOT) != header.qv_pmsg_length ||
      fixed_part > header.qv_pmsg_length) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  view.p_buffer = p_bytes;
  view.length = header.qv_pmsg_length;
  view.total_tables = total_tables;
  view.p_indirect = p_bytes + fixed_part;
  view.indirect_length = header.qv_pmsg_length - static_cast<uint32_t>(fixed_part);
  return 0;
}

int32_t sr_i_check_packed_anchor(const sr_i_packed_buffer_view &view, const unsigned char *p_slot) {
  qv_pmsg_value_anchor_t anchor;
  std::memcpy(&anchor, p_slot, sizeof anchor);
  if (!sr_i_packed_span_inside(anchor.offset, anchor.length, view.indirect_length)) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  return 0;
}

int32_t sr_i_get_packed_table_name(const sr_i_packed_buffer_view &view, uint32_t table_index,
                                   const char **pp_name) {
  if (table_index >= view.total_tables) {
    return sr_i_raise(SR_E_NO_ROW_FOR_INDEX);
  }
  const unsigned char *p_slot = view.table_slot(table_index, SR_I_PACKED_NAME);
  if (const int32_t rc = sr_i_check_packed_anchor(view, p_slot); rc != 0) {
    return rc;
  }
  qv_pmsg_value_anchor_t anchor;
  std::memcpy(&anchor, p_slot, sizeof anchor);
  // The caller reads the name as a C string where it lies: it must end
  // with a NUL inside its body.
  const unsigned char *p_name = view.p_indirect + anchor.offset;
  if (anchor.length == 0 || p_name[anchor.length - 1] != '\0') {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  *pp_name = reinterpret_cast<const char *>(p_name);
  return 0;
}

int32_t sr_i_decode_packed_value(const sr_i_packed_buffer_view &view, uint32_t table,
                                 sr_i_packed_table_slot slot, qv_value_t *p_value) {
  qv_pmsg_value_t encoded;
  std::memcpy(&encoded, view.table_slot(table, slot), sizeof encoded);
  const int32_t rc = qv_pmsg_build_conv_packed_client_value_1(
      nullptr, 0, Sr_Packed_Table_Slot_Types[slot], p_value, &encoded, view.p_indirect,
      view.indirect_length);
  if (rc == QV_PMSG_RESULT_MALFORMED) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  if (rc == QV_PMSG_RESULT_NO_MEMORY) {
    return sr_i_raise_no_memory();
  }
  if (rc != 0) {
    return sr_i_raise_library_call("qv_pmsg_build_conv_packed_client_value", rc);
  }
  return 0;
}

int32_t sr_i_read_packed_fixed_metadata(const sr_i_packed_buffer_view &view, uint32_t table,
                                        sr_i_packed_fixed_metadata &metadata) {
  qv_value_t value;
  if (const int32_t rc = sr_i_decode_packed_value(view, table, SR_I_PACKED_FIXED_METADATA, &value);
      rc != 0) {
    return rc;
  }
  const sr_i_decoded<qv_structured_data_t> p_fixed(value.ptr_sd);
  if (p_fixed->element_count != Fixed_Metadata_Elements) {
    return sr_i_raise(SR_E_TABLE_UNREADABLE);
  }
  for (uint32_t element = 0; element < Fixed_Metadata_Elements; ++element) {
    if (p_fixed->elements[element].data_type != Fixed_Metadata_Types[element]) {
      return sr_i_raise(SR_E_TABLE_UNREADABLE);
    }
  }
  metadata.total_rows = p_fixed->elements[1].value.val_uint32;
  metadata.total_columns = p_fixed->elements[2].value.val_uint32;
  metadata.change_counter = p_fixed->elements[3].value.val_uint64;
  return 0;
}
