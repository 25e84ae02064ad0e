// sr_x_pack_tables.cpp - sr_pack_tables_1: several open tables packed into
// one new buffer for another process. A reader of every table it packs: it
// takes their read locks (in sr_i_pack_tables), and neither the fork guard
// nor ForkMutex, since nothing of the registry changes.

#include "frame/sr_i_frame.h"
#include "packed/sr_i_packed_buffer.h"

namespace {
constexpr sr_i_entry_point_t Pack_Tables{109, false};
}

extern "C" int32_t sr_pack_tables_1(uint32_t total_tables,
                                    const sr_opaque_handle_t *p_table_handles,
                                    const uint32_t *p_uncommitted_updates_visible,
                                    const uint32_t *p_total_row_fixed_indices,
                                    const uint32_t *p_row_fixed_indices, void **p_p_buffer) {
  return sr_i_run_entry_point(Pack_Tables, [&]() -> int32_t {
    if (p_p_buffer == nullptr || (total_tables > 0 && (p_table_handles == nullptr ||
                                                       p_uncommitted_updates_visible == nullptr ||
                                                       p_total_row_fixed_indices == nullptr))) {
      return sr_i_raise(SR_E_NULL_POINTER);
    }
    return sr_i_pack_tables(total_tables, p_table_handles, p_uncommitted_updates_visible,
                            p_total_row_fixed_indices, p_row_fixed_indices, p_p_buffer);
  });
}
