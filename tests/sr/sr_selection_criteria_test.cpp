// Selection criteria: the expansion of replacement variables into literals,
// compilation against a real table with its column callback (columns and
// structured-data fields, the conversion of the text, the failures), and
// evaluation on hand-built row records.

#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <tuple>
#include <vector>

#include "frame/sr_i_tree.h"
#include "pmsg_test_values.h"
#include "queries/sr_i_selection_criteria.h"
#include "rows/sr_i_rows.h"
#include "sr_row_test_support.h"

namespace {

using namespace sr_test;

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
  expansion result{rc, rc == 0 ? p_result : ""};
  std::free(p_result);
  return result;
}

// A handle whose header holds the halves 0x0001 and 0x00ab in memory order.
qv_resource_handle_t sample_handle() {
  qv_resource_handle_t handle{0, {1, 2, 0xabcd, 0xffffffff}};
  const uint16_t halves[2] = {0x0001, 0x00ab};
  std::memcpy(&handle.header, halves, sizeof halves);
  return handle;
}

// ---- Expansion --------------------------------------------------------------

TEST(Expansion, EachVariableBecomesTheLiteralOfItsType) {
  EXPECT_EQ(expand("").text, "");
  EXPECT_EQ(expand("count > 3 && name =~ \"^a\\.b\"").text, "count > 3 && name =~ \"^a\\.b\"");
  // A quote after "$" is no variable: both stay.
  EXPECT_EQ(expand("a == $\"x$' && b == $i$'", 5).text, "a == $\"x$' && b == 5$'");
  // Numbers are bare, each in its own format, letters in either case.
  EXPECT_EQ(expand("$i|$I|$ui|$UI", -42, INT32_MIN, 4294967295u, 0u).text,
            "-42|-2147483648|4294967295|0");
  EXPECT_EQ(expand("$l|$L|$ul|$UL", INT64_MIN, int64_t{1} << 40, UINT64_MAX, uint64_t{1}).text,
            "-9223372036854775808|1099511627776|18446744073709551615|1");
  // $f prints fixed-point, $d the shortest form: the same number differs.
  EXPECT_EQ(expand("$f|$F|$d|$D", 2.5, 1e20, 2.5, 1e20).text,
            "2.500000|100000000000000000000.000000|2.5|1e+20");
  // Integers, doubles and pointers mixed are taken in the format's order.
  EXPECT_EQ(expand("$i $d $s $ul $l $f", 1, 0.5, "x", uint64_t{2}, int64_t{-3}, 4.25).text,
            "1 0.5 \"x\" 2 -3 4.250000");

  // Strings, binaries and handles are quoted; null pointers stand for the
  // empty values.
  EXPECT_EQ(expand("$s|$S|$s", "eth\"0", "", static_cast<char *>(nullptr)).text,
            "\"eth\"0\"|\"\"|\"\"");
  value_arena arena;
  EXPECT_EQ(expand("$b|$B", arena.binary(std::string_view("\x00\x1f\xab\xff", 4)).ptr_binary,
                   static_cast<qv_binary_t *>(nullptr))
                .text,
            "\"0x001fabff\"|\"0x\"");
  qv_resource_handle_t handle = sample_handle();
  const std::string handle_text = "\"0x0001 0x00ab 0x00000001 0x00000002 0x0000abcd 0xffffffff\"";
  EXPECT_EQ(expand("$rh|$RH", &handle, &handle).text, handle_text + "|" + handle_text);
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
    EXPECT_EQ(last_error(),
              std::make_pair(SR_E_INVALID_CRITERIA,
                             "2605-109 An invalid positional/replacement variable type was found "
                             "in the selection criteria string: " +
                                 format + ".\n"));
  }
}

TEST(Expansion, ResultsPastTheFirstBufferAreReturnedWhole) {
  // Around the first buffer's end: the terminator alone, then a number
  // printed across it.
  for (const size_t length : {4095u, 4096u}) {
    EXPECT_EQ(expand(std::string(length, 'a').c_str()).text, std::string(length, 'a'));
  }
  const std::string near_end(4090, 'c');
  EXPECT_EQ(expand((near_end + "$l").c_str(), INT64_MIN).text, near_end + "-9223372036854775808");
  // A value several buffers long, with text and a variable after it.
  const std::string long_value(10000, 'v');
  value_arena arena;
  const qv_value_t long_binary = arena.binary(std::string(5000, '\x55'));
  EXPECT_EQ(
      expand("x == $s && y == $b && z == $i", long_value.c_str(), long_binary.ptr_binary, 17).text,
      "x == \"" + long_value + "\" && y == \"0x" + std::string(10000, '5') + "\" && z == 17");
}

