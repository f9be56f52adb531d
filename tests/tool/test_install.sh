#!/bin/bash
# Installs the build tree into a scratch prefix, builds a consumer program
# against it with pkg-config and with CMake's find_package, runs both, runs
# the installed oxidm, and builds and inspects the Debian package.
# Usage: test_install.sh BUILD_DIR SOURCE_DIR [SANITIZE]
# SANITIZE is the build's OXIDM_SANITIZE: consumers of an instrumented
# library are built with the same sanitizer.
set -euo pipefail
build=$(cd "$1" && pwd) src=$(cd "$2" && pwd) sanitize=${3:-}
case $sanitize in
  address-undefined) cflags="-fsanitize=address,undefined" ;;
  thread) cflags="-fsanitize=thread" ;;
  *) cflags="" ;;
esac
work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
prefix=$work/prefix
fail() { echo "FAIL: $*" >&2; exit 1; }

cmake --install "$build" --prefix "$prefix" >/dev/null
libdir=$(cd "$prefix" && ls -d lib* | head -1)
for f in "$libdir/libox_idm.so" "$libdir/libox_idm.so.1" "$libdir/libox_idm.so.1.0.0" \
         "$libdir/libox_cu.so.1" "$libdir/libox_tr.so.1" "$libdir/libox_mss.so.1" \
         include/oxidm/oxidm.h include/oxidm/ox_cu.h include/oxidm/ox_tr.h include/oxidm/ox_mss.h \
         "$libdir/pkgconfig/oxidm.pc" "$libdir/cmake/oxidm/oxidmConfig.cmake" bin/oxidm share/man/man1/oxidm.1; do
  [[ -e $prefix/$f ]] || fail "not installed: $f"
done
[[ -L $prefix/$libdir/libox_idm.so && -L $prefix/$libdir/libox_idm.so.1 ]] || fail "library links missing"
soname=$(objdump -p "$prefix/$libdir/libox_idm.so.1.0.0" | awk '/SONAME/ {print $2}')
[[ $soname == libox_idm.so.1 ]] || fail "soname is '$soname'"
ls "$prefix/$libdir/oxidm/mpm/"*.so >/dev/null 2>&1 || fail "no sample plug-in installed"
echo "installed tree: ok"

check_output() {  # program
  local out
  out=$("$1") || fail "$1 exited $?"
  grep -q "map: status 22: 2650-660" <<<"$out" || fail "$1: unexpected map answer: $out"
  grep -q "cluster: -1" <<<"$out" || fail "$1: unexpected cluster answer: $out"
  grep -q "groups of root: status 0" <<<"$out" || fail "$1: unexpected groups answer: $out"
}

# pkg-config
export PKG_CONFIG_PATH=$prefix/$libdir/pkgconfig
# shellcheck disable=SC2046
cc $cflags -o "$work/consumer-pc" "$src/tests/tool/consumer/consumer.c" $(pkg-config --cflags --libs oxidm) 2>/dev/null
check_output "$work/consumer-pc"
echo "pkg-config consumer: ok"

# CMake package
cmake -S "$src/tests/tool/consumer" -B "$work/consumer-build" -G Ninja -DCMAKE_PREFIX_PATH="$prefix" \
      -DCMAKE_BUILD_RPATH="$prefix/$libdir" -DCMAKE_C_FLAGS="$cflags" >/dev/null
cmake --build "$work/consumer-build" >/dev/null 2>&1
check_output "$work/consumer-build/consumer"
echo "CMake consumer: ok"

# The installed command finds its libraries and plug-ins by itself.
"$prefix/bin/oxidm" --version | grep -q "oxidm 1" || fail "installed oxidm --version"
"$prefix/bin/oxidm" mechanisms | grep -q . || fail "installed oxidm knows no mechanism"
if [[ $(id -u) == 0 ]]; then
  rc=0
  "$prefix/bin/oxidm" --root "$prefix/share/doc/oxidm/examples" --json cluster any no-such-host.invalid >/dev/null || rc=$?
  [[ $rc == 1 ]] || fail "installed oxidm --root: exit $rc"
fi
# A plug-in built outside the tree against the installed headers only, loaded by path.
cp "$src/mpm/oxmpm_host.c" "$src/mpm/oxmpm_host.h" "$work/"
# shellcheck disable=SC2046
cc $cflags -shared -fPIC -DOXMPM_SHARED_OBJECT -o "$work/host.so" "$work/oxmpm_host.c" $(pkg-config --cflags --libs oxidm)
"$prefix/bin/oxidm" --plugin "$work/host.so" mechanisms | grep -q "($work/host.so)" || fail "--plugin of an outside plug-in"
echo "installed oxidm: ok"

# Debian package
if command -v dpkg-deb >/dev/null; then
  (cd "$work" && cpack --config "$build/CPackConfig.cmake" -B "$work/pkg" >/dev/null)
  deb=$(ls "$work"/pkg/*.deb | head -1)
  [[ -n $deb ]] || fail "no .deb built"
  listing=$(dpkg-deb -c "$deb")
  for f in usr/bin/oxidm usr/lib/libox_idm.so.1.0.0 usr/include/oxidm/oxidm.h usr/share/man/man1/oxidm.1 \
           usr/lib/pkgconfig/oxidm.pc usr/lib/cmake/oxidm/oxidmConfig.cmake; do
    grep -q "\./$f\$" <<<"$listing" || grep -q "\./$f " <<<"$listing" || fail "package lacks $f"
  done
  dpkg-deb -f "$deb" Package | grep -qx oxidm || fail "package name"
  echo "Debian package $(basename "$deb"): ok"
fi
