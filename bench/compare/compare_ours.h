// compare_ours.h - what the rest of the comparison borrows from our side: the
// loaded tables of the read workloads, so that the record floor walks the
// very records our selection reads, the same table unpacked, whose records
// the index floor indexes again, and our read of a whole table, which the
// shipping floor does after its copy.
#ifndef COMPARE_OURS_H
#define COMPARE_OURS_H

#include <cstdint>

#include "qv_sr.h"

namespace compare {

// The column positions of the comparison's table, in the order it is made.
inline constexpr uint32_t Count_Column = 1;
inline constexpr uint32_t Note_Column = 4;

// The transient table of `rows` rows (0 .. rows-1, committed) that the read
// workloads share, loaded on first use and kept for the whole run; null when
// it could not be loaded.
sr_opaque_handle_t loaded_transient_table(int64_t rows);

// The table loaded_transient_table(rows) makes, packed and unpacked into a
// tree of its own (keyed through the same hash), kept for the whole run;
// null when it could not be made.
sr_opaque_handle_t unpacked_transient_table(int64_t rows);

// Reads every column of every row of `table` by packed index, as a program
// reading a whole table does (strings copied out and freed). False when a
// read fails or `rows` rows are not there.
bool read_every_value(sr_opaque_handle_t table, uint32_t rows);

}  // namespace compare

#endif  // COMPARE_OURS_H