// ---- Compilation and evaluation on a real table ---------------------------

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

// A table keyed by the string "name", with an int32 "count", a structured
// "peer" (fields "x", "port", "host"; odd name lengths leave the packed
// definition unaligned), an int32 array "ports", a binary "blob" and a
// resource handle "owner"; and the row "eth0" of count 5, peer (-1, 80,
// "h1"), ports (22, 443), blob 00 1f ab ff and owner (1, 0xab, ..., 0xffffffff).
class Criteria : public RowTables {
 protected:
  void SetUp() override {
    RowTables::SetUp();
    p_definition_->number_of_fields = 3;
    p_definition_->field_def[0] = {QV_INT64, const_cast<char *>("x")};
    p_definition_->field_def[1] = {QV_UINT32, const_cast<char *>("port")};
    p_definition_->field_def[2] = {QV_CHAR_PTR, const_cast<char *>("host")};
    std::vector<sr_column_t> columns = {column("name", QV_CHAR_PTR, SR_PRIMARY_KEY),
                                        column("count", QV_INT32),
                                        column("peer", QV_SD_PTR),
                                        column("ports", QV_INT32_ARRAY),
                                        column("blob", QV_BINARY_PTR),
                                        column("owner", QV_RSRC_HANDLE_PTR)};
    columns[2].sd_defn = p_definition_.get();
    p_table_ = object(make_table("/criteria", columns, Explicit));
    p_conversion_ = static_cast<sr_i_tree_t *>(tree_)->p_to_table_string_conversion_handle;
  }
  // Fills `row` as the row "eth0".
  void fill(Row &row) {
    value_arena arena;
    qv_value_t owner{};
    owner.ptr_rsrc_handle = &owner_;
    const qv_value_t values[] = {string_value("eth0"),
                                 int32_value(5),
                                 arena.structured({{QV_INT64, number64(static_cast<uint64_t>(-1))},
                                                   {QV_UINT32, number32(80)},
                                                   {QV_CHAR_PTR, arena.string("h1")}}),
                                 arena.array({int32_value(22), int32_value(443)}),
                                 blob_,
                                 owner};
    for (uint32_t at = 0; at < 6; ++at) {
      row.put(at, values[at]);
    }
  }

  // The callback's answer: its code, and the id and type it filled in.
  using answer = std::tuple<int32_t, uint32_t, qv_data_type_t>;
  answer resolve(const char *p_name, uint32_t parent_id = CU_EXPR_NO_PARENT) {
    cu_validate_data_t data{QV_UNKNOWN, 0xDEAD};
    const int32_t rc = sr_i_validate_column_callback(
        p_table_, p_name, static_cast<uint32_t>(std::strlen(p_name)), parent_id, &data);
    return rc == 0 ? answer{0, data.id, data.type} : answer{rc, 0, QV_UNKNOWN};
  }

  // 1 match, 0 no match, -1 compilation failed, else the evaluation's code.
  int32_t verdict(const std::string &criteria, const void *p_record,
                  cu_iconv_t *p_conversion = nullptr) {
    cu_expression_t *p_expression = nullptr;
    if (sr_i_compile_expression(criteria.c_str(), p_table_, &p_expression,
                                p_conversion ? p_conversion : p_conversion_) != 0) {
      return -1;
    }
    bool matches = true;
    const int32_t rc = sr_i_row_matches(p_table_, p_expression, p_record, &matches);
    cu_free_expr_1(p_expression, 0);
    return rc != 0 ? rc : matches ? 1 : 0;
  }

