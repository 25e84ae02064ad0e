/*
 * sr_i_selection_criteria.h - selection criteria: the expansion of a
 * criteria format with the caller's replacement values into a plain
 * expression, its compilation against a table's columns, and its evaluation
 * on one row record or on a run of the fixed index's entries.
 */
#ifndef SR_I_SELECTION_CRITERIA_H
#define SR_I_SELECTION_CRITERIA_H

#include <cstdarg>
#include <cstdint>
#include <cstdlib>
#include <memory>

#include "qv_cu.h"
#include "rows/sr_i_rows.h"
#include "tables/sr_i_table.h"

/*
 * Expands the replacement variables ($i, $l, $ui, $ul, $f, $d, $s, $b, $rh,
 * letters in either case) of `p_selection_criteria` with the values read
 * from `ap`, writing each as a literal of the expression language. The new
 * string goes to `*p_result`; the caller frees it with free. Returns 0, 109
 * (an unknown variable; the insert is the whole format) or 12, raised.
 */
int32_t sr_i_select_printf(char **p_result, const char *p_selection_criteria, va_list ap);

/* Expanded criteria, released with free. */
struct sr_i_free_string {
  void operator()(char *p_string) const { std::free(p_string); }
};
using sr_i_expanded_criteria = std::unique_ptr<char, sr_i_free_string>;

/* sr_i_select_printf into `expanded`; null criteria stay null. */
int32_t sr_i_expand_criteria(const char *p_selection_criteria, va_list ap,
                             sr_i_expanded_criteria &expanded);

/*
 * Compiles expanded criteria for rows of `p_table`: variables name columns
 * (or fields of a structured-data column). The criteria are converted to the
 * tables' code set with `p_string_conversion_handle` first; without a handle
 * the call fails with 15. Returns 0 with the expression in
 * `*p_compiled_expression` (freed with cu_free_expr_1(expression, 0)), or
 * 15, 12, or 11 naming "cu_iconv_str" or "cu_comp_expr", raised.
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
 * What an evaluation that did not return 0 means: the evaluator's "no
 * match" results (an arithmetic fault, a missing value, an index out of
 * range) give 0 with `*p_matches` false, any other 11 naming
 * "cu_exec_expr", raised.
 */
int32_t sr_i_evaluation_failure(int32_t evaluation_result, bool *p_matches);

/*
 * Evaluates the expression on a row record of `p_table`. Returns 0 with
 * `*p_matches` set (the evaluator's "no match" results count as no match),
 * or 11 naming "cu_exec_expr", raised. Inline: a selection calls it once per
 * row.
 */
inline int32_t sr_i_row_matches(const sr_i_table_t *p_table, const cu_expression_t *p_expression,
                                const void *p_record, bool *p_matches) {
  uint32_t result = 0;
  const int32_t rc =
      cu_exec_expr_1(p_expression, CU_EXPR_MODE_ENCODED_SLOTS, sr_i_row_slot(p_record, 0),
                     p_table->total_columns, &result, sr_i_row_variable_part(p_table, p_record));
  if (rc != 0) {
    return sr_i_evaluation_failure(rc, p_matches);
  }
  *p_matches = result != 0;
  return 0;
}

/*
 * Criteria compiled for one table, freed with the object: the expression
 * of `compile` (null criteria compile to no expression, which every row
 * matches), then `matches` per row record.
 */
class sr_i_table_criteria {
 public:
  sr_i_table_criteria() = default;
  ~sr_i_table_criteria();
  sr_i_table_criteria(const sr_i_table_criteria &) = delete;
  sr_i_table_criteria &operator=(const sr_i_table_criteria &) = delete;

  /* Compiles expanded `p_criteria` (or null) against `p_table`'s columns,
   * strings converted with its tree's conversion handle. Returns 0, or the
   * raised code of sr_i_compile_expression. */
  int32_t compile(sr_i_table_t *p_table, const char *p_criteria);

  /* Verdicts for `total` consecutive entries of the table's fixed index,
   * judged on their applied records (`applied`) or on their committed ones:
   * 1 for a record that matches, 0 for one that does not and for an entry
   * without that record. Without criteria every entry gets 1. One call of
   * the evaluator judges them all. Returns 0 or 11 (raised). */
  int32_t judge(const sr_i_table_t *p_table, const sr_i_index_entry_t *p_entries, uint32_t total,
                bool applied, unsigned char *p_verdicts) const;

  /* Whether a row record of the table matches: 0 with `*p_matches` set, or
   * 11 (raised). */
  int32_t matches(const sr_i_table_t *p_table, const void *p_record, bool *p_matches) const {
    if (p_expression_ == nullptr) {
      *p_matches = true;
      return 0;
    }
    return sr_i_row_matches(p_table, p_expression_, p_record, p_matches);
  }

 private:
  cu_expression_t *p_expression_ = nullptr;
};

#endif /* SR_I_SELECTION_CRITERIA_H */
