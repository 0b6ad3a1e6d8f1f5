#!/usr/bin/env bash
# Format and lint: clang-format (.clang-format) must find every C++ file as it would write it,
# and clang-tidy (.clang-tidy) must find nothing in the native code, the tests and the benchmarks.
#   bash scripts/lint.sh [cmake build folder with compile_commands.json]
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build-test}
mapfile -t files < <(find native test bench -name '*.cc' -o -name '*.h' | sort)
clang-format --dry-run --Werror "${files[@]}"
if ! run-clang-tidy -p "$build" -j "$(nproc)" -quiet "$PWD/native/" "$PWD/test/" "$PWD/bench/" > "$build/tidy.log" 2>&1; then
  grep -E "(warning|error):" "$build/tidy.log" || tail -30 "$build/tidy.log"
  exit 1
fi
echo "lint: ${#files[@]} C++ files formatted, clang-tidy finds nothing"
