// pmsg_fuzz_decode.cpp - feeds arbitrary slots and indirect areas to the
// bounded decoder. It must never read outside the area, and whatever it
// accepts must be exactly what the encoder would have written.

#include <cstdint>
#include <cstdlib>

#include "pmsg_fuzz_input.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  pmsg_fuzz_input input;
  if (!input.read(p_data, size)) {
    return 0;
  }
  qv_value_t value{};
  int32_t result = qv_pmsg_build_conv_packed_client_value_1(
      nullptr, 0, static_cast<qv_data_type_t>(input.type), &value, &input.slot, input.area.get(),
      input.area_length);
  if (result != QV_PMSG_RESULT_OK || input.type < QV_CHAR_PTR) {
    return 0;
  }
  pmsg_fuzz_expect_canonical(input.type, value, input.area.get() + input.slot.anchor.offset,
                             input.slot.anchor.length);
  std::free(value.ptr_char);
  return 0;
}
