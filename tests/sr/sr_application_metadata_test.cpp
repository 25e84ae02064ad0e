// Application metadata: the container keeps its elements sorted and each
// element's applied and committed values apart until commit or abort, and
// frees every block exactly once (AddressSanitizer's leak checker holds the
// tests to that); the commit record carries the container and the change
// counter, byte for byte, and refuses records that do not hold together; the
// exported get and set read and change element 0 of a table under the
// table's view and access rules.

#include <gtest/gtest.h>

#include <cstdarg>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "schema/sr_i_application_metadata.h"
#include "storage/sr_i_commit_record.h"
#include "tables/sr_i_table.h"

namespace {

constexpr uint32_t Committed_View = 0;
constexpr uint32_t Applied_View = 1;

// A container that frees itself.
using container =
    std::unique_ptr<sr_i_application_metadata_t, decltype(&sr_i_free_application_metadata)>;
container new_container(uint32_t elements = 1) {
  sr_i_application_metadata_t *p_container = nullptr;
  EXPECT_EQ(sr_i_allocate_application_metadata_buffer(elements, &p_container), 0);
  return {p_container, &sr_i_free_application_metadata};
}

// The bytes of the element in the view, or "#<code>" when the get fails.
std::string read(const sr_i_application_metadata_t *p_container, uint32_t type, uint32_t view) {
  uint32_t length = 0;
  void *p_data = nullptr;
  if (const int32_t rc =
          sr_i_get_application_metadata_element(p_container, type, view, &length, &p_data);
      rc != 0) {
    return "#" + std::to_string(rc);
  }
  std::string bytes(static_cast<const char *>(p_data), length);
  std::free(p_data);
  return bytes;
}

int32_t add(sr_i_application_metadata_t *p_container, uint32_t type, const std::string &bytes) {
  return sr_i_add_application_metadata_element(p_container, type,
                                               static_cast<uint32_t>(bytes.size()), bytes.data());
}

int32_t set_v(sr_i_application_metadata_t *p_container, uint32_t array_count, ...) {
  va_list ap;
  va_start(ap, array_count);
  const int32_t rc = sr_i_set_application_metadata_v(p_container, array_count, ap);
  va_end(ap);
  return rc;
}

std::vector<uint32_t> types_of(const sr_i_application_metadata_t *p_container) {
  std::vector<uint32_t> types;
  for (uint32_t position = 0; position < p_container->total_elements; ++position) {
    types.push_back(p_container->p_index[position].type);
  }
  return types;
}

// "committed/applied" for types 1 to 5, as read() renders them.
std::string views_of(const sr_i_application_metadata_t *p_container) {
  std::string views;
  for (uint32_t type = 1; type <= 5; ++type) {
    views += read(p_container, type, Committed_View) + "/" + read(p_container, type, Applied_View) +
             (type < 5 ? " " : "");
  }
  return views;
}

// One element in each state: 1 committed, 2 changed, 3 added, 4 deleted.
container container_in_every_state() {
  container metadata = new_container();
  for (const uint32_t type : {4u, 2u, 1u}) {
    EXPECT_EQ(add(metadata.get(), type, "c" + std::to_string(type)), 0);
  }
  sr_i_commit_application_metadata_buffer_updates(metadata.get());
  EXPECT_EQ(sr_i_set_application_metadata_element(metadata.get(), 2, 2, "a2"), 0);
  EXPECT_EQ(add(metadata.get(), 3, "a3"), 0);
  EXPECT_EQ(sr_i_delete_application_metadata_element(metadata.get(), 4), 0);
  EXPECT_EQ(views_of(metadata.get()), "c1/c1 c2/a2 #202/a3 c4/#204 #202/#202");
  return metadata;
}

TEST(MetadataContainer, CommitAndAbortSettleEveryState) {
  container committed = container_in_every_state(), aborted = container_in_every_state();
  EXPECT_EQ(sr_i_commit_application_metadata_buffer_updates(committed.get()), 0);
  EXPECT_EQ(sr_i_abort_application_metadata_buffer_updates(aborted.get()), 0);
  EXPECT_EQ(views_of(committed.get()), "c1/c1 a2/a2 a3/a3 #202/#202 #202/#202");
  EXPECT_EQ(views_of(aborted.get()), "c1/c1 c2/c2 #202/#202 c4/c4 #202/#202");
  EXPECT_EQ(committed->total_elements, 3u);
  EXPECT_EQ(aborted->total_elements, 3u);
}

TEST(MetadataContainer, AddKeepsTypesSortedAndUniqueAndDoublesTheArray) {
  container metadata = new_container();
  sr_i_application_metadata_t *p_container = metadata.get();
  for (const uint32_t type : {5u, 1u, 9u, 3u, 7u}) {
    ASSERT_EQ(add(p_container, type, std::to_string(type)), 0);
  }
  EXPECT_EQ(types_of(p_container), (std::vector<uint32_t>{1, 3, 5, 7, 9}));
  EXPECT_EQ(p_container->max_elements, 8u);
  EXPECT_EQ(add(p_container, 7, "again"), SR_E_DUPLICATE_KEY);
  ASSERT_EQ(sr_i_delete_application_metadata_element(p_container, 7), 0);
  EXPECT_EQ(add(p_container, 7, "again"), SR_E_DUPLICATE_KEY);
  EXPECT_EQ(sr_i_set_application_metadata_element(p_container, 4, 1, "x"), SR_E_NO_ROW_FOR_KEY);
  EXPECT_EQ(p_container->total_elements, 5u);
}

TEST(MetadataContainer, SetsBeforeCommitReplaceOnlyTheAppliedValue) {
  container metadata = new_container();
  sr_i_application_metadata_t *p_container = metadata.get();
  ASSERT_EQ(add(p_container, 0, "old"), 0);
  sr_i_commit_application_metadata_buffer_updates(p_container);
  const qv_binary_t *p_committed = p_container->p_index[0].p_committed;
  ASSERT_EQ(sr_i_set_application_metadata(p_container, 0, 5, "first"), 0);
  ASSERT_EQ(sr_i_set_application_metadata(p_container, 0, 6, "second"), 0);
  EXPECT_EQ(p_container->p_index[0].p_committed, p_committed);
  EXPECT_EQ(read(p_container, 0, Committed_View), "old");
  EXPECT_EQ(read(p_container, 0, Applied_View), "second");

  // The list form sets or adds each triple and returns the count, not 0.
  EXPECT_EQ(set_v(p_container, 0u), 0);
  EXPECT_EQ(set_v(p_container, 3u, 0u, 3u, "newer", 6u, 0u, nullptr, 2u, 3u, "two"), 3);
  EXPECT_EQ(types_of(p_container), (std::vector<uint32_t>{0, 2, 6}));
  EXPECT_EQ(read(p_container, 0, Applied_View) + read(p_container, 6, Applied_View), "new");

  // Visibility before type: a swap would ask for type 1, which is missing.
  uint32_t length = 0;
  void *p_data = nullptr;
  ASSERT_EQ(sr_i_get_application_metadata(p_container, Applied_View, 2, &length, &p_data), 0);
  EXPECT_EQ(std::string(static_cast<char *>(p_data), length), "two");
  std::free(p_data);
}

TEST(MetadataContainer, DuplicateCopiesTheCommittedViewAndSkipsUncommittedAdditions) {
  container source = container_in_every_state();
  sr_i_application_metadata_t *p_copy = nullptr;
  ASSERT_EQ(sr_i_duplicate_application_metadata_buffer(source.get(), &p_copy), 0);
  const container copy(p_copy, &sr_i_free_application_metadata);
  EXPECT_EQ(copy->max_elements, source->max_elements);
  source.reset();  // the copy must own its blocks
  EXPECT_EQ(views_of(copy.get()), "c1/c1 c2/c2 #202/#202 c4/c4 #202/#202");
}

// ---- The commit record ----

uint32_t word_at(const std::vector<unsigned char> &record, size_t offset) {
  uint32_t word;
  std::memcpy(&word, record.data() + offset, 4);
  return word;
}

// Without metadata the record is its 24-byte header and the counter; with
// it, each element travels with its newest value, applied or committed.
TEST(CommitRecord, ItsBytesCarryTheCounterAndTheNewestValues) {
  std::vector<unsigned char> record;
  ASSERT_EQ(sr_i_create_commit_record(new_container(2).get(), 0x1122334455667788ull, record), 0);
  ASSERT_EQ(record.size(), 24u);
  EXPECT_EQ(word_at(record, 0), 24u);
  EXPECT_EQ(word_at(record, 4), 0u);
  EXPECT_EQ(word_at(record, 8), 0xFFFFFFFFu);
  EXPECT_EQ(word_at(record, 12), 8u);
  EXPECT_EQ(word_at(record, 16) + (uint64_t{word_at(record, 20)} << 32), 0x1122334455667788ull);

  container source = new_container(2);
  ASSERT_EQ(sr_i_set_application_metadata(source.get(), 7, 3, "old"), 0);
  ASSERT_EQ(sr_i_commit_application_metadata_buffer_updates(source.get()), 0);
  ASSERT_EQ(sr_i_set_application_metadata(source.get(), 7, 5, "newer"), 0);
  ASSERT_EQ(sr_i_set_application_metadata(source.get(), 2, 0, nullptr), 0);
  ASSERT_EQ(sr_i_create_commit_record(source.get(), 9, record), 0);
  EXPECT_EQ(word_at(record, 12), 33u);  // 8 + 4 + (8 + 0) + (8 + 5)
  EXPECT_EQ(record.size(), 16u + 33u);
  container loaded = new_container(2);
  uint64_t counter = 0;
  ASSERT_EQ(sr_i_open_commit_record(record, loaded.get(), &counter), 0);
  EXPECT_EQ(counter, 9u);
  EXPECT_EQ(read(loaded.get(), 7, Committed_View), "newer");
  EXPECT_EQ(read(loaded.get(), 2, Committed_View), "");
}

TEST(CommitRecord, RecordsThatDoNotHoldTogetherAreUnreadable) {
  std::vector<unsigned char> good;
  container source = new_container(2);
  ASSERT_EQ(sr_i_set_application_metadata(source.get(), 1, 4, "data"), 0);
  ASSERT_EQ(sr_i_create_commit_record(source.get(), 3, good), 0);

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
    container loaded = new_container(2);
    uint64_t counter = 77;
    EXPECT_EQ(sr_i_open_commit_record(hostile[at], loaded.get(), &counter), SR_E_TABLE_UNREADABLE)
        << at;
    EXPECT_EQ(counter, 77u) << at;
    EXPECT_EQ(loaded->total_elements, 0u) << at;
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

// ---- The exported calls, on a table object built by hand ----

class ApplicationMetadataCalls : public ::testing::Test {
 protected:
  void SetUp() override {
    p_table_ = sr_i_create_null_table();
    ASSERT_NE(p_table_, nullptr);
    if (p_table_->p_application_metadata == nullptr) {
      ASSERT_EQ(sr_i_allocate_application_metadata_buffer(1, &p_table_->p_application_metadata), 0);
    }
    p_table_->mode = Sr_Mode_Writable;
    p_table_->implicitly_controlled = 0;
  }
  void TearDown() override {
    sr_i_free_application_metadata(p_table_->p_application_metadata);
    p_table_->p_application_metadata = nullptr;
    sr_i_close_table(p_table_);
  }

  int32_t set(const std::string &bytes) {
    auto *p_value = static_cast<qv_binary_t *>(std::malloc(sizeof(qv_binary_t) + bytes.size()));
    p_value->length = static_cast<uint32_t>(bytes.size());
    bytes.copy(reinterpret_cast<char *>(p_value->data), bytes.size());
    const int32_t rc = sr_set_application_metadata_1(p_table_, p_value);
    std::free(p_value);
    return rc;
  }
  // What the exported get returns in the view, rendered as read() does.
  std::string get(uint32_t view) {
    p_table_->uncommitted_updates_visible = view;
    qv_binary_t *p_value = nullptr;
    if (const int32_t rc = sr_get_application_metadata_1(p_table_, &p_value); rc != 0) {
      return "#" + std::to_string(rc);
    }
    std::string bytes(reinterpret_cast<char *>(p_value->data), p_value->length);
    std::free(p_value);
    return bytes;
  }

  sr_i_table_t *p_table_ = nullptr;
};

// The set is applied, not committed, on an explicitly controlled table
// (what commit and abort then do is the container's part, above), and
// committed at once on an implicitly controlled one.
TEST_F(ApplicationMetadataCalls, SetChangesTheAppliedViewOfElementZero) {
  EXPECT_EQ(get(Committed_View), "#202");
  ASSERT_EQ(set("v1"), 0);
  EXPECT_EQ(get(Committed_View), "#202");
  EXPECT_EQ(get(Applied_View), "v1");
  EXPECT_EQ(read(p_table_->p_application_metadata, 0, Applied_View), "v1");
  p_table_->implicitly_controlled = 1;
  ASSERT_EQ(set("now"), 0);
  EXPECT_EQ(get(Committed_View), "now");
}

TEST_F(ApplicationMetadataCalls, RefusalsComeInOrderAndLeaveTheTableUnchanged) {
  ASSERT_EQ(set("before"), 0);
  const qv_binary_t value{};
  qv_binary_t *p_out = nullptr;
  const struct {
    bool is_set, with_table, with_pointer;
    uint32_t mode;
    int32_t rc;
  } cases[] = {
      {false, false, false, Sr_Mode_Writable, SR_E_INVALID_HANDLE},
      {false, true, false, Sr_Mode_Writable, SR_E_NULL_POINTER},
      {true, false, false, Sr_Mode_Read_Only, SR_E_INVALID_HANDLE},
      {true, true, false, Sr_Mode_Read_Only, SR_E_NULL_POINTER},
      {true, true, true, Sr_Mode_Read_Only, SR_E_ACCESS},
  };
  for (const auto &test_case : cases) {
    p_table_->mode = test_case.mode;
    sr_opaque_handle_t handle = test_case.with_table ? p_table_ : nullptr;
    EXPECT_EQ(
        test_case.is_set
            ? sr_set_application_metadata_1(handle, test_case.with_pointer ? &value : nullptr)
            : sr_get_application_metadata_1(handle, test_case.with_pointer ? &p_out : nullptr),
        test_case.rc);
    EXPECT_EQ(get(Applied_View), "before");
  }
}

}  // namespace
