#!/usr/bin/env bash
# Builds quorvad and the performance table in Release (its own build
# directory, no tests) and prints the table: every figure of the daemon
# beside its raw baseline, measured in the same run. Needs root.
#
# usage: scripts/bench-performance.sh [--dir DIR] [--quick] [--repetitions N]
#   --dir DIR   the file system to measure on (default $TMPDIR or /tmp)
#   --quick     small sizes: checks that every part runs
# The build directory is $QUORVAD_BENCH_BUILD_DIR (default build-release).
set -euo pipefail
cd "$(dirname "$0")/.."

build=${QUORVAD_BENCH_BUILD_DIR:-build-release}
launcher=()
if command -v ccache >/dev/null; then launcher=(-DCMAKE_CXX_COMPILER_LAUNCHER=ccache); fi
cmake -S . -B "$build" -G Ninja -DCMAKE_BUILD_TYPE=Release "${launcher[@]}" \
  -DQUORVAD_BUILD_TESTS=OFF -DQUORVAD_BUILD_BENCH=ON -DQUORVAD_SANITIZE=OFF >/dev/null
nice ninja -C "$build" -j "${QUORVAD_BENCH_JOBS:-1}" quorvad QRVPerformance_bench
exec "$build/bench/QRVPerformance_bench" "$@"
