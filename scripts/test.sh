#!/usr/bin/env bash
# Checks the daemon's locking with clang's thread-safety analysis, builds
# quorvad with AddressSanitizer and UndefinedBehaviorSanitizer and runs
# every test: unit tests, the packed-buffer tests and the integration tests
# that start the real daemon on temporary roots (those need root; as another
# user they are skipped with a message).
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/install-deps.sh

# Locking checked by the compiler before anything is built for running.
scripts/check-thread-safety.sh

build=${QUORVAD_TEST_BUILD_DIR:-build-test}
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Debug -DQUORVAD_SANITIZE=ON >/dev/null
cmake --build "$build"

# Short fuzzing runs (clang comes with the packages above). Their output goes
# to a file unless they find something.
fuzz() {
  local name=$1 log
  shift
  log=$(mktemp)
  if ! "$@" >"$log" 2>&1; then
    tail -n 60 "$log"
    echo "$name fuzzing failed" >&2
    exit 1
  fi
  echo "$name fuzzing: $(grep -o 'Done [0-9]* runs in [0-9]* second(s)' "$log" | tail -n 1)"
  rm -f "$log"
}
fuzz packed-buffer scripts/fuzz-smoke.sh "${QUORVAD_FUZZ_SECONDS:-20}"

export ASAN_OPTIONS=${ASAN_OPTIONS:-detect_leaks=1:abort_on_error=1}
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}
ctest --test-dir "$build" --output-on-failure -j "$(nproc)" --timeout 300

# Requests through the dispatcher to a daemon on a temporary root. As root it
# runs in a private mount namespace with / read-only; where none can be made
# (a restricted container) it is left out rather than run unfenced.
if [[ $(id -u) -ne 0 ]] || unshare --mount --propagation private true 2>/dev/null; then
  fuzz request scripts/fuzz-requests.sh "${QUORVAD_FUZZ_SECONDS:-20}"
  fuzz upcall env FUZZ_TARGET=upcall scripts/fuzz-requests.sh "${QUORVAD_FUZZ_SECONDS:-20}"
else
  echo "request and upcall fuzzing skipped: no private mount namespace here"
fi
