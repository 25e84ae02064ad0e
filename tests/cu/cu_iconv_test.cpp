// Code-set conversion: which locales keep bytes unchanged, long strings, and
// refusal of what cannot be converted (the codec and tree tests convert
// to and from ISO-8859-1).

#include <gtest/gtest.h>

#include <clocale>
#include <cstdlib>
#include <string>

#include "qv_cu.h"

namespace {

// Opens a handle and converts one string; "" with the result on failure.
struct converted {
  int32_t result;
  std::string text;
};

converted convert(const char *p_code_set, uint32_t flags, const std::string &input) {
  cu_iconv_t *p_handle = nullptr;
  int32_t result = cu_iconv_open_1(p_code_set, flags, &p_handle);
  if (result != CU_RESULT_OK) {
    return {result, ""};
  }
  char *p_out = nullptr;
  result = cu_iconv_str_1(p_handle, input.c_str(), &p_out);
  converted out{result, p_out ? p_out : ""};
  std::free(p_out);
  cu_iconv_close_1(p_handle);
  return out;
}

bool locale_keeps_utf8_unchanged() {
  cu_locale_info_t *p_info = nullptr;
  EXPECT_EQ(cu_get_locale_info_1(&p_info), CU_RESULT_OK);
  const int32_t unchanged = cu_utf8_is_not_modified_1(p_info);
  cu_rel_locale_info_1(p_info);
  return unchanged != 0;
}

const std::string Utf8_Text = "caf\xc3\xa9 \xe2\x82\xac \xf0\x9f\x98\x80";  // café € 😀

TEST(CodeSetConversion, CAndUtf8LocalesKeepUtf8BytesUnchanged) {
  ASSERT_NE(std::setlocale(LC_CTYPE, "C"), nullptr);
  EXPECT_TRUE(locale_keeps_utf8_unchanged());
  const converted stored =
      convert("ANSI_X3.4-1968", CU_ICONV_TO_STORED | CU_ICONV_UNCHANGED, Utf8_Text);
  EXPECT_EQ(stored.result, CU_RESULT_OK);
  EXPECT_EQ(stored.text, Utf8_Text);
  if (std::setlocale(LC_CTYPE, "C.UTF-8") == nullptr) {
    GTEST_SKIP() << "no C.UTF-8 locale on this machine";
  }
  EXPECT_TRUE(locale_keeps_utf8_unchanged());
  std::setlocale(LC_CTYPE, "C");
}

TEST(CodeSetConversion, UnconvertibleTextIsAnErrorNotATruncation) {
  // The euro sign has no ISO-8859-1 byte.
  EXPECT_EQ(convert("ISO-8859-1", CU_ICONV_FROM_STORED, "price \xe2\x82\xac 5").result,
            CU_RESULT_INVALID_SEQUENCE);
  // Malformed UTF-8, and a sequence cut short at the end.
  EXPECT_EQ(convert("ISO-8859-1", CU_ICONV_FROM_STORED, "bad \xc3\x28").result,
            CU_RESULT_INVALID_SEQUENCE);
  EXPECT_EQ(convert("ISO-8859-1", CU_ICONV_FROM_STORED, "cut \xc3").result,
            CU_RESULT_INVALID_SEQUENCE);
}

TEST(CodeSetConversion, LongStringsGrowTheOutput) {
  const std::string latin1(10000, '\xe9');
  const converted stored = convert("ISO-8859-1", CU_ICONV_TO_STORED, latin1);
  ASSERT_EQ(stored.result, CU_RESULT_OK);
  ASSERT_EQ(stored.text.size(), 20000u);
  EXPECT_EQ(stored.text.substr(19998), "\xc3\xa9");
}

// Bad arguments are refused; a null handle copies byte for byte.
TEST(CodeSetConversion, BadArgumentsAreRefusedAndANullHandleCopies) {
  cu_iconv_t *p_handle = nullptr;
  EXPECT_EQ(cu_iconv_open_1("NO-SUCH-CODE-SET", 0, &p_handle), CU_RESULT_UNSUPPORTED_CODE_SET);
  EXPECT_EQ(cu_iconv_open_1("UTF-8", 2, &p_handle), CU_RESULT_BAD_FLAGS);
  EXPECT_EQ(cu_iconv_open_1(nullptr, 0, &p_handle), CU_RESULT_NULL_ARGUMENT);
  char *p_out = nullptr;
  EXPECT_EQ(cu_iconv_str_1(nullptr, nullptr, &p_out), CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(cu_get_locale_info_1(nullptr), CU_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(cu_utf8_is_not_modified_1(nullptr), 0);
  ASSERT_EQ(cu_iconv_str_1(nullptr, Utf8_Text.c_str(), &p_out), CU_RESULT_OK);
  EXPECT_EQ(std::string(p_out), Utf8_Text);
  std::free(p_out);
  EXPECT_EQ(cu_iconv_is_unchanged_1(nullptr), 1);
}

}  // namespace
