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

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
ctest --test-dir "$build" --output-on-failure -j "$(nproc)" --timeout 300

# A short run of the packed-buffer fuzzer, when clang can build it.
if [ -x scripts/fuzz-smoke.sh ] && command -v clang++ >/dev/null; then
  scripts/fuzz-smoke.sh "${QUORVAD_FUZZ_SECONDS:-20}"
fi
