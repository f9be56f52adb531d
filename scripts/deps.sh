#!/bin/bash
# Installs the Debian packages the build, the tests and the tools need, when
# any is missing.  Sourced by the other scripts.  Usage: scripts/deps.sh [extra packages...]
set -euo pipefail
need=(cmake ninja-build g++ gcc clang libclang-rt-14-dev libgtest-dev libbenchmark-dev libnss-wrapper python3 binutils pkg-config libkrb5-dev
      dpkg-dev debhelper lintian)
need+=("$@")
missing=()
for p in "${need[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
if ((${#missing[@]})); then
  echo "installing: ${missing[*]}" >&2
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
