// pmsg_test_values.cpp - the shared helpers of the codec tests.

#include "pmsg_test_values.h"

#include <algorithm>
#include <bit>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace {

int fixed_width(int32_t type) {
  switch (type) {
    case QV_INT32:
    case QV_UINT32:
    case QV_FLOAT32:
      return 4;
    case QV_INT64:
    case QV_UINT64:
    case QV_FLOAT64:
      return 8;
    default:
      return 0;
  }
}

int array_width(int32_t type) {
  return type == QV_INT32_ARRAY || type == QV_UINT32_ARRAY || type == QV_FLOAT32_ARRAY ? 4 : 8;
}

std::string random_bytes(std::mt19937 &random, int first_byte, size_t most) {
  std::string bytes(random() % (most + 1), '\0');
  for (char &byte : bytes) {
    byte = static_cast<char>(first_byte + random() % (256 - first_byte));
  }
  return bytes;
}

}  // namespace

bool is_fixed_type(int32_t type) {
  return fixed_width(type) != 0;
}

value_arena::~value_arena() {
  for (void *p_block : blocks_) {
    std::free(p_block);
  }
}

void *value_arena::allocate(size_t bytes) {
  blocks_.push_back(std::calloc(1, bytes + 1));
  return blocks_.back();
}

namespace {

// A value holding a pointer: every pointer member of the union shares the
// same eight bytes.
qv_value_t pointing_to(void *p_data) {
  qv_value_t value{};
  value.ptr_char = static_cast<char *>(p_data);
  return value;
}

}  // namespace

qv_value_t value_arena::string(std::string_view text) {
  return pointing_to(std::memcpy(allocate(text.size() + 1), text.data(), text.size()));
}

qv_value_t value_arena::binary(std::string_view bytes) {
  auto *p_binary = static_cast<qv_binary_t *>(allocate(sizeof(qv_binary_t) + bytes.size()));
  p_binary->length = static_cast<uint32_t>(bytes.size());
  std::memcpy(p_binary->data, bytes.data(), bytes.size());
  return pointing_to(p_binary);
}

qv_value_t value_arena::handle(uint32_t header, uint32_t id1, uint32_t id2, uint32_t id3,
                               uint32_t id4) {
  auto *p_handle = static_cast<qv_resource_handle_t *>(allocate(sizeof(qv_resource_handle_t)));
  *p_handle = {header, {id1, id2, id3, id4}};
  return pointing_to(p_handle);
}

qv_value_t value_arena::structured(const std::vector<std::pair<int32_t, qv_value_t>> &elements) {
  auto *p_structured = static_cast<qv_structured_data_t *>(allocate(
      sizeof(qv_structured_data_t) + elements.size() * sizeof(qv_structured_data_element_t)));
  p_structured->element_count = static_cast<uint32_t>(elements.size());
  for (size_t index = 0; index < elements.size(); ++index) {
    p_structured->elements[index] = {as_type(elements[index].first), 0, elements[index].second};
  }
  return pointing_to(p_structured);
}

qv_value_t value_arena::array(const std::vector<qv_value_t> &elements) {
  auto *p_array = static_cast<qv_array_t *>(
      allocate(sizeof(qv_array_t) + elements.size() * sizeof(qv_value_t)));
  p_array->element_count = static_cast<uint32_t>(elements.size());
  std::copy(elements.begin(), elements.end(), p_array->elements);
  return pointing_to(p_array);
}

qv_value_t value_arena::byte_string(const std::vector<field> &fields) {
  std::string packed;
  for (const field &one : fields) {
    const auto length = static_cast<int16_t>(one.data.size());
    packed.append(reinterpret_cast<const char *>(&length), 2);
    packed += {static_cast<char>(one.type), static_cast<char>(one.serial)};
    packed += one.data;
  }
  auto *p_byte_string = static_cast<qv_sbs_t *>(allocate(sizeof(qv_sbs_t) + packed.size()));
  p_byte_string->length = static_cast<int32_t>(packed.size());
  std::memcpy(p_byte_string->fields, packed.data(), packed.size());
  return pointing_to(p_byte_string);
}

