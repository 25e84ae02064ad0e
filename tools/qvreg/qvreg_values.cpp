// qvreg_values.cpp - rendering and parsing the values of every column type
// (see qvreg_values.h for the forms).

#include "qvreg_values.h"

#include <array>
#include <cerrno>
#include <charconv>
#include <cinttypes>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <limits>

#include "qvreg_session.h"

namespace qvreg {

namespace {

constexpr std::array<const char *, QV_DATA_TYPE_LIMIT> Type_Names = {"unknown",
                                                                     "none",
                                                                     "int32",
                                                                     "uint32",
                                                                     "int64",
                                                                     "uint64",
                                                                     "float32",
                                                                     "float64",
                                                                     "string",
                                                                     "binary",
                                                                     "resource_handle",
                                                                     "sd",
                                                                     "sbs",
                                                                     "int32_array",
                                                                     "uint32_array",
                                                                     "int64_array",
                                                                     "uint64_array",
                                                                     "float32_array",
                                                                     "float64_array",
                                                                     "string_array",
                                                                     "binary_array",
                                                                     "resource_handle_array",
                                                                     "sd_array"};

bool is_array(qv_data_type_t type) {
  return type >= QV_INT32_ARRAY && type <= QV_SD_PTR_ARRAY;
}

// The type of one element of an array type.
qv_data_type_t element_type(qv_data_type_t type) {
  switch (type) {
    case QV_INT32_ARRAY:
      return QV_INT32;
    case QV_UINT32_ARRAY:
      return QV_UINT32;
    case QV_INT64_ARRAY:
      return QV_INT64;
    case QV_UINT64_ARRAY:
      return QV_UINT64;
    case QV_FLOAT32_ARRAY:
      return QV_FLOAT32;
    case QV_FLOAT64_ARRAY:
      return QV_FLOAT64;
    case QV_CHAR_PTR_ARRAY:
      return QV_CHAR_PTR;
    case QV_BINARY_PTR_ARRAY:
      return QV_BINARY_PTR;
    case QV_RSRC_HANDLE_PTR_ARRAY:
      return QV_RSRC_HANDLE_PTR;
    default:
      return QV_SD_PTR;
  }
}

column_info element_column(const column_info &column, qv_data_type_t type) {
  column_info element = column;
  element.type = type;
  return element;
}

std::string hex_of(const unsigned char *p_bytes, size_t length) {
  static constexpr char Digits[] = "0123456789abcdef";
  std::string text;
  text.reserve(length * 2);
  for (size_t at = 0; at < length; ++at) {
    text.push_back(Digits[p_bytes[at] >> 4]);
    text.push_back(Digits[p_bytes[at] & 15]);
  }
  return text;
}

std::string handle_text(const qv_resource_handle_t &handle) {
  char text[64];
  std::snprintf(text, sizeof text, "%08x:%08x.%08x.%08x.%08x", handle.header, handle.id.id1,
                handle.id.id2, handle.id.id3, handle.id.id4);
  return text;
}

[[noreturn]] void refuse(const column_info &column, const std::string &given) {
  throw usage_error("column \"" + column.name + "\" takes a value of type " +
                    type_name(column.type) + ", not " + given);
}

// Hex digits, an optional "0x" first, into bytes.
std::vector<unsigned char> bytes_of_hex(const column_info &column, std::string_view text) {
  if (text.starts_with("0x")) {
    text.remove_prefix(2);
  }
  if (text.size() % 2 != 0) {
    refuse(column, "\"" + std::string(text) + "\" (an odd number of hex digits)");
  }
  std::vector<unsigned char> bytes(text.size() / 2);
  for (size_t at = 0; at < bytes.size(); ++at) {
    unsigned value = 0;
    const auto [end, error] =
        std::from_chars(text.data() + 2 * at, text.data() + 2 * at + 2, value, 16);
    if (error != std::errc() || end != text.data() + 2 * at + 2) {
      refuse(column, "\"" + std::string(text) + "\" (not hex)");
    }
    bytes[at] = static_cast<unsigned char>(value);
  }
  return bytes;
}

template <typename Number>
Number number_of(const column_info &column, const json &given) {
  if constexpr (std::is_floating_point_v<Number>) {
    if (given.is_number()) {
      return static_cast<Number>(given.get<double>());
    }
  } else if (given.is_number_integer()) {
    if (given.is_number_unsigned()) {
      const auto number = given.get<uint64_t>();
      if (number <= static_cast<uint64_t>(std::numeric_limits<Number>::max())) {
        return static_cast<Number>(number);
      }
    } else {
      const auto number = given.get<int64_t>();
      if (number >= static_cast<int64_t>(std::numeric_limits<Number>::min()) &&
          (number < 0 || static_cast<uint64_t>(number) <=
                             static_cast<uint64_t>(std::numeric_limits<Number>::max()))) {
        return static_cast<Number>(number);
      }
    }
  }
  refuse(column, given.dump());
}

template <typename Number>
Number number_of_text(const column_info &column, const std::string &text) {
  Number number{};
  if constexpr (std::is_floating_point_v<Number>) {
    char *p_end = nullptr;
    errno = 0;
    const double parsed = std::strtod(text.c_str(), &p_end);
    if (text.empty() || *p_end != '\0' || errno == ERANGE) {
      refuse(column, "\"" + text + "\"");
    }
    number = static_cast<Number>(parsed);
  } else {
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (text.empty() || error != std::errc() || end != text.data() + text.size()) {
      refuse(column, "\"" + text + "\"");
    }
  }
  return number;
}

qv_value_t build(const column_info &column, const json &given, owned_value &blocks);

qv_value_t build_text(const std::string &text, owned_value &blocks) {
  qv_value_t value{};
  auto *p_text = static_cast<char *>(blocks.block(text.size() + 1));
  std::memcpy(p_text, text.c_str(), text.size() + 1);
  value.ptr_char = p_text;
  return value;
}

qv_value_t build_bytes(const column_info &column, const std::string &hex, owned_value &blocks) {
  const std::vector<unsigned char> bytes = bytes_of_hex(column, hex);
  qv_value_t value{};
  // An empty value's blocks stay as calloc left them: nothing to copy.
  if (column.type == QV_SBS_PTR) {
    auto *p_sbs = static_cast<qv_sbs_t *>(blocks.block(sizeof(qv_sbs_t) + bytes.size()));
    p_sbs->length = static_cast<int32_t>(bytes.size());
    if (!bytes.empty()) {
      std::memcpy(p_sbs->fields, bytes.data(), bytes.size());
    }
    value.ptr_sbs = p_sbs;
  } else {
    auto *p_binary = static_cast<qv_binary_t *>(blocks.block(sizeof(qv_binary_t) + bytes.size()));
    p_binary->length = static_cast<uint32_t>(bytes.size());
    if (!bytes.empty()) {
      std::memcpy(p_binary->data, bytes.data(), bytes.size());
    }
    value.ptr_binary = p_binary;
  }
  return value;
}

qv_value_t build_handle(const column_info &column, const std::string &text, owned_value &blocks) {
  auto *p_handle = static_cast<qv_resource_handle_t *>(blocks.block(sizeof(qv_resource_handle_t)));
  int consumed = 0;
  if (std::sscanf(text.c_str(), "%8x:%8x.%8x.%8x.%8x%n", &p_handle->header, &p_handle->id.id1,
                  &p_handle->id.id2, &p_handle->id.id3, &p_handle->id.id4, &consumed) != 5 ||
      static_cast<size_t>(consumed) != text.size()) {
    refuse(column, "\"" + text + "\" (expected header:id1.id2.id3.id4 in hex)");
  }
  qv_value_t value{};
  value.ptr_rsrc_handle = p_handle;
  return value;
}

qv_value_t build_structured(const column_info &column, const json &given, owned_value &blocks) {
  if (!given.is_object()) {
    refuse(column, given.dump() + " (expected an object of its fields)");
  }
  auto *p_data = static_cast<qv_structured_data_t *>(blocks.block(
      sizeof(qv_structured_data_t) + column.fields.size() * sizeof(qv_structured_data_element_t)));
  p_data->element_count = static_cast<uint32_t>(column.fields.size());
  for (size_t at = 0; at < column.fields.size(); ++at) {
    const auto &[name, type] = column.fields[at];
    const auto found = given.find(name);
    if (found == given.end()) {
      refuse(column, given.dump() + " (field \"" + name + "\" missing)");
    }
    column_info field = element_column(column, type);
    field.name = column.name + "." + name;
    p_data->elements[at].data_type = type;
    p_data->elements[at].value = build(field, *found, blocks);
  }
  qv_value_t value{};
  value.ptr_sd = p_data;
  return value;
}

qv_value_t build_array(const column_info &column, const json &given, owned_value &blocks) {
  if (!given.is_array()) {
    refuse(column, given.dump() + " (expected a list)");
  }
  auto *p_array = static_cast<qv_array_t *>(
      blocks.block(sizeof(qv_array_t) + given.size() * sizeof(qv_value_t)));
  p_array->element_count = static_cast<uint32_t>(given.size());
  const column_info element = element_column(column, element_type(column.type));
  for (size_t at = 0; at < given.size(); ++at) {
    p_array->elements[at] = build(element, given[at], blocks);
  }
  qv_value_t value{};
  value.ptr_array = p_array;
  return value;
}

qv_value_t build(const column_info &column, const json &given, owned_value &blocks) {
  qv_value_t value{};
  switch (column.type) {
    case QV_INT32:
      value.val_int32 = number_of<int32_t>(column, given);
      return value;
    case QV_UINT32:
      value.val_uint32 = number_of<uint32_t>(column, given);
      return value;
    case QV_INT64:
      value.val_int64 = number_of<int64_t>(column, given);
      return value;
    case QV_UINT64:
      value.val_uint64 = number_of<uint64_t>(column, given);
      return value;
    case QV_FLOAT32:
      value.val_float32 = number_of<float>(column, given);
      return value;
    case QV_FLOAT64:
      value.val_float64 = number_of<double>(column, given);
      return value;
    case QV_SD_PTR:
      return build_structured(column, given, blocks);
    default:
      break;
  }
  if (is_array(column.type)) {
    return build_array(column, given, blocks);
  }
  if (!given.is_string()) {
    refuse(column, given.dump());
  }
  const std::string text = given.get<std::string>();
  switch (column.type) {
    case QV_CHAR_PTR:
      return build_text(text, blocks);
    case QV_BINARY_PTR:
    case QV_SBS_PTR:
      return build_bytes(column, text, blocks);
    case QV_RSRC_HANDLE_PTR:
      return build_handle(column, text, blocks);
    default:
      refuse(column, "anything (the shell cannot write this type)");
  }
}

}  // namespace

std::string type_name(qv_data_type_t type) {
  const auto number = static_cast<uint32_t>(type);
  return number < Type_Names.size() ? Type_Names[number] : "unknown";
}

qv_data_type_t type_of_name(const std::string &name) {
  for (uint32_t number = QV_INT32; number < Type_Names.size(); ++number) {
    if (name == Type_Names[number]) {
      return static_cast<qv_data_type_t>(number);
    }
  }
  return QV_UNKNOWN;
}

std::vector<column_info> columns_of(sr_opaque_handle_t table, std::vector<json> *p_defaults) {
  sr_table_metadata_t *p_metadata = nullptr;
  check(sr_get_table_metadata_1(table, -1, &p_metadata));
  std::vector<column_info> columns;
  for (uint32_t at = 0; at < p_metadata->number_of_columns; ++at) {
    const sr_column_t &definition = p_metadata->column_definitions[at];
    column_info column{
        definition.name, definition.type, static_cast<uint32_t>(definition.qualifier), {}};
    if (definition.sd_defn != nullptr) {
      for (uint32_t field = 0; field < definition.sd_defn->number_of_fields; ++field) {
        column.fields.emplace_back(definition.sd_defn->field_def[field].name,
                                   definition.sd_defn->field_def[field].type);
      }
    }
    if (p_defaults != nullptr) {
      p_defaults->push_back(to_json(column, definition.default_value));
    }
    columns.push_back(std::move(column));
  }
  sr_free_table_metadata_1(p_metadata);
  return columns;
}

json to_json(const column_info &column, const qv_value_t &value) {
  switch (column.type) {
    case QV_INT32:
      return value.val_int32;
    case QV_UINT32:
      return value.val_uint32;
    case QV_INT64:
      return value.val_int64;
    case QV_UINT64:
      return value.val_uint64;
    case QV_FLOAT32:
      return static_cast<double>(value.val_float32);
    case QV_FLOAT64:
      return value.val_float64;
    case QV_CHAR_PTR:
      return value.ptr_char != nullptr ? value.ptr_char : "";
    case QV_BINARY_PTR:
      return value.ptr_binary != nullptr ? hex_of(value.ptr_binary->data, value.ptr_binary->length)
                                         : "";
    case QV_SBS_PTR:
      return value.ptr_sbs != nullptr
                 ? hex_of(value.ptr_sbs->fields, static_cast<size_t>(value.ptr_sbs->length))
                 : "";
    case QV_RSRC_HANDLE_PTR:
      return value.ptr_rsrc_handle != nullptr ? handle_text(*value.ptr_rsrc_handle)
                                              : handle_text(qv_resource_handle_t{});
    case QV_SD_PTR: {
      json object = json::object();
      if (value.ptr_sd == nullptr) {
        return object;
      }
      for (uint32_t at = 0; at < value.ptr_sd->element_count; ++at) {
        const qv_structured_data_element_t &element = value.ptr_sd->elements[at];
        const std::string name =
            at < column.fields.size() ? column.fields[at].first : "field" + std::to_string(at);
        object[name] = to_json(element_column(column, element.data_type), element.value);
      }
      return object;
    }
    default:
      break;
  }
  if (!is_array(column.type)) {
    return nullptr;
  }
  json list = json::array();
  if (value.ptr_array != nullptr) {
    const column_info element = element_column(column, element_type(column.type));
    for (uint32_t at = 0; at < value.ptr_array->element_count; ++at) {
      list.push_back(to_json(element, value.ptr_array->elements[at]));
    }
  }
  return list;
}

std::string to_text(const column_info &column, const qv_value_t &value) {
  const json rendered = to_json(column, value);
  return rendered.is_string() ? rendered.get<std::string>() : rendered.dump();
}

void free_value(qv_data_type_t type, qv_value_t &value) {
  if (type >= QV_CHAR_PTR && type < QV_DATA_TYPE_LIMIT) {
    std::free(value.ptr_char);  // one block, nested values inside it
    value.ptr_char = nullptr;
  }
}

void *owned_value::block(size_t bytes) {
  void *p_block = std::calloc(1, bytes > 0 ? bytes : 1);
  if (p_block == nullptr) {
    throw std::bad_alloc();
  }
  blocks_.emplace_back(p_block, &std::free);
  return p_block;
}

void from_json(const column_info &column, const json &given, owned_value &into) {
  into.value = build(column, given, into);
}

void from_text(const column_info &column, const std::string &text, owned_value &into) {
  switch (column.type) {
    case QV_INT32:
      into.value.val_int32 = number_of_text<int32_t>(column, text);
      return;
    case QV_UINT32:
      into.value.val_uint32 = number_of_text<uint32_t>(column, text);
      return;
    case QV_INT64:
      into.value.val_int64 = number_of_text<int64_t>(column, text);
      return;
    case QV_UINT64:
      into.value.val_uint64 = number_of_text<uint64_t>(column, text);
      return;
    case QV_FLOAT32:
      into.value.val_float32 = number_of_text<float>(column, text);
      return;
    case QV_FLOAT64:
      into.value.val_float64 = number_of_text<double>(column, text);
      return;
    case QV_CHAR_PTR:
    case QV_BINARY_PTR:
    case QV_SBS_PTR:
    case QV_RSRC_HANDLE_PTR:
      into.value = build(column, json(text), into);
      return;
    default:
      break;
  }
  const json parsed = json::parse(text, nullptr, false);
  if (parsed.is_discarded()) {
    refuse(column, "\"" + text + "\" (not JSON)");
  }
  into.value = build(column, parsed, into);
}

}  // namespace qvreg
