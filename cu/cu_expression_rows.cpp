// cu_expression_rows.cpp - judging rows: one row, or a batch of rows given
// by their pointers, by a program's fused tests when it has them
// (cu_expression_fusion.cpp made them) and by the stack machine otherwise.
//
// A batch exists so that what is the same for every row is done once per
// batch: the caller's argument checks, the library call, and the choice
// between fused tests and the stack machine. Rows are records placed
// wherever their pool put them, so while one row is judged the slot the
// program reads first is asked for some rows ahead.

#include <cstring>

#include "cu_i_encoded_values.h"
#include "cu_i_expression.h"

namespace {

// How many rows ahead of the one being judged a batch asks for a row's
// slot to be brought into the cache (8 and 16 were slower over a table of
// 100,000 rows in the cache, and over one of 1,000,000 that is not).
constexpr uint32_t Prefetch_Distance = 32;

// The C operators on doubles treat a NaN as the language does: only !=
// holds.
[[gnu::always_inline]] inline bool floating_holds(cu_i_comparison comparison, double value,
                                                  double bound) {
  switch (comparison) {
    case cu_i_comparison::equal:
      return value == bound;
    case cu_i_comparison::not_equal:
      return value != bound;
    case cu_i_comparison::less:
      return value < bound;
    case cu_i_comparison::less_equal:
      return value <= bound;
    case cu_i_comparison::greater:
      return value > bound;
    case cu_i_comparison::greater_equal:
      return value >= bound;
  }
  return false;
}

// Whether a test of `Kind` holds for the value in `p_slot`. Returns 0, or
// CU_RESULT_VALUE_MISSING for a string body without its NUL.
template <cu_i_fused_kind Kind>
[[gnu::always_inline]] inline int32_t kind_holds(const cu_i_fused_test &test,
                                                 const unsigned char *p_slot,
                                                 const unsigned char *p_indirect, bool &holds) {
  if constexpr (Kind == cu_i_fused_kind::signed_32 || Kind == cu_i_fused_kind::unsigned_32 ||
                Kind == cu_i_fused_kind::signed_64 || Kind == cu_i_fused_kind::unsigned_64) {
    uint64_t bits;
    if constexpr (Kind == cu_i_fused_kind::signed_32) {
      bits =
          static_cast<uint64_t>(static_cast<int64_t>(static_cast<int32_t>(cu_i_load_u32(p_slot))));
    } else if constexpr (Kind == cu_i_fused_kind::unsigned_32) {
      bits = cu_i_load_u32(p_slot);
    } else {
      bits = cu_i_load_u64(p_slot);
    }
    holds = (bits - test.low <= test.span) != test.negated;
    return CU_RESULT_OK;
  } else if constexpr (Kind == cu_i_fused_kind::floating_32 ||
                       Kind == cu_i_fused_kind::floating_64) {
    double value;
    if constexpr (Kind == cu_i_fused_kind::floating_32) {
      float single;
      std::memcpy(&single, p_slot, sizeof single);
      value = single;
    } else {
      std::memcpy(&value, p_slot, sizeof value);
    }
    holds = floating_holds(test.comparison, value, test.bound);
    return CU_RESULT_OK;
  } else {
    // A string body must end with its NUL, which is not part of the value.
    const unsigned char *p_body = p_indirect + cu_i_load_u32(p_slot);
    uint32_t length = cu_i_load_u32(p_slot + 4);
    if constexpr (Kind == cu_i_fused_kind::string_bytes) {
      if (length == 0 || p_body[length - 1] != '\0') {
        return CU_RESULT_VALUE_MISSING;
      }
      --length;
    }
    const bool equal =
        length == test.length && (length == 0 || std::memcmp(p_body, test.p_bytes, length) == 0);
    holds = equal != test.negated;
    return CU_RESULT_OK;
  }
}

// Whether one fused test holds for a row. Returns 0, or
// CU_RESULT_VALUE_MISSING for a slot beyond the row's or a damaged string.
int32_t test_holds(const cu_i_fused_test &test, const unsigned char *p_slots, uint32_t total_slots,
                   const unsigned char *p_indirect, bool &holds) {
  if (test.slot >= total_slots) {
    return CU_RESULT_VALUE_MISSING;
  }
  const unsigned char *p_slot = p_slots + uint64_t{test.slot} * Cu_I_Slot_Bytes;
  switch (test.kind) {
    case cu_i_fused_kind::signed_32:
      return kind_holds<cu_i_fused_kind::signed_32>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::unsigned_32:
      return kind_holds<cu_i_fused_kind::unsigned_32>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::signed_64:
      return kind_holds<cu_i_fused_kind::signed_64>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::unsigned_64:
      return kind_holds<cu_i_fused_kind::unsigned_64>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::floating_32:
      return kind_holds<cu_i_fused_kind::floating_32>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::floating_64:
      return kind_holds<cu_i_fused_kind::floating_64>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::string_bytes:
      return kind_holds<cu_i_fused_kind::string_bytes>(test, p_slot, p_indirect, holds);
    case cu_i_fused_kind::plain_bytes:
      break;
  }
  return kind_holds<cu_i_fused_kind::plain_bytes>(test, p_slot, p_indirect, holds);
}

// The tests in order, stopping at the first that fails or does not hold.
int32_t run_fused(const cu_expression_t &expression, const unsigned char *p_slots,
                  uint32_t total_slots, const unsigned char *p_indirect, uint32_t *p_result) {
  for (const cu_i_fused_test &test : expression.fused_tests) {
    bool holds = false;
    if (const int32_t result = test_holds(test, p_slots, total_slots, p_indirect, holds);
        result != CU_RESULT_OK) {
      return result;
    }
    if (!holds) {
      *p_result = 0;
      return CU_RESULT_OK;
    }
  }
  *p_result = 1;
  return CU_RESULT_OK;
}

// The rows of one batch call, as the caller described them.
struct row_batch {
  const unsigned char *p_row_pointers;
  uint32_t pointer_stride;
  uint32_t total_rows;
  uint32_t values_offset;
  uint32_t total_values;
  uint32_t indirect_offset;

