/*
 * sr_i_commit_record.h - the commit record that ends every apply of a table
 * with a file: the change counter of the state it commits and the table's
 * application metadata. Built here in its file form:
 *
 *   +0   u32 record length (16 + L)     +4  u32 0 (next offset)
 *   +8   u32 type: 0xFFFFFFFF while live, 0 once a later commit killed it
 *   +12  u32 L: 8, or 12 + the sum over elements of (8 + element length)
 *   +16  u64 change counter
 *   +24  u32 element count (only when L > 8), then per element
 *        u32 type, u32 length, the bytes
 */
#ifndef SR_I_COMMIT_RECORD_H
#define SR_I_COMMIT_RECORD_H

#include <cstdint>
#include <span>
#include <vector>

#include "schema/sr_i_application_metadata.h"

inline constexpr uint32_t Sr_Live_Commit_Record = 0xFFFFFFFFu;
inline constexpr uint32_t Sr_Empty_Commit_Record_Length = 24;

/*
 * The next commit overwrites a commit record's type word in place, and a
 * power failure can tear a write that straddles two disk sectors. A commit
 * record whose type word would cross a sector boundary is therefore put
 * behind a dead record (Sr_Commit_Record_Padding, type 0, which readers
 * skip). Returns the padding a commit record starting at `offset` needs:
 * 0 or the dead record's length.
 */
inline constexpr uint32_t Sr_Disk_Sector = 512;
inline constexpr uint32_t Sr_Commit_Record_Padding_Length = 12;
extern const uint32_t Sr_Commit_Record_Padding[3];
constexpr uint32_t sr_i_commit_record_padding(uint32_t offset) {
  const uint32_t type_word = (offset + 8) % Sr_Disk_Sector;
  return type_word + 4 > Sr_Disk_Sector ? Sr_Commit_Record_Padding_Length : 0;
}

/*
 * The commit record for `change_counter` with every element of the
 * container (its applied value, else its committed one) in `record`.
 * Returns 0 or 12 (raised).
 */
int32_t sr_i_create_commit_record(const sr_i_application_metadata_t *p_application_metadata,
                                  uint64_t change_counter, std::vector<unsigned char> &record);

/*
 * Reads a commit record: its change counter into `*p_change_counter`, and
 * its elements into the container, which has no pending change (a table
 * being loaded), as committed values. Returns 0; 14 (raised) when the
 * record's lengths or element types do not hold together, leaving the
 * container as it was; 12.
 */
int32_t sr_i_open_commit_record(std::span<const unsigned char> record,
                                sr_i_application_metadata_t *p_application_metadata,
                                uint64_t *p_change_counter);

#endif /* SR_I_COMMIT_RECORD_H */
