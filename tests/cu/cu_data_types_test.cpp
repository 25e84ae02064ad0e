// The data-type property table, the shared empty values and the order of
// resource handles.

#include <gtest/gtest.h>

#include <algorithm>
#include <vector>

#include "qv_cu.h"

namespace {

TEST(DataTypes, ExactlyTypes8To22AreVariableLength) {
  for (int type = 0; type < QV_DATA_TYPE_LIMIT; ++type) {
    const bool variable = (cu_dtc_table_1[type] & CU_DTC_POINTER) != 0;
    EXPECT_EQ(variable, type >= QV_CHAR_PTR && type <= QV_SD_PTR_ARRAY) << "type " << type;
    const bool valid = (cu_dtc_table_1[type] & CU_DTC_VALID) != 0;
    EXPECT_EQ(valid, type >= QV_INT32) << "type " << type;
  }
}

TEST(DataTypes, SharedEmptyValuesAreEmpty) {
  EXPECT_STREQ(cu_ptr_empty_char_1, "");
  EXPECT_EQ(cu_ptr_empty_binary_1->length, 0u);
  EXPECT_EQ(cu_ptr_empty_sd_1->element_count, 0u);
  EXPECT_EQ(cu_ptr_empty_array_1->element_count, 0u);
  EXPECT_EQ(cu_ptr_invld_rsrc_hndl_1->header, 0xFFFFFFFFu);
  EXPECT_EQ(cu_ptr_invld_rsrc_hndl_1->id.id4, 0xFFFFFFFFu);
}

qv_resource_handle_t handle(uint32_t header, uint32_t id1, uint32_t id2, uint32_t id3,
                            uint32_t id4) {
  return qv_resource_handle_t{header, {id1, id2, id3, id4}};
}

TEST(ResourceHandleOrder, IsATotalOrderOverAllFiveWordsWithNullFirst) {
  std::vector<qv_resource_handle_t> handles = {
      handle(0, 0, 0, 0, 1),           handle(1, 0, 0, 0, 0), handle(0, 0, 0, 0, 0),
      handle(0, 0x80000000u, 0, 0, 0), handle(0, 1, 0, 0, 0), handle(2, 0, 0, 1, 0),
      handle(0, 0, 1, 0, 0),           handle(5, 0, 0, 0, 1)};
  std::sort(handles.begin(), handles.end(), [](const auto &left, const auto &right) {
    return cu_rsrc_hndl_cmp_1(&left, &right) < 0;
  });
  // The identity words decide before the header, each compared as unsigned.
  const std::vector<qv_resource_handle_t> expected = {
      handle(0, 0, 0, 0, 0), handle(1, 0, 0, 0, 0),          handle(0, 0, 0, 0, 1),
      handle(5, 0, 0, 0, 1), handle(2, 0, 0, 1, 0),          handle(0, 0, 1, 0, 0),
      handle(0, 1, 0, 0, 0), handle(0, 0x80000000u, 0, 0, 0)};
  for (size_t at = 0; at < expected.size(); ++at) {
    EXPECT_EQ(cu_rsrc_hndl_cmp_1(&handles[at], &expected[at]), 0) << "position " << at;
  }
  for (size_t at = 0; at + 1 < handles.size(); ++at) {
    EXPECT_EQ(cu_rsrc_hndl_cmp_1(&handles[at], &handles[at + 1]), -1);
    EXPECT_EQ(cu_rsrc_hndl_cmp_1(&handles[at + 1], &handles[at]), 1);
  }
  // A null handle sorts first.
  EXPECT_EQ(cu_rsrc_hndl_cmp_1(nullptr, &handles[0]), -1);
  EXPECT_EQ(cu_rsrc_hndl_cmp_1(&handles[0], nullptr), 1);
  EXPECT_EQ(cu_rsrc_hndl_cmp_1(nullptr, nullptr), 0);
}

}  // namespace