qv_value_t number32(uint32_t bits) {
  qv_value_t value{};
  value.val_uint32 = bits;
  return value;
}

qv_value_t number64(uint64_t bits) {
  qv_value_t value{};
  value.val_uint64 = bits;
  return value;
}

std::vector<std::pair<int32_t, qv_value_t>> sample_values(value_arena &arena) {
  qv_value_t names = arena.array({arena.string("alpha"), arena.string(""), arena.string("gamma")});
  qv_value_t inner = arena.structured({{QV_CHAR_PTR, arena.string("inner")},
                                       {QV_INT64_ARRAY, arena.array({number64(1), number64(2)})}});
  std::string int32_field(8, '\0');
  uint32_t numbers[2] = {0x01020304, 0xA0B0C0D0};
  std::memcpy(int32_field.data(), numbers, 8);
  return {
      {QV_INT32, number32(0x80000001u)},
      {QV_UINT32, number32(0xFFFFFFFEu)},
      {QV_INT64, number64(0x8000000000000001ull)},
      {QV_UINT64, number64(0x0102030405060708ull)},
      {QV_FLOAT32, number32(std::bit_cast<uint32_t>(-1.5f))},
      {QV_FLOAT64, number64(std::bit_cast<uint64_t>(3.25e300))},
      {QV_CHAR_PTR, arena.string("a 32-byte string for the codec!!")},
      {QV_CHAR_PTR, arena.string("")},
      {QV_BINARY_PTR, arena.binary(std::string_view("\0\x01\xFF"
                                                    "bytes",
                                                    8))},
      {QV_BINARY_PTR, arena.binary("")},
      {QV_RSRC_HANDLE_PTR, arena.handle(0x00010002, 3, 4, 5, 0xFFFF0006)},
      {QV_SD_PTR, arena.structured({{QV_CHAR_PTR, arena.string("name")},
                                    {QV_UINT32, number32(7)},
                                    {QV_FLOAT64, number64(std::bit_cast<uint64_t>(0.5))},
                                    {QV_SD_PTR, inner},
                                    {QV_CHAR_PTR_ARRAY, names},
                                    {QV_BINARY_PTR, arena.binary("")}})},
      {QV_SD_PTR, arena.structured({})},
      {QV_SBS_PTR,
       arena.byte_string(
           {{QV_INT32, 1, int32_field}, {QV_CHAR_PTR, 2, "text"}, {QV_INT64, 3, "odd"}})},
      {QV_SBS_PTR, arena.byte_string({})},
      {QV_INT32_ARRAY, arena.array({number32(1), number32(0xFFFFFFFF), number32(3)})},
      {QV_UINT32_ARRAY, arena.array({})},
      {QV_INT64_ARRAY, arena.array({number64(1ull << 63), number64(42)})},
      {QV_UINT64_ARRAY, arena.array({number64(5)})},
      {QV_FLOAT32_ARRAY, arena.array({number32(0x3F800000)})},
      {QV_FLOAT64_ARRAY, arena.array({number64(0x7FF8000000000001ull), number64(0)})},
      {QV_CHAR_PTR_ARRAY, names},
      {QV_CHAR_PTR_ARRAY, arena.array({})},
      {QV_BINARY_PTR_ARRAY, arena.array({arena.binary("xy"), arena.binary("")})},
      {QV_RSRC_HANDLE_PTR_ARRAY,
       arena.array({arena.handle(1, 2, 3, 4, 5), arena.handle(6, 7, 8, 9, 10)})},
      {QV_SD_PTR_ARRAY, arena.array({inner, arena.structured({}), inner})},
  };
}

