#!/usr/bin/env bash
# Fails on a C++ file that does not match .clang-format and, given a build folder with a compile
# database, on a name that breaks the naming rules of .clang-tidy.
# Usage: check-style.sh [BUILD_DIR]
set -euo pipefail
cd "$(dirname "$0")/.."
mapfile -t files < <(git ls-files '*.cpp' '*.h' 2>/dev/null || find . -path ./build\* -prune -o -name '*.cpp' -print -o -name '*.h' -print)
clang-format --dry-run -Werror "${files[@]}"
echo "format: ${#files[@]} files match .clang-format"
if [ $# -ge 1 ]; then
    run-clang-tidy -p "$1" -quiet -j "$(nproc)" "$(pwd)/(utils|platform|config|storage|plugins|service|host|tests|tools|bench)/" \
        >"$1/clang-tidy.log" 2>&1 || { grep -E "warning:|error:" "$1/clang-tidy.log" | sort -u; exit 1; }
    echo "names: every file follows .clang-tidy"
fi
