#!/usr/bin/env bash
# Installs the Debian 12 packages that building, running and testing quorvad need.
# Idempotent: it asks apt only for what is missing, so a warm machine pays nothing.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config
  libplist-dev libsqlite3-dev sqlite3 libacl1-dev acl libsodium-dev libsystemd-dev
  libspdlog-dev libfmt-dev
  libgtest-dev libgmock-dev libbenchmark-dev
  clang libclang-rt-14-dev
)

missing=()
for p in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$p")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  exit 0
fi

echo "installing: ${missing[*]}"
sudo_cmd=()
if [ "$(id -u)" -ne 0 ]; then sudo_cmd=(sudo); fi
export DEBIAN_FRONTEND=noninteractive
"${sudo_cmd[@]}" apt-get update -qq
"${sudo_cmd[@]}" apt-get install -y -qq --no-install-recommends "${missing[@]}"
