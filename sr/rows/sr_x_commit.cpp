// sr_x_commit.cpp - sr_commit_1: makes a table's applied changes committed.

#include "frame/sr_i_frame.h"
#include "rows/sr_i_transaction.h"

namespace {
constexpr sr_i_entry_point_t Commit{17, true};
}

extern "C" int32_t sr_commit_1(sr_opaque_handle_t table_handle) {
  return sr_i_run_entry_point(Commit, [&] {
    return sr_i_with_writable_table(table_handle,
                                    [&](sr_i_table_t *p_table) { return sr_i_commit(p_table); });
  });
}
