#!/bin/sh
# Checks tools/print-trace.sh and docs/tracing.md against the sources and a
# real trace:
#  1. every exported call's entry record identifier (read from the
#     sr_i_entry_point_t constants of sr/**/sr_x_*.cpp and the functions that
#     run them) is named by the tool, entry and exit, and listed in the page;
#  2. every other identifier a record of "_SRA" is written with is named by
#     the tool and listed in the page; every SR_E_* code is named;
#  3. a trace written by a real program prints with named lines.
#   check_print_trace.sh <source dir> <program that fails one call> <scratch dir>
set -eu
source_dir=$1 program=$2 scratch=$3
tool=$source_dir/tools/print-trace.sh
page=$source_dir/docs/tracing.md
rm -rf "$scratch"
mkdir -p "$scratch"
failures=0
fail() {
  echo "$*" >&2
  failures=$((failures + 1))
}
# Prints the tool's reading of one record line.
named() {
  printf '2026-01-01T00:00:00.000000Z 1.1 _SRA %s\n' "$1" | "$tool"
}

find "$source_dir/sr" -name 'sr_x_*.cpp' | sort | xargs awk '
/constexpr sr_i_entry_point_t/ {
  line = $0; sub(/.*sr_i_entry_point_t /, "", line)
  name = line; sub(/\{.*/, "", name)
  id = line; sub(/^[^{]*\{/, "", id); sub(/,.*/, "", id)
  entry_id[name] = id
}
/^extern "C" int32_t / { function_name = $0; sub(/^extern "C" int32_t /, "", function_name); sub(/\(.*/, "", function_name) }
/sr_i_run_entry_point\(/ { name = $0; sub(/.*sr_i_run_entry_point\(/, "", name); sub(/,.*/, "", name); print entry_id[name], function_name }
' >"$scratch/entry_points"
test "$(wc -l <"$scratch/entry_points")" -gt 40 || fail "too few entry points read from the sources"
while read -r id function_name; do
  exit_id=$((id + 1))
  named "$id" | grep -q " _SRA $id .*$function_name.* called\$" || fail "entry $id of $function_name not named"
  named "$exit_id 108(0x6c)" | grep -q " _SRA $exit_id .*$function_name.* returned 108 SR_E_DUPLICATE_KEY\$" ||
    fail "exit $exit_id of $function_name not named"
  grep -q "^| $id | $exit_id | .*\`$function_name\`" "$page" || fail "$function_name ($id) missing from docs/tracing.md"
done <"$scratch/entry_points"

grep -rhoE 'tr_record_[a-z_0-9]+\(Sr_Trace_Component, [0-9]+' "$source_dir/sr" | sed 's/.*, //' | sort -u >"$scratch/record_ids"
grep -rq 'tr_record_error_1(Sr_Trace_Component, 0,' "$source_dir/sr" || fail "no error record read from the sources"
echo 0 >>"$scratch/record_ids"
while read -r id; do
  test "$(named "$id \"x\"")" != "2026-01-01T00:00:00.000000Z 1.1 _SRA $id \"x\"" || fail "record $id not named"
  grep -q "^| $id | " "$page" || fail "record $id missing from docs/tracing.md"
done <"$scratch/record_ids"

grep -E '^#define SR_E_[A-Z_]+ [0-9]+' "$source_dir/sr/include/qv_sr.h" | while read -r _ name code _; do
  named "16 $code(0x0)" | grep -q "returned $code $name\$" || { echo "code $code not named $name" >&2; exit 1; }
done || failures=$((failures + 1))

# A real trace: the program opens and closes a tree, then closes it again,
# which fails with 100 and raises an error.
QV_TRACE_LEVELS=_SRA=1 QV_TRACE_FILE=$scratch/trace.log "$program" >/dev/null
"$tool" "$scratch/trace.log" >"$scratch/printed"
for line in ' _SRA 82 sr_open_tree_1 returned 0$' ' _SRA 15 sr_close_tree_1 called$' \
  ' _SRA 0 error raised: function=[a-z_]* line=[0-9]* file=sr/' \
  ' _SRA 16 sr_close_tree_1 returned 100 SR_E_INVALID_HANDLE$'; do
  grep -q "$line" "$scratch/printed" || fail "no line matching '$line' in:$(cat "$scratch/printed")"
done
test "$failures" -eq 0
