/*
 * tr_test_support.h - the fixture of the trace library tests: a private
 * temporary directory whose trace file QV_TRACE_FILE names, settings reloaded
 * around each test, and a parser for the record lines the file holds.
 */
#ifndef TR_TEST_SUPPORT_H
#define TR_TEST_SUPPORT_H

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <memory>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tr_internal.h"

/* A level array that lives as long as the process, as registration requires:
 * the library keeps the pointer and rewrites the levels on every reload. */
inline unsigned char *LevelsForLife(std::size_t total, unsigned char initial = 0) {
  static std::vector<std::unique_ptr<unsigned char[]>> arrays;
  arrays.push_back(std::make_unique<unsigned char[]>(total));
  std::fill_n(arrays.back().get(), total, initial);
  return arrays.back().get();
}

/* One record line taken apart. */
struct ParsedLine {
  time_t seconds = 0;
  long pid = 0;
  long thread_id = 0;
  std::string component;
  unsigned long id = 0;
  bool has_payload = false;
  std::string payload;
};

/* Takes a line apart; fails the test when it is not in the record format
 * "YYYY-MM-DDTHH:MM:SS.uuuuuuZ pid.tid component id[ payload]", with one
 * blank between fields and numbers without leading zeros. */
inline ParsedLine ParseLine(const std::string &line) {
  static const std::regex kFields(
      R"((\d{4})-(\d\d)-(\d\d)T(\d\d):(\d\d):(\d\d)\.\d{6}Z (0|[1-9]\d*)\.(0|[1-9]\d*) (\S+) )"
      R"((0|[1-9]\d*)(?= |$))");
  std::smatch match;
  ParsedLine parsed;
  if (!std::regex_search(line, match, kFields, std::regex_constants::match_continuous)) {
    ADD_FAILURE() << "not a record line: " << line;
    return parsed;
  }
  struct tm utc = {};
  int *fields[] = {&utc.tm_year, &utc.tm_mon, &utc.tm_mday, &utc.tm_hour, &utc.tm_min, &utc.tm_sec};
  for (int at = 0; at < 6; ++at) {
    *fields[at] = std::stoi(match[at + 1]);
  }
  utc.tm_year -= 1900;
  utc.tm_mon -= 1;
  parsed.seconds = timegm(&utc);
  parsed.pid = std::stol(match[7]);
  parsed.thread_id = std::stol(match[8]);
  parsed.component = match[9];
  parsed.id = std::stoul(match[10]);
  parsed.has_payload = match.suffix().length() != 0;
  parsed.payload = parsed.has_payload ? match.suffix().str().substr(1) : "";
  return parsed;
}

class TraceFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    char directory_template[] = "/tmp/qv_tr_test.XXXXXX";
    ASSERT_NE(mkdtemp(directory_template), nullptr);
    directory_ = directory_template;
    trace_path_ = directory_ + "/trace.log";
    Settings(nullptr, nullptr);
  }

  void TearDown() override {
    unsetenv("QV_TRACE_LEVELS");
    unsetenv("QV_TRACE_DEVELOPMENT");
    unsetenv("QV_TRACE_FILE");
    tr_i_reload_settings();
    std::filesystem::remove_all(directory_);
  }

  /* Sets the environment (null unsets) and makes the library read it again. */
  void Settings(const char *p_levels, const char *p_development,
                const std::string &trace_file = "") {
    const auto set = [](const char *p_name, const char *p_value) {
      p_value ? setenv(p_name, p_value, 1) : unsetenv(p_name);
    };
    set("QV_TRACE_LEVELS", p_levels);
    set("QV_TRACE_DEVELOPMENT", p_development);
    set("QV_TRACE_FILE", trace_file.empty() ? trace_path_.c_str() : trace_file.c_str());
    tr_i_reload_settings();
  }

  /* The lines of the trace file; fails the test if the last one is open. */
  std::vector<std::string> ReadLines() const {
    std::ifstream file(trace_path_, std::ios::binary);
    const std::string text{std::istreambuf_iterator<char>(file), {}};
    EXPECT_TRUE(text.empty() || text.back() == '\n') << "the trace file ends inside a line";
    std::vector<std::string> lines;
    std::istringstream stream(text);
    for (std::string line; std::getline(stream, line);) {
      lines.push_back(line);
    }
    return lines;
  }

  std::string directory_;
  std::string trace_path_;
};

#endif /* TR_TEST_SUPPORT_H */
