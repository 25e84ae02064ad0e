#!/bin/sh
# Keeps the C programs shown in the documentation true. In a markdown page,
# a fenced C block must come right after the line
#   <!-- example: examples/guide/rows.c -->
# and hold exactly that file's text; a fenced block right after
#   <!-- output: examples/guide/rows.c -->
# must hold exactly what the program prints when run in an empty directory.
# Every program a page names is run, built by the project (examples/X.c is
# <build dir>/examples/X), each in an empty directory of its own, and must
# exit with 0.
#   check_docs.sh <source dir> <build dir> <scratch dir> <page.md>...
set -eu
source_dir=$1 build_dir=$2 scratch=$3
shift 3
rm -rf "$scratch"
mkdir -p "$scratch/blocks" "$scratch/runs"
failures=0
fail() {
  echo "$*" >&2
  failures=$((failures + 1))
}

# Runs a program once, in an empty directory; its output is kept in
# $scratch/runs/<name>/stdout, its status in .../status.
run() {
  name=$(basename "$1" .c)
  directory=$scratch/runs/$name
  if [ ! -d "$directory" ]; then
    mkdir -p "$directory/work"
    status=0
    (cd "$directory/work" && "$build_dir/${1%.c}" >"../stdout") || status=$?
    echo "$status" >"$directory/status"
    [ "$status" -eq 0 ] || fail "$1 exited with $status"
  fi
}

for page in "$@"; do
  page_name=$(basename "$page" .md)
  # One file per fenced block, and one line per block to check:
  # <kind> <program> <block file> <line>; kind "untested" for a C block
  # without a marker.
  awk -v blocks="$scratch/blocks/$page_name" '
    inside && /^```/ { inside = 0; close(block); next }
    inside { print > block; next }
    /^```/ {
      inside = 1
      block = blocks "." FNR
      printf "" > block
      if (previous ~ /^<!-- (example|output): [^ ]+ -->$/) {
        split(previous, words, " ")
        kind = words[2]
        sub(/:$/, "", kind)
        print kind, words[3], block, FNR
      } else if ($0 == "```c") {
        print "untested -", block, FNR
      }
    }
    { previous = $0 }
  ' "$page" >"$scratch/$page_name.blocks"
  test -s "$scratch/$page_name.blocks" || fail "$page: no example found"
  while read -r kind program block line; do
    case $kind in
      untested) fail "$page:$line: a C block that is not an example file" ;;
      example)
        run "$program"
        cmp -s "$source_dir/$program" "$block" || fail "$page:$line: the block is not $program"
        ;;
      output)
        run "$program"
        cmp -s "$scratch/runs/$(basename "$program" .c)/stdout" "$block" ||
          fail "$page:$line: the output of $program differs:
$(diff "$block" "$scratch/runs/$(basename "$program" .c)/stdout")"
        ;;
    esac
  done <"$scratch/$page_name.blocks"
done
test "$failures" -eq 0
