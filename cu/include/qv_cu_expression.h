/*
 * qv_cu_expression.h - the selection expression language of libqv_cu: a
 * compiler that turns criteria text such as
 *     Age > 30 && Name =~ "^a" && "eth0" in Interfaces.Name
 * into an immutable compiled expression, and an evaluator that runs it on
 * row records whose values are still in their encoded form (8-byte slots
 * and an indirect area, as libqv_pmsg lays them out), one row per call or a
 * batch of rows per call. The language itself is described in
 * docs/expressions.md.
 *
 * Conventions for the functions below:
 *  1. They return a signed 32-bit result: 0 for success, otherwise one of
 *     the codes listed here or in qv_cu.h (CU_RESULT_NULL_ARGUMENT 1,
 *     CU_RESULT_BAD_FLAGS 4, CU_RESULT_NO_MEMORY 12). They record no
 *     per-thread error information: the code says what went wrong.
 *  2. Evaluation results 6, 7 and 8 mean "this row cannot match" and are
 *     ordinary outcomes of a well-formed expression on some row; every other
 *     non-zero evaluation result is a fault of the caller.
 *  3. A compiled expression belongs to the caller, who releases it with
 *     cu_free_expr_1. It never changes after compilation, so any number of
 *     threads may evaluate the same compiled expression at once; it must
 *     not be freed while an evaluation is running. Compiling keeps no
 *     shared state either: threads may compile at the same time.
 *  4. Compilation keeps no pointer to the text or to the token. Evaluation
 *     reads the row in place, allocates no memory of its own and keeps no
 *     pointer to the row once it returns.
 *  5. No C++ exception ever leaves these functions.
 */
#ifndef QV_CU_EXPRESSION_H
#define QV_CU_EXPRESSION_H

#include <stdint.h>

#include "qv_types.h"

#ifndef QV_CU_EXPORT
#if defined(__GNUC__)
#define QV_CU_EXPORT __attribute__((visibility("default")))
#else
#define QV_CU_EXPORT
#endif
#endif

