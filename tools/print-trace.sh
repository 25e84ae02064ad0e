#!/bin/sh
# print-trace.sh - prints trace files of the registry with names: each
# record of the component "_SRA" gets, after its identifier, the exported
# function it enters or leaves (and the name of the code it returned), or
# the kind of record it is. Other lines are printed as they are.
#   tools/print-trace.sh [FILE...]      (standard input without a file)
# The identifiers are those of docs/tracing.md; the test
# tests/tools/check_print_trace.sh keeps this table in step with the sources.
exec awk '
BEGIN {
  # Entry record identifiers; the exit record of each is the next number.
  call[1] = "sr_abort_1"
  call[3] = "sr_add_columns_1"
  call[5] = "sr_add_row_1"
  call[7] = "sr_apply_1"
  call[9] = "sr_change_column_name_1"
  call[11] = "sr_change_default_value_1"
  call[13] = "sr_close_table_1"
  call[15] = "sr_close_tree_1"
  call[17] = "sr_commit_1"
  call[19] = "sr_copy_table_by_handle_1"
  call[21] = "sr_copy_table_by_name_1"
  call[23] = "sr_create_table_1"
  call[25] = "sr_create_hashed_key_table_1"
  call[27] = "sr_delete_columns_1"
  call[29] = "sr_delete_row_by_index_1"
  call[31] = "sr_delete_rows_1"
  call[33] = "sr_delete_table_1"
  call[35] = "sr_free_table_list_1"
  call[37] = "sr_free_table_metadata_1"
  call[39] = "sr_get_application_metadata_1"
  call[41] = "sr_get_duplicate_rows_1"
  call[43] = "sr_get_field_by_fixed_index_and_visibility_1"
  call[45] = "sr_get_field_by_index_1"
  call[47] = "sr_get_field_by_index_and_visibility_1"
  call[49] = "sr_get_field_by_key_1"
  call[51] = "sr_get_field_by_key_and_visibility_1"
  call[53] = "sr_get_fields_by_fixed_index_and_visibility_1"
  call[55] = "sr_get_fields_by_index_1"
  call[57] = "sr_get_fields_by_index_and_visibility_1"
  call[59] = "sr_get_fields_by_key_1"
  call[61] = "sr_get_fields_by_key_and_visibility_1"
  call[63] = "sr_get_selected_rows_v_1"
  call[65] = "sr_get_table_metadata_1"
  call[67] = "sr_get_updated_rows_1"
  call[69] = "sr_list_tables_1"
  call[71] = "sr_mount_local_tree_1"
  call[73] = "sr_move_table_by_handle_1"
  call[75] = "sr_move_table_by_name_1"
  call[77] = "sr_open_table_1 or sr_i_open_table_vorel_format"
  call[79] = "sr_open_hashed_key_table_1"
  call[81] = "sr_open_tree_1"
  call[83] = "sr_overlay_memory_column_qualifier_1"
  call[85] = "sr_overlay_memory_default_value_1"
  call[87] = "sr_repair_tables_1"
  call[89] = "sr_select_1"
  call[91] = "sr_set_application_metadata_1"
  call[93] = "sr_set_field_by_fixed_index_1"
  call[95] = "sr_set_field_by_index_1"
  call[97] = "sr_set_field_by_key_1"
  call[99] = "sr_set_fields_by_fixed_index_1"
  call[101] = "sr_set_fields_by_index_1"
  call[103] = "sr_set_fields_by_key_1"
  call[105] = "sr_unmount_local_tree_1"
  call[107] = "sr_get_fixed_row_index_for_key_1"
  call[109] = "sr_pack_tables_1"
  call[111] = "sr_unpack_table_1"
  call[113] = "sr_get_total_packed_tables_1"
  call[115] = "sr_get_packed_table_name_1"
  call[117] = "sr_convert_packed_table_buffer_1"
  call[121] = "sr_i_get_directory_list_compat"
  call[123] = "sr_i_free_directory_list_compat"
  call[125] = "sr_i_create_directory_compat"
  call[127] = "sr_i_delete_directory_compat"
  call[141] = "sr_i_dump_table"
  call[143] = "sr_i_dump_tree"
  # Return codes (qv_sr.h).
  code[10] = "SR_E_SYSTEM_CALL"
  code[11] = "SR_E_LIBRARY_CALL"
  code[12] = "SR_E_NO_MEMORY"
  code[13] = "SR_E_TREE_FULL"
  code[14] = "SR_E_TABLE_UNREADABLE"
  code[15] = "SR_E_INTERNAL"
  code[16] = "SR_E_FILESYSTEM_FULL"
  code[100] = "SR_E_INVALID_HANDLE"
  code[101] = "SR_E_NULL_POINTER"
  code[102] = "SR_E_INVALID_PATH"
  code[103] = "SR_E_INVALID_MODE"
  code[104] = "SR_E_NO_COLUMNS"
  code[105] = "SR_E_INVALID_COLUMN"
  code[106] = "SR_E_DUPLICATE_COLUMN"
  code[107] = "SR_E_KEY_EXPECTED"
  code[108] = "SR_E_DUPLICATE_KEY"
  code[109] = "SR_E_INVALID_CRITERIA"
  code[200] = "SR_E_NO_TABLE"
  code[201] = "SR_E_TABLE_EXISTS"
  code[202] = "SR_E_NO_ROW_FOR_KEY"
  code[203] = "SR_E_NO_ROW_FOR_INDEX"
  code[204] = "SR_E_ROW_DELETED"
  code[205] = "SR_E_NO_ROWS"
  code[206] = "SR_E_ACCESS"
  code[207] = "SR_E_MOUNT_POINT_EXISTS"
  code[208] = "SR_E_NO_MOUNT_POINT"
  code[209] = "SR_E_UNCOMMITTED"
  code[210] = "SR_E_NOT_APPLIED"
  code[211] = "SR_E_EXCLUSIVE_MODES"
  code[212] = "SR_E_APPLIED_UNCOMMITTED"
  code[213] = "SR_E_NO_REPLACED_ROW"
  code[214] = "SR_E_NO_DELETED_ROW"
  code[215] = "SR_E_NO_COMMIT_RECORD"
}

# A record: <time> <pid>.<thread> <component> <identifier>[ <payload>]
$3 == "_SRA" && match($0, /^[^ ]+ [^ ]+ [^ ]+ [0-9]+/) {
  head = substr($0, 1, RLENGTH)
  payload = substr($0, RLENGTH + 2)
  id = $4
  if (id == 0) {
    print head " error raised: " payload
  } else if (id == 119) {
    print head " filesystem full (device, directory): " payload
  } else if (id == 120) {
    print head " key not found (key, table): " payload
  } else if (id == 4294967295) {
    print head " development: " payload
  } else if (id in call) {
    print head " " call[id] " called"
  } else if ((id - 1) in call) {
    returned = payload
    sub(/\(.*/, "", returned)
    if (returned == 0) {
      print head " " call[id - 1] " returned 0"
    } else {
      print head " " call[id - 1] " returned " returned " " \
            ((returned in code) ? code[returned] : "(unknown code)")
    }
  } else {
    print
  }
  next
}
{ print }
' "$@"
