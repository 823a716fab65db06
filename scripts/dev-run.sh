#!/usr/bin/env bash
# Builds quorvad and runs it in the foreground on a development root
# (build/devroot unless QUORVAD_ROOT says otherwise), with its own accounts,
# os-release and a trust-store entry that makes the built quorvactl a
# privileged client. Extra arguments go to quorvad (e.g. --log-level 7).
set -euo pipefail
cd "$(dirname "$0")/.."

scripts/install-deps.sh

cmake -S . -B build -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null
cmake --build build --target quorvad quorvactl

root=${QUORVAD_ROOT:-$PWD/build/devroot}
scripts/prepare-root.sh "$root" build/client/quorvactl >/dev/null
if [ "$(id -u)" -ne 0 ]; then
  echo "note: quorvad is meant to run as root; as $(id -un) it cannot hand containers to their owners" >&2
fi
echo "quorvad on root $root" >&2
echo "  talk to it:  build/client/quorvactl --root $root lookup --id com.example.demo --class 2 --create" >&2
echo "  its log:     $root/private/var/root/Library/Logs/Quorva/quorvad.log" >&2
exec build/Daemon/quorvad --root "$root" "$@"
