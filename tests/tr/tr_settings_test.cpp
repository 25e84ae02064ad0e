/*
 * tr_settings_test.cpp - QV_TRACE_LEVELS: the forms of a setting, which one
 * wins, malformed items, and the levels registration writes into a
 * component's array.
 */
#include <algorithm>

#include "tr_test_support.h"

namespace {

struct LevelCase {
  const char *p_levels;
  unsigned api, errors, wherever; /* expected levels of _SRA */
};

unsigned LevelOf(const char *p_levels, const char *p_component, const char *p_category) {
  return tr_i_level_for(tr_i_parse_level_settings(p_levels), p_component, p_category);
}

TEST(LevelSettings, FormsAndOverridesGiveEachCategoryItsLevel) {
  const LevelCase cases[] = {
      {"_SRA.API=1,_SRA.Errors=2", 1, 2, 0},
      {"_SRA=3", 3, 3, 3},
      {"*=4", 4, 4, 4},
      {"_SRA.*=9", 9, 9, 9},
      {"*.Errors=6", 0, 6, 0},
      {"*=1,_SRA.Errors=7", 1, 7, 1},
      {"_SRA.API=5,_SRA=2", 2, 2, 2},
      {"_SRA=2,_SRA.API=5", 5, 2, 2},
      {" _SRA . API = 8 ,\t_SRA.Wherever=255", 8, 0, 255},
      {"_OTHER=5,_SRAX=5", 0, 0, 0},
      {"_sra=5,_SRA.api=5", 0, 0, 0},
      {"", 0, 0, 0},
  };
  for (const LevelCase &c : cases) {
    EXPECT_EQ(LevelOf(c.p_levels, "_SRA", "API"), c.api) << c.p_levels;
    EXPECT_EQ(LevelOf(c.p_levels, "_SRA", "Errors"), c.errors) << c.p_levels;
    EXPECT_EQ(LevelOf(c.p_levels, "_SRA", "Wherever"), c.wherever) << c.p_levels;
  }
}

TEST(LevelSettings, MalformedItemIsSkippedAndTheOthersStillApply) {
  for (const char *p_bad : {"_SRA.API", "=3", ".API=3", "_SRA.=3", "_SRA.API=", "_SRA.API=x",
                            "_SRA.API=256", "_SRA.API=-1", "_SRA.API=+1", "_SRA.API=1 2",
                            "_SRA.API=1=2", "_SRA.API=99999999999999999999", "", ","}) {
    for (const std::string &levels :
         {std::string(p_bad) + ",_SRA.Errors=2", "_SRA.Errors=2," + std::string(p_bad)}) {
      EXPECT_EQ(tr_i_parse_level_settings(levels).size(), 1u) << levels;
      EXPECT_EQ(LevelOf(levels.c_str(), "_SRA", "Errors"), 2u) << levels;
      EXPECT_EQ(LevelOf(levels.c_str(), "_SRA", "API"), 0u) << levels;
    }
  }
}

using Registration = TraceFileTest;

/* The category ids are not the order of the array, and a fourth byte belongs
 * to no category: levels must go to p_levels[category_id] and nowhere else. */
const tr_category_t kCategories[] = {{2, "API"}, {0, "Errors"}, {1, "Wherever"}};

TEST_F(Registration, WritesEachCategoryLevelAtItsIdAndNothingWithoutAnArgument) {
  Settings("_REG1.API=1,_REG1.Errors=2,_REG1.Nothing=9", nullptr);
  unsigned char *levels = LevelsForLife(4, 0xee);
  EXPECT_EQ(tr_register_component_1(nullptr, levels, kCategories, 3), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_register_component_1("_REG1", nullptr, kCategories, 3), TR_RESULT_NULL_ARGUMENT);
  EXPECT_EQ(tr_register_component_1("_REG1", levels, nullptr, 3), TR_RESULT_NULL_ARGUMENT);
  EXPECT_FALSE(tr_i_component_is_registered("_REG1"));
  EXPECT_EQ(std::count(levels, levels + 4, 0xee), 4) << "levels written by a refused call";
  ASSERT_EQ(tr_register_component_1("_REG1", levels, kCategories, 3), TR_RESULT_OK);
  EXPECT_EQ(levels[2], 1);
  EXPECT_EQ(levels[0], 2);
  EXPECT_EQ(levels[1], 0);
  EXPECT_EQ(levels[3], 0xee);
}

TEST_F(Registration, EnvironmentIsReadOnceAndReloadReachesRegisteredArrays) {
  Settings("_REG2=3", nullptr);
  unsigned char *levels = LevelsForLife(3);
  ASSERT_EQ(tr_register_component_1("_REG2", levels, kCategories, 3), TR_RESULT_OK);
  const std::size_t registrations = tr_i_total_registrations();

  setenv("QV_TRACE_LEVELS", "_REG2=7", 1);
  ASSERT_EQ(tr_register_component_1("_REG2", levels, kCategories, 3), TR_RESULT_OK);
  EXPECT_EQ(levels[0], 3) << "the environment was read again without a reload";
  EXPECT_EQ(tr_i_total_registrations(), registrations) << "a repeated registration was added";

  tr_i_reload_settings();
  EXPECT_EQ(levels[0], 7);
  EXPECT_EQ(levels[1], 7);
  EXPECT_EQ(levels[2], 7);
}

}  // namespace
