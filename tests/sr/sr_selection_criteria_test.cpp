// Selection criteria: the expansion of replacement variables into literals
// (every type's exact text, letters in either case, quotes after "$" kept,
// unknown variables refused with the whole format in the message, results
// past the first buffer), compilation against a real table with its column
// callback (columns, structured-data fields read from the metadata record,
// the missing conversion handle, failing conversion and compilation), and
// evaluation on hand-built row records.

#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <string>
#include <vector>

#include "qv_cu.h"
#include "sr_i_rows.h"
#include "sr_i_selection_criteria.h"
#include "sr_i_tree.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

struct last_error {
  int32_t code;
  std::string text;
};

last_error read_last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  last_error copy{p_error->code, p_error->p_text};
  cu_rel_error_1(p_error);
  return copy;
}

struct expansion {
  int32_t rc;
  std::string text;
};

// sr_i_select_printf with the values given here as further arguments.
expansion expand(const char *p_format, ...) {
  va_list arguments;
  va_start(arguments, p_format);
  char *p_result = nullptr;
  const int32_t rc = sr_i_select_printf(&p_result, p_format, arguments);
  va_end(arguments);
  expansion result{rc, ""};
  if (rc == 0) {
    result.text = p_result;
    std::free(p_result);
  }
  return result;
}

// A binary value in a malloc'ed block, as a caller would pass it.
struct binary_value {
  explicit binary_value(std::vector<unsigned char> bytes)
      : p_value(static_cast<qv_binary_t *>(std::malloc(sizeof(qv_binary_t) + bytes.size()))) {
    p_value->length = static_cast<uint32_t>(bytes.size());
    if (!bytes.empty()) {
      std::memcpy(p_value->data, bytes.data(), bytes.size());
    }
  }
  ~binary_value() { std::free(p_value); }
  binary_value(const binary_value &) = delete;
  binary_value &operator=(const binary_value &) = delete;
  qv_binary_t *p_value;
};

qv_resource_handle_t resource_handle(uint16_t first_half, uint16_t second_half, uint32_t id1,
                                     uint32_t id2, uint32_t id3, uint32_t id4) {
  qv_resource_handle_t handle{};
  const uint16_t halves[2] = {first_half, second_half};
  std::memcpy(&handle.header, halves, sizeof halves);
  handle.id = {id1, id2, id3, id4};
  return handle;
}

// ---- Expansion --------------------------------------------------------------

TEST(Expansion, PlainTextAndQuotesAfterADollarAreCopiedUnchanged) {
  EXPECT_EQ(expand("").text, "");
  EXPECT_EQ(expand("count > 3 && name =~ \"^a\\.b\"").text, "count > 3 && name =~ \"^a\\.b\"");
  const expansion quoted = expand("a == $\"x$' && b == $i$'", 5);
  EXPECT_EQ(quoted.rc, 0);
  EXPECT_EQ(quoted.text, "a == $\"x$' && b == 5$'");
}

TEST(Expansion, NumbersAreWrittenBareInTheirOwnFormat) {
  EXPECT_EQ(expand("$i|$I", -42, std::numeric_limits<int32_t>::min()).text, "-42|-2147483648");
  EXPECT_EQ(expand("$l|$L", std::numeric_limits<int64_t>::min(), int64_t{1} << 40).text,
            "-9223372036854775808|1099511627776");
  EXPECT_EQ(expand("$ui|$UI|$uI|$Ui", 4294967295u, 0u, 7u, 8u).text, "4294967295|0|7|8");
  EXPECT_EQ(expand("$ul|$UL|$uL|$Ul", std::numeric_limits<uint64_t>::max(), uint64_t{1},
                   uint64_t{2}, uint64_t{3})
                .text,
            "18446744073709551615|1|2|3");
  // $f prints fixed-point, $d the shortest form: the same number differs.
  EXPECT_EQ(expand("$f|$F|$d|$D", 2.5, 1e20, 2.5, 1e20).text,
            "2.500000|100000000000000000000.000000|2.5|1e+20");
  EXPECT_EQ(expand("$f", static_cast<double>(0.1f)).text, "0.100000");
  // Integers, doubles and pointers mixed are taken in the format's order.
  EXPECT_EQ(expand("$i $d $s $ul $l $f", 1, 0.5, "x", uint64_t{2}, int64_t{-3}, 4.25).text,
            "1 0.5 \"x\" 2 -3 4.250000");
}

