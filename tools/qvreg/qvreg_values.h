// qvreg_values.h - values as a user types and reads them: every column type
// rendered as JSON (numbers, strings, binaries and structured byte strings
// as hex, resource handles as "header:id1.id2.id3.id4" in hex, arrays as
// lists, structured data as objects keyed by field name) and as text (the
// same, without quotes around a plain string), and parsed back by the
// column's type.

#ifndef QVREG_VALUES_H
#define QVREG_VALUES_H

#include <cstdlib>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "qv_sr.h"

namespace qvreg {

using json = nlohmann::ordered_json;

// The type's name as the shell shows and takes it ("int32", "string", ...);
// "unknown" for a number outside the types.
std::string type_name(qv_data_type_t type);

// The type of a name, or QV_UNKNOWN.
qv_data_type_t type_of_name(const std::string &name);

// A column's definition as the shell needs it: name, type and, for
// structured data, the field names and types.
struct column_info {
  std::string name;
  qv_data_type_t type = QV_UNKNOWN;
  uint32_t qualifier = 0;
  std::vector<std::pair<std::string, qv_data_type_t>> fields;
};

// The columns of an open table (invisible ones included); their defaults
// as JSON in `defaults` when it is given.
std::vector<column_info> columns_of(sr_opaque_handle_t table,
                                    std::vector<json> *p_defaults = nullptr);

// A value read from a table, rendered; the value itself is not freed.
json to_json(const column_info &column, const qv_value_t &value);
std::string to_text(const column_info &column, const qv_value_t &value);

// Frees what a read left in a value of `type` (one block per value).
void free_value(qv_data_type_t type, qv_value_t &value);

// A value built for a call, with the blocks it points into.
class owned_value {
 public:
  qv_value_t value{};
  // A block of `bytes` bytes, zeroed, freed with this value.
  void *block(size_t bytes);

 private:
  std::vector<std::unique_ptr<void, decltype(&std::free)>> blocks_;
};

// Parses the text a user typed, or a JSON value, by the column's type.
// Throws usage_error naming the column and the type expected.
void from_text(const column_info &column, const std::string &text, owned_value &into);
void from_json(const column_info &column, const json &given, owned_value &into);

}  // namespace qvreg

#endif  // QVREG_VALUES_H
