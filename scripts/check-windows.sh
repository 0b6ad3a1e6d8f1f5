#!/usr/bin/env bash
# Compiles every Windows source of the add-on with the mingw-w64 cross compiler against the
# Node headers and NAN. There is no Windows node.lib here, so nothing is linked.
set -euo pipefail
cd "$(dirname "$0")/.."
cxx=x86_64-w64-mingw32-g++-posix
node_include=$(node -p "require('path').resolve(process.execPath, '../../include/node')")
nan_include=$(node -p "require('path').dirname(require.resolve('nan/nan.h'))")
out=$(mktemp -d)
trap 'rm -rf "$out"' EXIT
failed=0
for source in $(node scripts/sources.js addon win32); do
  if ! "$cxx" -std=c++17 -c -o "$out/$(basename "$source").o" -Wall -Wno-unused-parameter -Wno-unknown-pragmas \
      -DNOMINMAX -DWIN32_LEAN_AND_MEAN -D_WIN32_WINNT=0x0A00 \
      -I native -I "$node_include" -I "$nan_include" "$source"; then
    echo "windows: $source does not compile"
    failed=1
  fi
done
[ "$failed" = 0 ] && echo "windows: every source compiles with $cxx"
exit "$failed"
