/*
 * sr_i_selection_criteria.h - selection criteria: the expansion of a
 * criteria format with the caller's replacement values into a plain
 * expression, its compilation against a table's columns, and its evaluation
 * on one row record.
 */
#ifndef SR_I_SELECTION_CRITERIA_H
#define SR_I_SELECTION_CRITERIA_H

#include <cstdarg>
#include <cstdint>

#include "qv_cu.h"
#include "tables/sr_i_table.h"

/*
 * Expands the replacement variables ($i, $l, $ui, $ul, $f, $d, $s, $b, $rh,
 * letters in either case) of `p_selection_criteria` with the values read
 * from `ap`, writing each as a literal of the expression language. The new
 * string goes to `*p_result`; the caller frees it with free. Returns 0, 109
 * (an unknown variable; the insert is the whole format) or 12, raised.
 */
int32_t sr_i_select_printf(char **p_result, const char *p_selection_criteria, va_list ap);

/*
 * Compiles expanded criteria for rows of `p_table`: variables name columns
 * (or fields of a structured-data column). The criteria are converted to the
 * tables' code set with `p_string_conversion_handle` first; without a handle
 * the call fails with 15. Returns 0 with the expression in
 * `*p_compiled_expression` (freed with cu_free_expr_1(expression, 0)), or
 * 15, or 11 naming "cu_iconv_str" or "cu_comp_expr", raised.
 */
int32_t sr_i_compile_expression(const char *p_selection_criteria, sr_i_table_t *p_table,
                                cu_expression_t **p_compiled_expression,
                                cu_iconv_t *p_string_conversion_handle);

/* The compiler's callback: resolves a variable name to a column (parent_id
 * CU_EXPR_NO_PARENT) or to a field of column `parent_id`'s structured-data
 * definition. 0 with `p_return_data` filled, or -1 for an unknown name. */
int32_t sr_i_validate_column_callback(void *p_token, const char *p_name, uint32_t length,
                                      uint32_t parent_id, cu_validate_data_t *p_return_data);

/*
 * Evaluates the expression on a row record of `p_table`. Returns 0 with
 * `*p_matches` set (the evaluator's "no match" results count as no match),
 * or 11 naming "cu_exec_expr", raised.
 */
int32_t sr_i_row_matches(const sr_i_table_t *p_table, const cu_expression_t *p_expression,
                         const void *p_record, bool *p_matches);

#endif /* SR_I_SELECTION_CRITERIA_H */
