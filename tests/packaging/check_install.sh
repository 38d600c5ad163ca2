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
# A consumer that asks for C++14 gets the C++17 the headers need from the target.
cmake -S "$source_dir/examples/consumer" -B "$work/consumer14" -G Ninja -DCMAKE_CXX_STANDARD=14 \
      -DCMAKE_PREFIX_PATH="$work/prefix" -DCMAKE_CXX_FLAGS="$cxx_flags" \
      -DCMAKE_EXE_LINKER_FLAGS="$cxx_flags" > "$work/configure14.log"
cmake --build "$work/consumer14" > "$work/build14.log"
LD_LIBRARY_PATH="$work/prefix/lib:$work/prefix/lib/x86_64-linux-gnu" NXBASE_LOG_PATH="$work/log.txt" \
    "$work/consumer/consumer"
grep -q "consumer started" "$work/log.txt"

# The .pc file names the prefix it was installed to.
pcdir=$(dirname "$(find "$work/prefix" -name nxbase.pc | head -n 1)")
flags=$(PKG_CONFIG_PATH="$pcdir" pkg-config --cflags --libs nxbase)
case "$flags" in *"$work/prefix"*) ;; *) echo "pkg-config points elsewhere: $flags"; exit 1 ;; esac
libdir=$(PKG_CONFIG_PATH="$pcdir" pkg-config --variable=libdir nxbase)
c++ -std=c++17 $cxx_flags "$source_dir/examples/consumer/main.cpp" $flags \
    -Wl,-rpath,"$libdir" -o "$work/consumer-pc"
NXBASE_LOG_PATH="$work/log2.txt" "$work/consumer-pc"
grep -q "consumer started" "$work/log2.txt"

# The installed programs start without any library path from the environment.
if [ -x "$work/prefix/bin/nxreg" ]; then
    env -u LD_LIBRARY_PATH NXBASE_MACHINE_REGISTRY="$work/m.sqlite" \
        NXBASE_USER_REGISTRY="$work/u.sqlite" NXBASE_LOG_PATH="$work" \
        "$work/prefix/bin/nxreg" files > /dev/null
    env -u LD_LIBRARY_PATH NXBASE_LOG_PATH="$work" "$work/prefix/bin/nxcolor" --list-illuminants \
        | grep -q D65
    env -u LD_LIBRARY_PATH NXBASE_LOG_PATH="$work" "$work/prefix/bin/lumaserver" --version > /dev/null
    # A manual page per program, when help2man made them.
    if command -v help2man > /dev/null; then
        for tool in nxcolor nxreg nxmsg lumaserver; do
            test -s "$work/prefix/share/man/man1/$tool.1.gz" || { echo "no manual page for $tool"; exit 1; }
        done
    fi
fi

# The Python module, when built, imports from the prefix and finds the
# installed library by its run path.
module=$(find "$work/prefix" -name 'nxbase.cpython-*.so' | head -n 1)
if [ -n "$module" ] && [[ "$cxx_flags" != *sanitize* ]]; then
    test -f "$(dirname "$module")/nxbase.pyi"
    env -u LD_LIBRARY_PATH PYTHONPATH="$(dirname "$module")" NXBASE_LOG_PATH="$work" /usr/bin/python3 -c \
        "import nxbase; assert nxbase.spectra_to_Lab([0.5] * 36).shape == (3,); print('python', nxbase.__version__)"
fi
echo "installed package works with find_package and pkg-config"
