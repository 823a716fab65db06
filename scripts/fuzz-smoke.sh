#!/usr/bin/env bash
# Builds the packbuff fuzzer with clang in its own build directory and runs it
# for a few seconds. Exits non-zero when the build fails or the fuzzer finds a
# crash (the input is left under <build dir>/artifacts/).
#
#   scripts/fuzz-smoke.sh [seconds]     default 30; BUILD_DIR overrides build-fuzz
set -euo pipefail

seconds="${1:-30}"
root="$(cd "$(dirname "$0")/.." && pwd)"
build="${BUILD_DIR:-$root/build-fuzz}"

BUILD_DIR="$build" "$root/scripts/fuzz-build.sh" packbuff_fuzz

# A small seed corpus: an empty buffer, one of each item kind, a key/value pair.
corpus="$build/corpus/packbuff"
artifacts="$build/artifacts"
mkdir -p "$corpus" "$artifacts"
seed() { printf "$2" >"$corpus/$1"; }
seed end '\x08\0\0\0\0\0\0\0\0'
seed inline '\x08\x01\0\x05\0\x07\0\0\0\0\0\0\0\0\0\0\0'
seed string '\x00\x02\0\x01\0\x04\0\0\0abc\0\0\0\0\0\0\0\0\0\0\0\0\0'
seed bytes '\x10\x03\0\x02\0\x02\0\0\0\x01\x02\0\0\0\0\0\0\x03\0\x03\0\0\0\0\0\0\0\0\0\0\0\0\0'
seed pair '\x01\x02\0\x03\0\x02\0\0\0k\0\0\0\0\0\0\0\x02\0\x04\0\x02\0\0\0v\0\0\0\0\0\0\0\0\0\0\0\0\0\0\0'

"$build/fuzz/packbuff_fuzz" -max_total_time="$seconds" -print_final_stats=1 \
  -artifact_prefix="$artifacts/" "$corpus"
