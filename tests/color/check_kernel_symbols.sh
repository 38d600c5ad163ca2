#!/bin/sh
# The kernel files built for other instruction sets (the batch's and the
# fine grid's) must define nothing
# the linker could share with the rest of the library (a weak copy of an
# inline function, built with AVX instructions, could be the one every file
# calls): one external symbol each, their entry point.
# Usage: check_kernel_symbols.sh OBJECT...
status=0
checked=0
for object in "$@"; do
    case "$object" in
        *colorbatch_baseline.cpp.o|*colorbatch_avx2.cpp.o|*colorbatch_avx512.cpp.o) ;;
        *finegrid_avx2.cpp.o|*finegrid_avx512.cpp.o) ;;
        *) continue ;;
    esac
    checked=$((checked + 1))
    # DW.ref.* are the exception-handling personality's data references
    # (no code), which builds without optimisation keep.
    symbols=$(nm -C --defined-only --extern-only "$object" | grep -v ' DW\.ref\.')
    if [ "$(printf '%s\n' "$symbols" | grep -c .)" -ne 1 ]; then
        echo "$object defines more than its entry point:"
        printf '%s\n' "$symbols"
        status=1
    fi
done
if [ "$checked" -eq 0 ]; then
    echo "no kernel object among the arguments"
    exit 1
fi
exit $status