  std::unique_ptr<sr_sd_def_t, decltype(&std::free)> p_definition_ =
      zeroed_block<sr_sd_def_t>(3 * sizeof(sr_sd_field_def_t));
  sr_i_table_t *p_table_ = nullptr;
  cu_iconv_t *p_conversion_ = nullptr;
  value_arena arena_;
  qv_value_t blob_ = arena_.binary(std::string_view("\x00\x1f\xab\xff", 4));
  qv_resource_handle_t owner_ = sample_handle();
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

TEST_F(Criteria, CriteriaAreConvertedThenCompiledAndFailuresNameTheirCause) {
  // Stored strings are UTF-8; criteria written in Latin-1 match only when
  // the conversion handle turns them into UTF-8 first.
  cu_iconv_t *p_latin1 = nullptr, *p_ascii = nullptr;
  ASSERT_EQ(cu_iconv_open_1("ISO-8859-1", CU_ICONV_TO_STORED, &p_latin1), 0);
  ASSERT_EQ(cu_iconv_open_1("ANSI_X3.4-1968", CU_ICONV_TO_STORED, &p_ascii), 0);
  Row row(p_table_);
  row.put(0, string_value("caf\xc3\xa9"));
  EXPECT_EQ(verdict("name == \"caf\xe9\"", row.record(), p_latin1), 1);

  const std::string comp_expr = "2605-011 The cu_comp_expr library function unexpectedly returned ";
  const struct {
    const char *p_criteria;
    cu_iconv_t *p_conversion;
    int32_t code;
    std::string message_start;
  } refusals[] = {{"count > 3", nullptr, SR_E_INTERNAL, "2605-015 "},
                  {"name == \"caf\xe9\"", p_ascii, SR_E_LIBRARY_CALL,
                   "2605-011 The cu_iconv_str library function"},
                  {"bogus > 1", p_conversion_, SR_E_LIBRARY_CALL,
                   comp_expr + std::to_string(CU_RESULT_UNKNOWN_NAME) + " to the "},
                  {"peer.nothing == 1", p_conversion_, SR_E_LIBRARY_CALL,
                   comp_expr + std::to_string(CU_RESULT_UNKNOWN_NAME) + " to the "},
                  {"name == 3", p_conversion_, SR_E_LIBRARY_CALL,
                   comp_expr + std::to_string(CU_RESULT_TYPE_MISMATCH) + " to the "}};
  for (const auto &refused : refusals) {
    cu_expression_t *p_expression = nullptr;
    EXPECT_EQ(
        sr_i_compile_expression(refused.p_criteria, p_table_, &p_expression, refused.p_conversion),
        refused.code)
        << refused.p_criteria;
    EXPECT_EQ(p_expression, nullptr);
    const auto [code, text] = last_error();
    EXPECT_EQ(code, refused.code);
    EXPECT_EQ(text.rfind(refused.message_start, 0), 0u) << text;
  }
  cu_iconv_close_1(p_ascii);
  cu_iconv_close_1(p_latin1);
}

TEST_F(Criteria, ColumnsAndFieldsAreReadFromTheRecord) {
  Row eth0(p_table_);
  fill(eth0);
  const void *p_record = eth0.record();
  // Expanded literals compile and match their columns.
  qv_resource_handle_t different = owner_;
  different.id.id4 = 0;
  for (const std::string &matching :
       {std::string("count > 3"), std::string("name == \"eth0\""),
        std::string("peer.port == 80 && peer.host == \"h1\" && peer.x == -1"),
        std::string("443 in ports && len(ports) == 2"), std::string("blob == \"0x001fabff\""),
        expand("name == $s && count == $i && blob == $b && owner == $rh && peer.port == $ui",
               "eth0", 5, blob_.ptr_binary, &owner_, 80u)
            .text}) {
    EXPECT_EQ(verdict(matching, p_record), 1) << matching;
  }
  // Rows that cannot match (division by zero, an index out of range) do not.
  for (const std::string &other :
       {std::string("count > 5"), std::string("name == \"eth1\""), std::string("peer.port == 81"),
        std::string("blob == \"0x001fab\""), std::string("count / (count - 5) > 0"),
        std::string("ports[5] == 1"), expand("owner == $rh", &different).text}) {
    EXPECT_EQ(verdict(other, p_record), 0) << other;
  }
  // Without a body for the peer its fields are missing: no match.
  Row without_peer(p_table_);
  without_peer.put(0, string_value("eth1"));
  without_peer.put(1, int32_value(5));
  EXPECT_EQ(verdict("peer.port == 80", without_peer.record()), 0);
  EXPECT_EQ(verdict("count == 5", without_peer.record()), 1);
  // Any other evaluator fault is raised, naming it.
  bool matches = true;
  EXPECT_EQ(sr_i_row_matches(p_table_, nullptr, p_record, &matches), SR_E_LIBRARY_CALL);
  EXPECT_EQ(last_error().second.rfind(
                "2605-011 The cu_exec_expr library function unexpectedly returned 1 to the ", 0),
            0u);
}

}  // namespace
