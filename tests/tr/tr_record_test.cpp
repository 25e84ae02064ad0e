/*
 * tr_record_test.cpp - what each record call puts in the trace file: the
 * line format, escaping, truncation, the development-record rule, and how
 * the file is opened and what happens when it cannot be.
 */
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "tr_test_support.h"

namespace {

const tr_category_t kCategories[] = {{0, "API"}};

class TraceRecords : public TraceFileTest {
 protected:
  void SetUp() override {
    TraceFileTest::SetUp();
    ASSERT_EQ(tr_register_component_1("_REC", levels_, kCategories, 1), TR_RESULT_OK);
  }
  unsigned char *levels_ = LevelsForLife(1);
};

TEST_F(TraceRecords, EachKindWritesOneLineInTheRecordFormat) {
  /* Local time five hours off UTC shows a timestamp that is not UTC. */
  const char *p_saved_tz = getenv("TZ");
  const std::string saved_tz = p_saved_tz ? p_saved_tz : "";
  setenv("TZ", "EST+5", 1);
  tzset();
  const time_t before = time(nullptr);
  EXPECT_EQ(tr_record_id_1("_REC", 81), TR_RESULT_OK);
  EXPECT_EQ(tr_record_values_32_1("_REC", 82, 3, 0u, 206u, 0xffffffffu), TR_RESULT_OK);
  EXPECT_EQ(tr_record_strings_1("_REC", 119, 3, "/dev/sda1", nullptr, "a b"), TR_RESULT_OK);
  EXPECT_EQ(tr_record_fmt_string_1("_REC", 7, "rc=%d name=%s\n", -1, "x"), TR_RESULT_OK);
  EXPECT_EQ(tr_record_error_1("_REC", 0, "sr_i_open", 42, "sr/sr_i_open.cpp", 3), TR_RESULT_OK);
  const time_t after = time(nullptr);
  p_saved_tz ? setenv("TZ", saved_tz.c_str(), 1) : unsetenv("TZ");
  tzset();

  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 5u);
  const struct {
    unsigned long id;
    bool has_payload;
    const char *p_payload;
  } expected[] = {
      {81, false, ""},
      {82, true, "0(0x0) 206(0xce) 4294967295(0xffffffff)"},
      {119, true, "\"/dev/sda1\" (null) \"a b\""},
      {7, true, "rc=-1 name=x"},
      {0, true, "function=sr_i_open line=42 file=sr/sr_i_open.cpp flags=0x3"},
  };
  for (std::size_t index = 0; index < lines.size(); ++index) {
    const ParsedLine line = ParseLine(lines[index]);
    EXPECT_EQ(line.pid, getpid());
    EXPECT_EQ(line.thread_id, gettid());
    EXPECT_EQ(line.component, "_REC");
    EXPECT_EQ(line.id, expected[index].id);
    EXPECT_EQ(line.has_payload, expected[index].has_payload) << lines[index];
    EXPECT_EQ(line.payload, expected[index].p_payload);
    EXPECT_GE(line.seconds, before - 1) << lines[index];
    EXPECT_LE(line.seconds, after + 1) << lines[index];
  }
}

TEST_F(TraceRecords, ControlCharactersAreEscapedSoARecordStaysOneLine) {
  tr_record_strings_1("_REC", 1, 2, "a\nb\tc\"d\\e\x01", "caf\xc3\xa9");
  tr_record_fmt_string_1("_REC", 2, "x\r\ny%c", '\x7f');
  tr_record_error_1("_REC", 3, "f", 1, "dir with blank/x.cpp", 0);
  tr_record_id_1("_R EC", 4);
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_EQ(ParseLine(lines[0]).payload, R"("a\nb\tc\"d\\e\x01" "café")");
  EXPECT_EQ(ParseLine(lines[1]).payload, R"(x\r\ny\x7f)");
  EXPECT_EQ(ParseLine(lines[2]).payload,
            R"(function=f line=1 file=dir\x20with\x20blank/x.cpp flags=0x0)");
  EXPECT_EQ(ParseLine(lines[3]).component, R"(_R\x20EC)");
}

TEST_F(TraceRecords, LongPayloadIsCutAtTheLimitNeverInsideAnEscapeOrCharacter) {
  const std::string filler(TR_MAX_PAYLOAD_BYTES - 1, 'a');
  tr_record_fmt_string_1("_REC", 1, "%s", (filler + "bbbbbbbbbb").c_str());
  tr_record_fmt_string_1("_REC", 2, "%s\x01", filler.c_str());
  tr_record_strings_1("_REC", 3, 1, (filler.substr(1) + "\xc3\xa9").c_str());
  tr_record_fmt_string_1("_REC", 4, "%s", (filler + "c").c_str());
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 4u);
  EXPECT_EQ(ParseLine(lines[0]).payload, filler + "b[truncated]");
  EXPECT_EQ(ParseLine(lines[1]).payload, filler + "[truncated]");
  EXPECT_EQ(ParseLine(lines[2]).payload, "\"" + filler.substr(1) + "[truncated]");
  EXPECT_EQ(ParseLine(lines[3]).payload, filler + "c");
}

