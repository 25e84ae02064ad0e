// With the "_SRA" levels switched on through the environment, the frame
// writes entry and exit records and the raising code an error record. The
// environment is set before main, as a user would set it before starting a
// program: the trace library reads it at the first registration.

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <sstream>
#include <string>

#include "qv_sr.h"

namespace {

const std::string Trace_File = "/tmp/sr_trace_on_" + std::to_string(getpid()) + ".log";
const bool Environment_Set = [] {
  setenv("QV_TRACE_LEVELS", "_SRA=1", 1);
  setenv("QV_TRACE_FILE", Trace_File.c_str(), 1);
  return true;
}();

std::string trace_text() {
  std::ifstream file(Trace_File);
  std::stringstream text;
  text << file.rdbuf();
  return text.str();
}

bool has_record(const std::string &text, const std::string &record) {
  return text.find(" _SRA " + record) != std::string::npos;
}

TEST(TraceOn, EntryExitAndErrorRecordsAreWritten) {
  ASSERT_TRUE(Environment_Set);
  sr_opaque_handle_t tree = nullptr;
  ASSERT_EQ(sr_open_tree_1(&tree, 0, 0), 0);
  ASSERT_EQ(sr_close_tree_1(tree), 0);
  ASSERT_EQ(sr_close_tree_1(nullptr), SR_E_INVALID_HANDLE);
  const std::string text = trace_text();
  std::remove(Trace_File.c_str());
  // The first open registers the component after its entry record would have
  // been written, so its exit record is the first one.
  EXPECT_TRUE(has_record(text, "82 ")) << text;
  EXPECT_TRUE(has_record(text, "15")) << text;
  EXPECT_TRUE(has_record(text, "16 ")) << text;
  EXPECT_NE(text.find("sr_close_tree_1"), std::string::npos) << text;  // the error record
  EXPECT_NE(text.find("sr/frame/sr_x_close_tree"), std::string::npos) << text;
}

}  // namespace
