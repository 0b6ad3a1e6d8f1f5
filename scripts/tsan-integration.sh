#!/usr/bin/env bash
# The integration tests that drive the real back ends' threads (X11, PulseAudio, FFmpeg, the
# capture engine) against an add-on built with ThreadSanitizer, in a copy of the tree
# (build-tsan-addon/) so that the plain add-on stays as it is. The unit tests' sanitizer run sees
# only the fakes' threads; races between a device's own thread and the host's calls show here.
# It fails on a race report. A sanitized host runs several times slower, so the tests' timing
# checks are the plain run's to judge: their outcome is printed, not counted.
set -euo pipefail
cd "$(dirname "$0")/.."
jobs=$(nproc)
copy=build-tsan-addon
runtime=$(gcc -print-file-name=libtsan.so)
flags="-fsanitize=thread -g -O1"
[ -f "$runtime" ] || { echo "no ThreadSanitizer runtime ($runtime)"; exit 1; }

rm -rf "$copy"
mkdir -p "$copy/reports"
git ls-files -z --cached --others --exclude-standard | tar --null -T - --ignore-failed-read -cf - 2> /dev/null |
  tar -xf - -C "$copy"
ln -s "$PWD/node_modules" "$copy/node_modules"
(cd "$copy" && CFLAGS="$flags" CXXFLAGS="$flags" LDFLAGS="-fsanitize=thread" node scripts/gyp.js rebuild -j "$jobs") \
  > "$copy.log" 2>&1 || { tail -50 "$copy.log"; exit 1; }

# Without the runtime first in the process the add-on does not load, and every test would fail
# without a report: check that it loads before counting on the silence.
LD_PRELOAD="$runtime" node -e "require('./$copy')" || { echo "the ThreadSanitizer build does not load"; exit 1; }

reports="$PWD/$copy/reports"
TAVIO_TEST_PRELOAD="$runtime" TSAN_OPTIONS="log_path=$reports/tsan ignore_noninstrumented_modules=1" \
  node --test --test-concurrency=1 "$copy"/test/js/{faults,camera,camera-faults,audio,recording}.test.js \
  > "$copy/tests.log" 2>&1 || true
echo "tests under ThreadSanitizer (timing checks not counted): $(grep -E '^# (pass|fail) ' "$copy/tests.log" | tr '\n' ' ')"
if compgen -G "$reports/tsan.*" > /dev/null; then
  cat "$reports"/tsan.*
  echo "ThreadSanitizer reported races (above)"
  exit 1
fi
echo "ThreadSanitizer: no race"
