#!/usr/bin/env bash
# Reads "family;dir,dir,...;header,header,..." lines and checks that every
# listed header is out of reach of the family's include directories. The
# system's directories are left out (-nostdinc): installed NxBase headers in
# /usr/include must not count as reachable.
set -euo pipefail
compiler="$1"
table="$2"
failures=0
checked=0
while IFS=';' read -r family dirs forbidden; do
    [ -n "$family" ] || continue
    flags=()
    IFS=',' read -r -a list <<< "$dirs"
    for dir in "${list[@]}"; do flags+=("-I$dir"); done
    IFS=',' read -r -a headers <<< "$forbidden"
    for header in "${headers[@]}"; do
        [ -n "$header" ] || continue
        checked=$((checked + 1))
        # Without the system's directories a header that is found stops at
        # its first standard include: anything but "not found" means reached.
        out=$(printf '#include "nxbase/%s"\n' "$header" | "$compiler" -std=c++17 -E -x c++ -nostdinc "${flags[@]}" - 2>&1 >/dev/null) || true
        if [[ "$out" != *"nxbase/$header: No such file"* ]]; then
            echo "family $family reaches nxbase/$header, which is above or beside it"
            failures=$((failures + 1))
        fi
    done
done < "$table"
[ "$checked" -gt 0 ] || { echo "no header was checked"; exit 1; }
echo "$checked headers out of reach as they should be, $failures wrong"
[ "$failures" -eq 0 ]
