#!/usr/bin/env bash
# Compiles the daemon's libraries (Daemon/, src/base, platform/) with clang's
# thread-safety analysis, its findings as errors: guarded data touched without
# its lock, a REQUIRES function called without it, a lock left held. Only the
# object files are built (no tests, no linking, no optimisation, no
# sanitizer), in a build directory of its own so that later runs recompile
# only what changed.
set -euo pipefail
cd "$(dirname "$0")/.."

build=${QUORVAD_THREAD_SAFETY_BUILD_DIR:-build-thread-safety}
launcher=()
if command -v ccache >/dev/null; then
  launcher=(-DCMAKE_C_COMPILER_LAUNCHER=ccache -DCMAKE_CXX_COMPILER_LAUNCHER=ccache)
fi
cmake -S . -B "$build" -G Ninja -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ \
  -DCMAKE_BUILD_TYPE=Debug -DCMAKE_C_FLAGS_DEBUG=-O0 -DCMAKE_CXX_FLAGS_DEBUG=-O0 \
  -DCMAKE_CXX_FLAGS="-Wthread-safety -Werror=thread-safety" \
  -DQUORVAD_BUILD_TESTS=OFF "${launcher[@]}" >/dev/null
if ! cmake --build "$build" --target quorva_base quorva_platform quorvad_core >"$build/check.log" 2>&1; then
  grep -E -B2 -A6 'error:' "$build/check.log" | head -n 200 || tail -n 60 "$build/check.log"
  echo "thread-safety check failed" >&2
  exit 1
fi
echo "thread-safety check: passed"
