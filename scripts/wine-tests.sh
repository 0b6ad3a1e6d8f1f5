#!/usr/bin/env bash
# Links the Windows capture code with mingw-w64 into unit_tests.exe (the unit tests that need no
# Linux platform layer) and startup.exe (the add-on's start-up discovery), then runs both under
# Wine (scripts/wine-tests.js). GoogleTest is built from Debian's sources once per build folder.
set -euo pipefail
cd "$(dirname "$0")/.."
build=${1:-build-windows}
jobs=$(nproc)
mkdir -p "$build"
log="$build/build.log"
# No optimisation: the tests are quick either way, and the build is what CI waits for.
cmake -S test/windows -B "$build" -DCMAKE_TOOLCHAIN_FILE="$PWD/test/windows/mingw.cmake" -DCMAKE_BUILD_TYPE= \
  > "$log" 2>&1 || { tail -30 "$log"; exit 1; }
cmake --build "$build" -j "$jobs" >> "$log" 2>&1 || { tail -50 "$log"; exit 1; }
node scripts/wine-tests.js "$build"
