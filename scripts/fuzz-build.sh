#!/usr/bin/env bash
# Configures the clang fuzzing build directory (BUILD_DIR, default build-fuzz)
# and builds the given libFuzzer targets in it. Shared by the fuzz scripts so
# that they use one build directory configured one way.
#
#   scripts/fuzz-build.sh TARGET...
set -euo pipefail

root="$(cd "$(dirname "$0")/.." && pwd)"
build="${BUILD_DIR:-$root/build-fuzz}"
CC=clang CXX=clang++ cmake -S "$root" -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DQUORVAD_BUILD_FUZZ=ON -DQUORVAD_BUILD_TESTS=OFF -DQUORVAD_BUILD_BENCH=OFF >/dev/null
for target in "$@"; do cmake --build "$build" --target "$target"; done
