// pmsg_bench.cpp - the value codec on a typical row: an integer key, a
// 32-byte string, a double and a 16-element integer array. Encoding is
// measured per value kind and per row; decoding includes the free() of each
// decoded block, as every caller pays it.

#include <benchmark/benchmark.h>

#include <cstdlib>
#include <vector>

#include "qv_pmsg.h"

namespace {

struct typical_row {
  static constexpr int Columns = 4;
  qv_data_type_t types[Columns] = {QV_INT32, QV_CHAR_PTR, QV_FLOAT64, QV_INT32_ARRAY};
  qv_value_t values[Columns] = {};
  std::vector<unsigned char> array_block;
  char text[33] = "0123456789abcdef0123456789abcdef";

  typical_row() {
    array_block.resize(sizeof(qv_array_t) + 16 * sizeof(qv_value_t));
    auto *p_array = reinterpret_cast<qv_array_t *>(array_block.data());
    p_array->element_count = 16;
    for (uint32_t index = 0; index < 16; ++index) {
      p_array->elements[index].val_int32 = static_cast<int32_t>(index * 1000);
    }
    values[0].val_int32 = 42;
    values[1].ptr_char = text;
    values[2].val_float64 = 2.5;
    values[3].ptr_array = p_array;
  }
};

struct encoded {
  qv_pmsg_value_t slots[typical_row::Columns];
  unsigned char area[256];
  uint32_t used = 0;

  explicit encoded(const typical_row &row) {
    for (int column = 0; column < typical_row::Columns; ++column) {
      qv_pmsg_build_conv_protocol_value_1(nullptr, 0, row.types[column], &row.values[column],
                                          &slots[column], area, sizeof area, &used);
    }
  }
};

void encode_one(benchmark::State &state, int column) {
  typical_row row;
  qv_pmsg_value_t slot;
  unsigned char area[256];
  for (auto _ : state) {
    uint32_t offset = 0;
    int32_t result = qv_pmsg_build_conv_protocol_value_1(
        nullptr, 0, row.types[column], &row.values[column], &slot, area, sizeof area, &offset);
    benchmark::DoNotOptimize(result);
    benchmark::DoNotOptimize(area);
    benchmark::ClobberMemory();
  }
}

void BM_EncodeInt32(benchmark::State &state) {
  encode_one(state, 0);
}
void BM_EncodeString32(benchmark::State &state) {
  encode_one(state, 1);
}
void BM_EncodeInt32Array16(benchmark::State &state) {
  encode_one(state, 3);
}

void BM_EncodeRow(benchmark::State &state) {
  typical_row row;
  qv_pmsg_value_t slots[typical_row::Columns];
  unsigned char area[256];
  for (auto _ : state) {
    uint32_t offset = 0;
    for (int column = 0; column < typical_row::Columns; ++column) {
      qv_pmsg_build_conv_protocol_value_1(nullptr, 0, row.types[column], &row.values[column],
                                          &slots[column], area, sizeof area, &offset);
    }
    benchmark::DoNotOptimize(offset);
    benchmark::ClobberMemory();
  }
}

void decode_one(benchmark::State &state, int column) {
  typical_row row;
  encoded input(row);
  for (auto _ : state) {
    qv_value_t value;
    int32_t result = qv_pmsg_build_conv_packed_client_value_1(
        nullptr, 0, row.types[column], &value, &input.slots[column], input.area, input.used);
    benchmark::DoNotOptimize(result);
    benchmark::DoNotOptimize(value);
    std::free(value.ptr_char);
  }
}

void BM_DecodeString32(benchmark::State &state) {
  decode_one(state, 1);
}
void BM_DecodeInt32Array16(benchmark::State &state) {
  decode_one(state, 3);
}

void BM_DecodeRow(benchmark::State &state) {
  typical_row row;
  encoded input(row);
  for (auto _ : state) {
    qv_value_t values[typical_row::Columns];
    for (int column = 0; column < typical_row::Columns; ++column) {
      qv_pmsg_build_conv_packed_client_value_1(nullptr, 0, row.types[column], &values[column],
                                               &input.slots[column], input.area, input.used);
    }
    benchmark::DoNotOptimize(values);
    std::free(values[1].ptr_char);
    std::free(values[3].ptr_array);
  }
}

}  // namespace

BENCHMARK(BM_EncodeInt32);
BENCHMARK(BM_EncodeString32);
BENCHMARK(BM_EncodeInt32Array16);
BENCHMARK(BM_EncodeRow);
BENCHMARK(BM_DecodeString32);
BENCHMARK(BM_DecodeInt32Array16);
BENCHMARK(BM_DecodeRow);
