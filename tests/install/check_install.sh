#!/usr/bin/env bash
# Installs the build as the README says, then builds programs against the
# installed files by the README's two routes and runs them: the README's
# first program with `cc app.c $(pkg-config --cflags --libs qv_sr)`, and
# every installed example with the CMake file installed beside them
# (find_package(qv)). No LD_LIBRARY_PATH and no pkg-config option beyond the
# README's: the installed files must find each other on their own. The
# installed tree is moved before use, so nothing in it may depend on the
# place it was installed to.
#   check_install.sh <build dir> <library dir, e.g. lib> <scratch dir>
set -euo pipefail
unset LD_LIBRARY_PATH
build=$1 libdir=$2 scratch=$3
rm -rf "$scratch"
mkdir -p "$scratch"
cmake --install "$build" --prefix "$scratch/installed" >/dev/null
mv "$scratch/installed" "$scratch/prefix"
prefix=$scratch/prefix
documentation=$prefix/share/doc/qv
test -f "$prefix/share/qv/nls/qv_sr.cat"
test -f "$documentation/guide.md"

cd "$scratch"
cp "$documentation/examples/guide/first_program.c" app.c
export PKG_CONFIG_PATH=$prefix/$libdir/pkgconfig
# shellcheck disable=SC2046
cc app.c $(pkg-config --cflags --libs qv_sr)
./a.out

cmake -S "$documentation/examples" -B examples -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build examples >/dev/null
for program in open_tree configuration guide/first_program guide/trees_and_mounts \
  guide/creating_tables guide/rows guide/transactions guide/persistence guide/processes \
  guide/errors_and_tracing guide/selection; do
  test -x "examples/$program"
done
(mkdir run && cd run && ../examples/configuration >/dev/null && ../examples/guide/processes >/dev/null)
"$prefix/bin/qv-print-trace" </dev/null
