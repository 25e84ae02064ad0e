// pmsg_fuzz_input.h - how the codec's fuzz targets read their input: one
// byte of data type, the 8-byte slot, then the indirect area, which is
// copied into a heap block of exactly its size so that AddressSanitizer
// reports the first byte read outside it.

#ifndef PMSG_FUZZ_INPUT_H
#define PMSG_FUZZ_INPUT_H

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "qv_pmsg.h"

struct pmsg_fuzz_input {
  int32_t type = 0;  // 0 to 31: inside the range of qv_data_type_t
  qv_pmsg_value_t slot{};
  std::unique_ptr<unsigned char[]> area;
  uint32_t area_length = 0;

  bool read(const uint8_t *p_data, size_t size) {
    if (size < 9 || size - 9 > UINT32_MAX) {
      return false;
    }
    type = p_data[0] % 32;
    std::memcpy(&slot, p_data + 1, 8);
    area_length = static_cast<uint32_t>(size - 9);
    area.reset(new unsigned char[area_length]);
    std::memcpy(area.get(), p_data + 9, area_length);
    return true;
  }
};

// A decoded value must encode back into exactly the body it came from:
// the decoder accepts only what the encoder writes. Aborts otherwise.
inline void pmsg_fuzz_expect_canonical(int32_t type, const qv_value_t &value,
                                       const unsigned char *p_body, uint32_t length) {
  std::unique_ptr<unsigned char[]> again(new unsigned char[length + 1]);
  qv_pmsg_value_t slot{};
  uint32_t offset = 0;
  int32_t result = qv_pmsg_build_conv_protocol_value_1(
      nullptr, 0, static_cast<qv_data_type_t>(type), &value, &slot, again.get(), length, &offset);
  if (result != QV_PMSG_RESULT_OK || offset != length ||
      (length != 0 && std::memcmp(again.get(), p_body, length) != 0)) {
    std::abort();
  }
}

#endif  // PMSG_FUZZ_INPUT_H
