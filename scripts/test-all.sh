#!/bin/bash
# Builds and runs every test: the library's lock annotations checked by
# clang, the whole suite as a plain debug build and under ASan+UBSan, and the
# concurrency tests under TSan, the Debian packages (built without their own
# run of the suite, checked by lintian, unpacked into a scratch root and
# built against).  Installs missing Debian packages first.  Warnings are
# errors here.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/deps.sh
jobs=$(nproc)
werror=-DOXIDM_WERROR=ON
status=0
run_suite() {  # preset, ctest arguments...
  local preset=$1; shift
  echo "=== $preset: build" >&2
  cmake --preset "$preset" $werror >/dev/null
  cmake --build --preset "$preset" -j "$jobs"
  echo "=== $preset: test" >&2
  ctest --preset "$preset" -j "$jobs" --timeout 300 "$@" || status=1
}
echo "=== thread-safety: the library under clang's lock analysis" >&2
cmake --preset thread-safety $werror >/dev/null
cmake --build --preset thread-safety -j "$jobs" || status=1
run_suite debug
run_suite asan-ubsan
run_suite tsan
echo "=== packages: build, lintian, unpacked into a scratch root and built against" >&2
DEB_BUILD_OPTIONS="nocheck parallel=$jobs" scripts/packages.sh && tests/tool/test_install.sh build/deb . || status=1
if [[ -x fuzz/run-short.sh ]]; then
  echo "=== fuzz: short runs" >&2
  fuzz/run-short.sh || status=1
fi
exit $status
