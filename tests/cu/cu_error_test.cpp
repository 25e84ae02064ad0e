// Per-thread error information: formatting of inserts, catalog texts and
// their fallback, isolation between threads, clearing.

#include <gtest/gtest.h>

#include <cstdlib>
#include <string>
#include <thread>

#include "cu_i_message.h"
#include "qv_cu.h"

namespace {

struct last_error {
  int32_t code;
  int32_t message;
  std::string text;
};

last_error read_last_error() {
  cu_error_t *p_error = nullptr;
  EXPECT_EQ(cu_get_error_1(&p_error), CU_RESULT_OK);
  last_error copy{p_error->code, p_error->message, p_error->p_text};
  cu_rel_error_1(p_error);
  return copy;
}

constexpr const char *System_Call_Text =
    "2605-010 The %1$s system call unexpectedly returned an errno of %2$d to the %3$s "
    "function near line %4$d of file %5$s, version %6$s.\n";

// Points NLSPATH at the test catalogs for one test.
class catalog_path {
 public:
  explicit catalog_path(const std::string &directory) {
    setenv("NLSPATH", (directory + "/%N").c_str(), 1);
  }
  ~catalog_path() { unsetenv("NLSPATH"); }
};

TEST(ErrorInformation, PositionalInsertsAreFilledFromTheArguments) {
  EXPECT_EQ(cu_set_error_1(10, 0, "no_such_catalog.cat", 1, 1, System_Call_Text, "write", 28,
                           "sr_i_write", 212, "sr/sr_i_files", "1.2"),
            10);
  const last_error error = read_last_error();
  EXPECT_EQ(error.code, 10);
  EXPECT_EQ(error.message, 1);
  EXPECT_EQ(error.text,
            "2605-010 The write system call unexpectedly returned an errno of 28 to the "
            "sr_i_write function near line 212 of file sr/sr_i_files, version 1.2.\n");
  EXPECT_EQ(cu_get_error_1(nullptr), CU_RESULT_NULL_ARGUMENT);
  cu_rel_error_1(nullptr);  // must be harmless
}

TEST(ErrorInformation, EachThreadSeesOnlyItsOwnError) {
  cu_set_error_1(101, 0, "", 1, 8, "main thread %1$s\n", "here");
  std::string other_before;
  std::string other_after;
  std::thread other([&] {
    other_before = read_last_error().text;
    cu_set_error_1(202, 0, "", 1, 19, "other thread %1$d\n", 7);
    other_after = read_last_error().text;
  });
  other.join();
  EXPECT_EQ(other_before, "");
  EXPECT_EQ(other_after, "other thread 7\n");
  const last_error mine = read_last_error();
  EXPECT_EQ(mine.code, 101);
  EXPECT_EQ(mine.text, "main thread here\n");
}

// A thread's record goes with its other thread-local objects when it ends
// (and the main thread's before static objects and atexit handlers), while
// those may still call a library: from then on an error is reported by its
// code alone, and nothing freed is touched.
struct caller_at_thread_end {
  int32_t *p_set_result = nullptr;
  last_error *p_seen = nullptr;
  ~caller_at_thread_end() {
    *p_set_result = cu_set_error_1(12, 0, "", 1, 9, "late %1$s\n", "error");
    *p_seen = read_last_error();
    cu_set_no_error_1();
  }
};
thread_local caller_at_thread_end Caller_At_Thread_End;

TEST(ErrorInformation, CallsAfterTheThreadsRecordIsGoneReportByCodeAlone) {
  int32_t set_result = 0;
  last_error seen{-1, -1, "unset"};
  std::thread ending([&] {
    // Made before the record, so destroyed after it.
    Caller_At_Thread_End.p_set_result = &set_result;
    Caller_At_Thread_End.p_seen = &seen;
    cu_set_error_1(101, 0, "", 1, 8, "while alive\n");
  });
  ending.join();
  EXPECT_EQ(set_result, 12);
  EXPECT_EQ(seen.code, 0);
  EXPECT_EQ(seen.text, "");
}

// The catalog's text is preferred and may reorder the inserts; a faulty
// translation, a message the catalog lacks or a missing catalog give the
// default text.
TEST(ErrorInformation, CatalogTextIsPreferredUnlessFaultyOrMissing) {
  {
    catalog_path path(CU_TEST_CATALOG_DIR);
    cu_set_error_1(11, 0, "cu_test.cat", 1, 1, "default: %1$s returned %2$d\n", "iconv", -1);
    EXPECT_EQ(read_last_error().text, "CATALOG: iconv returned -1\n");
    cu_set_error_1(11, 0, "cu_test.cat", 1, 2, "default: %1$s returned %2$d\n", "iconv", 4);
    EXPECT_EQ(read_last_error().text, "CATALOG reordered: 4 came from iconv\n");
    // The translation reads argument 1 as a number where the default has a string.
    cu_set_error_1(102, 0, "cu_test.cat", 1, 3, "default path %1$s\n", "/a b");
    EXPECT_EQ(read_last_error().text, "default path /a b\n");
    // The translation names an argument the default does not have.
    cu_set_error_1(102, 0, "cu_test.cat", 1, 4, "default %1$s %2$s\n", "x", "y");
    EXPECT_EQ(read_last_error().text, "default x y\n");
    cu_set_error_1(102, 0, "cu_test.cat", 1, 9, "default only\n");
    EXPECT_EQ(read_last_error().text, "default only\n");
  }
  catalog_path path("/nonexistent-directory");
  cu_set_error_1(11, 0, "cu_test.cat", 1, 1, "default: %1$s returned %2$d\n", "iconv", 3);
  EXPECT_EQ(read_last_error().text, "default: iconv returned 3\n");
}

// The formatter through its internal seam, for shapes of text the messages
// of the registry do not have today.
std::string format(const char *p_preferred, const char *p_default, ...) {
  va_list arguments;
  va_start(arguments, p_default);
  std::string text = cu_i_format_message(p_preferred, p_default, arguments);
  va_end(arguments);
  return text;
}

TEST(MessageFormat, ConversionsLengthModifiersNullAndLongStrings) {
  EXPECT_EQ(format(nullptr, "%s=%lld (%5.1f) %u%%", "key", -5LL, 2.25, 7u), "key=-5 (  2.2) 7%");
  EXPECT_EQ(format(nullptr, "%2$s %1$llu", 18446744073709551615ULL, "max"),
            "max 18446744073709551615");
  EXPECT_EQ(format(nullptr, "[%1$s]", static_cast<const char *>(nullptr)), "[(null)]");
  const std::string long_text(2000, 'x');
  EXPECT_EQ(format(nullptr, "%1$s!", long_text.c_str()), long_text + "!");
}

// A "*" width, a gap in the positions and clashing types all make the
// argument list unknowable: the text is copied and no argument is read.
TEST(MessageFormat, UnusableDefaultTextIsCopiedWithoutReadingArguments) {
  for (const char *p_text : {"width %*d", "gap %1$s %3$s", "clash %1$s %1$d", "mixed %1$s %s"}) {
    EXPECT_EQ(format(nullptr, p_text), p_text);
  }
}

}  // namespace
