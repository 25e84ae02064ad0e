// cu_fuzz_table.h - what the expression fuzz targets share: a table with a
// column of every type (and fields for its two structured columns) that
// answers the compiler's callback, and one row of it encoded with libqv_pmsg
// the way the registry stores rows.

#ifndef CU_FUZZ_TABLE_H
#define CU_FUZZ_TABLE_H

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <utility>
#include <vector>

#include "qv_cu_expression.h"
#include "qv_pmsg.h"

struct cu_fuzz_column {
  const char *p_name;
  qv_data_type_t type;
};

// Column i is slot i; "Ghost" (after the last slot) has no slot in the row.
inline const cu_fuzz_column Cu_Fuzz_Columns[] = {{"Id", QV_INT32},
                                                 {"Count", QV_UINT32},
                                                 {"Big", QV_INT64},
                                                 {"Huge", QV_UINT64},
                                                 {"Ratio", QV_FLOAT32},
                                                 {"Weight", QV_FLOAT64},
                                                 {"Name", QV_CHAR_PTR},
                                                 {"Mac", QV_BINARY_PTR},
                                                 {"Owner", QV_RSRC_HANDLE_PTR},
                                                 {"Link", QV_SD_PTR},
                                                 {"Raw", QV_SBS_PTR},
                                                 {"Vlans", QV_INT32_ARRAY},
                                                 {"Masks", QV_UINT32_ARRAY},
                                                 {"Offsets", QV_INT64_ARRAY},
                                                 {"Sizes", QV_UINT64_ARRAY},
                                                 {"Loads", QV_FLOAT32_ARRAY},
                                                 {"Temps", QV_FLOAT64_ARRAY},
                                                 {"Aliases", QV_CHAR_PTR_ARRAY},
                                                 {"Keys", QV_BINARY_PTR_ARRAY},
                                                 {"Peers", QV_RSRC_HANDLE_PTR_ARRAY},
                                                 {"Addresses", QV_SD_PTR_ARRAY},
                                                 {"Ghost", QV_INT32}};
constexpr uint32_t Cu_Fuzz_Total_Slots = 21;
constexpr uint32_t Cu_Fuzz_Link = 9;
constexpr uint32_t Cu_Fuzz_Addresses = 20;

// The structured columns' fields; "Extra" is declared but never stored.
inline const cu_fuzz_column Cu_Fuzz_Link_Fields[] = {
    {"Speed", QV_UINT32}, {"Media", QV_CHAR_PTR}, {"Lanes", QV_INT32_ARRAY}, {"Extra", QV_INT64}};
inline const cu_fuzz_column Cu_Fuzz_Address_Fields[] = {
    {"Family", QV_CHAR_PTR}, {"Prefix", QV_INT32}, {"Gateway", QV_BINARY_PTR}};

template <size_t Total>
int32_t cu_fuzz_find(const cu_fuzz_column (&columns)[Total], const char *p_name,
                     cu_validate_data_t *p_data) {
  for (uint32_t position = 0; position < Total; ++position) {
    if (std::strcmp(columns[position].p_name, p_name) == 0) {
      *p_data = {columns[position].type, position};
      return 0;
    }
  }
  return -1;
}

inline int32_t cu_fuzz_answer(void *, const char *p_name, uint32_t, uint32_t parent_id,
                              cu_validate_data_t *p_data) {
  if (parent_id == CU_EXPR_NO_PARENT) {
    return cu_fuzz_find(Cu_Fuzz_Columns, p_name, p_data);
  }
  if (parent_id == Cu_Fuzz_Link) {
    return cu_fuzz_find(Cu_Fuzz_Link_Fields, p_name, p_data);
  }
  return parent_id == Cu_Fuzz_Addresses ? cu_fuzz_find(Cu_Fuzz_Address_Fields, p_name, p_data) : -1;
}

// One encoded row: 4-byte header word, the slots, and the variable part.
struct cu_fuzz_row {
  std::vector<unsigned char> record;
  std::vector<unsigned char> indirect;

