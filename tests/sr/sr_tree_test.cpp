// Trees through the exported calls: opening and closing, bad handles, the
// set of open trees under concurrent use, and the conversion handles that
// follow the process's locale.

#include <gtest/gtest.h>

#include <clocale>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "frame/sr_i_tree.h"
#include "qv_sr.h"
#include "sr_row_test_support.h"

namespace {

using sr_test::last_error;

bool is_open_tree(sr_opaque_handle_t tree) {
  pthread_mutex_lock(&Registry_Trees_Mutex);
  const bool open =
      P_Registry_Trees != nullptr && P_Registry_Trees->count(static_cast<sr_i_tree_t *>(tree)) == 1;
  pthread_mutex_unlock(&Registry_Trees_Mutex);
  return open;
}

// Open registers the tree and close ends it; a closed tree is refused (a
// null one too: the C interface test), and a later success clears the
// message of the refused call.
TEST(Trees, OpenRegistersTheTreeCloseEndsItAndAClosedTreeIsRefused) {
  sr_opaque_handle_t tree = nullptr;
  ASSERT_EQ(sr_open_tree_1(&tree, 3, 1000), 0);
  ASSERT_NE(tree, nullptr);
  EXPECT_TRUE(is_open_tree(tree));
  EXPECT_EQ(sr_close_tree_1(tree), 0);
  EXPECT_FALSE(is_open_tree(tree));
  EXPECT_EQ(sr_close_tree_1(tree), SR_E_INVALID_HANDLE);
  EXPECT_EQ(last_error().first, 100);
  ASSERT_EQ(sr_open_tree_1(&tree, 0, 0), 0);
  EXPECT_EQ(last_error().first, 0);
  EXPECT_EQ(sr_close_tree_1(tree), 0);
}

TEST(Trees, ManyThreadsOpenAndCloseTreesAtOnce) {
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int thread = 0; thread < 4; ++thread) {
    threads.emplace_back([&] {
      for (int round = 0; round < 200; ++round) {
        sr_opaque_handle_t tree = nullptr;
        if (sr_open_tree_1(&tree, 0, 0) != 0 || !is_open_tree(tree) || sr_close_tree_1(tree) != 0) {
          ++failures;
        }
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  EXPECT_EQ(failures, 0);
}

// Every key a hash function was given, and a comparison for string keys.
std::vector<std::string> Hashed_Keys;
uint32_t remember_key(const void *p_key) {
  Hashed_Keys.emplace_back(static_cast<const char *>(p_key));
  return 0;
}
int32_t compare_strings(const void *p_stored_key, const void *p_key) {
  return std::strcmp(static_cast<const char *>(p_stored_key), static_cast<const char *>(p_key));
}

// Converts with one of a tree's handles.
std::string convert(cu_iconv_t *p_handle, const std::string &text) {
  char *p_out = nullptr;
  EXPECT_EQ(cu_iconv_str_1(p_handle, text.c_str(), &p_out), 0);
  std::string out = p_out ? p_out : "";
  std::free(p_out);
  return out;
}

// In the C locale the tree stores bytes as they are. In a Latin-1 locale
// (compiled by the build, with localedef, into SR_TEST_LOCALE_DIR) strings
// are converted to UTF-8 and back, with the handles opened when the tree
// was, whatever the locale later.
TEST(TreeConversion, TheLocaleAtOpenDecidesTheConversion) {
  ASSERT_NE(std::setlocale(LC_CTYPE, "C"), nullptr);
  sr_opaque_handle_t handle = nullptr;
  ASSERT_EQ(sr_open_tree_1(&handle, 0, 0), 0);
  auto *p_tree = static_cast<sr_i_tree_t *>(handle);
  EXPECT_EQ(cu_iconv_is_unchanged_1(p_tree->p_to_table_string_conversion_handle), 1);
  EXPECT_EQ(cu_iconv_is_unchanged_1(p_tree->p_from_table_string_conversion_handle), 1);
  const std::string utf8 = "gr\xc3\xbc\xc3\x9f dich \xe2\x82\xac";
  EXPECT_EQ(convert(p_tree->p_to_table_string_conversion_handle, utf8), utf8);
  EXPECT_EQ(sr_close_tree_1(handle), 0);

  const std::string locale_directory = SR_TEST_LOCALE_DIR;
  if (!std::filesystem::exists(locale_directory + "/fr_FR.ISO-8859-1")) {
    GTEST_SKIP() << "no Latin-1 locale could be built on this machine";
  }
  setenv("LOCPATH", locale_directory.c_str(), 1);
  ASSERT_NE(std::setlocale(LC_CTYPE, "fr_FR.ISO-8859-1"), nullptr);
  const int32_t rc = sr_open_tree_1(&handle, 0, 0);
  std::setlocale(LC_CTYPE, "C");
  unsetenv("LOCPATH");
  ASSERT_EQ(rc, 0);
  p_tree = static_cast<sr_i_tree_t *>(handle);
  EXPECT_EQ(convert(p_tree->p_to_table_string_conversion_handle, "caf\xe9"), "caf\xc3\xa9");
  EXPECT_EQ(convert(p_tree->p_from_table_string_conversion_handle, "caf\xc3\xa9"), "caf\xe9");

  // A row's key is hashed as it is stored, converted, not as the caller
  // passed it: the hash table finds keys by their stored bytes. Reading it
  // back converts the stored bytes to the caller's code set again.
  sr_column_t key_column = sr_test::column("key", QV_CHAR_PTR, SR_PRIMARY_KEY);
  sr_opaque_handle_t table = nullptr;
  ASSERT_EQ(sr_create_hashed_key_table_1(handle, "/latin1", &key_column, 1, 2, 4, remember_key,
                                         compare_strings, &table),
            0);
  ASSERT_EQ(sr_test::add_fields(table, {{"key", sr_test::string_value("caf\xe9")}}), 0);
  EXPECT_EQ(Hashed_Keys, std::vector<std::string>{"caf\xc3\xa9"});
  sr_test::field_list read{{"key", {}}};
  ASSERT_EQ(sr_get_fields_by_index_and_visibility_1(table, 0, read.names.data(),
                                                    read.pointers.data(), 1, 1, nullptr),
            0);
  EXPECT_STREQ(read.values[0].ptr_char, "caf\xe9");
  std::free(read.values[0].ptr_char);
  EXPECT_EQ(sr_close_tree_1(handle), 0);
}

}  // namespace