#ifdef __cplusplus
extern "C" {
#endif

/* ---- Result codes ------------------------------------------------------ */

/* Evaluation: the mode is not one this library knows (only
 * CU_EXPR_MODE_ENCODED_SLOTS is). */
#define CU_RESULT_BAD_MODE 5

/* Evaluation, "the row cannot match": */
/* Integer division or remainder by zero, floating division by zero, a shift
 * count outside 0..63, or an integer result outside [-2^63, 2^64). */
#define CU_RESULT_ARITHMETIC_FAULT 6
/* A value is absent or not of the expected shape: a variable beyond the
 * row's slots, a structured value without the named field or whose field
 * has another type than declared, or a stored body too short for what it
 * claims to hold. */
#define CU_RESULT_VALUE_MISSING 7
/* An array index is negative or not below the array's element count. */
#define CU_RESULT_INDEX_OUT_OF_RANGE 8

/* Compilation: */
/* The text does not follow the grammar. */
#define CU_RESULT_SYNTAX_ERROR 20
/* The callback did not know a name, or the function named does not exist. */
#define CU_RESULT_UNKNOWN_NAME 21
/* Operands of types the operator cannot take (a string compared with a
 * number, a pattern on an integer), or a whole expression that is not a
 * number. */
#define CU_RESULT_TYPE_MISMATCH 22
/* A number out of range, or a quoted binary or resource-handle literal not
 * in its text form. */
#define CU_RESULT_BAD_LITERAL 23
/* The C library refused a regular expression, or it uses back-references,
 * excessive repetition, or repeats a part that can match the empty string. */
#define CU_RESULT_BAD_PATTERN 24
/* Text longer than CU_EXPR_MAX_TEXT_BYTES, nesting deeper than
 * CU_EXPR_MAX_NESTING, or an expression that would need too deep an
 * evaluation stack. */
#define CU_RESULT_TOO_COMPLEX 25
/* The callback answered a data type outside 2..22. */
#define CU_RESULT_BAD_VARIABLE_TYPE 26

/* ---- Limits ------------------------------------------------------------ */

/* The longest criteria text, in bytes, without its terminating NUL. */
#define CU_EXPR_MAX_TEXT_BYTES 65536
/* The deepest nesting of parentheses, brackets, function calls and unary
 * operators. */
#define CU_EXPR_MAX_NESTING 32

/* ---- Naming variables -------------------------------------------------- */

/* The callback's answer for one name. */
typedef struct cu_validate_data_struct_t {
  qv_data_type_t type; /* the variable's data type, 2 to 22 */
  uint32_t id;         /* a column: its slot index in the row; a field: its
                          position among the structured value's elements */
} cu_validate_data_t;

/* The parent_id that asks about a plain variable (a column). */
#define CU_EXPR_NO_PARENT 0xFFFFFFFFu

/*
 * Called by the compiler for every variable name it meets, in text order.
 *   p_token    the token given to cu_comp_expr_1, passed through untouched
 *   p_name     the name, NUL-terminated (valid only during the call)
 *   length     the name's length in bytes, without the NUL
 *   parent_id  CU_EXPR_NO_PARENT for a plain variable; otherwise the id of
 *              the structured-data variable (a QV_SD_PTR or QV_SD_PTR_ARRAY
 *              column) whose field is named
 *   p_data     receives the answer
 * Returns 0 with *p_data filled, or -1 when the name is unknown (any other
 * non-zero value, or a C++ exception thrown by the callback, is taken as -1).
 */
typedef int32_t (*cu_validate_callback_t)(void *p_token, const char *p_name, uint32_t length,
                                          uint32_t parent_id, cu_validate_data_t *p_data);

/* A compiled expression; opaque. */
typedef struct cu_expression_struct_t cu_expression_t;

/* The evaluation mode in which the variables are encoded slots of one row. */
#define CU_EXPR_MODE_ENCODED_SLOTS 16

/* ---- Functions --------------------------------------------------------- */

/*
 * Compiles criteria text (UTF-8, NUL-terminated).
 *   p_text         the text
 *   flags          0
 *   callback       resolves each variable name; called before this returns
 *   p_token        handed to the callback
 *   pp_expression  receives the compiled expression, or null on failure
 * Returns 0, CU_RESULT_NULL_ARGUMENT (a null text, callback or
 * pp_expression), CU_RESULT_BAD_FLAGS, CU_RESULT_SYNTAX_ERROR,
 * CU_RESULT_UNKNOWN_NAME, CU_RESULT_TYPE_MISMATCH, CU_RESULT_BAD_LITERAL,
 * CU_RESULT_BAD_PATTERN, CU_RESULT_TOO_COMPLEX, CU_RESULT_BAD_VARIABLE_TYPE,
 * CU_RESULT_NO_MEMORY. The first error found in text order is reported.
 * Regular expressions are compiled here, under the calling thread's locale
 * (LC_CTYPE and LC_COLLATE decide what a bracket expression matches).
 */
QV_CU_EXPORT int32_t cu_comp_expr_1(const char *p_text, uint32_t flags,
                                    cu_validate_callback_t callback, void *p_token,
                                    cu_expression_t **pp_expression);

/*
 * Evaluates a compiled expression on one row.
 *   p_expression  from cu_comp_expr_1
 *   mode          CU_EXPR_MODE_ENCODED_SLOTS: variable id i is the i-th
 *                 8-byte encoded slot at p_values (any alignment), and the
 *                 bodies of variable-length values lie in the indirect area
 *                 at the offsets their anchors give. The anchors of the
 *                 slots themselves are trusted; everything nested inside a
 *                 body is checked against that body's length.
 *   p_values      the row's first slot (may be null when total_values is 0)
 *   total_values  how many slots the row has
 *   p_result      receives 1 when the row matches, 0 when it does not; set
 *                 to 0 whenever the result is not 0
 *   p_indirect    the start of the row's indirect area; may be null when the
 *                 expression names no variable-length variable
 * Returns 0, CU_RESULT_ARITHMETIC_FAULT, CU_RESULT_VALUE_MISSING,
 * CU_RESULT_INDEX_OUT_OF_RANGE (the row cannot match), or the faults
 * CU_RESULT_NULL_ARGUMENT and CU_RESULT_BAD_MODE. Safe to call from several
 * threads at once on the same expression.
 */
QV_CU_EXPORT int32_t cu_exec_expr_1(const cu_expression_t *p_expression, uint32_t mode,
                                    const void *p_values, uint32_t total_values, uint32_t *p_result,
                                    const void *p_indirect);

/*
 * Evaluates a compiled expression on a batch of row records, giving the
 * verdicts cu_exec_expr_1 would give row by row, at a lower cost per row:
 * the arguments are checked once, and rows are read ahead.
 *   p_expression     from cu_comp_expr_1
 *   mode             CU_EXPR_MODE_ENCODED_SLOTS, as for cu_exec_expr_1
 *   p_row_pointers   the first of total_rows row pointers (const void *,
 *                    at any alignment); the i-th lies i * pointer_stride
 *                    bytes after it, so the pointers may be a plain array
 *                    (stride sizeof(void *)) or a member of an array of
 *                    structures (stride the structure's size). A null row
 *                    pointer is a row that does not match.
 *   pointer_stride   the bytes from one row pointer to the next
 *   total_rows       how many rows; 0 does nothing
 *   values_offset    a row's first 8-byte slot lies this many bytes after
 *                    its pointer
 *   total_values     how many slots each row has
 *   indirect_offset  a row's indirect area starts this many bytes after its
 *                    pointer
 *   p_verdicts       receives total_rows bytes: 1 for a row that matches,
 *                    0 for one that does not, including a row for which
 *                    cu_exec_expr_1 would return CU_RESULT_ARITHMETIC_FAULT,
 *                    CU_RESULT_VALUE_MISSING or CU_RESULT_INDEX_OUT_OF_RANGE
 * Returns 0, or, with nothing written, CU_RESULT_NULL_ARGUMENT (a null
 * expression, or a null p_row_pointers or p_verdicts with total_rows above
 * 0) or CU_RESULT_BAD_MODE. Safe to call from several threads at once on
 * the same expression.
 */
QV_CU_EXPORT int32_t cu_exec_expr_rows_1(const cu_expression_t *p_expression, uint32_t mode,
                                         const void *p_row_pointers, uint32_t pointer_stride,
                                         uint32_t total_rows, uint32_t values_offset,
                                         uint32_t total_values, uint32_t indirect_offset,
                                         unsigned char *p_verdicts);

/*
 * Releases a compiled expression; a null pointer is ignored.
 *   flags  0; with any other value nothing is released
 * Returns 0 or CU_RESULT_BAD_FLAGS.
 */
QV_CU_EXPORT int32_t cu_free_expr_1(cu_expression_t *p_expression, uint32_t flags);

#ifdef __cplusplus
}
#endif

#endif /* QV_CU_EXPRESSION_H */
