// The message set and the errors the frame raises: built-in texts, the
// compiled catalog agreeing with them, the inserts of each raising
// function, the key-not-found texts and the filesystem-full lookup.

#include <gtest/gtest.h>
#include <nl_types.h>

#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>

#include "frame/sr_i_errors.h"

namespace {

struct last_error {
  int32_t code;
  int32_t message;
  std::string text;
};

last_error read_last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), 0);
  last_error copy{p_error->code, p_error->message, p_error->p_text};
  cu_rel_error_1(p_error);
  return copy;
}

TEST(MessageSet, EveryPlainCodeHasTheMessageOfItsNumber) {
  for (int32_t code : {13,  14,  100, 101, 103, 104, 105, 106, 107, 108, 200, 201,
                       202, 203, 204, 205, 206, 207, 208, 209, 210, 211, 212}) {
    const int32_t number = sr_i_plain_message_number(code);
    ASSERT_GT(number, 0) << code;
    char prefix[16];
    std::snprintf(prefix, sizeof prefix, "2605-%03d ", code);
    EXPECT_EQ(std::string(cu_mesgtbl_qv_sr_set[number]).rfind(prefix, 0), 0u) << code;
  }
}

TEST(MessageSet, CompiledCatalogHoldsTheBuiltInTexts) {
  const std::string path = std::string(SR_TEST_CATALOG_DIR) + "/qv_sr.cat";
  nl_catd catalog = catopen(path.c_str(), 0);
  ASSERT_NE(catalog, reinterpret_cast<nl_catd>(-1)) << path;
  for (int number = 1; number < SR_MESSAGE_COUNT; ++number) {
    EXPECT_STREQ(catgets(catalog, 1, number, "missing"), cu_mesgtbl_qv_sr_set[number]) << number;
  }
  catclose(catalog);
}

// Raises from a function of known name and returns the line it raised on.
int raise_system_call_from_here() {
  const int line = __LINE__ + 1;
  EXPECT_EQ(sr_i_raise_system_call("pthread_cond_wait", 22), SR_E_SYSTEM_CALL);
  return line;
}

TEST(RaisingErrors, SystemCallMessageNamesCallFunctionLineModuleAndVersion) {
  const int line = raise_system_call_from_here();
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, 10);
  EXPECT_EQ(error.message, SR_I_MESSAGE_SYSTEM_CALL);
  EXPECT_EQ(error.text,
            "2605-010 The pthread_cond_wait system call unexpectedly returned an "
            "errno of 22 to the raise_system_call_from_here function near line " +
                std::to_string(line) +
                " of file tests/sr/sr_messages_test, version " SR_TEST_VERSION ".\n");
}

// (The invalid path's texts are checked with the path syntax.)
TEST(RaisingErrors, EachRaisingFunctionUsesItsMessage) {
  EXPECT_EQ(sr_i_raise_library_call("cu_iconv_str", 3), 11);
  EXPECT_EQ(read_last_error().text.rfind("2605-011 The cu_iconv_str library function "
                                         "unexpectedly returned 3 to the TestBody function",
                                         0),
            0u);
  EXPECT_EQ(sr_i_raise_no_memory(), 12);
  EXPECT_EQ(
      read_last_error().text.rfind("2605-012 Memory could not be allocated in the TestBody", 0),
      0u);
  EXPECT_EQ(sr_i_raise_internal(), 15);
  EXPECT_EQ(read_last_error().message, SR_I_MESSAGE_INTERNAL);
  EXPECT_EQ(sr_i_raise(SR_E_APPLIED_UNCOMMITTED), 212);
  EXPECT_EQ(read_last_error().message, 29);
}