  cu_fuzz_row() {
    std::vector<std::vector<unsigned char>> blocks;
    auto block = [&blocks](size_t bytes) {
      blocks.emplace_back(bytes + 8, 0);
      return static_cast<void *>(blocks.back().data());
    };
    auto text = [&](const char *p_text) {
      qv_value_t value{};
      value.ptr_char = static_cast<char *>(
          std::memcpy(block(std::strlen(p_text)), p_text, std::strlen(p_text) + 1));
      return value;
    };
    auto binary = [&](const char *p_bytes, uint32_t length) {
      auto *p_binary = static_cast<qv_binary_t *>(block(sizeof(qv_binary_t) + length));
      p_binary->length = length;
      std::memcpy(p_binary->data, p_bytes, length);
      qv_value_t value{};
      value.ptr_binary = p_binary;
      return value;
    };
    auto handle = [&](uint32_t header, uint32_t id1) {
      auto *p_handle = static_cast<qv_resource_handle_t *>(block(sizeof(qv_resource_handle_t)));
      *p_handle = {header, {id1, 2, 3, 4}};
      qv_value_t value{};
      value.ptr_rsrc_handle = p_handle;
      return value;
    };
    auto number = [](uint64_t bits) {
      qv_value_t value{};
      value.val_uint64 = bits;
      return value;
    };
    auto array = [&](std::vector<qv_value_t> elements) {
      auto *p_array = static_cast<qv_array_t *>(
          block(sizeof(qv_array_t) + elements.size() * sizeof(qv_value_t)));
      p_array->element_count = static_cast<uint32_t>(elements.size());
      std::memcpy(p_array->elements, elements.data(), elements.size() * sizeof(qv_value_t));
      qv_value_t value{};
      value.ptr_array = p_array;
      return value;
    };
    auto structured = [&](std::vector<std::pair<qv_data_type_t, qv_value_t>> elements) {
      auto *p_structured = static_cast<qv_structured_data_t *>(block(
          sizeof(qv_structured_data_t) + elements.size() * sizeof(qv_structured_data_element_t)));
      p_structured->element_count = static_cast<uint32_t>(elements.size());
      for (size_t index = 0; index < elements.size(); ++index) {
        p_structured->elements[index].data_type = elements[index].first;
        p_structured->elements[index].value = elements[index].second;
      }
      qv_value_t value{};
      value.ptr_sd = p_structured;
      return value;
    };
    float ratio = 0.1f;
    double weight = 2.5;
    uint32_t ratio_bits;
    uint64_t weight_bits;
    std::memcpy(&ratio_bits, &ratio, 4);
    std::memcpy(&weight_bits, &weight, 8);
    auto *p_raw = static_cast<qv_sbs_t *>(block(sizeof(qv_sbs_t) + 6));
    p_raw->length = 6;
    std::memcpy(p_raw->fields, "\x02\x00\x09\x01hi", 6);
    qv_value_t raw{};
    raw.ptr_sbs = p_raw;
    const std::pair<qv_data_type_t, qv_value_t> cells[Cu_Fuzz_Total_Slots] = {
        {QV_INT32, number(7)},
        {QV_UINT32, number(4000000000u)},
        {QV_INT64, number(static_cast<uint64_t>(-5000000000))},
        {QV_UINT64, number(UINT64_MAX)},
        {QV_FLOAT32, number(ratio_bits)},
        {QV_FLOAT64, number(weight_bits)},
        {QV_CHAR_PTR, text("eth0")},
        {QV_BINARY_PTR, binary("\x00\x11\x22\xaa", 4)},
        {QV_RSRC_HANDLE_PTR, handle(0x00020001u, 1)},
        {QV_SD_PTR, structured({{QV_UINT32, number(1000)},
                                {QV_CHAR_PTR, text("copper")},
                                {QV_INT32_ARRAY, array({number(1), number(2), number(4)})}})},
        {QV_SBS_PTR, raw},
        {QV_INT32_ARRAY, array({number(10), number(20), number(static_cast<uint32_t>(-30))})},
        {QV_UINT32_ARRAY, array({number(0xFFFFFF00u)})},
        {QV_INT64_ARRAY, array({number(UINT64_MAX), number(uint64_t{1} << 40)})},
        {QV_UINT64_ARRAY, array({number(0), number(UINT64_MAX)})},
        {QV_FLOAT32_ARRAY, array({number(ratio_bits)})},
        {QV_FLOAT64_ARRAY, array({number(weight_bits), number(0)})},
        {QV_CHAR_PTR_ARRAY, array({text("wan"), text(""), text("uplink")})},
        {QV_BINARY_PTR_ARRAY, array({binary("\x01\x02", 2), binary("", 0)})},
        {QV_RSRC_HANDLE_PTR_ARRAY, array({handle(0, 1), handle(0x10, 9)})},
        {QV_SD_PTR_ARRAY, array({structured({{QV_CHAR_PTR, text("inet")},
                                             {QV_INT32, number(24)},
                                             {QV_BINARY_PTR, binary("\x0a\x00\x00\x01", 4)}}),
                                 structured({{QV_CHAR_PTR, text("inet6")}})})},
    };
    uint32_t total = 0;
    for (const auto &[type, value] : cells) {
      uint32_t size = 0;
      qv_pmsg_size_conv_protocol_value_1(1, 0, type, &value, &size);
      total += size;
    }
    record.assign(4 + 8 * Cu_Fuzz_Total_Slots, 0);
    indirect.assign(total, 0);
    uint32_t offset = 0;
    for (uint32_t index = 0; index < Cu_Fuzz_Total_Slots; ++index) {
      qv_pmsg_value_t slot;
      if (qv_pmsg_build_conv_protocol_value_1(nullptr, 0, cells[index].first, &cells[index].second,
                                              &slot, indirect.data(), total, &offset) != 0) {
        std::abort();
      }
      std::memcpy(record.data() + 4 + 8 * index, &slot, sizeof slot);
    }
  }
};

#endif  // CU_FUZZ_TABLE_H
