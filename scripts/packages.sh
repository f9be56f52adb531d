#!/bin/bash
# Builds the Debian packages from a copy of the source tree (the tree itself
# stays clean) into build/deb/, and checks them with lintian (errors and
# warnings fail; what remains is overridden in debian/ with its reason).
# Installs the build dependencies of debian/control first.
# Usage: scripts/packages.sh     DEB_BUILD_OPTIONS as usual: nocheck skips the test suite
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
if ! dpkg-checkbuilddeps >/dev/null 2>&1; then
  echo "installing the build dependencies of debian/control" >&2
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq && apt-get build-dep -y -qq ./ >/dev/null
fi
out=build/deb
rm -rf "$out" && mkdir -p "$out/src"
git ls-files -z -co --exclude-standard | tar --null -T - --ignore-failed-read -cf - | tar -xf - -C "$out/src"
[[ ${DEB_BUILD_OPTIONS:-} == *parallel=* ]] || export DEB_BUILD_OPTIONS="${DEB_BUILD_OPTIONS:-} parallel=$(nproc)"
(cd "$out/src" && dpkg-buildpackage -b -uc -us) >"$out/build.log" 2>&1 || { tail -50 "$out/build.log" >&2; exit 1; }
rm -rf "$out/src"
lintian --fail-on error,warning "$out"/*.changes
ls "$out"/*.deb
