// cu_fuzz_compile.cpp - feeds arbitrary text to the expression compiler
// against a table with a column of every type. Whatever the text, the
// compiler must return a documented code, in bounded time and stack, and
// leak nothing whether it succeeds or fails.

#include <cstdint>
#include <cstdlib>
#include <string>

#include "cu_fuzz_table.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  const std::string text(reinterpret_cast<const char *>(p_data), size);
  cu_expression_t *p_expression = nullptr;
  const int32_t result = cu_comp_expr_1(text.c_str(), 0, &cu_fuzz_answer, nullptr, &p_expression);
  const bool documented =
      result == 0 || (result >= CU_RESULT_SYNTAX_ERROR && result <= CU_RESULT_BAD_VARIABLE_TYPE);
  if (!documented || (result == 0) != (p_expression != nullptr)) {
    std::abort();
  }
  cu_free_expr_1(p_expression, 0);
  return 0;
}
