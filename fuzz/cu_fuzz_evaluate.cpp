// cu_fuzz_evaluate.cpp - compiles the input's text (up to its first NUL)
// and evaluates it on a fixed encoded row. Bytes after the NUL overwrite
// the row's variable part from its start, so that damaged bodies are tried
// too; the slots, which the registry vouches for, are left alone. The
// evaluator must only answer 0 (with a result of 0 or 1), 6, 7 or 8, and the
// same answer twice.

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string>

#include "cu_fuzz_table.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  static const cu_fuzz_row Pristine;
  const auto *p_end = static_cast<const uint8_t *>(std::memchr(p_data, 0, size));
  const size_t text_size = p_end == nullptr ? size : static_cast<size_t>(p_end - p_data);
  const std::string text(reinterpret_cast<const char *>(p_data), text_size);
  cu_expression_t *p_expression = nullptr;
  if (cu_comp_expr_1(text.c_str(), 0, &cu_fuzz_answer, nullptr, &p_expression) != 0) {
    return 0;
  }
  // A block of exactly the area's size, so that a read past it is reported.
  const size_t area_size = Pristine.indirect.size();
  std::unique_ptr<unsigned char[]> area(new unsigned char[area_size]);
  std::memcpy(area.get(), Pristine.indirect.data(), area_size);
  if (p_end != nullptr) {
    const size_t damage = std::min(area_size, size - text_size - 1);
    std::memcpy(area.get(), p_end + 1, damage);
  }
  uint32_t results[2] = {};
  int32_t codes[2] = {};
  for (int attempt = 0; attempt < 2; ++attempt) {
    codes[attempt] =
        cu_exec_expr_1(p_expression, CU_EXPR_MODE_ENCODED_SLOTS, Pristine.record.data() + 4,
                       Cu_Fuzz_Total_Slots, &results[attempt], area.get());
  }
  cu_free_expr_1(p_expression, 0);
  const bool allowed = codes[0] == 0 || codes[0] == CU_RESULT_ARITHMETIC_FAULT ||
                       codes[0] == CU_RESULT_VALUE_MISSING ||
                       codes[0] == CU_RESULT_INDEX_OUT_OF_RANGE;
  if (!allowed || results[0] > 1 || codes[0] != codes[1] || results[0] != results[1]) {
    std::abort();
  }
  return 0;
}
