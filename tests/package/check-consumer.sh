#!/usr/bin/env bash
# Installs the built library into a temporary prefix and builds a small consumer
# against it twice: through find_package and through pkg-config.
set -euo pipefail
build_dir=$1
consumer_src=$2
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

cmake --install "$build_dir" --prefix "$work/prefix" >/dev/null

cmake -S "$consumer_src" -B "$work/cmake-build" -G Ninja -DCMAKE_PREFIX_PATH="$work/prefix" >/dev/null
cmake --build "$work/cmake-build" >/dev/null
LD_LIBRARY_PATH="$work/prefix/lib" "$work/cmake-build/consumer" | grep -qx 'consumer: 3 of 4'

libdir=$(find "$work/prefix" -name pelmora.pc -printf '%h\n' | head -n 1)
export PKG_CONFIG_PATH="$libdir"
g++ "$consumer_src/main.cpp" -o "$work/pc-consumer" $(pkg-config --cflags --libs pelmora)
LD_LIBRARY_PATH="$(dirname "$libdir")" "$work/pc-consumer" | grep -qx 'consumer: 3 of 4'
echo "package consumer: find_package and pkg-config builds ran"