std::pair<int32_t, qv_value_t> random_value(std::mt19937 &random, value_arena &arena, int32_t type,
                                            int depth) {
  if (type == 0) {
    type = 2 + static_cast<int32_t>(random() % 21);
  }
  bool may_nest = depth < 3;
  uint64_t bits = (uint64_t{random()} << 32) | random();
  switch (type) {
    case QV_CHAR_PTR:
      return {type, arena.string(random_bytes(random, 1, 40))};
    case QV_BINARY_PTR:
      return {type, arena.binary(random_bytes(random, 0, 40))};
    case QV_RSRC_HANDLE_PTR:
      return {type, arena.handle(random(), random(), random(), random(), random())};
    case QV_SD_PTR: {
      std::vector<std::pair<int32_t, qv_value_t>> elements(may_nest ? random() % 6 : 0);
      for (auto &element : elements) {
        element = random_value(random, arena, 0, depth + 1);
      }
      return {type, arena.structured(elements)};
    }
    case QV_SBS_PTR: {
      std::vector<value_arena::field> fields(random() % 4);
      for (auto &field : fields) {
        field = {static_cast<int8_t>(random() % 12), static_cast<int8_t>(random()),
                 random_bytes(random, 0, 24)};
      }
      return {type, arena.byte_string(fields)};
    }
    default:
      break;
  }
  if (is_fixed_type(type)) {
    return {type, fixed_width(type) == 4 ? number32(static_cast<uint32_t>(bits)) : number64(bits)};
  }
  std::vector<qv_value_t> elements(type >= QV_CHAR_PTR_ARRAY && !may_nest ? 0 : random() % 17);
  for (qv_value_t &element : elements) {
    element = type >= QV_CHAR_PTR_ARRAY ? random_value(random, arena, type - 11, depth + 1).second
              : array_width(type) == 4  ? number32(random())
                                        : number64((uint64_t{random()} << 32) | random());
  }
  return {type, arena.array(elements)};
}

namespace {

std::string hex(const void *p_bytes, size_t length) {
  std::string text;
  char pair[3];
  for (size_t at = 0; at < length; ++at) {
    std::snprintf(pair, sizeof pair, "%02x", static_cast<const unsigned char *>(p_bytes)[at]);
    text += pair;
  }
  return text;
}

// A value written out by what it holds, each part tagged with its type: a
// null pointer stands for the type's empty value, or (`decoded`) for a
// missing piece, which a decoded value must never have.
std::string render(int32_t type, const qv_value_t &value, bool decoded) {
  const std::string tag = std::to_string(type) + ":";
  if (is_fixed_type(type)) {
    return tag + hex(&value, fixed_width(type));
  }
  if (value.ptr_char == nullptr && decoded) {
    return tag + "<null>";
  }
  const qv_resource_handle_t invalid = {~0u, {~0u, ~0u, ~0u, ~0u}};
  switch (type) {
    case QV_CHAR_PTR:
      return tag + '"' + (value.ptr_char ? value.ptr_char : "") + '"';
    case QV_BINARY_PTR:
      return tag + (value.ptr_binary ? hex(value.ptr_binary->data, value.ptr_binary->length) : "");
    case QV_RSRC_HANDLE_PTR:
      return tag + hex(value.ptr_rsrc_handle ? value.ptr_rsrc_handle : &invalid, sizeof invalid);
    case QV_SBS_PTR:
      return tag + (value.ptr_sbs ? hex(value.ptr_sbs->fields, value.ptr_sbs->length) : "");
    case QV_SD_PTR: {
      std::string text = tag + "{";
      for (uint32_t at = 0; value.ptr_sd && at < value.ptr_sd->element_count; ++at) {
        const qv_structured_data_element_t &element = value.ptr_sd->elements[at];
        text += render(element.data_type, element.value, decoded) + ",";
      }
      return text + "}";
    }
    default: {
      const int32_t element_type = type >= QV_CHAR_PTR_ARRAY ? type - 11
                                   : array_width(type) == 4  ? QV_UINT32
                                                             : QV_UINT64;
      std::string text = tag + "[";
      for (uint32_t at = 0; value.ptr_array && at < value.ptr_array->element_count; ++at) {
        text += render(element_type, value.ptr_array->elements[at], decoded) + ",";
      }
      return text + "]";
    }
  }
}

}  // namespace

testing::AssertionResult values_equal(int32_t type, const qv_value_t &expected,
                                      const qv_value_t &actual) {
  const std::string wanted = render(type, expected, false), found = render(type, actual, true);
  if (wanted == found) {
    return testing::AssertionSuccess();
  }
  return testing::AssertionFailure() << "expected " << wanted << "\n   found " << found;
}