TEST(Expansion, StringsBinariesAndHandlesAreQuoted) {
  EXPECT_EQ(expand("$s|$S", "eth\"0", "").text, "\"eth\"0\"|\"\"");
  binary_value bytes({0x00, 0x1f, 0xab, 0xff});
  binary_value empty({});
  EXPECT_EQ(expand("$b|$B", bytes.p_value, empty.p_value).text, "\"0x001fabff\"|\"0x\"");
  qv_resource_handle_t handle = resource_handle(0x0001, 0x00ab, 1, 2, 0xabcd, 0xffffffff);
  const std::string handle_text = "\"0x0001 0x00ab 0x00000001 0x00000002 0x0000abcd 0xffffffff\"";
  EXPECT_EQ(expand("$rh|$RH|$rH|$Rh", &handle, &handle, &handle, &handle).text,
            handle_text + "|" + handle_text + "|" + handle_text + "|" + handle_text);
  // Null pointers stand for the empty values.
  EXPECT_EQ(expand("$s|$b", static_cast<char *>(nullptr), static_cast<qv_binary_t *>(nullptr)).text,
            "\"\"|\"0x\"");
  EXPECT_EQ(expand("$rh", static_cast<qv_resource_handle_t *>(nullptr)).text,
            expand("$rh", cu_ptr_invld_rsrc_hndl_1).text);
}

TEST(Expansion, UnknownVariablesGive109NamingTheWholeFormat) {
  const std::string long_format = std::string(5000, 'a') + "$q";
  for (const std::string &format :
       {std::string("a == $"), std::string("a == $x"), std::string("$u"), std::string("$ux > 1"),
        std::string("$Uh"), std::string("$r"), std::string("$rx"), std::string("$ $i"),
        std::string("$i > $z"), long_format}) {
    cu_set_no_error_1();
    EXPECT_EQ(expand(format.c_str(), 1, 2).rc, SR_E_INVALID_CRITERIA) << format;
    const last_error error = read_last_error();
    EXPECT_EQ(error.code, SR_E_INVALID_CRITERIA);
    EXPECT_EQ(error.text,
              "2605-109 An invalid positional/replacement variable type was found in the "
              "selection criteria string: " +
                  format + ".\n");
  }
}

TEST(Expansion, ResultsPastTheFirstBufferAreReturnedWhole) {
  // Around the first buffer's end: the terminator alone, then a number
  // printed across it.
  const std::string fills_first(4095, 'a');
  EXPECT_EQ(expand(fills_first.c_str()).text, fills_first);
  const std::string needs_second(4096, 'b');
  EXPECT_EQ(expand(needs_second.c_str()).text, needs_second);
  const std::string near_end(4090, 'c');
  EXPECT_EQ(expand((near_end + "$l").c_str(), std::numeric_limits<int64_t>::min()).text,
            near_end + "-9223372036854775808");

  // A value several buffers long, with text and a variable after it.
  const std::string long_value(10000, 'v');
  binary_value long_binary(std::vector<unsigned char>(5000, 0x5a));
  const expansion grown =
      expand("x == $s && y == $b && z == $i", long_value.c_str(), long_binary.p_value, 17);
  ASSERT_EQ(grown.rc, 0);
  std::string hex;
  for (int at = 0; at < 5000; ++at) {
    hex += "5a";
  }
  EXPECT_EQ(grown.text, "x == \"" + long_value + "\" && y == \"0x" + hex + "\" && z == 17");
}

// ---- Compilation and evaluation on a real table ---------------------------

