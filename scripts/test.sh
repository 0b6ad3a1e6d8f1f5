#!/usr/bin/env bash
# Every test: the add-on and the unit tests are built, the C++ files are checked for format and
# lint, the unit tests run plainly, under
# AddressSanitizer + UndefinedBehaviorSanitizer and under ThreadSanitizer, then the Windows checks
# (every Windows source compiles; the capture code links for Windows and its unit tests and start-up
# run under Wine), then the JavaScript integration tests (each starts its own Xvfb and PulseAudio),
# and last those that drive the real back ends' threads against a ThreadSanitizer build.
set -euo pipefail
cd "$(dirname "$0")/.."
jobs=$(nproc)

bash scripts/setup.sh
[ -f node_modules/nan/nan.h ] || npm install --ignore-scripts --no-audit --no-fund
[ -d node_modules/puppeteer-core ] || npm install --ignore-scripts --no-audit --no-fund  # the browser test's driver
node scripts/gyp.js rebuild -j "$jobs" > build-gyp.log 2>&1 || { tail -50 build-gyp.log; exit 1; }

unit() {  # unit <folder> <cmake options...>
  local dir=$1
  shift
  cmake -S . -B "$dir" -DCMAKE_BUILD_TYPE=RelWithDebInfo "$@" > /dev/null
  cmake --build "$dir" -j "$jobs" > "$dir.log" 2>&1 || { tail -50 "$dir.log"; exit 1; }
  (cd "$dir" && ctest --output-on-failure -j "$jobs")
}

echo "== unit tests"
unit build-test
echo "== format and lint"
bash scripts/lint.sh build-test
echo "== unit tests, address and undefined-behaviour sanitizers"
ASAN_OPTIONS=detect_leaks=1 unit build-asan -DSANITIZE=address,undefined
echo "== unit tests, thread sanitizer"
TSAN_OPTIONS=halt_on_error=1 unit build-tsan -DSANITIZE=thread

echo "== windows: every source compiles"
bash scripts/check-windows.sh
echo "== windows: unit tests and start-up under Wine"
bash scripts/wine-tests.sh

echo "== integration tests"
node --test --test-concurrency=1 test/js/
echo "== integration tests against the add-on built with ThreadSanitizer"
bash scripts/tsan-integration.sh
