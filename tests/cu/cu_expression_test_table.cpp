// cu_expression_test_table.cpp - the shared helpers of the expression tests.

#include "cu_expression_test_table.h"

#include <gtest/gtest.h>

#include <cstring>

int32_t test_table::answer(void *p_token, const char *p_name, uint32_t length, uint32_t parent_id,
                           cu_validate_data_t *p_data) {
  auto *p_table = static_cast<test_table *>(p_token);
  p_table->questions.push_back({p_name, length, parent_id});
  const auto &columns = p_table->columns_;
  if (parent_id == CU_EXPR_NO_PARENT) {
    for (uint32_t position = 0; position < columns.size(); ++position) {
      if (columns[position].name == p_name) {
        *p_data = {columns[position].type, position};
        return 0;
      }
    }
    return -1;
  }
  if (parent_id >= columns.size()) {
    return -1;
  }
  const auto &fields = columns[parent_id].fields;
  for (uint32_t position = 0; position < fields.size(); ++position) {
    if (fields[position].first == p_name) {
      *p_data = {fields[position].second, position};
      return 0;
    }
  }
  return -1;
}

uint32_t test_row::body_offset(uint32_t index) const {
  uint32_t offset;
  std::memcpy(&offset, slots() + 8 * index, sizeof offset);
  return offset;
}

laid_out_row lay_out(const test_row &row) {
  laid_out_row laid{row.record, row.total_slots};
  laid.bytes.insert(laid.bytes.end(), row.indirect.begin(), row.indirect.end());
  return laid;
}

test_row encode_row(const std::vector<std::pair<int32_t, qv_value_t>> &cells) {
  test_row row;
  row.total_slots = static_cast<uint32_t>(cells.size());
  row.record.assign(4 + 8 * cells.size(), 0xEE);
  uint32_t total = 0;
  for (const auto &[type, value] : cells) {
    uint32_t size = 0;
    EXPECT_EQ(qv_pmsg_size_conv_protocol_value_1(1, 0, as_type(type), &value, &size), 0);
    total += size;
  }
  row.indirect.resize(total);
  uint32_t offset = 0;
  for (size_t index = 0; index < cells.size(); ++index) {
    qv_pmsg_value_t slot;
    EXPECT_EQ(qv_pmsg_build_conv_protocol_value_1(nullptr, 0, as_type(cells[index].first),
                                                  &cells[index].second, &slot, row.indirect.data(),
                                                  total, &offset),
              0)
        << "cell " << index;
    std::memcpy(row.record.data() + 4 + 8 * index, &slot, sizeof slot);
  }
  return row;
}

// Column positions are slot indexes. Ghost has no slot in the row, and
// Broken answers a type no column may have.
test_table interfaces_table() {
  return test_table({{"Id", QV_INT32, {}},
                     {"Count", QV_UINT32, {}},
                     {"Big", QV_INT64, {}},
                     {"Huge", QV_UINT64, {}},
                     {"Ratio", QV_FLOAT32, {}},
                     {"Weight", QV_FLOAT64, {}},
                     {"Name", QV_CHAR_PTR, {}},
                     {"Mac", QV_BINARY_PTR, {}},
                     {"Owner", QV_RSRC_HANDLE_PTR, {}},
                     {"Link",
                      QV_SD_PTR,
                      {{"Speed", QV_UINT32},
                       {"Media", QV_CHAR_PTR},
                       {"Up", QV_INT32},
                       {"Peer", QV_RSRC_HANDLE_PTR},
                       {"Lanes", QV_INT32_ARRAY},
                       {"Legacy", QV_INT32},   // stored as a string in the row
                       {"Extra", QV_INT32}}},  // not stored in the row
                     {"Raw", QV_SBS_PTR, {}},
                     {"Vlans", QV_INT32_ARRAY, {}},
                     {"Masks", QV_UINT32_ARRAY, {}},
                     {"Offsets", QV_INT64_ARRAY, {}},
                     {"Sizes", QV_UINT64_ARRAY, {}},
                     {"Loads", QV_FLOAT32_ARRAY, {}},
                     {"Temps", QV_FLOAT64_ARRAY, {}},
                     {"Aliases", QV_CHAR_PTR_ARRAY, {}},
                     {"Keys", QV_BINARY_PTR_ARRAY, {}},
                     {"Peers", QV_RSRC_HANDLE_PTR_ARRAY, {}},
                     {"Addresses",
                      QV_SD_PTR_ARRAY,
                      {{"Family", QV_CHAR_PTR}, {"Prefix", QV_INT32}, {"Gateway", QV_BINARY_PTR}}},
                     {"Path", QV_CHAR_PTR, {}},
                     {"Ghost", QV_INT32, {}},
                     {"Broken", QV_NONE, {}}});
}

