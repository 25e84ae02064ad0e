// qvreg_output.h - what a subcommand prints: a grid of named columns and
// rows of JSON cells, shown as an aligned table for a terminal, as CSV
// (RFC 4180 quoting; what `import` reads back) or as a JSON array of
// objects (what `jq` and `import` read).

#ifndef QVREG_OUTPUT_H
#define QVREG_OUTPUT_H

#include <ostream>
#include <string>
#include <vector>

#include "qvreg_values.h"

namespace qvreg {

struct grid {
  std::vector<std::string> header;
  std::vector<std::vector<json>> rows;
};

// Prints `table` in `format` ("table", "csv" or "json").
void print(std::ostream &out, const grid &table, const std::string &format);

// A cell as text: a string as it is, null as nothing, anything else as
// JSON.
std::string cell_text(const json &cell);

// Splits CSV text into records of fields (quoted fields may hold commas,
// quotes doubled, and line breaks). Throws usage_error on a broken quote.
std::vector<std::vector<std::string>> parse_csv(const std::string &text);

}  // namespace qvreg

#endif  // QVREG_OUTPUT_H