// A table keyed by the string "name", with an int32 "count", a structured
// "peer" (fields "x", "port", "host"; odd name lengths leave the packed
// definition unaligned), an int32 array "ports", a binary "blob" and a
// resource handle "owner".
class Criteria : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    p_definition_ = static_cast<sr_sd_def_t *>(
        std::malloc(sizeof(sr_sd_def_t) + 3 * sizeof(sr_sd_field_def_t)));
    p_definition_->number_of_fields = 3;
    p_definition_->field_def[0] = {QV_INT64, const_cast<char *>("x")};
    p_definition_->field_def[1] = {QV_UINT32, const_cast<char *>("port")};
    p_definition_->field_def[2] = {QV_CHAR_PTR, const_cast<char *>("host")};
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                        column("count", QV_INT32, SR_STANDARD),
                                        column("peer", QV_SD_PTR, SR_STANDARD),
                                        column("ports", QV_INT32_ARRAY, SR_STANDARD),
                                        column("blob", QV_BINARY_PTR, SR_STANDARD),
                                        column("owner", QV_RSRC_HANDLE_PTR, SR_STANDARD)};
    columns[2].sd_defn = p_definition_;
    sr_opaque_handle_t handle = nullptr;
    ASSERT_EQ(sr_create_table_1(tree_, "/criteria", columns.data(),
                                static_cast<uint32_t>(columns.size()), Explicit, &handle),
              0);
    p_table_ = object(handle);
    p_conversion_ = static_cast<sr_i_tree_t *>(tree_)->p_to_table_string_conversion_handle;
  }
  void TearDown() override {
    std::free(p_definition_);
    RowTables::TearDown();
  }

  int32_t compile(const char *p_criteria, cu_expression_t **pp_expression) {
    return sr_i_compile_expression(p_criteria, p_table_, pp_expression, p_conversion_);
  }

  // The callback's answer: its code, and the id and type it filled in.
  struct answer {
    int32_t rc;
    uint32_t id;
    qv_data_type_t type;
    bool operator==(const answer &) const = default;
  };
  answer resolve(const char *p_name, uint32_t parent_id = CU_EXPR_NO_PARENT) {
    cu_validate_data_t data{QV_UNKNOWN, 0xDEAD};
    const int32_t rc = sr_i_validate_column_callback(
        p_table_, p_name, static_cast<uint32_t>(std::strlen(p_name)), parent_id, &data);
    return rc == 0 ? answer{0, data.id, data.type} : answer{rc, 0, QV_UNKNOWN};
  }

  sr_sd_def_t *p_definition_ = nullptr;
  sr_i_table_t *p_table_ = nullptr;
  cu_iconv_t *p_conversion_ = nullptr;
};

TEST_F(Criteria, TheCallbackResolvesColumnsAndStructuredFieldsByWholeName) {
  const answer unknown{-1, 0, QV_UNKNOWN};
  EXPECT_EQ(resolve("count"), (answer{0, 1, QV_INT32}));
  EXPECT_EQ(resolve("owner"), (answer{0, 5, QV_RSRC_HANDLE_PTR}));
  for (const char *p_unknown : {"coun", "counts", "Count", "", "port"}) {
    EXPECT_EQ(resolve(p_unknown), unknown) << p_unknown;
  }
  // The length is not consulted: the terminated name decides.
  cu_validate_data_t data{};
  EXPECT_EQ(sr_i_validate_column_callback(p_table_, "count", 2, CU_EXPR_NO_PARENT, &data), 0);
  EXPECT_EQ(data.id, 1u);

  // Fields of "peer" (column 2), read from the packed definition.
  EXPECT_EQ(resolve("x", 2), (answer{0, 0, QV_INT64}));
  EXPECT_EQ(resolve("port", 2), (answer{0, 1, QV_UINT32}));
  EXPECT_EQ(resolve("host", 2), (answer{0, 2, QV_CHAR_PTR}));
  EXPECT_EQ(resolve("hos", 2), unknown);
  EXPECT_EQ(resolve("name", 2), unknown);  // a column is no field
  EXPECT_EQ(resolve("port", 1), unknown);  // a column without a definition
  EXPECT_EQ(resolve("port", p_table_->total_columns), unknown);
}

TEST_F(Criteria, CompilationNeedsAWorkingConversion) {
  cu_expression_t *p_expression = nullptr;
  EXPECT_EQ(sr_i_compile_expression("count > 3", p_table_, &p_expression, nullptr), SR_E_INTERNAL);
  EXPECT_EQ(p_expression, nullptr);
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, SR_E_INTERNAL);
  EXPECT_EQ(error.text.rfind("2605-015 ", 0), 0u) << error.text;

  cu_iconv_t *p_ascii = nullptr;
  ASSERT_EQ(cu_iconv_open_1("ANSI_X3.4-1968", CU_ICONV_TO_STORED, &p_ascii), 0);
  EXPECT_EQ(sr_i_compile_expression("name == \"caf\xe9\"", p_table_, &p_expression, p_ascii),
            SR_E_LIBRARY_CALL);
  EXPECT_EQ(p_expression, nullptr);
  EXPECT_EQ(read_last_error().text.rfind("2605-011 The cu_iconv_str library function", 0), 0u);
  cu_iconv_close_1(p_ascii);
}

