// cu_expression_entry_points.cpp - cu_comp_expr_1, cu_exec_expr_1,
// cu_exec_expr_rows_1 and cu_free_expr_1: argument checks, the text length
// limit, and the boundary that no exception crosses. The work is in the
// compiler and the evaluator.

#include <cxxabi.h>

#include <cstring>
#include <new>

#include "cu_i_expression.h"

extern "C" {

int32_t cu_comp_expr_1(const char *p_text, uint32_t flags, cu_validate_callback_t callback,
                       void *p_token, cu_expression_t **pp_expression) {
  if (pp_expression == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  *pp_expression = nullptr;
  if (p_text == nullptr || callback == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  if (flags != 0) {
    return CU_RESULT_BAD_FLAGS;
  }
  const size_t length = strnlen(p_text, CU_EXPR_MAX_TEXT_BYTES + 1);
  if (length > CU_EXPR_MAX_TEXT_BYTES) {
    return CU_RESULT_TOO_COMPLEX;
  }
  try {
    std::unique_ptr<cu_expression_t> compiled;
    const int32_t result =
        cu_i_compile_expression(std::string_view(p_text, length), callback, p_token, compiled);
    if (result == CU_RESULT_OK) {
      *pp_expression = compiled.release();
    }
    return result;
  } catch (const abi::__forced_unwind &) {
    throw;  // thread cancellation inside the callback unwinds through
  } catch (...) {
    // The compiler throws nothing of its own past its entry, and a throwing
    // callback is handled where it is called; what is left is allocation
    // (std::bad_alloc, std::length_error).
    return CU_RESULT_NO_MEMORY;
  }
}

int32_t cu_exec_expr_1(const cu_expression_t *p_expression, uint32_t mode, const void *p_values,
                       uint32_t total_values, uint32_t *p_result, const void *p_indirect) {
  if (p_result == nullptr) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  *p_result = 0;
  if (p_expression == nullptr || (p_values == nullptr && total_values != 0) ||
      (p_indirect == nullptr && p_expression->reads_indirect)) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  if (mode != CU_EXPR_MODE_ENCODED_SLOTS) {
    return CU_RESULT_BAD_MODE;
  }
  const int32_t result =
      cu_i_evaluate_encoded(*p_expression, static_cast<const unsigned char *>(p_values),
                            total_values, static_cast<const unsigned char *>(p_indirect), p_result);
  if (result != CU_RESULT_OK) {
    *p_result = 0;
  }
  return result;
}

int32_t cu_exec_expr_rows_1(const cu_expression_t *p_expression, uint32_t mode,
                            const void *p_row_pointers, uint32_t pointer_stride,
                            uint32_t total_rows, uint32_t values_offset, uint32_t total_values,
                            uint32_t indirect_offset, unsigned char *p_verdicts) {
  if (p_expression == nullptr ||
      (total_rows != 0 && (p_row_pointers == nullptr || p_verdicts == nullptr))) {
    return CU_RESULT_NULL_ARGUMENT;
  }
  if (mode != CU_EXPR_MODE_ENCODED_SLOTS) {
    return CU_RESULT_BAD_MODE;
  }
  cu_i_evaluate_rows(*p_expression, static_cast<const unsigned char *>(p_row_pointers),
                     pointer_stride, total_rows, values_offset, total_values, indirect_offset,
                     p_verdicts);
  return CU_RESULT_OK;
}

int32_t cu_free_expr_1(cu_expression_t *p_expression, uint32_t flags) {
  if (flags != 0) {
    return CU_RESULT_BAD_FLAGS;
  }
  delete p_expression;
  return CU_RESULT_OK;
}

}  // extern "C"
