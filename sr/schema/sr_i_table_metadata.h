/*
 * sr_i_table_metadata.h - the description of an open table that
 * sr_get_table_metadata_1 hands out, also what a schema change starts from:
 * the column definitions as a caller would give them, defaults decoded.
 */
#ifndef SR_I_TABLE_METADATA_H
#define SR_I_TABLE_METADATA_H

#include <cstdint>

#include "qv_sr.h"
#include "tables/sr_i_table.h"

/*
 * A new description of `p_table` in `*p_p_metadata`. `all_metadata` 0: no
 * column definitions; -1: every column; any other value: the columns not
 * qualified SR_INVISIBLE. Rows are counted in the view the table's setting
 * shows. Returns 0, 12, or 11 when a default cannot be decoded (raised).
 */
int32_t sr_i_get_table_metadata(const sr_i_table_t *p_table, int32_t all_metadata,
                                sr_table_metadata_t **p_p_metadata);

/* Frees a description and everything it holds. */
void sr_i_free_table_metadata(sr_table_metadata_t *p_metadata);

#endif /* SR_I_TABLE_METADATA_H */
