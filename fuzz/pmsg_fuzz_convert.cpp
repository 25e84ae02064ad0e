// pmsg_fuzz_convert.cpp - feeds arbitrary slots and indirect areas to the
// byte-order converter, through its bounded core (the exported call trusts
// the top-level anchor). It must never touch bytes outside the area, and a
// value it accepts must then decode, and encode back into the converted body.

#include <cstdint>
#include <cstdlib>

#include "pmsg_fuzz_input.h"
#include "pmsg_i_format.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *p_data, size_t size) {
  pmsg_fuzz_input input;
  if (!input.read(p_data, size) || pmsg_i_kind_of(input.type) == pmsg_i_kind::invalid) {
    return 0;
  }
  int32_t result =
      pmsg_i_convert_value(input.slot.bytes, input.type, input.area.get(), input.area_length);
  if (result != QV_PMSG_RESULT_OK || input.type < QV_CHAR_PTR) {
    return 0;
  }
  qv_value_t value{};
  result = qv_pmsg_build_conv_packed_client_value_1(
      nullptr, 0, static_cast<qv_data_type_t>(input.type), &value, &input.slot, input.area.get(),
      input.area_length);
  if (result != QV_PMSG_RESULT_OK) {
    std::abort();  // the converter accepted what the decoder refuses
  }
  pmsg_fuzz_expect_canonical(input.type, value, input.area.get() + input.slot.anchor.offset,
                             input.slot.anchor.length);
  std::free(value.ptr_char);
  return 0;
}