// The key-not-found error: code 202, text of 213, the key rendered by its
// type (strings cut at 255 bytes, handles as six hexadecimal groups), the
// table named.
TEST(KeyNotFound, TheKeyIsRenderedByItsType) {
  std::string long_key(300, 'k');
  qv_resource_handle_t handle{0, {0xa, 0xbeef, 0x12345678, 0xffffffff}};
  const uint16_t halves[2] = {0x0102, 0xfffe};  // the header's halves in memory order
  std::memcpy(&handle.header, halves, sizeof halves);
  qv_value_t keys[9] = {};
  keys[0].val_int32 = -42;
  keys[1].val_uint32 = 4000000000u;
  keys[2].val_int64 = -9000000000LL;
  keys[3].val_uint64 = 18446744073709551615ULL;
  keys[4].val_float32 = 1.5f;
  keys[5].val_float64 = 0.000125;
  keys[6].ptr_char = long_key.data();
  keys[7].ptr_rsrc_handle = &handle;
  const struct {
    qv_data_type_t type;
    const char *p_table;
    std::string key, table;
  } cases[] = {
      {QV_INT32, "/cfg/t", "-42", "/cfg/t"},
      {QV_UINT32, "t", "4000000000", "t"},
      {QV_INT64, "t", "-9000000000", "t"},
      {QV_UINT64, "t", "18446744073709551615", "t"},
      {QV_FLOAT32, "t", "1.5", "t"},
      {QV_FLOAT64, "t", "0.000125", "t"},
      {QV_CHAR_PTR, "t", std::string(255, 'k'), "t"},
      {QV_RSRC_HANDLE_PTR, "t", "0x0102 0xfffe 0x0000000a 0x0000beef 0x12345678 0xffffffff", "t"},
      {QV_BINARY_PTR, nullptr, "***UNKNOWN KEY TYPE****", "(UNKNOWN_TABLE_NAME)"},
  };
  for (size_t at = 0; at < std::size(cases); ++at) {
    EXPECT_EQ(sr_i_raise_key_not_found(cases[at].p_table, &keys[at], cases[at].type),
              SR_E_NO_ROW_FOR_KEY);
    const last_error error = read_last_error();
    EXPECT_EQ(error.code, 202);
    EXPECT_EQ(error.message, SR_I_MESSAGE_KEY_NOT_FOUND);
    EXPECT_EQ(error.text, "2605-213 There is no row corresponding to the specified key value (" +
                              cases[at].key + ") in table (" + cases[at].table + ").\n");
  }
}

// The filesystem-full error names the device and the directory of the mount
// table entry with the longest whole-component prefix of the path; without
// a readable mount table nothing is raised and the earlier error stays.
TEST(FilesystemFull, TheLongestWholeComponentPrefixNamesTheFilesystem) {
  const std::string mount_table =
      std::filesystem::temp_directory_path() / ("sr_mtab_" + std::to_string(getpid()));
  const char *p_saved_path = Sr_Mount_Table_Path;
  Sr_Mount_Table_Path = mount_table.c_str();
  // Each case with a mount table of its own writes it; the others use the
  // last one written.
  const struct {
    std::string mount_table, path, device, directory;
  } cases[] = {
      {"/dev/root / ext4 rw 0 0\n"
       "/dev/sda2 /data ext4 rw 0 0\n"
       "/dev/sda3 /data/big xfs rw 0 0\n"
       "tmpfs /dat tmpfs rw 0 0\n"
       "/dev/sdb1 /mnt/my\\040disk ext4 rw 0 0\n"
       "short line\n",
       "/data/big/tables/t1", "/dev/sda3", "/data/big"},
      {"", "/data/bigger/t1", "/dev/sda2", "/data"},
      {"", "/data", "/dev/sda2", "/data"},
      {"", "/dat/t", "tmpfs", "/dat"},
      {"", "/database/t", "/dev/root", "/"},
      {"", "/mnt/my disk/t", "/dev/sdb1", "/mnt/my disk"},
      // A later mount over the same directory wins.
      {"/dev/sda2 /srv ext4 rw 0 0\noverlay /srv overlay rw 0 0\n", "/srv/registry/t", "overlay",
       "/srv"},
      // Without an entry for the root the device is unknown.
      {"/dev/sda2 /data ext4 rw 0 0\n", "/home/t", "UNKNOWN", "/"},
  };
  for (const auto &one : cases) {
    if (!one.mount_table.empty()) {
      std::ofstream(mount_table) << one.mount_table;
    }
    EXPECT_EQ(sr_i_raise_filesystem_full(one.path.c_str()), SR_E_FILESYSTEM_FULL);
    EXPECT_EQ(read_last_error().text,
              "2605-016 The filesystem containing the local tree is full: mounted(" + one.device +
                  ") mounted_over(" + one.directory + ").\n")
        << one.path;
  }
  // With no mount table to read, the error is raised all the same.
  std::filesystem::remove(mount_table);
  cu_set_error_1(205, 0, "", 1, 22, "earlier error\n");
  EXPECT_EQ(sr_i_raise_filesystem_full("/data/t"), SR_E_FILESYSTEM_FULL);
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, SR_E_FILESYSTEM_FULL);
  EXPECT_EQ(error.text,
            "2605-016 The filesystem containing the local tree is full: mounted(UNKNOWN) "
            "mounted_over(UNKNOWN).\n");
  Sr_Mount_Table_Path = p_saved_path;
}

}  // namespace