TEST_F(Criteria, CompilationFailuresNameTheLibraryFunction) {
  struct refusal {
    const char *p_criteria;
    int32_t result;
  } refusals[] = {{"bogus > 1", CU_RESULT_UNKNOWN_NAME},
                  {"peer.nothing == 1", CU_RESULT_UNKNOWN_NAME},
                  {"count >", CU_RESULT_SYNTAX_ERROR},
                  {"name == 3", CU_RESULT_TYPE_MISMATCH}};
  for (const refusal &refused : refusals) {
    cu_expression_t *p_expression = nullptr;
    EXPECT_EQ(compile(refused.p_criteria, &p_expression), SR_E_LIBRARY_CALL);
    EXPECT_EQ(p_expression, nullptr);
    const last_error error = read_last_error();
    EXPECT_EQ(error.code, SR_E_LIBRARY_CALL);
    const std::string expected =
        "2605-011 The cu_comp_expr library function unexpectedly returned " +
        std::to_string(refused.result) + " to the ";
    EXPECT_EQ(error.text.rfind(expected, 0), 0u) << error.text;
  }
}

// A row record built outside the pool, then copied to an odd address as
// records in the pool may lie.
class Row {
 public:
  explicit Row(const sr_i_table_t *p_table) : builder_(p_table) {}
  void put(uint32_t column, const qv_value_t &value) {
    ASSERT_EQ(builder_.put_value(column, value, nullptr), 0);
  }
  const void *record() {
    bytes_.assign(builder_.length() + 1, 0);
    std::memcpy(bytes_.data() + 1, builder_.data(), builder_.length());
    return bytes_.data() + 1;
  }

 private:
  sr_i_row_builder builder_;
  std::vector<unsigned char> bytes_;
};

class Evaluation : public Criteria {
 protected:
  void SetUp() override {
    Criteria::SetUp();
    if (HasFatalFailure()) {
      return;
    }
    peer_ = static_cast<qv_structured_data_t *>(
        std::malloc(sizeof(qv_structured_data_t) + 3 * sizeof(qv_structured_data_element_t)));
    peer_->element_count = 3;
    peer_->pad = 0;
    peer_->elements[0] = {QV_INT64, 0, {}};
    peer_->elements[0].value.val_int64 = -1;
    peer_->elements[1] = {QV_UINT32, 0, {}};
    peer_->elements[1].value.val_uint32 = 80;
    peer_->elements[2] = {QV_CHAR_PTR, 0, {}};
    peer_->elements[2].value.ptr_char = const_cast<char *>("h1");
    ports_ = static_cast<qv_array_t *>(std::malloc(sizeof(qv_array_t) + 2 * sizeof(qv_value_t)));
    ports_->element_count = 2;
    ports_->pad = 0;
    ports_->elements[0].val_int32 = 22;
    ports_->elements[1].val_int32 = 443;
  }
  void TearDown() override {
    std::free(peer_);
    std::free(ports_);
    Criteria::TearDown();
  }

  // The row "eth0": count 5, the peer and ports above, blob 00 1f ab ff,
  // owner (1, 0xab, 1, 2, 0xabcd, 0xffffffff).
  void fill(Row &row) {
    row.put(0, string_value("eth0"));
    row.put(1, int32_value(5));
    qv_value_t value{};
    value.ptr_sd = peer_;
    row.put(2, value);
    value.ptr_array = ports_;
    row.put(3, value);
    value.ptr_binary = blob_.p_value;
    row.put(4, value);
    value.ptr_rsrc_handle = &owner_;
    row.put(5, value);
  }

  // 1 match, 0 no match, -1 compilation failed, else the evaluation's code.
  int32_t verdict(const char *p_criteria, const void *p_record) {
    cu_expression_t *p_expression = nullptr;
    if (compile(p_criteria, &p_expression) != 0) {
      return -1;
    }
    bool matches = true;
    const int32_t rc = sr_i_row_matches(p_table_, p_expression, p_record, &matches);
    cu_free_expr_1(p_expression, 0);
    return rc != 0 ? rc : matches ? 1 : 0;
  }

