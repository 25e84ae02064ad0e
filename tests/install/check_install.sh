#!/usr/bin/env bash
# Installs the build as the README says, then builds a program against the
# installed files by the README's two routes (pkg-config with cc, and CMake's
# find_package) and runs each. No LD_LIBRARY_PATH and no pkg-config option
# beyond the README's: the installed files must find each other on their own.
# The installed tree is moved before use, so nothing in it may depend on the
# place it was installed to.
#   check_install.sh <build dir> <library dir, e.g. lib> <consumer source dir> <scratch dir>
set -euo pipefail
unset LD_LIBRARY_PATH
build=$1 libdir=$2 consumer=$3 scratch=$4
rm -rf "$scratch"
mkdir -p "$scratch"
cmake --install "$build" --prefix "$scratch/installed" >/dev/null
mv "$scratch/installed" "$scratch/prefix"
prefix=$scratch/prefix
test -f "$prefix/share/qv/nls/qv_sr.cat"

cd "$scratch"
cp "$consumer/consumer.c" app.c
export PKG_CONFIG_PATH=$prefix/$libdir/pkgconfig
# shellcheck disable=SC2046
cc app.c $(pkg-config --cflags --libs qv_sr)
./a.out

cmake -S "$consumer" -B cmake-build -DCMAKE_PREFIX_PATH="$prefix" >/dev/null
cmake --build cmake-build >/dev/null
cmake-build/consumer