int32_t append_value(encoded_row &row, int32_t type, const qv_value_t &value,
                     cu_iconv_t *p_conversion) {
  row.slots.emplace_back();
  for (;;) {
    std::memset(&row.slots.back(), 0x5C, sizeof(qv_pmsg_value_t));
    uint32_t offset = row.used;
    const int32_t result = qv_pmsg_build_conv_protocol_value_1(
        p_conversion, 0, as_type(type), &value, &row.slots.back(), row.area.data(),
        static_cast<uint32_t>(row.area.size()), &offset);
    if (result != QV_PMSG_RESULT_NO_ROOM) {
      row.used = offset;
      return result;
    }
    EXPECT_EQ(offset, row.used) << "NO_ROOM moved the offset, type " << type;
    EXPECT_EQ(row.slots.back().val_uint64, 0x5C5C5C5C5C5C5C5Cull) << "NO_ROOM wrote the slot";
    row.area.resize(row.area.empty() ? 16 : row.area.size() * 2);
  }
}

decoded_value::~decoded_value() {
  if (owns_block) {
    std::free(value.ptr_char);
  }
}

int32_t decode_slot(const encoded_row &row, size_t index, int32_t type, decoded_value &out,
                    cu_iconv_t *p_conversion) {
  int32_t result = qv_pmsg_build_conv_packed_client_value_1(
      p_conversion, 0, as_type(type), &out.value, &row.slots[index], row.area.data(), row.used);
  out.owns_block = result == QV_PMSG_RESULT_OK && !is_fixed_type(type);
  return result;
}

namespace {

void reverse(unsigned char *p_bytes, int width) {
  std::reverse(p_bytes, p_bytes + width);
}

// Reverses a 32-bit word and returns the value it had in host order.
uint32_t reverse_word(unsigned char *p_word) {
  uint32_t value;
  std::memcpy(&value, p_word, 4);
  reverse(p_word, 4);
  return value;
}

void body_to_other_order(int32_t type, unsigned char *p_body, uint32_t length) {
  if (type == QV_RSRC_HANDLE_PTR) {
    for (int word = 0; word < 5; ++word)
      reverse(p_body + 4 * word, 4);
  } else if (type == QV_SBS_PTR) {
    for (uint32_t position = 0; position < length;) {
      int16_t field_length;
      std::memcpy(&field_length, p_body + position, 2);
      int width = fixed_width(static_cast<int8_t>(p_body[position + 2]));
      reverse(p_body + position, 2);
      for (int at = 0; width != 0 && field_length % width == 0 && at < field_length; at += width) {
        reverse(p_body + position + 4 + at, width);
      }
      position += 4 + field_length;
    }
  } else if (type >= QV_INT32_ARRAY && type <= QV_FLOAT64_ARRAY) {
    uint32_t count = reverse_word(p_body);
    for (uint32_t index = 0; index < count; ++index) {
      reverse(p_body + 4 + index * array_width(type), array_width(type));
    }
  } else if (type == QV_SD_PTR) {
    uint32_t count = reverse_word(p_body);
    for (uint32_t index = 0; index < count; ++index) {
      unsigned char *p_record = p_body + 4 + 12 * index;
      int32_t element_type = static_cast<int32_t>(reverse_word(p_record));
      if (is_fixed_type(element_type)) {
        reverse(p_record + 4, fixed_width(element_type));
      } else {
        uint32_t offset = reverse_word(p_record + 4);
        body_to_other_order(element_type, p_body + offset, reverse_word(p_record + 8));
      }
    }
  } else if (type >= QV_CHAR_PTR_ARRAY) {
    uint32_t count = reverse_word(p_body);
    for (uint32_t index = 0; index < count; ++index) {
      uint32_t offset = reverse_word(p_body + 4 + 8 * index);
      body_to_other_order(type - 11, p_body + offset, reverse_word(p_body + 8 + 8 * index));
    }
  }
}

}  // namespace

void to_other_byte_order(int32_t type, unsigned char *p_slot, unsigned char *p_area) {
  if (is_fixed_type(type)) {
    reverse(p_slot, fixed_width(type));
    return;
  }
  uint32_t offset = reverse_word(p_slot);
  body_to_other_order(type, p_area + offset, reverse_word(p_slot + 4));
}
