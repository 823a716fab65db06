#!/usr/bin/env bash
# Builds quorvad with AddressSanitizer and UndefinedBehaviorSanitizer and runs
# every test: unit tests, the packed-buffer tests and the integration tests
# that start the real daemon on temporary roots (those need root; as another
# user they are skipped with a message).
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/install-deps.sh

build=${QUORVAD_TEST_BUILD_DIR:-build-test}
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DQUORVAD_SANITIZE=ON >/dev/null
cmake --build "$build"

# A short run of the packed-buffer fuzzer (clang comes with the packages
# above). Its output goes to a file unless it finds something.
fuzz_log=$(mktemp)
if ! scripts/fuzz-smoke.sh "${QUORVAD_FUZZ_SECONDS:-20}" >"$fuzz_log" 2>&1; then
  tail -n 60 "$fuzz_log"
  echo "packed-buffer fuzzing failed" >&2
  exit 1
fi
echo "packed-buffer fuzzing: $(grep -o 'Done [0-9]* runs in [0-9]* second(s)' "$fuzz_log" | tail -n 1)"
rm -f "$fuzz_log"

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
ctest --test-dir "$build" --output-on-failure -j "$(nproc)" --timeout 300
