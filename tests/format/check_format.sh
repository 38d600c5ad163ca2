#!/usr/bin/env bash
# Lists every C++ file of the tree that clang-format would change; fails if any.
set -euo pipefail
clang_format="$1"
cd "$2"
mapfile -t files < <(find include source platform tools python tests bench fuzz examples \
    \( -name '*.h' -o -name '*.cpp' \) -not -path '*/build/*' | sort)
if "$clang_format" --dry-run --Werror "${files[@]}" > /dev/null 2>&1; then
    echo "${#files[@]} files follow .clang-format"
    exit 0
fi
bad=()
for file in "${files[@]}"; do
    "$clang_format" --dry-run --Werror "$file" > /dev/null 2>&1 || bad+=("$file")
done
printf 'not formatted; clang-format -i %s\n' "${bad[*]}"
exit 1
