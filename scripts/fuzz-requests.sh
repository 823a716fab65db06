#!/usr/bin/env bash
# Builds the request fuzzer with clang in its own build directory and runs it
# for a few seconds. Exits non-zero when the build fails or the fuzzer finds a
# crash (the input is left under <build dir>/artifacts/<target>/).
#
#   scripts/fuzz-requests.sh [seconds] [libFuzzer options...]
#       default 30 s; BUILD_DIR overrides build-fuzz; FUZZ_TARGET=upcall runs
#       the upcall fuzzer (fuzz/upcall_fuzz.cpp) instead of the request one
#
# Both fuzzers make the daemon do real file-system work with hostile paths.
# As root it therefore runs in a private mount namespace in which everything
# but its work directory and the build directory is read-only, so that an
# escape from the temporary root fails instead of damaging this machine (the
# fuzzer notices escapes towards its sentinel directory either way). Set
# QUORVAD_FUZZ_UNSANDBOXED=1 to run as root without that namespace.
set -euo pipefail

seconds="${1:-30}"
shift || true
root="$(cd "$(dirname "$0")/.." && pwd)"
build="${BUILD_DIR:-$root/build-fuzz}"

target="${FUZZ_TARGET:-request}"
BUILD_DIR="$build" "$root/scripts/fuzz-build.sh" "${target}_fuzz"

# New inputs go to the build directory; the checked-in seeds are read only.
corpus="$build/corpus/$target"
artifacts="$build/artifacts/$target"
work="$(mktemp -d "${TMPDIR:-/tmp}/quorvad-rfuzz-run-XXXXXX")"
mkdir -p "$corpus" "$artifacts"

run=(env TMPDIR="$work" UBSAN_OPTIONS="${UBSAN_OPTIONS:-print_stacktrace=1}"
     "$build/fuzz/${target}_fuzz" -max_total_time="$seconds" -timeout=60 -rss_limit_mb=4096 -print_final_stats=1
     -artifact_prefix="$artifacts/" "$@" "$corpus" "$root/fuzz/corpus/$target")
status=0
if [[ $(id -u) -eq 0 && "${QUORVAD_FUZZ_UNSANDBOXED:-0}" != 1 ]]; then
  # Bind mounts make the two directories mounts of their own, which the
  # read-only remount of / leaves writable.
  unshare --mount --propagation private -- sh -c \
    'mount --bind "$1" "$1" && mount --bind "$2" "$2" && mount -o remount,bind,ro / && shift 2 && exec "$@"' \
    sh "$work" "$build" "${run[@]}" || status=$?
else
  "${run[@]}" || status=$?
fi
# After a crash the daemon's root and log are worth a look.
if [[ $status -eq 0 ]]; then
  rm -rf "$work"
else
  echo "fuzzer work directory kept: $work" >&2
fi
exit "$status"
