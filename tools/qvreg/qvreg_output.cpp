// qvreg_output.cpp - the three ways a grid is printed, and the CSV reader
// that takes the CSV form back.

#include "qvreg_output.h"

#include <algorithm>

#include "qvreg_session.h"

namespace qvreg {

namespace {

// A CSV field, quoted when it holds a separator, a quote or a line break,
// or has spaces at either end.
std::string csv_field(const std::string &text) {
  const bool quoted = text.find_first_of(",\"\r\n") != std::string::npos ||
                      (!text.empty() && (text.front() == ' ' || text.back() == ' '));
  if (!quoted) {
    return text;
  }
  std::string field = "\"";
  for (const char letter : text) {
    field += letter == '"' ? std::string("\"\"") : std::string(1, letter);
  }
  return field + "\"";
}

void print_aligned(std::ostream &out, const grid &table) {
  std::vector<size_t> widths;
  for (const std::string &name : table.header) {
    widths.push_back(name.size());
  }
  std::vector<std::vector<std::string>> texts;
  for (const auto &row : table.rows) {
    std::vector<std::string> line;
    for (size_t at = 0; at < row.size(); ++at) {
      line.push_back(cell_text(row[at]));
      widths[at] = std::max(widths[at], line.back().size());
    }
    texts.push_back(std::move(line));
  }
  const auto print_line = [&](const std::vector<std::string> &cells) {
    std::string line;
    for (size_t at = 0; at < cells.size(); ++at) {
      line += cells[at];
      if (at + 1 < cells.size()) {
        line += std::string(widths[at] - cells[at].size() + 2, ' ');
      }
    }
    out << line << '\n';
  };
  print_line(table.header);
  std::vector<std::string> rule;
  for (const size_t width : widths) {
    rule.emplace_back(width, '-');
  }
  print_line(rule);
  for (const auto &line : texts) {
    print_line(line);
  }
}

}  // namespace

std::string cell_text(const json &cell) {
  if (cell.is_null()) {
    return "";  // nothing to show (a column without fields, a table without a file)
  }
  return cell.is_string() ? cell.get<std::string>() : cell.dump();
}

void print(std::ostream &out, const grid &table, const std::string &format) {
  if (format == "json") {
    json list = json::array();
    for (const auto &row : table.rows) {
      json object = json::object();
      for (size_t at = 0; at < row.size(); ++at) {
        object[table.header[at]] = row[at];
      }
      list.push_back(std::move(object));
    }
    out << list.dump(2) << '\n';
  } else if (format == "csv") {
    const auto print_record = [&](const std::vector<std::string> &fields) {
      for (size_t at = 0; at < fields.size(); ++at) {
        out << (at > 0 ? "," : "") << csv_field(fields[at]);
      }
      out << "\r\n";
    };
    print_record(table.header);
    for (const auto &row : table.rows) {
      std::vector<std::string> fields;
      for (const json &cell : row) {
        fields.push_back(cell_text(cell));
      }
      print_record(fields);
    }
  } else {
    print_aligned(out, table);
  }
}

std::vector<std::vector<std::string>> parse_csv(const std::string &text) {
  std::vector<std::vector<std::string>> records;
  std::vector<std::string> record;
  std::string field;
  bool quoted = false;
  bool field_started = false;
  for (size_t at = 0; at < text.size(); ++at) {
    const char letter = text[at];
    if (quoted) {
      if (letter == '"' && at + 1 < text.size() && text[at + 1] == '"') {
        field += '"';
        ++at;
      } else if (letter == '"') {
        quoted = false;
      } else {
        field += letter;
      }
    } else if (letter == '"' && field.empty()) {
      quoted = true;
      field_started = true;
    } else if (letter == ',') {
      record.push_back(std::move(field));
      field.clear();
      field_started = true;
    } else if (letter == '\n' || letter == '\r') {
      if (letter == '\r' && at + 1 < text.size() && text[at + 1] == '\n') {
        ++at;
      }
      if (field_started || !field.empty() || !record.empty()) {
        record.push_back(std::move(field));
        records.push_back(std::move(record));
      }
      record.clear();
      field.clear();
      field_started = false;
    } else {
      field += letter;
      field_started = true;
    }
  }
  if (quoted) {
    throw usage_error("the CSV ends inside a quoted field");
  }
  if (field_started || !field.empty() || !record.empty()) {
    record.push_back(std::move(field));
    records.push_back(std::move(record));
  }
  return records;
}

}  // namespace qvreg
