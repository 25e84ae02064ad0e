// With no trace level set, the registry makes no trace record at all: the
// trace file named in the environment is never created, even by failing
// calls.

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "qv_sr.h"

namespace {

const std::string Trace_File = "/tmp/sr_trace_off_" + std::to_string(getpid()) + ".log";
const bool Environment_Set = [] {
  unsetenv("QV_TRACE_LEVELS");
  setenv("QV_TRACE_FILE", Trace_File.c_str(), 1);
  setenv("QV_TRACE_DEVELOPMENT", "1", 1);
  return true;
}();

TEST(TraceOff, NoRecordIsWrittenWhenNoLevelIsSet) {
  ASSERT_TRUE(Environment_Set);
  sr_opaque_handle_t tree = nullptr;
  ASSERT_EQ(sr_open_tree_1(&tree, 0, 0), 0);
  ASSERT_EQ(sr_close_tree_1(tree), 0);
  ASSERT_EQ(sr_close_tree_1(nullptr), SR_E_INVALID_HANDLE);
  ASSERT_EQ(sr_open_tree_1(nullptr, 0, 0), SR_E_INVALID_HANDLE);
  EXPECT_FALSE(std::filesystem::exists(Trace_File));
}

}  // namespace