test_row interfaces_row() {
  value_arena values;
  const qv_value_t link = values.structured(
      {{QV_UINT32, number<uint32_t>(1000)},
       {QV_CHAR_PTR, values.string("copper")},
       {QV_INT32, number<int32_t>(1)},
       {QV_RSRC_HANDLE_PTR, values.handle(0, 5, 0, 0, 0)},
       {QV_INT32_ARRAY, values.array({number<int32_t>(1), number<int32_t>(2), number<int32_t>(4)})},
       {QV_CHAR_PTR, values.string("x")}});
  const qv_value_t addresses = values.array(
      {values.structured({{QV_CHAR_PTR, values.string("inet")},
                          {QV_INT32, number<int32_t>(24)},
                          {QV_BINARY_PTR, values.binary(std::string("\x0a\x00\x00\x01", 4))}}),
       values.structured({{QV_CHAR_PTR, values.string("inet6")},
                          {QV_INT32, number<int32_t>(64)},
                          {QV_BINARY_PTR, values.binary("")}}),
       values.structured({{QV_CHAR_PTR, values.string("inet")}})});
  return encode_row({
      {QV_INT32, number<int32_t>(7)},
      {QV_UINT32, number<uint32_t>(4000000000u)},
      {QV_INT64, number<int64_t>(-5000000000)},
      {QV_UINT64, number<uint64_t>(UINT64_MAX)},
      {QV_FLOAT32, number<float>(0.1f)},
      {QV_FLOAT64, number<double>(2.5)},
      {QV_CHAR_PTR, values.string("eth0")},
      {QV_BINARY_PTR, values.binary(std::string("\x00\x11\x22\xaa\xbb\xcc", 6))},
      {QV_RSRC_HANDLE_PTR, values.handle(0x00020001u, 1, 2, 3, 0xFFFFFFFFu)},
      {QV_SD_PTR, link},
      {QV_SBS_PTR, values.byte_string({{QV_BINARY_PTR, 1, "hi"}})},  // bytes 02 00 09 01 h i
      {QV_INT32_ARRAY,
       values.array({number<int32_t>(10), number<int32_t>(20), number<int32_t>(-30)})},
      {QV_UINT32_ARRAY, values.array({number<uint32_t>(0xFFFFFF00u), number<uint32_t>(0)})},
      {QV_INT64_ARRAY, values.array({number<int64_t>(-1), number<int64_t>(int64_t{1} << 40)})},
      {QV_UINT64_ARRAY, values.array({number<uint64_t>(0), number<uint64_t>(UINT64_MAX)})},
      {QV_FLOAT32_ARRAY, values.array({number<float>(0.5f), number<float>(0.1f)})},
      {QV_FLOAT64_ARRAY, values.array({number<double>(36.6), number<double>(-1.5)})},
      {QV_CHAR_PTR_ARRAY,
       values.array({values.string("wan"), values.string(""), values.string("uplink")})},
      {QV_BINARY_PTR_ARRAY, values.array({values.binary("\x01\x02"), values.binary("")})},
      {QV_RSRC_HANDLE_PTR_ARRAY,
       values.array({values.handle(0, 1, 0, 0, 0), values.handle(0x10, 9, 9, 9, 9)})},
      {QV_SD_PTR_ARRAY, addresses},
      {QV_CHAR_PTR, values.string("C:\\temp\\'x'")},
  });
}

outcome run(test_table &table, const std::string &text, const test_row &row) {
  outcome result{-1, -1, 99};
  compiled_expression expression;
  result.compiled =
      cu_comp_expr_1(text.c_str(), 0, &test_table::answer, &table, &expression.p_expression);
  if (result.compiled == 0) {
    result.evaluated =
        cu_exec_expr_1(expression.p_expression, CU_EXPR_MODE_ENCODED_SLOTS, row.slots(),
                       row.total_slots, &result.matched, row.indirect.data());
  }
  return result;
}
