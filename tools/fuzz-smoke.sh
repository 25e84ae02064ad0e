#!/usr/bin/env bash
# Builds the libFuzzer targets with clang and runs each one briefly (a smoke
# run: no crash, no leak, no hang on what the fuzzer finds in that time).
#   FUZZ_SECONDS  seconds per target (default 20)
set -euo pipefail
cd "$(dirname "$0")/.."
if ! command -v clang++ >/dev/null 2>&1; then
  echo "fuzz-smoke: clang++ not installed; skipping"
  exit 0
fi
seconds=${FUZZ_SECONDS:-20}
cmake --preset fuzz >/dev/null
cmake --build build-fuzz -j"$(nproc)" --target fuzz_all
shopt -s nullglob
targets=(build-fuzz/fuzz/fuzz_*)
if [ ${#targets[@]} -eq 0 ]; then
  echo "fuzz-smoke: no fuzz targets"
  exit 0
fi
for target in "${targets[@]}"; do
  [ -x "$target" ] && [ -f "$target" ] || continue
  name=$(basename "$target")
  corpus="build-fuzz/corpus/$name"
  mkdir -p "$corpus"
  # Seeds live in fuzz/corpus/<library> for the targets fuzz_<library>_*,
  # or in fuzz/corpus/<library>_<input> for a target fuzz_<library>_<input>
  # whose input differs from its library's other targets.
  library=${name#fuzz_}
  own=$library
  library=${library%%_*}
  seeds=()
  if [ -d "fuzz/corpus/$own" ]; then
    seeds=("fuzz/corpus/$own")
  elif [ -d "fuzz/corpus/$library" ]; then
    seeds=("fuzz/corpus/$library")
  fi
  echo "fuzz-smoke: $name for ${seconds}s"
  "$target" -max_total_time="$seconds" -timeout=10 -rss_limit_mb=2048 -print_final_stats=1 \
    "$corpus" "${seeds[@]}" 2>&1 | tail -n 5
done
