/*
 * tr_concurrency_test.cpp - many writers on one trace file: threads and
 * processes produce whole lines, none lost and each writer's in its order;
 * racing first records open the file once; racing registrations are harmless
 * to the threads reading the levels.
 */
#include <sys/wait.h>

#include <atomic>
#include <latch>
#include <map>
#include <thread>

#include "tr_test_support.h"

namespace {

constexpr unsigned kWriters = 8;
constexpr unsigned kRecordsPerWriter = 1000;

const tr_category_t kCategories[] = {{0, "API"}, {1, "Errors"}};

/* Long lines make a torn or interleaved write likely to show. */
void WriteRecords(unsigned writer) {
  const std::string padding(300, 'p');
  for (unsigned sequence = 0; sequence < kRecordsPerWriter; ++sequence) {
    ASSERT_EQ(tr_record_fmt_string_1("_CON", 3, "w=%u n=%u %s", writer, sequence, padding.c_str()),
              TR_RESULT_OK);
  }
}

/* Every line whole, and every writer's records all there and in order. */
void CheckWritersLines(const std::vector<std::string> &lines) {
  EXPECT_EQ(lines.size(), kWriters * kRecordsPerWriter);
  std::map<unsigned, unsigned> next_sequence;
  for (const std::string &text : lines) {
    unsigned writer = 0, sequence = 0;
    char rest[400] = {};
    const bool whole =
        sscanf(ParseLine(text).payload.c_str(), "w=%u n=%u %399s", &writer, &sequence, rest) == 3 &&
        rest == std::string(300, 'p');
    EXPECT_TRUE(whole) << "torn or mixed line: " << text;
    EXPECT_TRUE(!whole || sequence == next_sequence[writer]++) << "out of order: " << text;
  }
  for (unsigned writer = 0; writer < kWriters; ++writer) {
    EXPECT_EQ(next_sequence[writer], kRecordsPerWriter) << "writer " << writer;
  }
}

/* Descriptors of this process open on `path`. */
int DescriptorsOn(const std::filesystem::path &path) {
  int total = 0;
  for (const auto &entry : std::filesystem::directory_iterator("/proc/self/fd")) {
    std::error_code error;
    total += std::filesystem::read_symlink(entry.path(), error) == path ? 1 : 0;
  }
  return total;
}

class TraceConcurrency : public TraceFileTest {
 protected:
  void SetUp() override {
    TraceFileTest::SetUp();
    ASSERT_EQ(tr_register_component_1("_CON", levels_, kCategories, 2), TR_RESULT_OK);
  }
  unsigned char *levels_ = LevelsForLife(2);
};

TEST_F(TraceConcurrency, ThreadsStartingTogetherOpenOnceAndWriteWholeLines) {
  std::latch start(kWriters);
  std::vector<std::thread> threads;
  for (unsigned writer = 0; writer < kWriters; ++writer) {
    threads.emplace_back([&start, writer] {
      start.arrive_and_wait();
      WriteRecords(writer);
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  EXPECT_EQ(DescriptorsOn(std::filesystem::canonical(trace_path_)), 1);
  CheckWritersLines(ReadLines());
}

TEST_F(TraceConcurrency, ProcessesAppendWholeLinesToOneFile) {
  std::vector<pid_t> children;
  for (unsigned writer = 0; writer < kWriters; ++writer) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      WriteRecords(writer);
      _exit(::testing::Test::HasFailure() ? 1 : 0);
    }
    children.push_back(child);
  }
  for (const pid_t child : children) {
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  CheckWritersLines(ReadLines());
}

TEST_F(TraceConcurrency, RacingRegistrationsWriteLevelsReadersCanLoadFreely) {
  Settings("_RACE.API=4,_RACE.Errors=6", nullptr);
  unsigned char *shared_levels = LevelsForLife(2);
  unsigned char *own_levels[kWriters];
  for (unsigned char *&levels : own_levels) {
    levels = LevelsForLife(2);
  }
  const std::size_t registrations_before = tr_i_total_registrations();
  std::atomic<bool> registering{true};
  std::latch start(kWriters + 1);
  std::thread reader([&] {
    start.arrive_and_wait();
    while (registering.load()) {
      const unsigned level = __atomic_load_n(&shared_levels[0], __ATOMIC_RELAXED);
      ASSERT_TRUE(level == 0 || level == 4) << level;
    }
  });
  std::vector<std::thread> threads;
  for (unsigned writer = 0; writer < kWriters; ++writer) {
    threads.emplace_back([&, writer] {
      start.arrive_and_wait();
      for (int round = 0; round < 100; ++round) {
        ASSERT_EQ(tr_register_component_1("_RACE", shared_levels, kCategories, 2), 0);
        ASSERT_EQ(tr_register_component_1("_RACE", own_levels[writer], kCategories, 2), 0);
      }
    });
  }
  for (std::thread &thread : threads) {
    thread.join();
  }
  registering = false;
  reader.join();
  EXPECT_EQ(shared_levels[0], 4);
  EXPECT_EQ(shared_levels[1], 6);
  for (unsigned writer = 0; writer < kWriters; ++writer) {
    EXPECT_EQ(own_levels[writer][0], 4);
    EXPECT_EQ(own_levels[writer][1], 6);
  }
  /* One entry for the shared array and one for each writer's own array. */
  EXPECT_EQ(tr_i_total_registrations(), registrations_before + 1 + kWriters);
}

}  // namespace
