#!/usr/bin/env bash
# Installs the build into a scratch prefix, then builds a program against it
# twice: with CMake's find_package and with pkg-config. Both must run.
#   check_install.sh <build dir> <source dir of the consumer> <scratch dir>
set -euo pipefail
build=$1 consumer=$2 scratch=$3
rm -rf "$scratch"
cmake --install "$build" --prefix "$scratch/prefix" >/dev/null
test -f "$scratch/prefix/share/qv/nls/qv_sr.cat"
cmake -S "$consumer" -B "$scratch/cmake-build" -DCMAKE_PREFIX_PATH="$scratch/prefix" >/dev/null
cmake --build "$scratch/cmake-build" >/dev/null
LD_LIBRARY_PATH="$scratch/prefix/lib" "$scratch/cmake-build/consumer"
flags=$(PKG_CONFIG_PATH="$scratch/prefix/lib/pkgconfig" pkg-config --define-prefix --cflags --libs qv_sr)
# shellcheck disable=SC2086
# The libraries live outside the linker's default directories: let it find
# the ones libqv_sr needs the same way the program will.
LD_LIBRARY_PATH="$scratch/prefix/lib" cc "$consumer/consumer.c" -o "$scratch/pkg-config-consumer" $flags
LD_LIBRARY_PATH="$scratch/prefix/lib" "$scratch/pkg-config-consumer"