  const unsigned char *row(uint32_t index) const {
    const unsigned char *p_row;
    std::memcpy(&p_row, p_row_pointers + uint64_t{index} * pointer_stride, sizeof p_row);
    return p_row;
  }
};

// Asks for the byte `offset` bytes into the row `Prefetch_Distance` rows
// after `index`. The address is computed as an integer: a prefetch never
// faults, whatever lies there.
[[gnu::always_inline]] inline void prefetch_ahead(const row_batch &rows, uint32_t index,
                                                  uint64_t offset) {
  if (index + Prefetch_Distance < rows.total_rows) {
    if (const unsigned char *p_row = rows.row(index + Prefetch_Distance); p_row != nullptr) {
      __builtin_prefetch(
          reinterpret_cast<const void *>(reinterpret_cast<uintptr_t>(p_row) + offset));
    }
  }
}

// One fused test applied to a batch, test by test rather than row by row,
// so that the loop over the rows knows the kind of test and nothing else
// (each row's slot count is the batch's, checked once). The first test
// judges every row, a null row not matching; each later one only the rows
// every test before it held for. A row that cannot match gets 0, as a row
// for which a test does not hold.
template <cu_i_fused_kind Kind, bool First>
void apply_test(const cu_i_fused_test &test, const row_batch &rows, unsigned char *p_verdicts) {
  if (test.slot >= rows.total_values) {
    std::memset(p_verdicts, 0, rows.total_rows);
    return;
  }
  const uint64_t slot_offset = rows.values_offset + uint64_t{test.slot} * Cu_I_Slot_Bytes;
  for (uint32_t index = 0; index < rows.total_rows; ++index) {
    prefetch_ahead(rows, index, slot_offset);
    if (!First && p_verdicts[index] == 0) {
      continue;
    }
    const unsigned char *p_row = rows.row(index);
    bool holds = false;
    if (p_row != nullptr && kind_holds<Kind>(test, p_row + slot_offset,
                                             p_row + rows.indirect_offset, holds) != CU_RESULT_OK) {
      holds = false;  // the row cannot match
    }
    p_verdicts[index] = holds ? 1 : 0;
  }
}

template <bool First>
void apply_test(const cu_i_fused_test &test, const row_batch &rows, unsigned char *p_verdicts) {
  switch (test.kind) {
    case cu_i_fused_kind::signed_32:
      return apply_test<cu_i_fused_kind::signed_32, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::unsigned_32:
      return apply_test<cu_i_fused_kind::unsigned_32, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::signed_64:
      return apply_test<cu_i_fused_kind::signed_64, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::unsigned_64:
      return apply_test<cu_i_fused_kind::unsigned_64, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::floating_32:
      return apply_test<cu_i_fused_kind::floating_32, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::floating_64:
      return apply_test<cu_i_fused_kind::floating_64, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::string_bytes:
      return apply_test<cu_i_fused_kind::string_bytes, First>(test, rows, p_verdicts);
    case cu_i_fused_kind::plain_bytes:
      break;
  }
  apply_test<cu_i_fused_kind::plain_bytes, First>(test, rows, p_verdicts);
}

// Programs without fused tests, on the stack machine row by row.
void interpret_rows(const cu_expression_t &expression, const row_batch &rows,
                    unsigned char *p_verdicts) {
  const uint64_t slot_offset =
      rows.values_offset + uint64_t{expression.first_slot_read} * Cu_I_Slot_Bytes;
  for (uint32_t index = 0; index < rows.total_rows; ++index) {
    prefetch_ahead(rows, index, slot_offset);
    const unsigned char *p_row = rows.row(index);
    uint32_t verdict = 0;  // a row that cannot match leaves it at 0
    if (p_row != nullptr) {
      cu_i_interpret_encoded(expression, p_row + rows.values_offset, rows.total_values,
                             p_row + rows.indirect_offset, &verdict);
    }
    p_verdicts[index] = static_cast<unsigned char>(verdict);
  }
}

}  // namespace

int32_t cu_i_evaluate_encoded(const cu_expression_t &expression, const unsigned char *p_slots,
                              uint32_t total_slots, const unsigned char *p_indirect,
                              uint32_t *p_result) noexcept {
  if (!expression.fused_tests.empty()) {
    return run_fused(expression, p_slots, total_slots, p_indirect, p_result);
  }
  return cu_i_interpret_encoded(expression, p_slots, total_slots, p_indirect, p_result);
}

void cu_i_evaluate_rows(const cu_expression_t &expression, const unsigned char *p_row_pointers,
                        uint32_t pointer_stride, uint32_t total_rows, uint32_t values_offset,
                        uint32_t total_values, uint32_t indirect_offset,
                        unsigned char *p_verdicts) noexcept {
  const row_batch rows{p_row_pointers, pointer_stride, total_rows,
                       values_offset,  total_values,   indirect_offset};
  if (expression.fused_tests.empty()) {
    interpret_rows(expression, rows, p_verdicts);
    return;
  }
  apply_test<true>(expression.fused_tests.front(), rows, p_verdicts);
  for (size_t test = 1; test < expression.fused_tests.size(); ++test) {
    apply_test<false>(expression.fused_tests[test], rows, p_verdicts);
  }
}