  qv_structured_data_t *peer_ = nullptr;
  qv_array_t *ports_ = nullptr;
  binary_value blob_{{0x00, 0x1f, 0xab, 0xff}};
  qv_resource_handle_t owner_ = resource_handle(0x0001, 0x00ab, 1, 2, 0xabcd, 0xffffffff);
};

TEST_F(Evaluation, ColumnsAndFieldsAreReadFromTheRecord) {
  Row row(p_table_);
  fill(row);
  const void *p_record = row.record();
  struct outcome {
    const char *p_criteria;
    int32_t verdict;
  } outcomes[] = {{"count > 3", 1},
                  {"count > 5", 0},
                  {"name == \"eth0\"", 1},
                  {"name == \"eth1\"", 0},
                  {"peer.port == 80 && peer.host == \"h1\" && peer.x == -1", 1},
                  {"peer.port == 81", 0},
                  {"443 in ports && len(ports) == 2", 1},
                  {"blob == \"0x001fabff\"", 1},
                  {"blob == \"0x001fab\"", 0}};
  for (const outcome &expected : outcomes) {
    EXPECT_EQ(verdict(expected.p_criteria, p_record), expected.verdict) << expected.p_criteria;
  }
}

TEST_F(Evaluation, RowsThatCannotMatchAreNoMatch) {
  Row row(p_table_);
  fill(row);
  const void *p_record = row.record();
  EXPECT_EQ(verdict("count / (count - 5) > 0", p_record), 0);  // division by zero
  EXPECT_EQ(verdict("ports[5] == 1", p_record), 0);            // index out of range
  Row without_peer(p_table_);  // no body for the peer: its fields are missing
  without_peer.put(0, string_value("eth1"));
  without_peer.put(1, int32_value(5));
  EXPECT_EQ(verdict("peer.port == 80", without_peer.record()), 0);
  EXPECT_EQ(verdict("count == 5", without_peer.record()), 1);
}

TEST_F(Evaluation, AnEvaluatorFaultIsRaisedNamingIt) {
  Row row(p_table_);
  fill(row);
  bool matches = true;
  EXPECT_EQ(sr_i_row_matches(p_table_, nullptr, row.record(), &matches), SR_E_LIBRARY_CALL);
  EXPECT_EQ(read_last_error().text.rfind(
                "2605-011 The cu_exec_expr library function unexpectedly returned 1 to the ", 0),
            0u);
}

TEST_F(Evaluation, ExpandedLiteralsCompileAndMatchTheirColumns) {
  Row row(p_table_);
  fill(row);
  const void *p_record = row.record();
  const expansion matching =
      expand("name == $s && count == $i && blob == $b && owner == $rh && peer.port == $ui", "eth0",
             5, blob_.p_value, &owner_, 80u);
  ASSERT_EQ(matching.rc, 0);
  EXPECT_EQ(verdict(matching.text.c_str(), p_record), 1) << matching.text;
  qv_resource_handle_t other = owner_;
  other.id.id4 = 0;
  const expansion different = expand("owner == $rh", &other);
  EXPECT_EQ(verdict(different.text.c_str(), p_record), 0) << different.text;
}

TEST_F(Evaluation, CriteriaAreConvertedBeforeCompiling) {
  // Stored strings are UTF-8; criteria written in Latin-1 match only when
  // the conversion handle turns them into UTF-8 first.
  cu_iconv_t *p_latin1 = nullptr;
  ASSERT_EQ(cu_iconv_open_1("ISO-8859-1", CU_ICONV_TO_STORED, &p_latin1), 0);
  Row row(p_table_);
  row.put(0, string_value("caf\xc3\xa9"));
  const void *p_record = row.record();
  cu_expression_t *p_expression = nullptr;
  ASSERT_EQ(sr_i_compile_expression("name == \"caf\xe9\"", p_table_, &p_expression, p_latin1), 0);
  bool matches = false;
  EXPECT_EQ(sr_i_row_matches(p_table_, p_expression, p_record, &matches), 0);
  EXPECT_TRUE(matches);
  cu_free_expr_1(p_expression, 0);
  cu_iconv_close_1(p_latin1);
}

}  // namespace
