// The commit record: its exact bytes, a round trip of the change counter
// and the application metadata, and records that do not hold together.

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "qv_sr.h"
#include "storage/sr_i_commit_record.h"

namespace {

struct container {
  sr_i_application_metadata_t *p = nullptr;
  container() { EXPECT_EQ(sr_i_allocate_application_metadata_buffer(2, &p), 0); }
  ~container() { sr_i_free_application_metadata(p); }
};

uint32_t word_at(const std::vector<unsigned char> &record, size_t offset) {
  uint32_t word;
  std::memcpy(&word, record.data() + offset, 4);
  return word;
}

TEST(CommitRecord, WithoutMetadataItIsTwentyFourBytes) {
  container empty;
  std::vector<unsigned char> record;
  ASSERT_EQ(sr_i_create_commit_record(empty.p, 0x1122334455667788ull, record), 0);
  ASSERT_EQ(record.size(), 24u);
  EXPECT_EQ(word_at(record, 0), 24u);
  EXPECT_EQ(word_at(record, 4), 0u);
  EXPECT_EQ(word_at(record, 8), 0xFFFFFFFFu);
  EXPECT_EQ(word_at(record, 12), 8u);
  uint64_t counter;
  std::memcpy(&counter, record.data() + 16, 8);
  EXPECT_EQ(counter, 0x1122334455667788ull);
}

TEST(CommitRecord, ElementsTravelWithTheirNewestValues) {
  container source;
  ASSERT_EQ(sr_i_set_application_metadata(source.p, 7, 3, "old"), 0);
  ASSERT_EQ(sr_i_commit_application_metadata_buffer_updates(source.p), 0);
  ASSERT_EQ(sr_i_set_application_metadata(source.p, 7, 5, "newer"), 0);  // applied, not committed
  ASSERT_EQ(sr_i_set_application_metadata(source.p, 2, 0, nullptr), 0);
  std::vector<unsigned char> record;
  ASSERT_EQ(sr_i_create_commit_record(source.p, 9, record), 0);
  // L = 8 + 4 + (8 + 0) + (8 + 5)
  EXPECT_EQ(word_at(record, 12), 33u);
  EXPECT_EQ(record.size(), 16u + 33u);

  container loaded;
  uint64_t counter = 0;
  ASSERT_EQ(sr_i_open_commit_record(record, loaded.p, &counter), 0);
  EXPECT_EQ(counter, 9u);
  uint32_t length = 0;
  void *p_data = nullptr;
  ASSERT_EQ(sr_i_get_application_metadata_element(loaded.p, 7, 0, &length, &p_data), 0);
  EXPECT_EQ(std::string(static_cast<char *>(p_data), length), "newer");
  std::free(p_data);
  ASSERT_EQ(sr_i_get_application_metadata_element(loaded.p, 2, 0, &length, &p_data), 0);
  EXPECT_EQ(length, 0u);
  std::free(p_data);
}

TEST(CommitRecord, RecordsThatDoNotHoldTogetherAreUnreadable) {
  container source;
  ASSERT_EQ(sr_i_set_application_metadata(source.p, 1, 4, "data"), 0);
  std::vector<unsigned char> good;
  ASSERT_EQ(sr_i_create_commit_record(source.p, 3, good), 0);

  auto with_word = [&](size_t offset, uint32_t word) {
    std::vector<unsigned char> bad = good;
    std::memcpy(bad.data() + offset, &word, 4);
    return bad;
  };
  const std::vector<std::vector<unsigned char>> hostile = {
      std::vector<unsigned char>(good.begin(), good.begin() + 20),  // shorter than a header
      std::vector<unsigned char>(good.begin(), good.end() - 1),     // lengths disagree
      with_word(12, 0xFFFFFFF0u),                                   // body length wraps
      with_word(24, 2),                                             // more elements than bytes
      with_word(32, 0xFFFFFFFFu),                                   // element past the end
      with_word(32, 1),                                             // bytes left over
  };
  for (size_t at = 0; at < hostile.size(); ++at) {
    container loaded;
    uint64_t counter = 77;
    EXPECT_EQ(sr_i_open_commit_record(hostile[at], loaded.p, &counter), SR_E_TABLE_UNREADABLE)
        << at;
    EXPECT_EQ(counter, 77u) << at;
    EXPECT_EQ(loaded.p->total_elements, 0u) << at;
  }
}

TEST(CommitRecord, ItsTypeWordNeverStraddlesADiskSector) {
  for (uint32_t offset = 0; offset < 3 * 512; ++offset) {
    const uint32_t start = offset + sr_i_commit_record_padding(offset);
    const uint32_t type_word = start + 8;
    EXPECT_EQ(type_word / 512, (type_word + 3) / 512) << offset;
  }
  EXPECT_EQ(sr_i_commit_record_padding(500), 0u);
  EXPECT_EQ(sr_i_commit_record_padding(501), 12u);
  EXPECT_EQ(sr_i_commit_record_padding(503), 12u);
  EXPECT_EQ(sr_i_commit_record_padding(504), 0u);
}

}  // namespace
