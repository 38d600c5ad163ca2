#!/usr/bin/env bash
# Installs the built tree into a temporary prefix, then builds and runs the
# example consumer against it, once with find_package and once with pkg-config.
set -euo pipefail
build_dir="$1"
source_dir="$2"
# The library's own compile flags (sanitizers), so that the consumer matches it.
cxx_flags="${3:-}"
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT

cmake --install "$build_dir" --prefix "$work/prefix" > "$work/install.log"
cmake -S "$source_dir/examples/consumer" -B "$work/consumer" -G Ninja \
      -DCMAKE_PREFIX_PATH="$work/prefix" -DCMAKE_CXX_FLAGS="$cxx_flags" \
      -DCMAKE_EXE_LINKER_FLAGS="$cxx_flags" > "$work/configure.log"
cmake --build "$work/consumer" > "$work/build.log"
LD_LIBRARY_PATH="$work/prefix/lib:$work/prefix/lib/x86_64-linux-gnu" NXBASE_LOG_PATH="$work/log.txt" \
    "$work/consumer/consumer"
grep -q "consumer started" "$work/log.txt"

libdir=$(ls -d "$work"/prefix/lib*/pkgconfig | head -n 1)
flags=$(PKG_CONFIG_PATH="$libdir" pkg-config --define-prefix --cflags --libs nxbase)
c++ -std=c++17 $cxx_flags "$source_dir/examples/consumer/main.cpp" $flags -o "$work/consumer-pc"
LD_LIBRARY_PATH="$(dirname "$libdir")" NXBASE_LOG_PATH="$work/log2.txt" "$work/consumer-pc"
grep -q "consumer started" "$work/log2.txt"
echo "installed package works with find_package and pkg-config"