TEST_F(TraceRecords, DevelopmentRecordsAreKeptOnlyWhenAskedFor) {
  const char *settings[] = {nullptr, "0", "yes", "1"};
  for (const char *p_development : settings) {
    Settings(nullptr, p_development);
    EXPECT_EQ(
        tr_record_fmt_string_1("_REC", TR_DEVELOPMENT_RECORD_ID, "DV|RET|%.3d|%u|%d", 7, 2u, -1),
        TR_RESULT_OK);
  }
  /* The rule is for formatted records only. */
  tr_record_values_32_1("_REC", TR_DEVELOPMENT_RECORD_ID, 1, 5u);
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(ParseLine(lines[0]).payload, "DV|RET|007|2|-1");
  EXPECT_EQ(ParseLine(lines[0]).id, TR_DEVELOPMENT_RECORD_ID);
  EXPECT_EQ(ParseLine(lines[1]).payload, "5(0x5)");
}

/* A call missing an argument writes nothing; a component never registered
 * is written and reported. */
TEST_F(TraceRecords, NullArgumentsWriteNothingAndUnregisteredComponentsAreReported) {
  EXPECT_EQ(tr_record_id_1(nullptr, 1), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_record_values_32_1(nullptr, 1, 1, 1u), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_record_strings_1(nullptr, 1, 1, "s"), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_record_fmt_string_1("_REC", 1, nullptr), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_record_error_1(nullptr, 1, "f", 1, "x", 0), TR_RESULT_NULL_ARGUMENT);
  EXPECT_FALSE(std::filesystem::exists(trace_path_));
  EXPECT_EQ(tr_record_id_1("_NEVER", 9), TR_RESULT_NOT_REGISTERED);
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(ParseLine(lines[0]).component, "_NEVER");
}

TEST_F(TraceRecords, FileIsOpenedOnFirstRecordForAppendCloseOnExecMode0644) {
  EXPECT_FALSE(std::filesystem::exists(trace_path_)) << "opened before any record";
  const mode_t saved_umask = umask(0);
  EXPECT_EQ(tr_record_id_1("_REC", 1), TR_RESULT_OK);
  umask(saved_umask);
  struct stat status;
  ASSERT_EQ(stat(trace_path_.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644u);
  const int descriptor = tr_i_trace_file_descriptor();
  ASSERT_GE(descriptor, 0);
  EXPECT_TRUE(fcntl(descriptor, F_GETFD) & FD_CLOEXEC);
  EXPECT_TRUE(fcntl(descriptor, F_GETFL) & O_APPEND);

  /* Reopened, the file keeps what was there and gets the new line after it. */
  Settings(nullptr, nullptr);
  EXPECT_EQ(tr_record_id_1("_REC", 2), TR_RESULT_OK);
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(ParseLine(lines[1]).id, 2u);
}

TEST_F(TraceRecords, LostRecordsAreReportedCountedAndKeepErrno) {
  const struct {
    std::string path;
    int records;
  } failing[] = {{directory_ + "/missing/trace.log", 2}, {"/dev/full", 1}};
  for (const auto &file : failing) {
    Settings(nullptr, nullptr, file.path);
    const uint64_t lost_before = tr_i_total_lost_records();
    for (int record = 0; record < file.records; ++record) {
      errno = EBADF;
      EXPECT_EQ(tr_record_id_1("_REC", 1), TR_RESULT_WRITE_FAILED) << file.path;
      EXPECT_EQ(errno, EBADF) << file.path;
    }
    EXPECT_EQ(tr_i_total_lost_records(), lost_before + file.records) << file.path;
  }
}

TEST_F(TraceRecords, DashWritesToStandardError) {
  const int saved_stderr = dup(STDERR_FILENO);
  const int capture = open(trace_path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  ASSERT_GE(capture, 0);
  ASSERT_EQ(dup2(capture, STDERR_FILENO), STDERR_FILENO);
  Settings(nullptr, nullptr, "-");
  EXPECT_EQ(tr_record_id_1("_REC", 5), TR_RESULT_OK);
  tr_i_close_trace_file();
  dup2(saved_stderr, STDERR_FILENO);
  close(saved_stderr);
  close(capture);
  EXPECT_GE(fcntl(STDERR_FILENO, F_GETFD), 0) << "standard error was closed";
  const std::vector<std::string> lines = ReadLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(ParseLine(lines[0]).id, 5u);
}

}  // namespace
